#include "GainRule.h"

#include <algorithm>
#include <cmath>

namespace ovix {
namespace {

// Weight of the previous frame in the a-priori SNR: high, so that what remains is steady.
constexpr float kSmoothing = 0.98f;
constexpr float kFloor = 0.03f;  // -30 dB: the motor's rest stays under the wanted sound
constexpr float kTiny = 1e-20f;

}  // namespace

GainRule::GainRule(size_t bins) : m_bins(bins), m_previousClean(bins), m_raw(bins) {}

void GainRule::Reset() { m_bFirst = true; }

void GainRule::Compute(const float* power, const float* noise, float strength, float* gain)
{
    for (size_t k = 0; k < m_bins; ++k) {
        if (noise[k] <= 0.0f) {
            m_raw[k] = 1.0f;
            m_previousClean[k] = power[k];
            continue;
        }
        const float posterior = power[k] / std::max(noise[k], kTiny);
        const float measured = std::max(posterior - 1.0f, 0.0f);
        const float previous = m_bFirst ? measured : m_previousClean[k] / std::max(noise[k], kTiny);
        const float prior = kSmoothing * previous + (1.0f - kSmoothing) * measured;
        const float wiener = prior / (1.0f + prior);
        m_raw[k] = std::max(wiener, kFloor);
        m_previousClean[k] = m_raw[k] * m_raw[k] * power[k];
    }
    m_bFirst = false;
    // Smooth across bins, but never raise a bin the motor does not touch above 1 or lower it:
    // a bin with no motor keeps exactly 1.
    for (size_t k = 0; k < m_bins; ++k) {
        float g = m_raw[k];
        if (g < 1.0f) {
            const float left = k > 0 ? m_raw[k - 1] : g;
            const float right = k + 1 < m_bins ? m_raw[k + 1] : g;
            g = 0.25f * left + 0.5f * g + 0.25f * right;
            g = std::min(g, 1.0f);
        }
        gain[k] = strength >= 1.0f ? g : std::pow(g, strength);
    }
}

}  // namespace ovix
