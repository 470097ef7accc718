#include "MotorEstimator.h"

#include <algorithm>
#include <cmath>

namespace ovix {
namespace {

constexpr double kLowQuantile = 0.2;
constexpr double kHighQuantile = 0.9;
constexpr size_t kMinRows = 8;
// How far above the surroundings' ceiling a cell must rise to count as motor: well above
// what one loud syllable or note more does to a bin.
constexpr float kRiseSteady = 2.0f;
constexpr float kRiseEdge = 1.0f;

}  // namespace

MotorEstimator::MotorEstimator(const SuppressorParameters& parameters)
    : m_bins(parameters.bins),
      m_aroundLow(m_bins),
      m_aroundHigh(m_bins),
      m_steady(m_bins),
      m_template(m_bins)
{
    // The longest column is a whole segment's rows.
    const size_t rows = parameters.segmentFrames / parameters.hop + parameters.fftSize / parameters.hop + 8 +
                        2 * (parameters.rampFrames / parameters.hop + 1);
    m_column.resize(std::max(rows, parameters.contextFrames * 2 / parameters.hop + 8));
}

void MotorEstimator::Quantiles(const SpectralFrames& frames, const FrameRole* roles, FrameRole wanted,
                               double q, std::vector<float>& out, size_t& used)
{
    used = 0;
    for (size_t k = 0; k < m_bins; ++k) {
        size_t n = 0;
        for (size_t row = 0; row < frames.Rows() && n < m_column.size(); ++row) {
            if (roles == nullptr || roles[row] == wanted) {
                m_column[n++] = frames.Row(row)[k];
            }
        }
        used = n;
        if (n == 0) {
            out[k] = 0.0f;
            continue;
        }
        const size_t at = std::min(n - 1, static_cast<size_t>(q * static_cast<double>(n)));
        std::nth_element(m_column.begin(), m_column.begin() + static_cast<ptrdiff_t>(at),
                         m_column.begin() + static_cast<ptrdiff_t>(n));
        out[k] = m_column[at];
    }
}

void MotorEstimator::SetSurroundings(const SpectralFrames& around)
{
    if (around.Rows() < kMinRows) {
        return;  // keep what earlier intervals heard around them
    }
    size_t used = 0;
    Quantiles(around, nullptr, FrameRole::kCore, kLowQuantile, m_aroundLow, used);
    Quantiles(around, nullptr, FrameRole::kCore, kHighQuantile, m_aroundHigh, used);
    m_bHaveAround = true;
}

double MotorEstimator::Estimate(const SpectralFrames& power, const FrameRole* roles,
                                SpectralFrames& noise)
{
    size_t coreRows = 0;
    Quantiles(power, roles, FrameRole::kCore, kLowQuantile, m_steady, coreRows);
    if (coreRows < kMinRows) {
        size_t edgeRows = 0;
        Quantiles(power, roles, FrameRole::kEdge, kLowQuantile, m_steady, edgeRows);
    }
    if (!m_bHaveAround) {
        // Nothing heard without the motor: only the template of earlier intervals could
        // tell motor from sound, and there is none yet either.
        std::fill(m_aroundLow.begin(), m_aroundLow.end(), 0.0f);
        std::copy(m_steady.begin(), m_steady.end(), m_aroundHigh.begin());
    }
    for (size_t k = 0; k < m_bins; ++k) {
        m_steady[k] = std::max(0.0f, m_steady[k] - m_aroundLow[k]);
    }

    noise.Clear();
    double motor = 0.0;
    double total = 0.0;
    for (size_t row = 0; row < power.Rows(); ++row) {
        const float* p = power.Row(row);
        float* n = noise.AddRow();
        const float rise = roles[row] == FrameRole::kEdge ? kRiseEdge : kRiseSteady;
        for (size_t k = 0; k < m_bins; ++k) {
            const float ceiling = m_aroundHigh[k] + m_steady[k];
            const float excess = p[k] > rise * ceiling ? p[k] - ceiling : 0.0f;
            n[k] = std::min(p[k], m_steady[k] + excess);
        }
        if (roles[row] != FrameRole::kAround) {
            for (size_t k = 0; k < m_bins; ++k) {
                motor += n[k];
                total += p[k];
            }
        }
    }
    return total > 0.0 ? motor / total : 0.0;
}

void MotorEstimator::Learn(const SpectralFrames& noise, const FrameRole* roles)
{
    double sum = 0.0;
    for (size_t row = 0; row < noise.Rows(); ++row) {
        if (roles[row] == FrameRole::kCore) {
            for (size_t k = 0; k < m_bins; ++k) {
                sum += noise.Row(row)[k];
            }
        }
    }
    if (sum <= 0.0) {
        return;
    }
    // A running mean of unit-sum spectra: each interval counts alike whatever its level.
    const float weight = 1.0f / static_cast<float>(std::min(m_learned + 1, 16u));
    for (size_t k = 0; k < m_bins; ++k) {
        double bin = 0.0;
        for (size_t row = 0; row < noise.Rows(); ++row) {
            if (roles[row] == FrameRole::kCore) {
                bin += noise.Row(row)[k];
            }
        }
        m_template[k] += weight * (static_cast<float>(bin / sum) - m_template[k]);
    }
    ++m_learned;
}

}  // namespace ovix
