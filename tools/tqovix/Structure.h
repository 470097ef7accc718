// The atom structure of any file, read tolerantly: where the library's parser stops at the
// first fault, this walk keeps what it read before it and names the fault, so that people
// can see why a file is refused.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

struct ScannedAtom {
    uint64_t offset = 0;
    uint64_t size = 0;
    std::string type;  // the four bytes as text: printable ASCII, others as Latin-1 ("©nam")
    int depth = 0;
};

struct Structure {
    bool readable = false;     // the file could be opened and read
    uint64_t fileSize = 0;
    bool atomic = false;       // its first bytes form an atom header of a movie's top-level type
    std::string brand;         // the file-type atom's major brand; empty without one
    std::vector<ScannedAtom> atoms;
    std::string fault;         // the first malformed atom, in words; empty when none
    uint64_t wholeSize = 0;    // what a file cut short would hold, by its last atom's size; 0 when not cut short
    std::string systemError;   // why the file could not be read
};

Structure ScanStructure(const std::string& path);
// Whether the file begins as a QuickTime or ISO movie does (its first atom's type), read
// from its first bytes only.
bool StartsLikeMovie(const std::string& path);
// What a file that is no movie most likely is, by its first bytes ("a JPEG image", "an
// XML file", ...); empty when they say nothing known.
std::string NonMovieKind(const std::string& path);
// Four type bytes as text a terminal and JSON can carry.
std::string AtomTypeText(const unsigned char type[4]);
