// Estimates the lens motor's noise power in every frame of an AF interval from what the
// camera tells us: the motor runs exactly inside the interval and is silent around it.
// - What the interval's ends show (Survey): where the sound steps up as the drive starts and
//   down as it stops, in units of how far the wanted sound steps on its own (StepDetector), and
//   the motor's spectrum as the smaller of the two steps. Whether that shows the lens and which
//   spectrum the lens has is decided across intervals (LensModel).
// - Per frame, how strongly the motor runs (it accelerates, brakes, is driven in bursts): a
//   low quantile over the motor's bins of the frame's power beyond the wanted sound's floor,
//   relative to the motor's spectrum. Wanted sound only raises some bins, so it passes.
// - Ticks and the drive's start and stop transients: what rises far above anything the
//   surroundings reached, in bins where the motor keeps rising or across the spectrum for a
//   moment; what rises in a bin only now and then is a syllable or a note.
// - A stepping motor's whine sweeps with its speed: per frame the fundamental whose harmonics
//   stand out, held to the pitch track around it (a voice's syllable is not the whine), and its
//   harmonics hidden under the wanted sound given the power of those shown.
#pragma once

#include "ColumnQuantiles.h"
#include "LensModel.h"
#include "SpectralFrames.h"
#include "StepDetector.h"
#include "SuppressorParameters.h"

#include <cstdint>
#include <vector>

namespace ovix {

// What the lens model tells the estimate of one interval.
struct LensView {
    const std::vector<float>& spectrum;  // the motor's steady spectrum
    const std::vector<float>& rises;  // how often each bin rises far in the lens's other drives
    const std::vector<float>& loud;  // and how loud it gets there
    const std::vector<float>& covered;  // in this drive, where the motor covers the wanted sound
    const std::vector<float>& coveredLoud;  // and how loud the drive gets there
    bool whine = false;  // a stepping motor: its whine is tracked and its hidden harmonics filled in
};

enum class FrameRole : uint8_t {
    kAround,  // outside the interval: the ramps and the analysis windows reaching past it
    kEdge,  // where the drive starts or stops
    kCore,  // the drive's steady part
};

class MotorEstimator {
public:
    explicit MotorEstimator(const SuppressorParameters& parameters);

    // Rows heard around the interval: [0, before) before it, the rest after it. `first` and
    // `last` say whether the segment to estimate holds the interval's start and end. The levels
    // a survey of the interval found there are taken over rather than measured again.
    void SetSurroundings(const SpectralFrames& around, size_t before, bool first, bool last,
                         const IntervalEvidence* surveyed = nullptr);
    // What the segment's ends show of a motor, for the lens model.
    void Survey(const SpectralFrames& power, const FrameRole* roles, IntervalEvidence& evidence);
    // Fills `noise` (same rows as `power`) for a motor of spectrum `lens` and answers the
    // motor's share of the power in the interval's frames.
    // The wanted sound's ceiling in use, to be raised to what it reached around other intervals.
    std::vector<float>& WantedCeiling() { return m_ceiling; }
    double Estimate(const SpectralFrames& power, const FrameRole* roles, const LensView& lens, SpectralFrames& noise);

private:
    void CoreRows(const FrameRole* roles, size_t rows, size_t& firstCore, size_t& endCore) const;
    void SelectMotorBins();
    // Per bin, the loudest of rows [from, to) but [skipFrom, skipTo), spread over neighbouring bins.
    void Ceiling(const SpectralFrames& frames, size_t from, size_t to, std::vector<float>& out, size_t skipFrom = 0,
                 size_t skipTo = 0);
    // The share of rows [from, to) of `frames` in which a whine stands above `base`; counts the
    // frames by the whine's pitch into `pitches` (IntervalEvidence::kPitchBands) when given.
    double WhineShare(const SpectralFrames& frames, size_t from, size_t to, const std::vector<float>& base,
                      float* pitches = nullptr);
    size_t Salience(const float* p);
    double DetectWhine(const float* p);
    void FillWhine(const float* p, float* n, double f0);
    void FollowWhine(const FrameRole* roles, size_t rows);

    size_t m_bins;
    StepDetector m_detector;
    const SpectralFrames* m_around = nullptr;
    size_t m_before = 0;
    bool m_bFirst = false;
    bool m_bLast = false;
    std::vector<float> m_floor;  // the wanted sound's floor around the interval
    std::vector<float> m_ceiling;  // and the most it reached
    std::vector<float> m_inside;
    std::vector<float> m_outside;
    std::vector<float> m_motor;  // the motor's spectrum used for this interval
    std::vector<float> m_usualInside;  // how loud the interval usually is
    std::vector<float> m_usualBefore;  // how loud the surroundings usually are, and at their loudest
    std::vector<float> m_usualAfter;
    std::vector<float> m_loudBefore;
    std::vector<float> m_loudAfter;
    std::vector<size_t> m_motorBins;
    std::vector<float> m_base;  // per frame: the wanted sound's ceiling plus the steady motor
    std::vector<float> m_salience;
    std::vector<float> m_spread;  // the salience, at most a bin away
    static constexpr int kMaxHarmonics = 8;
    struct Candidate {
        double hz = 0.0;
        int harmonics = 0;
        uint16_t bins[kMaxHarmonics] = {};
    };
    std::vector<Candidate> m_candidates;
    std::vector<float> m_activation;
    // Per frame: how many bins rise far above the surroundings, then whether the frame is a tick.
    std::vector<uint32_t> m_risenBins;
    std::vector<uint32_t> m_risenRows;  // per bin: in how many frames it rises so
    size_t m_tickRows = 0;  // the most frames a tick rises in
    std::vector<double> m_whine;  // per frame: the whine's fundamental, 0 for none
    std::vector<double> m_track;
    std::vector<double> m_window;
    size_t m_trackRows = 0;  // frames each side that a frame's whine is judged with
    size_t m_guardRows = 0;  // frames next to the interval left out of the wanted sound's ceiling
    double m_binHz = 1.0;
    std::vector<float> m_column;  // scratch: one bin across rows, or one row across bins
    ColumnQuantiles m_quantiles{0, 0};
};

}  // namespace ovix
