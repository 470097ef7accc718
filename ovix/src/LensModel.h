// What the lens sounds like, learned across the intervals of a session: the evidence each
// interval's ends gave (looked at before the interval is processed, with the intervals that
// follow it when the look-ahead holds them) and from it whether an interval shows the motor and
// which spectrum the motor has. One lens makes one noise: evidence that recurs in other
// intervals is believed sooner, evidence unlike what the lens showed elsewhere is not believed.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

namespace ovix {

// What one interval's ends show.
struct IntervalEvidence {
    explicit IntervalEvidence(size_t bins)
        : step(bins),
          score(bins),
          weak(bins),
          covered(bins),
          coveredLoud(bins),
          floor(bins),
          ceiling(bins),
          rises(bins),
          loud(bins),
          pitches(kPitchBands)
    {
    }

    // A whine's pitch is counted in sixth-octave bands from 100 Hz up (past 2.5 kHz).
    static constexpr double kPitchBandsPerOctave = 6.0;
    static constexpr size_t kPitchBands = 30;

    std::vector<float> step;  // the step into the interval where it stands out, unit power; 0 elsewhere
    std::vector<float> score;  // per bin, the step in units of the wanted sound's own steps
    std::vector<uint8_t> weak;  // bins that step more than the wanted sound usually does
    // Per bin the motor covers (even its quiet moments louder than the surroundings' loud ones),
    // how loud the wanted sound usually is there; 0 elsewhere.
    std::vector<float> covered;
    std::vector<float> coveredLoud;  // and the most of a frame there that is the motor's
    std::vector<float> floor;  // the wanted sound's usual level around the interval, per bin
    std::vector<float> ceiling;  // the loudest the wanted sound got around the interval, per bin
    std::vector<float> rises;  // per bin, the share of the interval's frames rising far above that
    std::vector<float> loud;  // per bin, how loud the interval gets (a high quantile over its frames)
    size_t standing = 0;  // bins that step far more than the wanted sound does
    double standingShare = 0.0;  // their step's share of the interval's power
    double whine = 0.0;  // the share of the interval's frames in which a whine stands out
    double whineNull = 0.0;  // the same share in the surroundings, where no motor ran
    std::vector<float> pitches;  // frames with a whine, by its pitch
    bool judged = false;  // at least one end could be compared with its surroundings
    bool adjoins = false;  // the drive runs on from, or into, the one beside it
    bool shown = false;  // the decision, once made
    bool decided = false;
};

class LensModel {
public:
    // `bins` per spectrum; `ahead`: how many later intervals a decision may wait for.
    LensModel(size_t bins, size_t ahead);

    static constexpr size_t kRemembered = 5;  // earlier intervals a decision looks back on

    // Forgets everything: a new session.
    void Reset();
    // The record of interval `span`, to be filled by a survey; replaces the oldest.
    IntervalEvidence& Record(size_t span);
    // Whether interval `span` shows the lens's motor, judged with the records of the
    // intervals from kRemembered before it to `lastAhead`; the decision is kept in its record.
    bool Decide(size_t span, size_t lastAhead);
    // Whether interval `span` or one showing the same lens whines: a stepping motor.
    bool Whines(size_t span, size_t lastAhead) const;
    // Per bin, how often the sound rises far above its surroundings in the other intervals near
    // `span` that show the lens (median); 1 where there are none.
    void Rises(size_t span, size_t lastAhead, std::vector<float>& rises, std::vector<float>& loud);
    // Per bin, the loudest the wanted sound got around the intervals near `span`.
    void Ceiling(size_t span, size_t lastAhead, std::vector<float>& ceiling) const;
    // The survey of interval `span`, if it is still held.
    const IntervalEvidence* Evidence(size_t span) const { return Find(span); }
    // The decision made about interval `span`.
    bool Shown(size_t span) const
    {
        const IntervalEvidence* evidence = Find(span);
        return evidence != nullptr && evidence->shown;
    }
    // The motor's spectrum for interval `span` (unit power per record, median across the
    // records that show it), into `motor`.
    void Spectrum(size_t span, size_t lastAhead, std::vector<float>& motor);

private:
    const IntervalEvidence* Find(size_t span) const;
    // How much of `evidence`'s step (unit power, in quarter-octave bands) falls where `lens`'s
    // does; for two whines, how much of the pitches they went through they share.
    double Likeness(const IntervalEvidence& evidence, const IntervalEvidence& lens);

    size_t m_bins;
    size_t m_ahead;
    std::vector<IntervalEvidence> m_records;
    std::vector<size_t> m_spanOf;  // per slot, the interval it holds, SIZE_MAX for none
    std::vector<float> m_octaves;  // per bin, the octaves it covers
    std::vector<uint16_t> m_band;  // per bin, its quarter-octave band
    std::vector<float> m_ownBands;
    std::vector<float> m_lensBands;
    std::vector<const IntervalEvidence*> m_chosen;
    std::vector<uint8_t> m_lensBins;  // where the intervals that show the lens are weak
    std::vector<float> m_lensPower;  // and their steps' power there
    std::vector<float> m_column;
};

}  // namespace ovix
