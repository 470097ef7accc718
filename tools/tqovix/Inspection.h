// What tqovix inspect reports about a movie, gathered once and printed as text or JSON.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

class CTqovixAtomControl;

struct InspectedAtom {
    uint64_t offset = 0;
    uint64_t size = 0;
    std::string type;
    int depth = 0;
};

struct InspectedTrack {
    std::string handler;
    std::string codec;
    uint32_t timeScale = 0;
    double rate = 0;      // frames per second, or sound samples per second
    bool known = false;   // the tables could be read: samples and chunks below
    bool aac = false;
    uint32_t channels = 0;
    uint32_t bits = 0;
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
    std::vector<InspectedAtom> atoms;
    std::vector<InspectedTrack> tracks;
    std::optional<InspectedTrim> trim;
    uint64_t afBytes = 0;
    uint64_t levelBytes = 0;
    int libraryAnswer = 0;  // the property query's: 0, 20 (processed) or why not
    std::string refusal;    // the parser's words for a refusal, when it has them
};

// Everything the report says, from a parsed tree and the library's own answers.
Inspection Inspect(const std::string& path, const CTqovixAtomControl& tree);
void PrintInspectionText(const Inspection& inspection);
void PrintInspectionJson(const Inspection& inspection);
