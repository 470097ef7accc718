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
    std::string format;  // the source's sound in words: "24-bit little-endian PCM", "AAC"
    uint32_t bits = 0;  // PCM: each sample's width
    bool floatingPoint = false;
    std::vector<IntervalLevels> intervals;
    uint64_t differingFrames = 0;  // outside the intervals and their ramps, by their bytes
    // Of one sample outside them, in 16-bit steps rounded up whatever the depth: 0 only when
    // every sample there is as it was.
    int largestDifference = 0;
    int64_t offset = 0;            // the destination's lag behind the source, in frames
    double correlation = 0;        // at that lag
    // When the two cannot be compared, the kind in words: "unreadable", "tables-inconsistent"
    // (the time table and the chunks disagree), "rate-differs", "channels-differ",
    // "format-differs" (another depth or kind of sample), "length-differs", "sound-stops-early"
    // (before what its tables promise) or "sound-differs".
    std::string reason;
};

// Sees every block of both sounds as it streams by (interleaved frames from `first` on, on the
// 16-bit scale whatever the format).
using SoundBlockSink = std::function<void(const double* source, const double* destination, uint64_t first,
                                          uint64_t frames)>;

// Empty on success, else why the two cannot be compared (then the movie is not the processed
// form of the source, or one of them has no sound we read, or tables that disagree with its
// chunks); result.reason then names the kind.
std::string CompareSounds(const std::string& sourcePath, const std::string& destinationPath, SoundComparison& result,
                          const SoundBlockSink& sink = {});
