#include "SuppressorParameters.h"

#include <algorithm>
#include <bit>
#include <cmath>

namespace ovix {
namespace {

constexpr double kWindowSeconds = 0.021;
constexpr size_t kMinFftSize = 64;
constexpr size_t kMaxFftSize = 32768;
constexpr uint64_t kRampsPerSecond = 100;  // 10 ms
constexpr uint64_t kEdgesPerSecond = 25;  // 40 ms
constexpr double kContextSeconds = 1.0;
constexpr double kLongestSegmentSeconds = 10.0;
// Sound held beyond one segment so that an interval is judged beside the ones that follow it.
constexpr double kLookAheadSeconds = 30.0;
constexpr size_t kIntervalsAhead = 2;

}  // namespace

SuppressorParameters::SuppressorParameters(uint64_t rate, unsigned channelCount, unsigned bytesPerSample)
    : rateHz(std::max<uint64_t>(rate, 1)), channels(std::max(channelCount, 1u))
{
    const double wanted = kWindowSeconds * static_cast<double>(rateHz);
    const size_t rounded = size_t{1} << static_cast<unsigned>(std::lround(std::log2(std::max(wanted, 1.0))));
    fftSize = std::clamp(rounded, kMinFftSize, kMaxFftSize);
    hop = fftSize / 4;
    bins = fftSize / 2 + 1;
    rampFrames = std::max<uint64_t>(1, rateHz / kRampsPerSecond);
    edgeFrames = std::max<uint64_t>(1, rateHz / kEdgesPerSecond);

    // Room for a whole segment with its context on both sides, the analysis windows that
    // reach past it and a pulled block at either end.
    const uint64_t margin = 2 * (fftSize + rampFrames + kBlockFrames);
    const uint64_t byBudget = kMaxHeldBytes / (uint64_t{channels} * std::max(bytesPerSample, 1u));
    const auto seconds = [this](double s) { return static_cast<uint64_t>(s * static_cast<double>(rateHz)); };
    const uint64_t wantedFrames = seconds(kLongestSegmentSeconds) + 2 * seconds(kContextSeconds) + margin +
                            seconds(kLookAheadSeconds);
    capacityFrames = std::max(std::min(byBudget, wantedFrames), 8 * margin);
    contextFrames = std::min<uint64_t>(seconds(kContextSeconds), capacityFrames / 6);
    segmentFrames = std::max<uint64_t>(
        std::min(capacityFrames - 2 * contextFrames - margin, seconds(kLongestSegmentSeconds)), fftSize);
    intervalsAhead = kIntervalsAhead;
}

}  // namespace ovix
