// Removes the lens motor's noise inside AF drive intervals and nothing else.
// Sound is appended as the session pulls it and read back once final. Each interval is first
// surveyed once its sound and surroundings are held: what its ends show of a motor goes to the
// lens model. It is processed once the intervals that follow it (as many as the look-ahead
// holds) are surveyed too, so that it is judged beside them; long intervals go in segments,
// judged by their start. Frames before the first pending interval are final at once. Per
// segment: power spectra of the interval and its surroundings, the motor's noise per frame
// (MotorEstimator), a spectral gain (GainRule), and the removed part resynthesised and
// subtracted under 10 ms raised-cosine ramps. Where nothing is removed the sound leaves
// bit-exact; an interval that does not show the lens's motor is left untouched.
// Everything is allocated by the constructor and SetSpans; blocks allocate nothing.
#pragma once

#include "AfInformation.h"
#include "GainRule.h"
#include "LensModel.h"
#include "MotorEstimator.h"
#include "RealFft.h"
#include "SampleFormat.h"
#include "SpectralFrames.h"
#include "SuppressorParameters.h"

#include <cstddef>
#include <cstdint>
#include <cstddef>
#include <vector>

namespace ovix {

class NoiseSuppressor {
public:
    static constexpr unsigned kMaxChannels = 8;
    static constexpr size_t kBlockFrames = SuppressorParameters::kBlockFrames;

    // `frameCount` bounds the sound (it may end earlier, see Finish). May throw std::bad_alloc.
    NoiseSuppressor(uint64_t rateHz, unsigned channels, uint64_t frameCount,
                    SampleFormat format = SampleFormat::Int16());

    // Sorted spans as AfInformation::Spans gives them; before the first frame.
    void SetSpans(std::vector<DriveSpan> spans);

    // Frames the look-ahead can take now; at least kBlockFrames once Ready() frames are released.
    uint64_t Room() const;
    // Appends interleaved frames in the session's format (at most Room()) and processes what
    // they complete.
    void Append(const void* samples, size_t frames);
    // No more sound: pending intervals are processed with what there is.
    void Finish();
    // Frames [0, Ready()) are final.
    uint64_t Ready() const;
    // Copies final frames that are still held (from Released() on), in the session's format.
    void Read(uint64_t firstFrame, size_t frames, void* out) const;
    // Frames before `frame` are no longer needed by the reader.
    void Release(uint64_t frame) { m_released = frame; }

    const SuppressorParameters& Parameters() const { return m_parameters; }
    // The motor share the last processed segment was judged by; for the bench and tests.
    double LastMotorShare() const { return m_lastShare; }
    // Per span, the share its last segment was judged by (0: left as it came).
    const std::vector<double>& SpanShares() const { return m_spanShares; }

private:
    // The spectra one segment is judged and processed by.
    struct SegmentSpectra {
        SegmentSpectra(size_t rows, size_t aroundRows, size_t bins) : power(rows, bins), around(aroundRows, bins), roles(rows) {}
        SpectralFrames power;  // every analysis frame reaching into what the segment writes
        SpectralFrames around;  // its surroundings: rows [0, before) before it, the rest after it
        std::vector<FrameRole> roles;
        size_t before = 0;
        int64_t firstRow = 0;  // the analysis frame of power's first row
        size_t span = SIZE_MAX;  // the interval whose survey they hold
    };

    struct Segment {
        const DriveSpan* span = nullptr;
        size_t index = 0;
        uint64_t coreStart = 0;  // this segment's share of the interval
        uint64_t coreEnd = 0;
        uint64_t writeStart = 0;  // with the ramps at the interval's ends
        uint64_t writeEnd = 0;
        bool first = false;
        bool last = false;
    };

    bool PendingSegment(Segment& segment) const;
    // The first segment of span `index`.
    Segment FirstSegment(size_t index, uint64_t at) const;
    bool IsWhole(size_t index) const;  // the span is processed in one segment
    bool Adjoins(size_t index) const;  // the span runs on from, or into, the one beside it
    uint64_t NeededFrom(const Segment& segment) const;
    uint64_t NeededUntil(const Segment& segment) const;
    // The last span that the decision about span `index` waits for.
    size_t LastAhead(size_t index) const;
    void ProcessComplete();
    void Survey(size_t index);
    void Analyse(const Segment& segment, SegmentSpectra& spectra);
    void ProcessSegment(const Segment& segment);
    void AddSurroundings(uint64_t from, uint64_t to, SpectralFrames& around);
    void Analyse(int64_t frame, float* power);
    void LoadFrame(int64_t frame, unsigned channel);
    void Resynthesise(const Segment& segment, const SegmentSpectra& spectra);
    float RampWeight(const DriveSpan& span, uint64_t frame) const;
    uint8_t* HeldFrame(uint64_t frame) { return m_ring.data() + (frame % m_parameters.capacityFrames) * m_frameBytes; }

    const SampleFormat m_format;
    const SuppressorParameters m_parameters;
    const size_t m_frameBytes;
    uint64_t m_total;
    uint64_t m_end = 0;  // frames appended
    uint64_t m_released = 0;
    std::vector<uint8_t> m_ring;  // the track's own bytes: untouched frames leave as they came
    std::vector<DriveSpan> m_spans;
    size_t m_next = 0;  // first span not fully processed
    uint64_t m_segmentAt = 0;  // where its next segment begins
    size_t m_surveyed = 0;  // spans before this one are surveyed (or are processed by segments)

    RealFft m_fft;
    std::vector<float> m_window;  // square root of a periodic Hann: analysis and synthesis
    std::vector<float> m_ramp;  // rising half of a raised cosine, strictly between 0 and 1
    std::vector<float> m_overlap;  // removed sound being overlap-added, fftSize frames
    std::vector<float> m_gain;
    SegmentSpectra m_work;  // long intervals, and intervals whose survey is no longer held
    // The surveys of the intervals a decision waits for, kept for their processing.
    std::vector<SegmentSpectra> m_surveys;
    SpectralFrames m_noise;
    MotorEstimator m_estimator;
    LensModel m_lens;
    std::vector<float> m_motor;  // the lens's spectrum for the interval being processed
    std::vector<float> m_rises;  // and how often its bins rise in the lens's other drives
    std::vector<float> m_loud;  // and how loud they get there
    const std::vector<float> m_noCover;
    GainRule m_gainRule;
    double m_lastShare = 0.0;
    std::vector<double> m_spanShares;
};

}  // namespace ovix
