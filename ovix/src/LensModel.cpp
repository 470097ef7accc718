#include "LensModel.h"

#include <algorithm>
#include <cmath>
#include <limits>

namespace ovix {
namespace {

// An interval shows the motor on its own when this many bins step far beyond the wanted
// sound's own steps at both its ends (about 300 Hz of spectrum), or fewer that carry this share
// of its power (a low rumble fills a handful of bins).
constexpr size_t kStrong = 6;
constexpr size_t kStrongFew = 2;
constexpr double kStrongShare = 0.1;

bool Strong(const IntervalEvidence& evidence)
{
    return evidence.judged && (evidence.standing >= kStrong ||
                               (evidence.standing >= kStrongFew && evidence.standingShare >= kStrongShare));
}
// Strong evidence is believed when this share of its power (in quarter-octave bands) falls where
// another interval's that showed the lens does. Unrelated spectra share a few percent.
constexpr double kLikeLens = 0.2;
constexpr double kBandsPerOctave = 4.0;
// Weaker evidence is believed when it recurs in another interval over this many octaves, or
// when, over the bins where the lens showed itself elsewhere, the interval's ends step by this
// many times the wanted sound's own steps on average (many bins together tell what one cannot).
constexpr double kRecurringOctaves = 0.2;
constexpr double kMatched = 0.75;
constexpr double kMinLensOctaves = 0.2;
constexpr size_t kNone = SIZE_MAX;
constexpr float kLoneScore = 1.0f;
// A whine in this share more of an interval's frames than the wanted sound alone makes one in
// (and in twice as many) is a stepping motor's.
constexpr double kWhineShare = 0.2;
constexpr double kWhineOverWanted = 2.0;
// Short surroundings may happen to hold no whine of the wanted sound's: it makes one in at least
// this share of frames for all they tell.
constexpr double kLeastWantedWhine = 0.1;

bool ShowsWhine(const IntervalEvidence& evidence)
{
    const double wanted = std::max(evidence.whineNull, kLeastWantedWhine);
    return evidence.whine - wanted >= kWhineShare && evidence.whine >= kWhineOverWanted * wanted;
}

}  // namespace

LensModel::LensModel(size_t bins, size_t ahead)
    : m_bins(bins), m_ahead(ahead), m_spanOf(kRemembered + 1 + ahead + 2, kNone), m_octaves(bins)
{
    m_records.reserve(m_spanOf.size());
    for (size_t i = 0; i < m_spanOf.size(); ++i) {
        m_records.emplace_back(bins);
    }
    m_chosen.reserve(m_spanOf.size());
    m_lensBins.resize(bins);
    m_lensPower.resize(bins);
    m_column.resize(m_spanOf.size());
    m_band.resize(bins);
    for (size_t k = 0; k < bins; ++k) {
        const double low = std::max(static_cast<double>(k) - 0.5, 0.25);
        m_octaves[k] = static_cast<float>(std::log2((static_cast<double>(k) + 0.5) / low));
        m_band[k] = static_cast<uint16_t>(kBandsPerOctave * std::log2(static_cast<double>(std::max<size_t>(k, 1))));
    }
    m_ownBands.resize(static_cast<size_t>(m_band.back()) + 1);
    m_lensBands.resize(m_ownBands.size());
}

void LensModel::Reset() { std::fill(m_spanOf.begin(), m_spanOf.end(), kNone); }

IntervalEvidence& LensModel::Record(size_t span)
{
    const size_t slot = span % m_spanOf.size();
    m_spanOf[slot] = span;
    IntervalEvidence& evidence = m_records[slot];
    evidence.standing = 0;
    evidence.standingShare = 0.0;
    evidence.whine = 0.0;
    evidence.whineNull = 0.0;
    evidence.judged = false;
    evidence.adjoins = false;
    evidence.shown = false;
    evidence.decided = false;
    std::fill(evidence.step.begin(), evidence.step.end(), 0.0f);
    std::fill(evidence.score.begin(), evidence.score.end(), 0.0f);
    std::fill(evidence.weak.begin(), evidence.weak.end(), uint8_t{0});
    std::fill(evidence.covered.begin(), evidence.covered.end(), 0.0f);
    std::fill(evidence.coveredLoud.begin(), evidence.coveredLoud.end(), 0.0f);
    std::fill(evidence.floor.begin(), evidence.floor.end(), 0.0f);
    std::fill(evidence.ceiling.begin(), evidence.ceiling.end(), 0.0f);
    std::fill(evidence.pitches.begin(), evidence.pitches.end(), 0.0f);
    std::fill(evidence.rises.begin(), evidence.rises.end(), 0.0f);
    return evidence;
}

const IntervalEvidence* LensModel::Find(size_t span) const
{
    const size_t slot = span % m_spanOf.size();
    return m_spanOf[slot] == span ? &m_records[slot] : nullptr;
}

double LensModel::Likeness(const IntervalEvidence& evidence, const IntervalEvidence& lens)
{
    std::fill(m_ownBands.begin(), m_ownBands.end(), 0.0f);
    std::fill(m_lensBands.begin(), m_lensBands.end(), 0.0f);
    for (size_t k = 0; k < m_bins; ++k) {
        m_ownBands[m_band[k]] += evidence.step[k];
        m_lensBands[m_band[k]] += lens.step[k];
    }
    double shared = 0.0;
    for (size_t b = 0; b < m_ownBands.size(); ++b) {
        shared += std::min(m_ownBands[b], m_lensBands[b]);
    }
    if (evidence.whine >= kWhineShare && lens.whine >= kWhineShare) {
        // A stepping motor sweeps its whine, each drive over its own stretch of the spectrum.
        double own = 0.0;
        double theirs = 0.0;
        for (size_t b = 0; b < IntervalEvidence::kPitchBands; ++b) {
            own += evidence.pitches[b];
            theirs += lens.pitches[b];
        }
        double pitches = 0.0;
        for (size_t b = 0; b < IntervalEvidence::kPitchBands && own > 0.0 && theirs > 0.0; ++b) {
            pitches += std::min(evidence.pitches[b] / own, lens.pitches[b] / theirs);
        }
        shared = std::max(shared, pitches);
    }
    return shared;
}

bool LensModel::Decide(size_t span, size_t lastAhead)
{
    IntervalEvidence* own = const_cast<IntervalEvidence*>(Find(span));
    if (own == nullptr) {
        return false;
    }
    own->decided = true;
    const size_t first = span > kRemembered ? span - kRemembered : 0;
    const size_t last = std::min(lastAhead, span + m_ahead);
    const bool strong = Strong(*own);
    bool lensSeen = false;
    bool lensBefore = false;  // an earlier interval was found to show the lens
    double like = 0.0;
    double recurring = 0.0;
    std::fill(m_lensBins.begin(), m_lensBins.end(), uint8_t{0});
    std::fill(m_lensPower.begin(), m_lensPower.end(), 0.0f);
    for (size_t other = first; other <= last; ++other) {
        const IntervalEvidence* evidence = other != span ? Find(other) : nullptr;
        if (evidence == nullptr) {
            continue;
        }
        const bool showsLens = evidence->decided ? evidence->shown : Strong(*evidence);
        if (showsLens) {
            lensSeen = true;
            lensBefore = lensBefore || other < span;
            like = std::max(like, Likeness(*own, *evidence));
            for (size_t k = 0; k < m_bins; ++k) {
                m_lensBins[k] |= evidence->weak[k];
                m_lensPower[k] += evidence->step[k];
            }
        }
        double octaves = 0.0;
        for (size_t k = 0; k < m_bins; ++k) {
            octaves += own->weak[k] != 0 && evidence->weak[k] != 0 ? m_octaves[k] : 0.0f;
        }
        recurring = std::max(recurring, octaves);
    }
    // Over the lens's bins, weighted by how much of its power each carries.
    double lensOctaves = 0.0;
    double lensPower = 0.0;
    double matched = 0.0;
    for (size_t k = 0; k < m_bins; ++k) {
        if (m_lensBins[k] != 0) {
            lensOctaves += m_octaves[k];
            lensPower += m_lensPower[k];
            matched += m_lensPower[k] * own->score[k];
        }
    }
    matched = lensOctaves >= kMinLensOctaves && lensPower > 0.0 ? matched / lensPower : 0.0;
    if (!own->judged) {
        // No surroundings to judge it by: a drive that runs on from or into one showing the lens
        // goes with it.
        own->shown = lensSeen && own->adjoins;
    } else if (strong) {
        // Wanted sound that happens to start and stop with a drive can step as clearly as a
        // motor; unlike what the lens made before, and like nothing the lens makes later, it is
        // not believed.
        own->shown = !lensBefore || like >= kLikeLens;
    } else {
        own->shown = recurring >= kRecurringOctaves || matched >= kMatched || ShowsWhine(*own);
    }
    return own->shown;
}

void LensModel::Rises(size_t span, size_t lastAhead, std::vector<float>& rises, std::vector<float>& loud)
{
    const size_t first = span > kRemembered ? span - kRemembered : 0;
    const size_t last = std::min(lastAhead, span + m_ahead);
    m_chosen.clear();
    for (size_t other = first; other <= last; ++other) {
        const IntervalEvidence* evidence = other != span ? Find(other) : nullptr;
        if (evidence != nullptr && evidence->judged &&
            (evidence->decided ? evidence->shown : Strong(*evidence))) {
            m_chosen.push_back(evidence);
        }
    }
    if (m_chosen.empty()) {
        std::fill(rises.begin(), rises.end(), 1.0f);
        std::fill(loud.begin(), loud.end(), std::numeric_limits<float>::max());
        return;
    }
    const size_t middle = m_chosen.size() / 2;
    for (size_t k = 0; k < m_bins; ++k) {
        for (size_t i = 0; i < m_chosen.size(); ++i) {
            m_column[i] = m_chosen[i]->rises[k];
        }
        std::nth_element(m_column.begin(), m_column.begin() + static_cast<ptrdiff_t>(middle),
                         m_column.begin() + static_cast<ptrdiff_t>(m_chosen.size()));
        rises[k] = m_column[middle];
        for (size_t i = 0; i < m_chosen.size(); ++i) {
            m_column[i] = m_chosen[i]->loud[k];
        }
        std::nth_element(m_column.begin(), m_column.begin() + static_cast<ptrdiff_t>(middle),
                         m_column.begin() + static_cast<ptrdiff_t>(m_chosen.size()));
        loud[k] = m_column[middle];
    }
}

void LensModel::Ceiling(size_t span, size_t lastAhead, std::vector<float>& ceiling) const
{
    const size_t first = span > kRemembered ? span - kRemembered : 0;
    const size_t last = std::min(lastAhead, span + m_ahead);
    for (size_t other = first; other <= last; ++other) {
        const IntervalEvidence* evidence = Find(other);
        if (evidence != nullptr && other != span) {
            for (size_t k = 0; k < m_bins; ++k) {
                ceiling[k] = std::max(ceiling[k], evidence->ceiling[k]);
            }
        }
    }
}

bool LensModel::Whines(size_t span, size_t lastAhead) const
{
    const size_t first = span > kRemembered ? span - kRemembered : 0;
    const size_t last = std::min(lastAhead, span + m_ahead);
    for (size_t other = first; other <= last; ++other) {
        const IntervalEvidence* evidence = Find(other);
        if (evidence != nullptr && (other == span || (evidence->decided && evidence->shown)) && ShowsWhine(*evidence)) {
            return true;
        }
    }
    return false;
}

void LensModel::Spectrum(size_t span, size_t lastAhead, std::vector<float>& motor)
{
    const size_t first = span > kRemembered ? span - kRemembered : 0;
    const size_t last = std::min(lastAhead, span + m_ahead);
    m_chosen.clear();
    for (size_t other = first; other <= last; ++other) {
        const IntervalEvidence* evidence = Find(other);
        if (evidence == nullptr || !evidence->judged) {
            continue;
        }
        const bool showsLens = evidence->decided ? evidence->shown : Strong(*evidence);
        if (other == span || showsLens) {
            m_chosen.push_back(evidence);
        }
    }
    motor.assign(m_bins, 0.0f);
    if (m_chosen.empty()) {
        return;
    }
    // One interval alone cannot tell the motor's part of its steps from the wanted sound's in
    // bins where the wanted sound steps about as far: only bins clearly beyond that are kept.
    const size_t middle = m_chosen.size() / 2;
    for (size_t k = 0; k < m_bins; ++k) {
        if (m_chosen.size() == 1) {
            motor[k] = m_chosen[0]->score[k] > kLoneScore ? m_chosen[0]->step[k] : 0.0f;
            continue;
        }
        for (size_t i = 0; i < m_chosen.size(); ++i) {
            m_column[i] = m_chosen[i]->step[k];
        }
        std::nth_element(m_column.begin(), m_column.begin() + static_cast<ptrdiff_t>(middle),
                         m_column.begin() + static_cast<ptrdiff_t>(m_chosen.size()));
        motor[k] = m_column[middle];
    }
}

}  // namespace ovix
