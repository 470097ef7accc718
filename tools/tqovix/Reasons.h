// Why a movie is refused or a job failed: one table of reasons, each worded once, used by
// every command and by the JSON reports. The exported code says little (8 covers a text
// file and an 8-bit movie alike); the reason is found from the paths and the file itself.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

enum class Reason {
    None,
    Aborted,
    SourceMissing,
    SourceIsDirectory,
    SourceNotRegularFile,
    SourceAccessDenied,
    SameFile,
    DestinationIsDirectory,
    DestinationDirectoryMissing,
    DestinationAccessDenied,
    DestinationExists,
    EmptyFile,
    NotAMovie,
    WrongBrand,
    MalformedAtom,
    Truncated,
    Fragmented,
    NoSoundTrack,
    UnsupportedSound,
    UnsupportedLayout,
    NoAFInformation,
    AlreadyProcessed,
    AlreadyInOutput,
    NoSpace,
    FileTooLarge,
    OutOfMemory,
    LibraryRefusedAF,
    WriteFailed,
    Internal,
};

struct ReasonRow {
    Reason reason;
    const char* key;    // stable, for JSON
    int code;           // the exported code that comes with it; -1 when the tool refuses itself
    const char* words;  // "{}" stands for the detail; without it the detail follows a colon
};
const std::vector<ReasonRow>& ReasonTable();

// Sizes for people: "26.0 MB", "1.2 GB"; and "26.0 of 53.6 MB" in the larger one's unit.
std::string SizeText(uint64_t bytes);
std::string SizesText(uint64_t part, uint64_t whole);

struct Verdict {
    int code = 0;  // exported code
    Reason reason = Reason::None;
    std::string text;  // for people; empty when nothing is wrong
    const char* Key() const;
    // The exported code the reason stands for (its row's), which hosts report: the library
    // answers 130 for a folder it may not write, and 8 for a processed movie at a job's
    // start. An internal error keeps the library's code; -1 when the tool refused by itself.
    int Result() const;
};

Verdict MakeVerdict(int code, Reason reason, const std::string& detail = {});
// The reason behind exported code `code` (0: none) for a job from `source` to
// `destination` (empty: a property query).
Verdict Explain(int code, const std::string& source, const std::string& destination = {});
// For a processable AAC movie whose sound is re-encoded whole rather than only around the AF
// intervals (an encoder configuration ours cannot splice into): why, in words; empty otherwise.
std::string AacWholeReason(const std::string& source);
// Whether the reason is about the destination rather than the source.
bool AboutDestination(Reason reason);
// Whether a job may write `destination`: not the source itself, not a directory, and not a
// file that stands there unless `replace`.
Verdict DestinationVerdict(const std::string& source, const std::string& destination, bool replace);
// The same, worded for this tool: an existing destination says how to replace it.
Verdict CheckDestination(const std::string& source, const std::string& destination, bool replace);
