// Sizes and constants of the motor-noise suppressor, derived once per session from the rate
// and channel count. Times are chosen in seconds and converted, so that every rate sees the
// same resolution in time and frequency.
#pragma once

#include <cstddef>
#include <cstdint>

namespace ovix {

struct SuppressorParameters {
    // `bytesPerSample`: as the track holds them, which is what the look-ahead's budget counts.
    SuppressorParameters(uint64_t rateHz, unsigned channels, unsigned bytesPerSample = 2);

    // Most sound the look-ahead may hold, whatever the format.
    static constexpr uint64_t kMaxHeldBytes = 32ull << 20;
    static constexpr size_t kBlockFrames = 1024;  // the largest block the session pulls

    uint64_t rateHz;
    unsigned channels;
    size_t fftSize;  // a power of two, about 21 ms: motor harmonics resolved, clicks still short
    size_t hop;  // a quarter of the window: smooth gains, no time aliasing of strong cuts
    size_t bins;
    uint64_t rampFrames;  // raised-cosine transitions at the ends of each interval
    uint64_t edgeFrames;  // a drive's start and stop transients live here
    uint64_t contextFrames;  // sound heard on each side of an interval, where the motor is silent
    uint64_t capacityFrames;  // the look-ahead's whole store
    uint64_t segmentFrames;  // the longest stretch of an interval processed at once
    size_t intervalsAhead;  // later intervals a decision about one waits for, when the store holds them
};

}  // namespace ovix
