#include "MotorEstimator.h"

#include <algorithm>
#include <cmath>

namespace ovix {
namespace {

// The wanted sound's usual level around an interval (its ceiling is the loudest it got there):
// what the motor's activation is measured beyond.
constexpr double kFloorQuantile = 0.35;
constexpr size_t kCeilingSpread = 2;
// Over the motor's bins, the share that wanted sound may raise without raising the estimate.
constexpr double kActivationQuantile = 0.3;
// How far above the surroundings' ceiling a cell must rise to be taken for motor.
constexpr float kRise = 2.0f;
// A motor keeps making its noise: a bin that rises so in fewer of the interval's frames is a
// syllable or a note, unless its frame rises across this share of the spectrum for no longer
// than a tick lasts (a loud syllable rises as broadly, for longer).
constexpr double kRecurring = 0.2;
constexpr double kBroadband = 0.2;
constexpr double kTickSeconds = 0.01;
// Each side of a drive's start or stop: long enough for medians to pass over syllables.
constexpr double kWindowSeconds = 0.3;
constexpr size_t kMinRows = 8;
// A stepping motor's whine: fundamentals searched in 1/48-octave steps, eight harmonics.
constexpr double kMinWhineHz = 100.0;
constexpr double kMaxWhineHz = 2500.0;
const double kWhineStep = std::pow(2.0, 1.0 / 48.0);
constexpr int kHarmonics = 8;
constexpr int kMinHarmonics = 3;
constexpr double kTrackSeconds = 0.25;  // each side: longer than a syllable or a short note
constexpr double kTrackOctaves = 1.0 / 6.0;
constexpr float kLobeSide = 0.4f;  // a partial's power one bin off its centre, under this window
// What shows a motor in an interval: the smaller of its two end steps carries this share of
// the sound at that end, or what rises far above the surroundings this share of its power.
constexpr double kClearStep = 0.065;
constexpr double kClearRise = 0.045;
// And that evidence looks like the lens heard in earlier intervals: this share of its power in
// bands where theirs was. Unrelated spectra share a few percent, a chord under a whine's sweep
// over a tenth.
constexpr double kLikeLens = 0.2;
constexpr double kBandsPerOctave = 4.0;
// Enough bins to judge a frame by, few enough to judge every frame quickly.
constexpr size_t kMaxMotorBins = 64;

}  // namespace

MotorEstimator::MotorEstimator(const SuppressorParameters& parameters)
    : m_bins(parameters.bins),
      m_windowRows(std::max<size_t>(kMinRows, static_cast<size_t>(kWindowSeconds * static_cast<double>(parameters.rateHz)) /
                                                  parameters.hop)),
      m_floor(m_bins),
      m_ceiling(m_bins),
      m_inside(m_bins),
      m_outside(m_bins),
      m_step(m_bins),
      m_motor(m_bins),
      m_history(kRemembered * m_bins)
{
    m_motorBins.reserve(m_bins);
    m_band.resize(m_bins);
    for (size_t k = 1; k < m_bins; ++k) {
        m_band[k] = static_cast<uint8_t>(kBandsPerOctave * std::log2(static_cast<double>(k)));
    }
    m_band[0] = m_band[1];
    m_bands = static_cast<size_t>(m_band[m_bins - 1]) + 1;
    m_stepBands.resize(m_bands);
    m_riseBands.resize(m_bands);
    m_templateBands.resize(m_bands);
    m_riseHistory.resize(kRemembered * m_bands);
    m_base.resize(m_bins);
    m_salience.resize(m_bins);
    m_spread.resize(m_bins);
    m_binHz = static_cast<double>(parameters.rateHz) / static_cast<double>(parameters.fftSize);
    static_assert(kHarmonics <= kMaxHarmonics);
    // The fundamentals searched and where their harmonics fall, worked out once.
    const double top = static_cast<double>(m_bins - 2);
    for (double f0 = kMinWhineHz; f0 <= kMaxWhineHz; f0 *= kWhineStep) {
        Candidate candidate;
        candidate.hz = f0;
        const double step = f0 / m_binHz;
        for (int h = 1; h <= kHarmonics && h * step <= top && h * step >= 1.0; ++h) {
            candidate.bins[candidate.harmonics++] = static_cast<uint16_t>(h * step + 0.5);
        }
        if (candidate.harmonics >= kMinHarmonics) {
            m_candidates.push_back(candidate);
        }
    }
    const size_t rows = (parameters.segmentFrames + parameters.fftSize + 2 * parameters.rampFrames) / parameters.hop + 8;
    m_column.resize(std::max({rows, parameters.contextFrames * 2 / parameters.hop + 8, m_bins, kRemembered}));
    m_activation.resize(m_column.size());
    m_risenBins.resize(m_column.size());
    // A tick shows in the frames whose window reaches it.
    m_tickRows = (static_cast<size_t>(kTickSeconds * static_cast<double>(parameters.rateHz)) + parameters.fftSize) / parameters.hop;
    m_risenRows.resize(m_bins);
    m_whine.resize(m_column.size());
    m_track.resize(m_column.size());
    m_trackRows = static_cast<size_t>(kTrackSeconds * static_cast<double>(parameters.rateHz)) / parameters.hop;
    m_window.resize(2 * m_trackRows + 1);
}

void MotorEstimator::Quantile(const SpectralFrames& frames, size_t from, size_t to, double q, std::vector<float>& out)
{
    const size_t n = std::min(to, frames.Rows()) - std::min(from, frames.Rows());
    for (size_t k = 0; k < m_bins; ++k) {
        if (n == 0) {
            out[k] = 0.0f;
            continue;
        }
        for (size_t i = 0; i < n; ++i) {
            m_column[i] = frames.Row(from + i)[k];
        }
        const size_t at = std::min(n - 1, static_cast<size_t>(q * static_cast<double>(n)));
        std::nth_element(m_column.begin(), m_column.begin() + static_cast<ptrdiff_t>(at),
                         m_column.begin() + static_cast<ptrdiff_t>(n));
        out[k] = m_column[at];
    }
}

void MotorEstimator::SetSurroundings(const SpectralFrames& around, size_t before, bool first, bool last)
{
    m_around = &around;
    m_before = std::min(before, around.Rows());
    m_bFirst = first;
    m_bLast = last;
    if (around.Rows() >= kMinRows) {
        Quantile(around, 0, around.Rows(), kFloorQuantile, m_floor);
        std::fill(m_ceiling.begin(), m_ceiling.end(), 0.0f);
        for (size_t row = 0; row < around.Rows(); ++row) {
            const float* p = around.Row(row);
            for (size_t k = 0; k < m_bins; ++k) {
                m_ceiling[k] = std::max(m_ceiling[k], p[k]);
            }
        }
        // A bin's ceiling is the loudest of it and its neighbours: a voice's harmonics move with
        // its pitch, and one louder syllable a bin away is no motor.
        std::copy(m_ceiling.begin(), m_ceiling.end(), m_inside.begin());
        for (size_t k = 0; k < m_bins; ++k) {
            const size_t from = k > kCeilingSpread ? k - kCeilingSpread : 0;
            const size_t to = std::min(m_bins, k + kCeilingSpread + 1);
            m_ceiling[k] = *std::max_element(m_inside.begin() + static_cast<ptrdiff_t>(from),
                                             m_inside.begin() + static_cast<ptrdiff_t>(to));
        }
    }
    // Otherwise what was heard around earlier intervals stands.
}

bool MotorEstimator::StepSpectrum(const SpectralFrames& power, const FrameRole* roles)
{
    size_t firstCore = power.Rows();
    size_t endCore = 0;
    for (size_t row = 0; row < power.Rows(); ++row) {
        if (roles[row] == FrameRole::kCore) {
            firstCore = std::min(firstCore, row);
            endCore = row + 1;
        }
    }
    if (firstCore >= endCore || endCore - firstCore < kMinRows) {
        return false;
    }
    const size_t window = std::min(m_windowRows, endCore - firstCore);
    const size_t after = m_around->Rows() - m_before;
    bool any = false;
    if (m_bFirst && m_before >= kMinRows) {
        Quantile(power, firstCore, firstCore + window, 0.5, m_inside);
        Quantile(*m_around, m_before - std::min(m_before, m_windowRows), m_before, 0.5, m_outside);
        for (size_t k = 0; k < m_bins; ++k) {
            m_step[k] = std::max(0.0f, m_inside[k] - m_outside[k]);
        }
        any = true;
    }
    if (m_bLast && after >= kMinRows) {
        Quantile(power, endCore - window, endCore, 0.5, m_inside);
        Quantile(*m_around, m_before, m_before + std::min(after, m_windowRows), 0.5, m_outside);
        for (size_t k = 0; k < m_bins; ++k) {
            const float step = std::max(0.0f, m_inside[k] - m_outside[k]);
            m_step[k] = any ? std::min(m_step[k], step) : step;
        }
        any = true;
    }
    return any;
}

void MotorEstimator::Remember(const float* spectrum, size_t width, std::vector<float>& history, size_t& count,
                              size_t& next)
{
    std::copy(spectrum, spectrum + width, history.begin() + static_cast<ptrdiff_t>(next * width));
    next = (next + 1) % kRemembered;
    count = std::min(count + 1, kRemembered);
}

void MotorEstimator::Template(bool withStep)
{
    const size_t rows = m_historyCount + (withStep ? 1 : 0);
    for (size_t k = 0; k < m_bins; ++k) {
        for (size_t i = 0; i < m_historyCount; ++i) {
            m_column[i] = m_history[i * m_bins + k];
        }
        if (withStep) {
            m_column[m_historyCount] = m_step[k];
        }
        const size_t middle = rows / 2;
        std::nth_element(m_column.begin(), m_column.begin() + static_cast<ptrdiff_t>(middle),
                         m_column.begin() + static_cast<ptrdiff_t>(rows));
        m_motor[k] = m_column[middle];
    }
}

void MotorEstimator::ToBands(const float* spectrum, std::vector<float>& bands) const
{
    std::fill(bands.begin(), bands.end(), 0.0f);
    double sum = 0.0;
    for (size_t k = 0; k < m_bins; ++k) {
        bands[m_band[k]] += spectrum[k];
        sum += spectrum[k];
    }
    for (float& band : bands) {
        band = sum > 0.0 ? static_cast<float>(band / sum) : 0.0f;
    }
}

double MotorEstimator::Likeness(const std::vector<float>& spectrum, const std::vector<float>& history, size_t count) const
{
    if (count == 0) {
        return 1.0;  // nothing heard yet to compare with
    }
    double best = 0.0;
    for (size_t i = 0; i < count; ++i) {
        double shared = 0.0;
        for (size_t b = 0; b < m_bands; ++b) {
            shared += std::min(spectrum[b], history[i * m_bands + b]);
        }
        best = std::max(best, shared);
    }
    return best;
}

// The bins where the motor is strongest: above its mean, at most kMaxMotorBins of them.
void MotorEstimator::SelectMotorBins()
{
    double mean = 0.0;
    for (size_t k = 0; k < m_bins; ++k) {
        mean += m_motor[k];
    }
    mean /= static_cast<double>(m_bins);
    m_motorBins.clear();
    for (size_t k = 0; k < m_bins; ++k) {
        if (m_motor[k] > mean) {
            m_motorBins.push_back(k);
        }
    }
    if (m_motorBins.size() > kMaxMotorBins) {
        std::nth_element(m_motorBins.begin(), m_motorBins.begin() + kMaxMotorBins, m_motorBins.end(),
                         [this](size_t a, size_t b) { return m_motor[a] > m_motor[b]; });
        m_motorBins.resize(kMaxMotorBins);
    }
}

// Per bin, how far the frame stands out above the ceiling (log of the ratio), 0 where it does
// not; answers how many bins stand out.
size_t MotorEstimator::Salience(const float* p)
{
    size_t standing = 0;
    for (size_t k = 0; k < m_bins; ++k) {
        const bool stands = p[k] > kRise * m_base[k] && m_base[k] > 0.0f;
        m_salience[k] = stands ? std::log(p[k] / m_base[k]) : 0.0f;
        standing += stands ? 1 : 0;
    }
    return standing;
}

// A whine: the fundamental whose harmonics stand out most above the wanted sound's ceiling, at
// least three of them and half of those in range; 0 when there is none.
double MotorEstimator::DetectWhine(const float* p)
{
    if (Salience(p) < static_cast<size_t>(kMinHarmonics)) {
        return 0.0;
    }
    // A harmonic may fall a bin either side of where its fundamental puts it.
    m_spread[0] = std::max(m_salience[0], m_salience[1]);
    for (size_t k = 1; k + 1 < m_bins; ++k) {
        m_spread[k] = std::max({m_salience[k - 1], m_salience[k], m_salience[k + 1]});
    }
    double bestScore = 0.0;
    size_t best = m_candidates.size();
    for (size_t c = 0; c < m_candidates.size(); ++c) {
        const Candidate& candidate = m_candidates[c];
        int count = 0;
        double score = 0.0;
        for (int h = 0; h < candidate.harmonics; ++h) {
            const float s = m_spread[candidate.bins[h]];
            count += s > 0.0f ? 1 : 0;
            score += s;
        }
        if (m_spread[candidate.bins[0]] > 0.0f && count >= kMinHarmonics && 2 * count >= candidate.harmonics && score > bestScore) {
            bestScore = score;
            best = c;
        }
    }
    return best < m_candidates.size() ? m_candidates[best].hz : 0.0;
}

// Every harmonic of a whine, the hidden ones too, gets at least the power of its strongest
// harmonic that stands out, spread over the window's main lobe.
void MotorEstimator::FillWhine(const float* p, float* n, double f0)
{
    Salience(p);
    const double top = static_cast<double>(m_bins - 2);
    float strongest = 0.0f;
    for (int h = 1; h <= kHarmonics && h * f0 / m_binHz <= top; ++h) {
        const auto k = static_cast<size_t>(h * f0 / m_binHz + 0.5);
        for (size_t j = k - 1; j <= k + 1; ++j) {
            if (m_salience[j] > 0.0f) {
                strongest = std::max(strongest, p[j] - m_base[j]);
            }
        }
    }
    const float lobe[3] = {kLobeSide, 1.0f, kLobeSide};
    for (int h = 1; h <= kHarmonics && h * f0 / m_binHz <= top; ++h) {
        const auto k = static_cast<size_t>(h * f0 / m_binHz + 0.5);
        for (size_t j = k - 1; j <= k + 1; ++j) {
            n[j] = std::min(p[j], std::max(n[j], strongest * lobe[j + 1 - k]));
        }
    }
}

// A motor's whine runs on through the drive and its pitch moves smoothly with the motor's speed;
// a voice or an instrument found in its place for a syllable or a note is not it. Each frame
// takes the median of the pitches found around it (none counting as none), so a whine hidden for
// a moment under louder sound is followed where it goes.
void MotorEstimator::FollowWhine(const FrameRole* roles, size_t rows)
{
    size_t first = rows;
    size_t end = 0;
    for (size_t row = 0; row < rows; ++row) {
        if (roles[row] == FrameRole::kCore) {
            first = std::min(first, row);
            end = row + 1;
        }
    }
    std::copy(m_whine.begin(), m_whine.begin() + static_cast<ptrdiff_t>(rows), m_track.begin());
    for (size_t row = first; row < end; ++row) {
        // Centred, so that the median of a steady sweep is the frame's own pitch.
        const size_t side = std::min({m_trackRows, row - first, end - 1 - row});
        std::copy(m_whine.begin() + static_cast<ptrdiff_t>(row - side),
                  m_whine.begin() + static_cast<ptrdiff_t>(row + side + 1), m_window.begin());
        std::nth_element(m_window.begin(), m_window.begin() + static_cast<ptrdiff_t>(side),
                         m_window.begin() + static_cast<ptrdiff_t>(2 * side + 1));
        const double median = m_window[side];
        const double own = m_whine[row];
        const bool near = own > 0.0 && median > 0.0 && std::abs(std::log2(own / median)) <= kTrackOctaves;
        m_track[row] = near ? own : median;
    }
    std::copy(m_track.begin(), m_track.begin() + static_cast<ptrdiff_t>(rows), m_whine.begin());
}

double MotorEstimator::Estimate(const SpectralFrames& power, const FrameRole* roles, SpectralFrames& noise)
{
    noise.Clear();
    // The interval shows its own motor by a step at its ends or by a strong rise above the
    // surroundings, either like the lens heard before; only such an interval teaches what the
    // lens sounds like.
    double stepShare = 0.0;
    double stepLikeness = 0.0;
    bool stepped = StepSpectrum(power, roles);
    if (stepped) {
        double step = 0.0;
        double inside = 0.0;
        for (size_t k = 0; k < m_bins; ++k) {
            step += m_step[k];
            inside += m_inside[k];
        }
        stepShare = inside > 0.0 ? step / inside : 0.0;
        stepped = step > 0.0;
        for (float& value : m_step) {
            value = stepped ? static_cast<float>(value / step) : 0.0f;
        }
        if (stepped && m_historyCount > 0) {
            Template(false);
            ToBands(m_motor.data(), m_templateBands);
            ToBands(m_step.data(), m_stepBands);
            stepLikeness = Likeness(m_stepBands, m_templateBands, 1);
        } else {
            stepLikeness = 1.0;
        }
    }
    if (m_historyCount == 0 && !stepped) {
        for (size_t row = 0; row < power.Rows(); ++row) {
            noise.AddRow();
        }
        return 0.0;
    }
    Template(stepped);
    SelectMotorBins();
    std::fill(m_risenRows.begin(), m_risenRows.end(), 0u);
    std::fill(m_inside.begin(), m_inside.end(), 0.0f);  // from here: what rose, per bin
    double rise = 0.0;
    for (size_t row = 0; row < power.Rows(); ++row) {
        const float* p = power.Row(row);
        float* n = noise.AddRow();
        float activation = 0.0f;
        const size_t used = m_motorBins.size();
        if (used > 0) {
            for (size_t i = 0; i < used; ++i) {
                const size_t k = m_motorBins[i];
                m_column[i] = std::max(0.0f, p[k] - m_floor[k]) / m_motor[k];
            }
            const size_t at = std::min(used - 1, static_cast<size_t>(kActivationQuantile * static_cast<double>(used)));
            std::nth_element(m_column.begin(), m_column.begin() + static_cast<ptrdiff_t>(at),
                             m_column.begin() + static_cast<ptrdiff_t>(used));
            activation = m_column[at];
        }
        m_activation[row] = activation;
        uint32_t risen = 0;
        for (size_t k = 0; k < m_bins; ++k) {
            const float steady = activation * m_motor[k];
            const float ceiling = m_ceiling[k] + steady;
            const bool rises = p[k] > kRise * ceiling;
            n[k] = rises ? p[k] - m_ceiling[k] : std::min(p[k], steady);
            m_base[k] = ceiling;
            m_risenRows[k] += rises ? 1u : 0u;
            risen += rises ? 1u : 0u;
            if (roles[row] == FrameRole::kCore) {
                const float above = n[k] - std::min(p[k], steady);
                rise += above;
                m_inside[k] += above;
            }
        }
        m_risenBins[row] = risen;
        m_whine[row] = DetectWhine(p);
    }
    // What rises only now and then in a bin, in frames that do not rise across the spectrum, is
    // wanted sound (a whine's sweep, passing through each bin briefly, is followed below).
    const auto recurring = static_cast<uint32_t>(kRecurring * static_cast<double>(power.Rows()));
    const auto broadband = static_cast<uint32_t>(kBroadband * static_cast<double>(m_bins));
    for (size_t row = 0; row < power.Rows();) {
        if (m_risenBins[row] < broadband) {
            m_risenBins[row++] = 0u;
            continue;
        }
        size_t end = row;
        while (end < power.Rows() && m_risenBins[end] >= broadband) {
            ++end;
        }
        const uint32_t tick = end - row <= m_tickRows ? 1u : 0u;
        for (; row < end; ++row) {
            m_risenBins[row] = tick;
        }
    }
    for (size_t row = 0; row < power.Rows(); ++row) {
        const float* p = power.Row(row);
        float* n = noise.Row(row);
        const bool tick = m_risenBins[row] != 0u;
        for (size_t k = 0; k < m_bins; ++k) {
            const float steady = std::min(p[k], m_activation[row] * m_motor[k]);
            if (!tick && m_risenRows[k] < recurring) {
                n[k] = steady;
            }
        }
    }
    // A whine sweeping with the motor's speed hides some harmonics under the wanted sound: they
    // are given the power of those that show.
    FollowWhine(roles, power.Rows());
    for (size_t row = 0; row < power.Rows(); ++row) {
        if (m_whine[row] == 0.0) {
            continue;
        }
        for (size_t k = 0; k < m_bins; ++k) {
            m_base[k] = m_ceiling[k] + m_activation[row] * m_motor[k];
        }
        FillWhine(power.Row(row), noise.Row(row), m_whine[row]);
    }
    // Never below the wanted sound's usual level around the interval: what a bin holds up to
    // that level is taken for wanted sound, whatever the motor's estimate says.
    for (size_t row = 0; row < power.Rows(); ++row) {
        const float* p = power.Row(row);
        float* n = noise.Row(row);
        for (size_t k = 0; k < m_bins; ++k) {
            n[k] = std::min(n[k], std::max(0.0f, p[k] - m_floor[k]));
        }
    }
    double motor = 0.0;
    double total = 0.0;
    for (size_t row = 0; row < power.Rows(); ++row) {
        if (roles[row] != FrameRole::kAround) {
            const float* p = power.Row(row);
            const float* n = noise.Row(row);
            for (size_t k = 0; k < m_bins; ++k) {
                motor += n[k];
                total += p[k];
            }
        }
    }
    if (total <= 0.0) {
        return 0.0;
    }
    ToBands(m_inside.data(), m_riseBands);
    const bool rose = rise / total >= kClearRise && Likeness(m_riseBands, m_riseHistory, m_riseCount) >= kLikeLens;
    bool shown = (stepShare >= kClearStep && stepLikeness >= kLikeLens) || rose;
    // A long drive's middle has no ends: it goes with what its start showed.
    if (!m_bFirst && !m_bLast) {
        shown = m_bShown;
    } else if (!m_bFirst) {
        shown = shown || m_bShown;
    }
    m_bShown = shown;
    // Only a motor shown teaches what the lens sounds like.
    if (shown && stepped) {
        Remember(m_step.data(), m_bins, m_history, m_historyCount, m_historyNext);
    }
    if (shown && rise > 0.0) {
        Remember(m_riseBands.data(), m_bands, m_riseHistory, m_riseCount, m_riseNext);
    }
    return shown ? motor / total : 0.0;
}

}  // namespace ovix
