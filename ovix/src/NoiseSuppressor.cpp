#include "NoiseSuppressor.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <numbers>

namespace ovix {
namespace {

// Below this share of the interval's power the motor is not audible: masked by the wanted
// sound or too quiet to matter. The interval then leaves as it came.
constexpr double kAudibleShare = 0.02;

int64_t FloorDiv(int64_t a, int64_t b)
{
    return a >= 0 ? a / b : -((-a + b - 1) / b);
}

uint64_t SaturatingAdd(uint64_t a, uint64_t b)
{
    return a > UINT64_MAX - b ? UINT64_MAX : a + b;
}

// Intervals up to this long (most AF drives) keep their survey's spectra for their processing.
constexpr double kKeptSurveySeconds = 4.0;

size_t RowsFor(const SuppressorParameters& p, uint64_t frames)
{
    return (frames + 2 * p.rampFrames + p.fftSize) / p.hop + 2;
}

size_t SegmentRows(const SuppressorParameters& p) { return RowsFor(p, p.segmentFrames); }

size_t KeptRows(const SuppressorParameters& p)
{
    return std::min(SegmentRows(p), RowsFor(p, static_cast<uint64_t>(kKeptSurveySeconds * static_cast<double>(p.rateHz))));
}

size_t AroundRows(const SuppressorParameters& p) { return 2 * p.contextFrames / p.hop + 4; }

}  // namespace

NoiseSuppressor::NoiseSuppressor(uint64_t rateHz, unsigned channels, uint64_t frameCount, SampleFormat format)
    : m_format(format),
      m_parameters(rateHz, std::clamp(channels, 1u, kMaxChannels), m_format.Bytes()),
      m_frameBytes(size_t{m_parameters.channels} * m_format.Bytes()),
      m_total(frameCount),
      m_ring(m_parameters.capacityFrames * m_frameBytes),
      m_fft(m_parameters.fftSize),
      m_window(m_parameters.fftSize),
      m_ramp(m_parameters.rampFrames),
      m_overlap(m_parameters.fftSize * m_parameters.channels),
      m_gain(m_parameters.bins),
      m_work(SegmentRows(m_parameters), AroundRows(m_parameters), m_parameters.bins),
      m_noise(SegmentRows(m_parameters), m_parameters.bins),
      m_estimator(m_parameters),
      m_lens(m_parameters.bins, m_parameters.intervalsAhead),
      m_motor(m_parameters.bins),
      m_rises(m_parameters.bins),
      m_loud(m_parameters.bins),
      m_noCover(m_parameters.bins),
      m_gainRule(m_parameters.bins)
{
    const size_t n = m_parameters.fftSize;
    for (size_t i = 0; i < n; ++i) {
        m_window[i] = static_cast<float>(
            std::sqrt(0.5 - 0.5 * std::cos(2.0 * std::numbers::pi * static_cast<double>(i) / static_cast<double>(n))));
    }
    m_surveys.reserve(m_parameters.intervalsAhead + 1);
    for (size_t i = 0; i <= m_parameters.intervalsAhead; ++i) {
        m_surveys.emplace_back(KeptRows(m_parameters), AroundRows(m_parameters), m_parameters.bins);
    }
    const double steps = static_cast<double>(m_ramp.size() + 1);
    for (size_t k = 0; k < m_ramp.size(); ++k) {
        m_ramp[k] = static_cast<float>(0.5 - 0.5 * std::cos(std::numbers::pi * static_cast<double>(k + 1) / steps));
    }
}

void NoiseSuppressor::SetSpans(std::vector<DriveSpan> spans)
{
    m_spans = std::move(spans);
    m_spanShares.assign(m_spans.size(), 0.0);
    m_next = 0;
    m_segmentAt = m_spans.empty() ? 0 : m_spans.front().start;
    m_surveyed = 0;
    m_lens.Reset();
    for (SegmentSpectra& survey : m_surveys) {
        survey.span = SIZE_MAX;
    }
}

NoiseSuppressor::Segment NoiseSuppressor::FirstSegment(size_t index, uint64_t at) const
{
    const DriveSpan& span = m_spans[index];
    const uint64_t ramp = m_parameters.rampFrames;
    Segment segment;
    segment.span = &span;
    segment.index = index;
    segment.coreStart = at;
    segment.coreEnd = std::min(span.end, SaturatingAdd(at, m_parameters.segmentFrames));
    segment.first = at == span.start;
    segment.last = segment.coreEnd == span.end;
    segment.writeStart = segment.first ? (span.start > ramp ? span.start - ramp : 0) : segment.coreStart;
    segment.writeEnd = std::min(m_total, segment.last ? SaturatingAdd(span.end, ramp) : segment.coreEnd);
    return segment;
}

bool NoiseSuppressor::PendingSegment(Segment& segment) const
{
    if (m_next >= m_spans.size()) {
        return false;
    }
    segment = FirstSegment(m_next, m_segmentAt);
    return true;
}

bool NoiseSuppressor::IsWhole(size_t index) const
{
    return m_spans[index].end - m_spans[index].start <= m_parameters.segmentFrames;
}

size_t NoiseSuppressor::LastAhead(size_t index) const
{
    if (!IsWhole(index)) {
        return index;
    }
    const uint64_t from = NeededFrom(FirstSegment(index, m_spans[index].start));
    size_t last = index;
    for (size_t next = index + 1; next < m_spans.size() && next <= index + m_parameters.intervalsAhead; ++next) {
        if (!IsWhole(next) ||
            NeededUntil(FirstSegment(next, m_spans[next].start)) - from + kBlockFrames > m_parameters.capacityFrames) {
            break;
        }
        last = next;
    }
    return last;
}

// The first frame a segment reads: its analysis windows and, for an interval's first
// segment, the surroundings before it.
uint64_t NoiseSuppressor::NeededFrom(const Segment& segment) const
{
    uint64_t from = segment.writeStart;
    if (segment.first) {
        from = from > m_parameters.contextFrames ? from - m_parameters.contextFrames : 0;
    }
    return from > m_parameters.fftSize ? from - m_parameters.fftSize : 0;
}

uint64_t NoiseSuppressor::NeededUntil(const Segment& segment) const
{
    uint64_t until = SaturatingAdd(segment.writeEnd, m_parameters.fftSize);
    if (segment.last) {
        until = std::max(until, SaturatingAdd(segment.writeEnd, m_parameters.contextFrames));
    }
    return std::min(until, m_total);
}

uint64_t NoiseSuppressor::Room() const
{
    uint64_t base = std::min(m_released, m_end);
    Segment segment;
    if (PendingSegment(segment)) {
        base = std::min(base, NeededFrom(segment));
    }
    return m_parameters.capacityFrames - (m_end - base);
}

void NoiseSuppressor::Append(const void* samples, size_t frames)
{
    const auto* from = static_cast<const uint8_t*>(samples);
    for (size_t f = 0; f < frames;) {
        const uint64_t at = (m_end + f) % m_parameters.capacityFrames;
        const size_t run = static_cast<size_t>(std::min<uint64_t>(frames - f, m_parameters.capacityFrames - at));
        std::memcpy(m_ring.data() + at * m_frameBytes, from + f * m_frameBytes, run * m_frameBytes);
        f += run;
    }
    m_end += frames;
    ProcessComplete();
}

void NoiseSuppressor::Finish()
{
    m_total = std::min(m_total, m_end);
    ProcessComplete();
}

uint64_t NoiseSuppressor::Ready() const
{
    Segment segment;
    if (PendingSegment(segment)) {
        return std::min(m_end, segment.writeStart);
    }
    return m_end;
}

void NoiseSuppressor::Read(uint64_t firstFrame, size_t frames, void* out) const
{
    auto* to = static_cast<uint8_t*>(out);
    for (size_t f = 0; f < frames;) {
        const uint64_t at = (firstFrame + f) % m_parameters.capacityFrames;
        const size_t run = static_cast<size_t>(std::min<uint64_t>(frames - f, m_parameters.capacityFrames - at));
        std::memcpy(to + f * m_frameBytes, m_ring.data() + at * m_frameBytes, run * m_frameBytes);
        f += run;
    }
}

void NoiseSuppressor::ProcessComplete()
{
    Segment segment;
    while (PendingSegment(segment)) {
        // Spans are surveyed in order, none beyond what the pending decision waits for: a span's
        // survey then sees the same sound however the sound was delivered.
        const size_t lastAhead = LastAhead(segment.index);
        while (m_surveyed <= lastAhead && m_surveyed < m_spans.size()) {
            if (IsWhole(m_surveyed)) {
                const Segment whole = FirstSegment(m_surveyed, m_spans[m_surveyed].start);
                if (m_end < NeededUntil(whole)) {
                    break;
                }
                Survey(m_surveyed);
            }
            ++m_surveyed;
        }
        if (m_end < NeededUntil(segment) || (IsWhole(segment.index) && m_surveyed <= lastAhead)) {
            return;
        }
        if (segment.writeStart < segment.writeEnd) {
            ProcessSegment(segment);
        }
        if (segment.last) {
            ++m_next;
            m_segmentAt = m_next < m_spans.size() ? m_spans[m_next].start : 0;
        } else {
            m_segmentAt = segment.coreEnd;
        }
    }
}

// Frame j of the analysis covers [j*hop, j*hop + fftSize); frames before the track or past
// its end read silence.
void NoiseSuppressor::LoadFrame(int64_t frame, unsigned channel)
{
    float* time = m_fft.Time();
    const size_t size = m_parameters.fftSize;
    const int64_t start = frame * static_cast<int64_t>(m_parameters.hop);
    const int64_t end = static_cast<int64_t>(m_end);
    const size_t from = static_cast<size_t>(std::clamp<int64_t>(-start, 0, static_cast<int64_t>(size)));
    const size_t to = static_cast<size_t>(std::clamp<int64_t>(end - start, static_cast<int64_t>(from),
                                                              static_cast<int64_t>(size)));
    std::fill(time, time + from, 0.0f);
    std::fill(time + to, time + size, 0.0f);
    const uint64_t capacity = m_parameters.capacityFrames;
    const uint8_t* samples = m_ring.data() + size_t{channel} * m_format.Bytes();
    uint64_t at = static_cast<uint64_t>(start + static_cast<int64_t>(from)) % capacity;
    // At most two runs: up to the ring's end, then on from its start.
    for (size_t i = from; i < to; at = 0) {
        const size_t run = static_cast<size_t>(std::min<uint64_t>(to - i, capacity - at));
        m_format.LoadWindowed(samples + at * m_frameBytes, m_frameBytes, run, m_window.data() + i, time + i);
        i += run;
    }
    m_fft.Forward();
}

void NoiseSuppressor::Analyse(int64_t frame, float* power)
{
    const float scale = 1.0f / static_cast<float>(m_parameters.channels);
    for (unsigned c = 0; c < m_parameters.channels; ++c) {
        LoadFrame(frame, c);
        const std::complex<float>* spectrum = m_fft.Spectrum();
        for (size_t k = 0; k < m_parameters.bins; ++k) {
            // std::norm goes through the modulus on some libraries: far slower than this.
            power[k] += (spectrum[k].real() * spectrum[k].real() + spectrum[k].imag() * spectrum[k].imag()) * scale;
        }
    }
}

// Analysis frames lying wholly within [from, to).
void NoiseSuppressor::AddSurroundings(uint64_t from, uint64_t to, SpectralFrames& around)
{
    const int64_t hop = static_cast<int64_t>(m_parameters.hop);
    const int64_t size = static_cast<int64_t>(m_parameters.fftSize);
    for (int64_t j = FloorDiv(static_cast<int64_t>(from) + hop - 1, hop); j * hop + size <= static_cast<int64_t>(to);
         ++j) {
        float* row = around.AddRow();
        if (row == nullptr) {
            return;
        }
        Analyse(j, row);
    }
}

// The spectra a segment is judged by: its surroundings (before the interval, back to the
// previous interval's ramp, when it begins; after it, up to the next one's ramp, when it ends)
// and every analysis frame reaching into what it writes.
void NoiseSuppressor::Analyse(const Segment& segment, SegmentSpectra& spectra)
{
    const DriveSpan& span = *segment.span;
    const uint64_t ramp = m_parameters.rampFrames;
    const int64_t hop = static_cast<int64_t>(m_parameters.hop);
    const int64_t size = static_cast<int64_t>(m_parameters.fftSize);
    const size_t index = segment.index;
    spectra.span = SIZE_MAX;
    if (segment.first) {
        spectra.around.Clear();
        uint64_t from = segment.writeStart > m_parameters.contextFrames ? segment.writeStart - m_parameters.contextFrames : 0;
        if (index > 0) {
            from = std::max(from, SaturatingAdd(m_spans[index - 1].end, ramp));
        }
        AddSurroundings(from, segment.writeStart, spectra.around);
        spectra.before = spectra.around.Rows();
    }
    if (segment.last) {
        uint64_t to = std::min(m_end, SaturatingAdd(segment.writeEnd, m_parameters.contextFrames));
        if (index + 1 < m_spans.size()) {
            const uint64_t next = m_spans[index + 1].start;
            to = std::min(to, next > ramp ? next - ramp : 0);
        }
        AddSurroundings(segment.writeEnd, to, spectra.around);
    }
    spectra.firstRow = FloorDiv(static_cast<int64_t>(segment.writeStart) - size, hop) + 1;
    const int64_t lastRow = FloorDiv(static_cast<int64_t>(segment.writeEnd) - 1, hop);
    spectra.power.Clear();
    for (int64_t j = spectra.firstRow; j <= lastRow; ++j) {
        float* row = spectra.power.AddRow();
        if (row == nullptr) {
            break;  // cannot happen with the sizes the parameters give
        }
        Analyse(j, row);
        const int64_t centre = j * hop + size / 2;
        const int64_t start = static_cast<int64_t>(span.start);
        const int64_t end = static_cast<int64_t>(span.end);
        const int64_t edge = static_cast<int64_t>(m_parameters.edgeFrames);
        FrameRole role = FrameRole::kAround;
        if (centre >= start && centre < end) {
            role = (centre < start + edge || centre >= end - edge) ? FrameRole::kEdge : FrameRole::kCore;
        }
        spectra.roles[spectra.power.Rows() - 1] = role;
    }
}

void NoiseSuppressor::Survey(size_t index)
{
    const Segment segment = FirstSegment(index, m_spans[index].start);
    SegmentSpectra& kept = m_surveys[index % m_surveys.size()];
    const bool keep = segment.writeEnd - segment.writeStart <= kKeptSurveySeconds * static_cast<double>(m_parameters.rateHz);
    SegmentSpectra& spectra = keep ? kept : m_work;
    Analyse(segment, spectra);
    spectra.span = keep ? index : SIZE_MAX;
    m_estimator.SetSurroundings(spectra.around, spectra.before, segment.first, segment.last);
    IntervalEvidence& evidence = m_lens.Record(index);
    m_estimator.Survey(spectra.power, spectra.roles.data(), evidence);
    evidence.adjoins = Adjoins(index);
}

bool NoiseSuppressor::Adjoins(size_t index) const
{
    const uint64_t touching = 2 * m_parameters.rampFrames;
    const DriveSpan& span = m_spans[index];
    return (index > 0 && span.start <= SaturatingAdd(m_spans[index - 1].end, touching)) ||
           (index + 1 < m_spans.size() && m_spans[index + 1].start <= SaturatingAdd(span.end, touching));
}

void NoiseSuppressor::ProcessSegment(const Segment& segment)
{
    const size_t index = segment.index;
    const bool whole = IsWhole(index);
    const size_t lastAhead = std::min(LastAhead(index), m_surveyed > 0 ? m_surveyed - 1 : 0);
    // A surveyed interval is judged before its spectra are looked at again: one left as it came
    // costs nothing more.
    if (whole && (!m_lens.Decide(index, lastAhead) || segment.span->strength <= 0.0f)) {
        m_lastShare = 0.0;
        return;
    }
    SegmentSpectra& kept = m_surveys[index % m_surveys.size()];
    SegmentSpectra& spectra = whole && kept.span == index ? kept : m_work;
    if (&spectra == &m_work) {
        Analyse(segment, m_work);
    }
    m_estimator.SetSurroundings(spectra.around, spectra.before, segment.first, segment.last,
                                whole ? m_lens.Evidence(index) : nullptr);
    // A long interval is judged by its start, with the intervals before it.
    if (!whole && segment.first) {
        IntervalEvidence& evidence = m_lens.Record(index);
        m_estimator.Survey(spectra.power, spectra.roles.data(), evidence);
        evidence.adjoins = Adjoins(index);
        if (!m_lens.Decide(index, lastAhead)) {
            m_lastShare = 0.0;
            return;
        }
    }
    if (!m_lens.Shown(index) || segment.span->strength <= 0.0f) {
        return;
    }
    m_lens.Spectrum(index, lastAhead, m_motor);
    // Wanted sound louder than anything heard around this interval may have been heard around
    // the others: only what rises above all of that can be the motor's.
    m_lens.Ceiling(index, lastAhead, m_estimator.WantedCeiling());
    m_lens.Rises(index, lastAhead, m_rises, m_loud);
    const IntervalEvidence* own = m_lens.Evidence(index);
    m_lastShare = m_estimator.Estimate(spectra.power, spectra.roles.data(),
                                       {m_motor, m_rises, m_loud, own != nullptr ? own->covered : m_noCover,
                                        own != nullptr ? own->coveredLoud : m_noCover, m_lens.Whines(index, lastAhead)},
                                       m_noise);
    if (m_lastShare < kAudibleShare) {
        return;
    }
    m_spanShares[index] = m_lastShare;
    Resynthesise(segment, spectra);
}

float NoiseSuppressor::RampWeight(const DriveSpan& span, uint64_t frame) const
{
    const uint64_t ramp = m_ramp.size();
    if (frame < span.start) {
        return m_ramp[ramp - (span.start - frame)];
    }
    if (frame >= span.end) {
        return m_ramp[ramp - 1 - (frame - span.end)];
    }
    return 1.0f;
}

// Overlap-adds the removed part frame by frame; a frame's first hop is complete once the
// frame is added, since the next frame starts after it.
void NoiseSuppressor::Resynthesise(const Segment& segment, const SegmentSpectra& spectra)
{
    const int64_t firstRow = spectra.firstRow;
    const int64_t lastRow = spectra.firstRow + static_cast<int64_t>(spectra.power.Rows()) - 1;
    const unsigned channels = m_parameters.channels;
    const size_t size = m_parameters.fftSize;
    const int64_t hop = static_cast<int64_t>(m_parameters.hop);
    // Sum of the squared windows at a quarter-window hop.
    const float synthesis = 0.5f;
    std::fill(m_overlap.begin(), m_overlap.end(), 0.0f);
    m_gainRule.Reset();
    for (int64_t j = firstRow; j <= lastRow; ++j) {
        const size_t row = static_cast<size_t>(j - firstRow);
        m_gainRule.Compute(spectra.power.Row(row), m_noise.Row(row), segment.span->strength, m_gain.data());
        bool touched = false;
        for (size_t k = 0; k < m_parameters.bins && !touched; ++k) {
            touched = m_gain[k] < 1.0f;
        }
        for (unsigned c = 0; c < channels && touched; ++c) {
            LoadFrame(j, c);
            std::complex<float>* spectrum = m_fft.Spectrum();
            for (size_t k = 0; k < m_parameters.bins; ++k) {
                spectrum[k] *= 1.0f - m_gain[k];
            }
            m_fft.Inverse();
            const float* time = m_fft.Time();
            // The window is a power of two long: slots wrap with a mask.
            const size_t offset = static_cast<size_t>(j * hop) & (size - 1);
            for (size_t i = 0; i < size; ++i) {
                const size_t slot = (offset + i) & (size - 1);
                m_overlap[slot * channels + c] += synthesis * m_window[i] * time[i];
            }
        }
        // Samples [j*hop, (j+1)*hop) are complete: write those inside the segment, then
        // clear their slots for the frames to come.
        for (int64_t t = j * hop; t < (j + 1) * hop; ++t) {
            if (t < 0) {
                continue;
            }
            const uint64_t frame = static_cast<uint64_t>(t);
            const uint64_t slot = (frame % size) * channels;
            if (frame >= segment.writeStart && frame < segment.writeEnd) {
                const float weight = RampWeight(*segment.span, frame);
                m_format.SubtractFromFrame(HeldFrame(frame), channels, m_overlap.data() + slot, weight);
            }
            std::fill_n(m_overlap.begin() + static_cast<ptrdiff_t>(slot), channels, 0.0f);
        }
    }
}

}  // namespace ovix
