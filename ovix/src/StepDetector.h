// Whether an interval's ends show a motor: the sound steps up where the drive starts and down
// where it stops, in the same bins, by more than the wanted sound steps on its own between two
// windows as far apart. How far it steps on its own is measured around the interval, where the
// motor is silent, per bin: changing music needs a larger step than a quiet room does, so what
// counts as a motor follows the material instead of one fixed bar.
#pragma once

#include "SpectralFrames.h"
#include "SuppressorParameters.h"

#include <cstddef>
#include <vector>

namespace ovix {

class StepDetector {
public:
    explicit StepDetector(const SuppressorParameters& parameters);

    // The wanted sound's own steps, from rows [0, before) and [before, Rows()) of `around`.
    void Calibrate(const SpectralFrames& around, size_t before);
    // Per bin, the smaller of the steps at the ends (the one end a segment holds, if only one) in
    // units of the wanted sound's own; core rows [firstCore, endCore) of `power` are inside.
    // Answers how many bins stand out.
    size_t Judge(const SpectralFrames& power, size_t firstCore, size_t endCore, bool first, bool last);
    // Whether `bin` stood out in the last judgement.
    bool Stands(size_t bin) const { return m_score[bin] > m_bar; }
    float Score(size_t bin) const { return m_score[bin]; }
    // How far beyond the wanted sound's own steps a bin must step to stand out.
    float Bar() const { return m_bar; }
    // Per bin, the power the sound gained into the interval (geometric means of the windows at an
    // end, the smaller gain of the two ends).
    const std::vector<float>& Step() const { return m_step; }
    // Whether the last judgement could compare an end with its surroundings.
    bool Judged() const { return m_bJudged; }
    size_t Bins() const { return m_bins; }

private:
    static constexpr float kTinyPower = 1e-12f;
    void LogRows(const SpectralFrames& frames, size_t from, size_t to, std::vector<float>& out) const;
    // Mean over rows [from, from + width) of logs held in `logs` (rows of m_bins); width 0 is m_width.
    void MeanOf(const std::vector<float>& logs, size_t from, float* out, size_t width = 0) const;

    size_t m_bins;
    size_t m_width;  // rows of each window
    size_t m_gap;  // rows between the outside and the inside window at an end
    size_t m_standardWidth;
    size_t m_shortestWidth;
    const SpectralFrames* m_around = nullptr;
    size_t m_before = 0;
    float m_bar = 0.0f;
    float m_floor = kTinyPower;
    std::vector<float> m_spread;  // per bin, the wanted sound's own step (log2 units)
    std::vector<float> m_sessionSpread;  // the last spread measured, for surroundings too short
    bool m_bSessionSpread = false;
    bool m_bJudged = false;
    std::vector<float> m_logsBefore;
    std::vector<float> m_logsAfter;
    std::vector<float> m_logsInside;
    std::vector<float> m_steps;  // per position, per bin
    std::vector<float> m_column;
    std::vector<float> m_a;
    std::vector<float> m_b;
    std::vector<float> m_score;
    std::vector<float> m_step;
};

}  // namespace ovix
