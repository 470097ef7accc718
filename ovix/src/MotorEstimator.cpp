#include "MotorEstimator.h"

#include "FastLog.h"

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
constexpr float kRise = 1.5f;
// A motor keeps making its noise: a bin that rises so in fewer of the interval's frames is a
// syllable or a note, unless its frame rises across this share of the spectrum for no longer
// than a tick lasts (a loud syllable rises as broadly, for longer).
constexpr double kRecurring = 0.2;
constexpr double kBroadband = 0.2;
// And it rises in the same bins in the lens's other drives, if not as often, and no louder than
// twice what those drives reach there at their loudest (a bird singing in one drive is no motor).
constexpr float kLensRecurring = 0.1f;
constexpr float kLensLoudness = 2.0f;
constexpr double kLoudInside = 0.9;
constexpr double kTickSeconds = 0.01;
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
// Bins whose ends step more than twice as far as the wanted sound does on its own count as weak
// evidence; the motor's spectrum is taken from bins that step beyond it at all.
constexpr float kWeakScore = 2.5f;
constexpr float kSpectrumScore = 0.0f;
// Also weak evidence: a bin that even in the interval's quiet moments is louder than the
// surroundings on both sides are most of the time.
constexpr double kQuietInside = 0.25;
constexpr double kUsualAround = 0.5;
constexpr double kLoudAround = 0.8;
// Levels are read from every fourth frame: frames a window apart, so none is counted twice.
constexpr size_t kLevelStride = 4;
// Where the motor covers the wanted sound, a frame up to this many times the drive's usual
// level there is the motor's doing (tones beating under a bin swing so far), louder is not.
constexpr float kCoveredLoud = 4.0f;
// Enough bins to judge a frame by, few enough to judge every frame quickly.
constexpr size_t kMaxMotorBins = 64;

}  // namespace

MotorEstimator::MotorEstimator(const SuppressorParameters& parameters)
    : m_bins(parameters.bins),
      m_detector(parameters),
      m_floor(m_bins),
      m_ceiling(m_bins),
      m_inside(m_bins),
      m_outside(m_bins),
      m_motor(m_bins),
      m_usualInside(m_bins),
      m_usualBefore(m_bins),
      m_usualAfter(m_bins),
      m_loudBefore(m_bins),
      m_loudAfter(m_bins)
{
    m_motorBins.reserve(m_bins);
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
    m_column.resize(std::max({rows, parameters.contextFrames * 2 / parameters.hop + 8, m_bins}));
    m_quantiles = ColumnQuantiles(m_column.size(), m_bins);
    m_activation.resize(m_column.size());
    m_risenBins.resize(m_column.size());
    // A tick shows in the frames whose window reaches it.
    m_tickRows = (static_cast<size_t>(kTickSeconds * static_cast<double>(parameters.rateHz)) + parameters.fftSize) / parameters.hop;
    m_risenRows.resize(m_bins);
    m_whine.resize(m_column.size());
    m_track.resize(m_column.size());
    m_trackRows = static_cast<size_t>(kTrackSeconds * static_cast<double>(parameters.rateHz)) / parameters.hop;
    m_guardRows = parameters.edgeFrames / parameters.hop;
    m_window.resize(2 * m_trackRows + 1);
}

void MotorEstimator::SetSurroundings(const SpectralFrames& around, size_t before, bool first, bool last,
                                     const IntervalEvidence* surveyed)
{
    m_around = &around;
    m_before = std::min(before, around.Rows());
    m_bFirst = first;
    m_bLast = last;
    if (surveyed != nullptr) {
        std::copy(surveyed->floor.begin(), surveyed->floor.end(), m_floor.begin());
        std::copy(surveyed->ceiling.begin(), surveyed->ceiling.end(), m_ceiling.begin());
        return;
    }
    m_detector.Calibrate(around, m_before);
    if (around.Rows() >= kMinRows) {
        const double quantiles[] = {kFloorQuantile};
        std::vector<float>* const outs[] = {&m_floor};
        m_quantiles.Compute(around, 0, around.Rows(), kLevelStride, quantiles, outs);
        // A drive's noise may begin a moment before the camera marks it and end a moment after:
        // the frames next to the interval do not tell how loud the wanted sound gets.
        const size_t skipFrom = m_before > m_guardRows ? m_before - m_guardRows : m_before;
        const size_t skipTo = around.Rows() - m_before > m_guardRows ? m_before + m_guardRows : m_before;
        Ceiling(around, 0, around.Rows(), m_ceiling, skipFrom, skipTo);
    }
    // Otherwise what was heard around earlier intervals stands.
}

// A bin's ceiling is the loudest of it and its neighbours: a voice's harmonics move with its
// pitch, and one louder syllable a bin away is no motor.
void MotorEstimator::Ceiling(const SpectralFrames& frames, size_t from, size_t to, std::vector<float>& out,
                             size_t skipFrom, size_t skipTo)
{
    std::fill(m_inside.begin(), m_inside.end(), 0.0f);
    for (size_t row = from; row < to; row = row + 1 == skipFrom ? std::max(skipTo, row + 1) : row + 1) {
        const float* p = frames.Row(row);
        for (size_t k = 0; k < m_bins; ++k) {
            m_inside[k] = std::max(m_inside[k], p[k]);
        }
    }
    for (size_t k = 0; k < m_bins; ++k) {
        const size_t low = k > kCeilingSpread ? k - kCeilingSpread : 0;
        const size_t high = std::min(m_bins, k + kCeilingSpread + 1);
        out[k] = *std::max_element(m_inside.begin() + static_cast<ptrdiff_t>(low),
                                   m_inside.begin() + static_cast<ptrdiff_t>(high));
    }
}

// The share of rows [from, to) of `frames` in which a whine stands above `base`.
double MotorEstimator::WhineShare(const SpectralFrames& frames, size_t from, size_t to, const std::vector<float>& base,
                                  float* pitches)
{
    std::copy(base.begin(), base.end(), m_base.begin());
    size_t found = 0;
    size_t looked = 0;
    // Every second frame: neighbours overlap by three quarters.
    for (size_t row = from; row < to; row += 2, ++looked) {
        const double f0 = DetectWhine(frames.Row(row));
        found += f0 > 0.0 ? 1 : 0;
        if (f0 > 0.0 && pitches != nullptr) {
            const auto band = static_cast<size_t>(IntervalEvidence::kPitchBandsPerOctave * std::log2(f0 / kMinWhineHz));
            pitches[std::min(band, IntervalEvidence::kPitchBands - 1)] += 1.0f;
        }
    }
    return looked > 0 ? static_cast<double>(found) / static_cast<double>(looked) : 0.0;
}

void MotorEstimator::CoreRows(const FrameRole* roles, size_t rows, size_t& firstCore, size_t& endCore) const
{
    firstCore = rows;
    endCore = 0;
    for (size_t row = 0; row < rows; ++row) {
        if (roles[row] == FrameRole::kCore) {
            firstCore = std::min(firstCore, row);
            endCore = row + 1;
        }
    }
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
        m_salience[k] = stands ? FastLog2(p[k] / m_base[k]) : 0.0f;
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

void MotorEstimator::Survey(const SpectralFrames& power, const FrameRole* roles, IntervalEvidence& evidence)
{
    size_t firstCore = 0;
    size_t endCore = 0;
    CoreRows(roles, power.Rows(), firstCore, endCore);
    if (firstCore >= endCore) {
        return;
    }
    std::copy(m_floor.begin(), m_floor.end(), evidence.floor.begin());
    std::copy(m_ceiling.begin(), m_ceiling.end(), evidence.ceiling.begin());
    double insidePower = 0.0;  // the interval's power, summed over its core frames
    for (size_t row = firstCore; row < endCore; ++row) {
        const float* p = power.Row(row);
        for (size_t k = 0; k < m_bins; ++k) {
            evidence.rises[k] += p[k] > kRise * m_ceiling[k] ? 1.0f : 0.0f;
            insidePower += p[k];
        }
    }
    for (float& rises : evidence.rises) {
        rises /= static_cast<float>(endCore - firstCore);
    }

    evidence.standing = m_detector.Judge(power, firstCore, endCore, m_bFirst, m_bLast);
    evidence.judged = m_detector.Judged();
    if (!evidence.judged) {
        return;
    }
    // A whine found in the interval far more often than the wanted sound alone makes one: judged
    // on each side against the other side's ceiling, where no motor ran either (against the
    // other half of the one side a long drive's segment has).
    const size_t after = m_around->Rows() - m_before;
    const bool both = m_bFirst && m_bLast && m_before >= kMinRows && after >= kMinRows;
    const size_t sideFrom = m_bFirst ? 0 : m_before;
    const size_t sideTo = m_bFirst ? m_before : m_around->Rows();
    const size_t cut = both ? m_before : (sideFrom + sideTo) / 2;
    if (both || sideTo - sideFrom >= 2 * kMinRows) {
        evidence.whine = WhineShare(power, firstCore, endCore, m_ceiling, evidence.pitches.data());
        Ceiling(*m_around, sideFrom, cut, m_outside);
        const double later = WhineShare(*m_around, cut, both ? m_around->Rows() : sideTo, m_outside);
        Ceiling(*m_around, cut, both ? m_around->Rows() : sideTo, m_outside);
        evidence.whineNull = std::max(later, WhineShare(*m_around, sideFrom, cut, m_outside));
    }
    // A motor runs through the drive: a bin whose quiet moments inside are not even as loud as
    // the surroundings usually are was stepped by wanted sound that came and went (a note struck
    // as the drive began), whatever its ends show. A bin quiet inside at least as loud as the
    // surroundings at their loudest is weak evidence of its own.
    const bool before = m_bFirst && m_before >= kMinRows;
    const bool later = m_bLast && after >= kMinRows;
    const double inside[] = {kQuietInside, kUsualAround, kLoudInside};
    std::vector<float>* const insideOuts[] = {&m_inside, &m_usualInside, &evidence.loud};
    m_quantiles.Compute(power, firstCore, endCore, kLevelStride, inside, insideOuts);
    const double around[] = {kUsualAround, kLoudAround};
    if (before) {
        std::vector<float>* const outs[] = {&m_usualBefore, &m_loudBefore};
        m_quantiles.Compute(*m_around, 0, m_before, kLevelStride, around, outs);
    }
    if (later) {
        std::vector<float>* const outs[] = {&m_usualAfter, &m_loudAfter};
        m_quantiles.Compute(*m_around, m_before, m_around->Rows(), kLevelStride, around, outs);
    }
    evidence.standing = 0;
    double standingPower = 0.0;
    double sum = 0.0;
    for (size_t k = 0; k < m_bins; ++k) {
        const bool persists = (!before || m_inside[k] > m_usualBefore[k]) && (!later || m_inside[k] > m_usualAfter[k]);
        evidence.score[k] = persists ? m_detector.Score(k) : std::min(m_detector.Score(k), 0.0f);
        const bool stands = evidence.score[k] > m_detector.Bar();
        evidence.standing += stands ? 1 : 0;
        standingPower += stands ? m_detector.Step()[k] : 0.0f;
        const bool louder = both && m_inside[k] > m_loudBefore[k] && m_inside[k] > m_loudAfter[k];
        evidence.weak[k] = evidence.score[k] > kWeakScore || louder ? 1 : 0;
        const bool covers = louder && evidence.score[k] > kWeakScore;
        evidence.covered[k] = covers ? std::max(m_usualBefore[k], m_usualAfter[k]) : 0.0f;
        evidence.coveredLoud[k] = covers ? std::min(evidence.loud[k], kCoveredLoud * m_usualInside[k]) : 0.0f;
        evidence.step[k] = evidence.score[k] > kSpectrumScore ? m_detector.Step()[k] : 0.0f;
        sum += evidence.step[k];
    }
    for (float& value : evidence.step) {
        value = sum > 0.0 ? static_cast<float>(value / sum) : 0.0f;
    }
    const double frames = static_cast<double>(endCore - firstCore);
    evidence.standingShare = insidePower > 0.0 ? standingPower * frames / insidePower : 0.0;
}

double MotorEstimator::Estimate(const SpectralFrames& power, const FrameRole* roles, const LensView& lens,
                                SpectralFrames& noise)
{
    noise.Clear();
    std::copy(lens.spectrum.begin(), lens.spectrum.end(), m_motor.begin());
    SelectMotorBins();
    std::fill(m_risenRows.begin(), m_risenRows.end(), 0u);
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
        }
        m_risenBins[row] = risen;
        // Every second frame: the pitch track is followed over a quarter second anyway.
        if (lens.whine && row % 2 == 0) {
            m_whine[row] = DetectWhine(p);
        } else {
            m_whine[row] = lens.whine ? m_whine[row - 1] : 0.0;
        }
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
            if (!tick && (m_risenRows[k] < recurring || lens.rises[k] < kLensRecurring)) {
                n[k] = steady;
            } else if (!tick) {
                n[k] = std::min(n[k], kLensLoudness * lens.loud[k]);
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
    // Where the motor covers the wanted sound, all but the wanted sound's usual level is the
    // motor's, however it moves from frame to frame (tones beating under one bin), up to how loud
    // the drive gets there (a bird's call louder than that stays the bird's).
    for (size_t row = 0; row < power.Rows(); ++row) {
        const float* p = power.Row(row);
        float* n = noise.Row(row);
        for (size_t k = 0; k < m_bins; ++k) {
            if (lens.covered[k] > 0.0f) {
                n[k] = std::max(n[k], std::min(p[k], lens.coveredLoud[k]) - lens.covered[k]);
            }
        }
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
    return total > 0.0 ? motor / total : 0.0;
}

}  // namespace ovix
