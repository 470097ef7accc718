// Spectral gain against the estimated motor noise: a decision-directed a-priori SNR and a
// Wiener rule, a floor so that the remaining sound never goes fully dark, and smoothing
// across neighbouring bins so that isolated cells do not flicker (musical noise).
// Where the motor contributes nothing the gain is exactly 1.
#pragma once

#include <cstddef>
#include <vector>

namespace ovix {

class GainRule {
public:
    explicit GainRule(size_t bins);

    // Forgets the previous frame: called where a run of frames begins.
    void Reset();
    // One frame: `power` of the sound, `noise` of the motor, `strength` 0..1 scales the
    // suppression in decibels. Writes `gain` (bins values in [floor, 1]).
    void Compute(const float* power, const float* noise, float strength, float* gain);

private:
    size_t m_bins;
    std::vector<float> m_previousClean;  // the wanted sound's power in the last frame
    std::vector<float> m_raw;
    bool m_bFirst = true;
};

}  // namespace ovix
