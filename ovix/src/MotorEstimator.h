// Estimates the lens motor's noise power in every frame of an AF interval from what the
// camera tells us: the motor runs exactly inside the interval and is silent around it.
// - Its spectrum: what the sound gains where the drive starts and loses where it stops,
//   compared with the sound just outside (medians over short windows). Wanted sound seldom
//   changes in the same bins at both ends, so the smaller of the two steps is the motor's.
// - Across intervals (one lens, one noise): the spectra of recent intervals, each scaled to
//   unit power, and a median across them, so one interval's music or speech does not pass
//   for the motor; an interval with no ends of its own (a long drive's middle) uses them alone.
// - Per frame, how strongly the motor runs (it accelerates, brakes, is driven in bursts): a
//   low quantile over the motor's bins of the frame's power beyond the wanted sound's floor,
//   relative to the motor's spectrum. Wanted sound only raises some bins, so it passes.
// - Ticks and the drive's start and stop transients: what rises far above anything the
//   surroundings reached (the edges are kept out of the end steps' windows), in bins where the
//   motor keeps rising or across the spectrum for a moment; what rises in a bin only now and
//   then is a syllable or a note.
// - Whether the interval shows a motor at all: a clear step at its ends or a clear rise, each
//   looking like what the lens made in earlier intervals that showed one (wanted sound that
//   happens to start and stop with a drive does not).
// - A stepping motor's whine sweeps with its speed: per frame the fundamental whose harmonics
//   stand out, held to the pitch track around it (a voice's syllable is not the whine), and its
//   harmonics hidden under the wanted sound given the power of those shown.
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

    // Rows heard around the interval: [0, before) before it, the rest after it. `first` and
    // `last` say whether the segment to estimate holds the interval's start and end.
    void SetSurroundings(const SpectralFrames& around, size_t before, bool first, bool last);
    // Fills `noise` (same rows as `power`) and answers the motor's share of the power in the
    // interval's frames: 0 when the interval does not show a motor (a quiet lens).
    double Estimate(const SpectralFrames& power, const FrameRole* roles, SpectralFrames& noise);

private:
    // Per-bin quantile over rows [from, to) of `frames`.
    void Quantile(const SpectralFrames& frames, size_t from, size_t to, double q, std::vector<float>& out);
    // The motor's spectrum from this interval's ends; false when it has no usable end.
    bool StepSpectrum(const SpectralFrames& power, const FrameRole* roles);
    // Adds `spectrum` (unit power) to the rows of `history`, a ring of kRemembered rows.
    static void Remember(const float* spectrum, size_t width, std::vector<float>& history, size_t& count, size_t& next);
    // The motor's spectrum: per bin, the median over remembered intervals and this one's step.
    void Template(bool withStep);
    // How much of `spectrum`'s power (unit power, in bands) falls where a remembered one's does.
    double Likeness(const std::vector<float>& spectrum, const std::vector<float>& history, size_t count) const;
    void ToBands(const float* spectrum, std::vector<float>& bands) const;
    void SelectMotorBins();
    size_t Salience(const float* p);
    double DetectWhine(const float* p);
    void FillWhine(const float* p, float* n, double f0);
    void FollowWhine(const FrameRole* roles, size_t rows);

    size_t m_bins;
    size_t m_windowRows;  // rows on each side of a drive's start or stop
    const SpectralFrames* m_around = nullptr;
    size_t m_before = 0;
    bool m_bFirst = false;
    bool m_bLast = false;
    bool m_bShown = false;  // whether the interval's earlier segments showed a motor
    std::vector<float> m_floor;  // the wanted sound's floor around the interval
    std::vector<float> m_ceiling;  // and the most it reached
    std::vector<float> m_inside;
    std::vector<float> m_outside;
    std::vector<float> m_step;
    std::vector<float> m_motor;  // the motor's spectrum used for this interval
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
    double m_binHz = 1.0;
    std::vector<float> m_column;  // scratch: one bin across rows, or one row across bins
    static constexpr size_t kRemembered = 5;
    std::vector<float> m_history;  // unit-power spectra of recent intervals, kRemembered rows
    size_t m_historyCount = 0;
    size_t m_historyNext = 0;
    // The same lens rises the same way in every interval: what rose above the surroundings in
    // recent intervals that showed a motor, in quarter-octave bands of unit power.
    std::vector<uint8_t> m_band;  // per bin
    size_t m_bands = 0;
    std::vector<float> m_stepBands;
    std::vector<float> m_riseBands;
    std::vector<float> m_templateBands;
    std::vector<float> m_riseHistory;
    size_t m_riseCount = 0;
    size_t m_riseNext = 0;
};

}  // namespace ovix
