#include "StepDetector.h"

#include "FastLog.h"

#include <algorithm>
#include <cmath>
#include <cstdint>

namespace ovix {
namespace {

constexpr double kWindowSeconds = 0.2;
constexpr double kShortestWindowSeconds = 0.07;
// Standing out: this many times the wanted sound's own spread at both ends.
constexpr float kBar = 3.0f;
constexpr float kOneEndBar = 4.0f;
constexpr size_t kMinPositions = 4;
constexpr size_t kSpreadBins = 3;  // each side: neighbouring bins share how much they move
constexpr float kMinSpread = 0.33f;  // 1 dB in log2 units
constexpr float kUnknownSpread = 2.0f;  // 6 dB: before anything was heard, only clear steps count
// Powers count from this far under the surroundings' mean bin: digital silence between words
// would otherwise make every word a step of a hundred decibels.
constexpr float kFloorBelowMean = 1e-5f;


}  // namespace

StepDetector::StepDetector(const SuppressorParameters& parameters)
    : m_bins(parameters.bins),
      m_spread(m_bins, kUnknownSpread),
      m_sessionSpread(m_bins, kUnknownSpread),
      m_a(m_bins),
      m_b(m_bins),
      m_score(m_bins),
      m_step(m_bins)
{
    const double rowsPerSecond = static_cast<double>(parameters.rateHz) / static_cast<double>(parameters.hop);
    m_standardWidth = std::max<size_t>(4, static_cast<size_t>(kWindowSeconds * rowsPerSecond));
    m_width = m_standardWidth;
    m_shortestWidth = std::max<size_t>(
        4, static_cast<size_t>(kShortestWindowSeconds / kWindowSeconds * static_cast<double>(m_standardWidth)));
    // From the last frame wholly before the ramp to the first frame centred past the edge.
    m_gap = (parameters.rampFrames + parameters.edgeFrames + parameters.fftSize) / parameters.hop;
    const size_t aroundRows = 2 * parameters.contextFrames / parameters.hop + 4;
    m_logsBefore.resize(aroundRows * m_bins);
    m_logsAfter.resize(aroundRows * m_bins);
    m_logsInside.resize(2 * m_width * m_bins);
    m_steps.resize(2 * (aroundRows / std::max<size_t>(1, m_width / 4) + 2) * m_bins);
    m_column.resize(std::max(m_bins, m_steps.size() / m_bins));
}

void StepDetector::LogRows(const SpectralFrames& frames, size_t from, size_t to, std::vector<float>& out) const
{
    for (size_t row = from; row < to; ++row) {
        const float* p = frames.Row(row);
        float* l = out.data() + (row - from) * m_bins;
        for (size_t k = 0; k < m_bins; ++k) {
            l[k] = FastLog2(std::max(p[k], m_floor));
        }
    }
}

void StepDetector::MeanOf(const std::vector<float>& logs, size_t from, float* out, size_t width) const
{
    width = width == 0 ? m_width : width;
    std::fill(out, out + m_bins, 0.0f);
    for (size_t row = from; row < from + width; ++row) {
        const float* l = logs.data() + row * m_bins;
        for (size_t k = 0; k < m_bins; ++k) {
            out[k] += l[k];
        }
    }
    const float scale = 1.0f / static_cast<float>(width);
    for (size_t k = 0; k < m_bins; ++k) {
        out[k] *= scale;
    }
}

void StepDetector::Calibrate(const SpectralFrames& around, size_t before)
{
    m_around = &around;
    m_before = std::min(before, around.Rows());
    double mean = 0.0;
    for (size_t row = 0; row < around.Rows(); ++row) {
        const float* p = around.Row(row);
        for (size_t k = 0; k < m_bins; ++k) {
            mean += p[k];
        }
    }
    if (around.Rows() > 0) {
        m_floor = static_cast<float>(mean / static_cast<double>(around.Rows() * m_bins)) * kFloorBelowMean;
    }
    const size_t after = around.Rows() - m_before;
    // Windows as long as the longer side allows, so that short surroundings still say something.
    const size_t longest = std::max(m_before, after);
    const size_t fits = longest > m_gap ? (longest - m_gap) / 2 : 0;
    m_width = std::clamp(fits, m_shortestWidth, m_standardWidth);
    LogRows(around, 0, m_before, m_logsBefore);
    LogRows(around, m_before, around.Rows(), m_logsAfter);
    const size_t stride = std::max<size_t>(1, m_width / 4);
    const size_t span = 2 * m_width + m_gap;
    size_t positions = 0;
    for (int side = 0; side < 2; ++side) {
        const std::vector<float>& logs = side == 0 ? m_logsBefore : m_logsAfter;
        const size_t rows = side == 0 ? m_before : after;
        for (size_t p = 0; p + span <= rows && (positions + 1) * m_bins <= m_steps.size(); p += stride) {
            MeanOf(logs, p, m_a.data());
            MeanOf(logs, p + m_width + m_gap, m_b.data());
            float* step = m_steps.data() + positions * m_bins;
            for (size_t k = 0; k < m_bins; ++k) {
                step[k] = std::abs(m_b[k] - m_a[k]);
            }
            ++positions;
        }
    }
    if (positions < kMinPositions) {
        // Too little heard around this interval: how the sound moved around earlier ones. A
        // longer or shorter window than theirs moves less or more, as an average of its rows.
        const float scale = std::sqrt(static_cast<float>(m_standardWidth) / static_cast<float>(m_width));
        for (size_t k = 0; k < m_bins; ++k) {
            m_spread[k] = m_sessionSpread[k] * (m_bSessionSpread ? scale : 1.0f);
        }
        return;
    }
    // A robust spread: the median step, scaled to a normal deviation.
    for (size_t k = 0; k < m_bins; ++k) {
        for (size_t i = 0; i < positions; ++i) {
            m_column[i] = m_steps[i * m_bins + k];
        }
        const size_t middle = positions / 2;
        std::nth_element(m_column.begin(), m_column.begin() + static_cast<ptrdiff_t>(middle),
                         m_column.begin() + static_cast<ptrdiff_t>(positions));
        m_a[k] = 1.4826f * m_column[middle];
    }
    for (size_t k = 0; k < m_bins; ++k) {
        const size_t from = k > kSpreadBins ? k - kSpreadBins : 0;
        const size_t to = std::min(m_bins, k + kSpreadBins + 1);
        float sum = 0.0f;
        for (size_t j = from; j < to; ++j) {
            sum += m_a[j];
        }
        m_spread[k] = std::max(kMinSpread, sum / static_cast<float>(to - from));
    }
    const float scale = std::sqrt(static_cast<float>(m_width) / static_cast<float>(m_standardWidth));
    for (size_t k = 0; k < m_bins; ++k) {
        m_sessionSpread[k] = m_spread[k] * scale;
    }
    m_bSessionSpread = true;
}

size_t StepDetector::Judge(const SpectralFrames& power, size_t firstCore, size_t endCore, bool first, bool last)
{
    std::fill(m_score.begin(), m_score.end(), 0.0f);
    std::fill(m_step.begin(), m_step.end(), 0.0f);
    m_bar = kBar;
    m_bJudged = false;
    // A drive shorter than the windows is judged on windows as long as it, whose means wander
    // more than the surroundings' longer ones did.
    const size_t width = std::min(m_width, endCore > firstCore ? endCore - firstCore : 0);
    if (m_around == nullptr || width < m_shortestWidth) {
        return 0;
    }
    const float wander = std::sqrt(static_cast<float>(m_width) / static_cast<float>(width));
    const size_t after = m_around->Rows() - m_before;
    const bool atStart = first && m_before >= width;
    const bool atEnd = last && after >= width;
    if (!atStart && !atEnd) {
        return 0;
    }
    m_bar = atStart && atEnd ? kBar : kOneEndBar;
    m_bJudged = true;
    bool any = false;
    if (atStart) {
        LogRows(power, firstCore, firstCore + width, m_logsInside);
        MeanOf(m_logsInside, 0, m_b.data(), width);
        MeanOf(m_logsBefore, m_before - width, m_a.data(), width);
        for (size_t k = 0; k < m_bins; ++k) {
            m_score[k] = (m_b[k] - m_a[k]) / (wander * m_spread[k]);
            m_step[k] = std::max(0.0f, std::exp2(m_b[k]) - std::exp2(m_a[k]));
        }
        any = true;
    }
    if (atEnd) {
        LogRows(power, endCore - width, endCore, m_logsInside);
        MeanOf(m_logsInside, 0, m_b.data(), width);
        MeanOf(m_logsAfter, 0, m_a.data(), width);
        for (size_t k = 0; k < m_bins; ++k) {
            const float score = (m_b[k] - m_a[k]) / (wander * m_spread[k]);
            const float step = std::max(0.0f, std::exp2(m_b[k]) - std::exp2(m_a[k]));
            m_score[k] = any ? std::min(m_score[k], score) : score;
            m_step[k] = any ? std::min(m_step[k], step) : step;
        }
    }
    size_t standing = 0;
    for (size_t k = 0; k < m_bins; ++k) {
        standing += m_score[k] > m_bar ? 1 : 0;
    }
    return standing;
}

}  // namespace ovix
