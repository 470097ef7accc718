// What tqovix inspect reports about a file, gathered once and printed as text or JSON. Any
// file with atoms can be inspected: what the library refuses is shown with its reason.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "Reasons.h"
#include "Structure.h"

struct InspectedTrack {
    std::string handler;
    std::string codec;
    uint32_t timeScale = 0;
    double rate = 0;      // frames per second, or sound samples per second
    bool known = false;   // the tables could be read: samples and chunks below
    bool aac = false;
    uint32_t channels = 0;
    uint32_t bits = 0;
    // PCM as the description lays it out; unknown for a kind we do not process.
    bool pcmKnown = false;
    bool floatingPoint = false;
    bool littleEndian = false;
    uint64_t samples = 0;
    size_t chunks = 0;
};

struct InspectedTrim {
    uint32_t removedForward = 0;
    uint32_t removedBackward = 0;
    uint32_t rateNumerator = 0;
    uint32_t rateDenominator = 0;
};

struct Inspection {
    std::string path;
    Structure structure;
    std::string kind;      // what a file that is no movie seems to be ("a JPEG image"); empty otherwise
    double seconds = -1;   // the movie header's duration; negative when unknown
    bool parsed = false;  // the library's parser read the tree: tracks and tags below
    std::vector<InspectedTrack> tracks;
    std::optional<InspectedTrim> trim;
    uint64_t afBytes = 0;
    uint64_t levelBytes = 0;
    Verdict verdict;  // the library's answer (0, 20 processed, or why not) and its reason
    // A processable AAC movie: whether a job keeps the source's packets outside the spans it
    // re-encodes around the AF intervals, or re-encodes the whole track, and why.
    bool aacProcessable = false;
    std::string aacWhole;
};

Inspection Inspect(const std::string& path);
// Duration, tracks and the library's verdict; then, unless `summaryOnly`, the atoms and the rest.
void PrintInspectionText(const Inspection& inspection, bool summaryOnly);
// One object; `report` makes it a whole report, with the format's version first.
std::string InspectionJson(const Inspection& inspection, bool report);
