// Estimates the lens motor's noise power in every frame of an AF interval from what the
// camera tells us: the motor runs inside the interval and is silent around it. The sound
// around the interval shows how the wanted sound behaves; what the interval holds beyond
// that is the motor's.
// - A steady part: the interval's low quantile against its surroundings' (low quantiles
//   pass over speech and notes, so they are not taken for noise).
// - A moving part: per frame and bin, what rises far above anything the surroundings
//   reached (a whine sweeping with the motor's speed, micro-step ticks, bursts).
// - The drive's start and stop transients are judged apart, with a lower bar.
// - Across intervals (one lens, one noise): the motor's spectral shape learned from earlier
//   intervals tells a quiet motor from wanted sound that happens to be louder inside.
#pragma once

#include "SpectralFrames.h"
#include "SuppressorParameters.h"

#include <cstdint>
#include <vector>

namespace ovix {

enum class FrameRole : uint8_t {
    kAround,  // outside the interval: the ramps and the analysis windows reaching past it
    kEdge,  // where the drive starts or stops
    kCore,  // the drive's steady part
};

class MotorEstimator {
public:
    explicit MotorEstimator(const SuppressorParameters& parameters);

    // Rows of the sound around the interval. With too few rows (an interval at the start of
    // the track, neighbours close by) the surroundings of earlier intervals stand in.
    void SetSurroundings(const SpectralFrames& around);
    // Fills `noise` (same rows as `power`) and answers the motor's share of the power in the
    // interval's frames: near 0 when the motor is not audible there.
    double Estimate(const SpectralFrames& power, const FrameRole* roles, SpectralFrames& noise);
    // Remembers the motor of an interval that was processed.
    void Learn(const SpectralFrames& noise, const FrameRole* roles);

private:
    void Quantiles(const SpectralFrames& frames, const FrameRole* roles, FrameRole wanted,
                   double q, std::vector<float>& out, size_t& used);

    size_t m_bins;
    std::vector<float> m_aroundLow;
    std::vector<float> m_aroundHigh;
    bool m_bHaveAround = false;
    std::vector<float> m_steady;
    std::vector<float> m_column;  // one bin across rows, for the quantiles
    std::vector<float> m_template;  // the motor's mean spectrum over learned intervals
    unsigned m_learned = 0;
};

}  // namespace ovix
