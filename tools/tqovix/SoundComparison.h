// What tqovix compare measures of a source's sound and its processed form, streaming both
// (memory stays bounded for any length): per AF interval the level before and after, outside
// them how far the sound moved, and the destination's offset against the source.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "SoundStream.h"

struct IntervalLevels {
    SoundInterval interval;
    double beforeDb = 0;
    double afterDb = 0;
};

struct SoundComparison {
    uint32_t rate = 0;
    uint32_t channels = 0;
    uint64_t frames = 0;
    bool aac = false;
    std::vector<IntervalLevels> intervals;
    uint64_t differingFrames = 0;  // outside the intervals and their ramps
    int largestDifference = 0;     // of one sample, outside them
    int64_t offset = 0;            // the destination's lag behind the source, in frames
    double correlation = 0;        // at that lag
    // When the two cannot be compared, the kind in words: "unreadable", "tables-inconsistent"
    // (the time table and the chunks disagree), "rate-differs", "channels-differ",
    // "length-differs", "sound-stops-early" (before what its tables promise) or "sound-differs".
    std::string reason;
};

// Sees every block of both sounds as it streams by (interleaved frames from `first` on).
using SoundBlockSink = std::function<void(const int16_t* source, const int16_t* destination, uint64_t first,
                                          uint64_t frames)>;

// Empty on success, else why the two cannot be compared (then the movie is not the processed
// form of the source, or one of them has no sound we read, or tables that disagree with its
// chunks); result.reason then names the kind.
std::string CompareSounds(const std::string& sourcePath, const std::string& destinationPath, SoundComparison& result,
                          const SoundBlockSink& sink = {});
