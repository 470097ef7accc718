#include "NoiseSuppressor.h"

#include <algorithm>
#include <cmath>
#include <numbers>

namespace ovix {
namespace {

// Motor rumble and whine sit mostly below 1 kHz: cut below 120 Hz, shelve the rest of that
// band down by 24 dB, and leave speech presence and ambience above 2 kHz nearly untouched.
constexpr double kHighPassHz = 120.0;
constexpr double kHighPassQ = std::numbers::sqrt2 / 2.0;
constexpr double kShelfHz = 800.0;
constexpr double kShelfGainDb = -24.0;
constexpr uint64_t kRampsPerSecond = 100;  // 10 ms
// The slowest pole (the high-pass's) decays by e in about 2 ms: after 100 ms a filter started
// cold differs from one that ran all along by far less than one step of 16 bits.
constexpr uint64_t kWarmUpsPerSecond = 10;

uint64_t SaturatingAdd(uint64_t a, uint64_t b)
{
    return a > UINT64_MAX - b ? UINT64_MAX : a + b;
}

int16_t Saturate(double value)
{
    const long rounded = std::lrint(value);
    return static_cast<int16_t>(std::clamp<long>(rounded, INT16_MIN, INT16_MAX));
}

}  // namespace

NoiseSuppressor::NoiseSuppressor(uint64_t rateHz, unsigned channels)
    : m_channels(std::clamp(channels, 1u, kMaxChannels)),
      m_ramp(std::max<uint64_t>(1, rateHz / kRampsPerSecond)),
      m_mix(kBlockFrames),
      m_warmUp(std::max<uint64_t>(1, rateHz / kWarmUpsPerSecond))
{
    const double rate = static_cast<double>(std::max<uint64_t>(rateHz, 1));
    // Keep both corners well below Nyquist at unusually low rates.
    m_highPass = DesignHighPass(rate, std::min(kHighPassHz, 0.2 * rate), kHighPassQ);
    m_lowShelf = DesignLowShelf(rate, std::min(kShelfHz, 0.4 * rate), kShelfGainDb);
    const double steps = static_cast<double>(m_ramp.size() + 1);
    for (size_t k = 0; k < m_ramp.size(); ++k) {
        m_ramp[k] = static_cast<float>(0.5 - 0.5 * std::cos(std::numbers::pi * static_cast<double>(k + 1) / steps));
    }
}

void NoiseSuppressor::SetSpans(std::vector<DriveSpan> spans)
{
    m_spans = std::move(spans);
    m_cursor = 0;
}

void NoiseSuppressor::Process(int16_t* samples, uint64_t firstFrame, size_t frames)
{
    if (m_spans.empty()) {
        return;
    }
    while (frames > 0) {
        const size_t block = std::min(frames, kBlockFrames);
        ProcessBlock(samples, firstFrame, block);
        samples += block * m_channels;
        firstFrame += block;
        frames -= block;
    }
}

bool NoiseSuppressor::FillMix(uint64_t firstFrame, size_t frames)
{
    const uint64_t ramp = m_ramp.size();
    const uint64_t blockEnd = firstFrame + frames;
    while (m_cursor < m_spans.size() && SaturatingAdd(m_spans[m_cursor].end, ramp) <= firstFrame) {
        ++m_cursor;
    }
    std::fill_n(m_mix.begin(), frames, 0.0f);
    bool any = false;
    for (size_t i = m_cursor; i < m_spans.size() && m_spans[i].start < SaturatingAdd(blockEnd, ramp); ++i) {
        const DriveSpan& span = m_spans[i];
        const uint64_t from = std::max(firstFrame, span.start > ramp ? span.start - ramp : 0);
        const uint64_t to = std::min(blockEnd, SaturatingAdd(span.end, ramp));
        for (uint64_t t = from; t < to; ++t) {
            float weight = 1.0f;
            if (t < span.start) {
                weight = m_ramp[ramp - (span.start - t)];
            } else if (t >= span.end) {
                weight = m_ramp[ramp - 1 - (t - span.end)];
            }
            float& mix = m_mix[t - firstFrame];
            mix = std::max(mix, weight * span.strength);
        }
        any = any || from < to;
    }
    return any;
}

bool NoiseSuppressor::NeedsFilter(uint64_t firstFrame, size_t frames) const
{
    const uint64_t lead = SaturatingAdd(m_ramp.size(), m_warmUp);
    const uint64_t blockEnd = firstFrame + frames;
    for (size_t i = m_cursor; i < m_spans.size(); ++i) {
        const uint64_t from = m_spans[i].start > lead ? m_spans[i].start - lead : 0;
        if (from >= blockEnd) {
            return false;  // spans are sorted: later ones begin later still
        }
        if (SaturatingAdd(m_spans[i].end, m_ramp.size()) > firstFrame) {
            return true;
        }
    }
    return false;
}

void NoiseSuppressor::ProcessBlock(int16_t* samples, uint64_t firstFrame, size_t frames)
{
    const bool mixAny = FillMix(firstFrame, frames);
    // Outside every span, ramp and warm-up the sound leaves as it came: nothing to compute.
    if (!mixAny && !NeedsFilter(firstFrame, frames)) {
        m_bSettled = false;
        return;
    }
    if (!m_bSettled) {
        m_highPassState.fill({});
        m_lowShelfState.fill({});
        m_bSettled = true;
    }
    switch (m_channels) {
    case 1: Filter<1>(samples, frames, mixAny); break;
    case 2: Filter<2>(samples, frames, mixAny); break;
    case 3: Filter<3>(samples, frames, mixAny); break;
    case 4: Filter<4>(samples, frames, mixAny); break;
    case 5: Filter<5>(samples, frames, mixAny); break;
    case 6: Filter<6>(samples, frames, mixAny); break;
    case 7: Filter<7>(samples, frames, mixAny); break;
    default: Filter<8>(samples, frames, mixAny); break;
    }
    for (unsigned c = 0; c < m_channels; ++c) {
        m_highPassState[c].Flush();
        m_lowShelfState[c].Flush();
    }
}

// The filters run on every frame of a block they are needed in, touched or not, so that their
// state is settled when a ramp begins; only frames with a mix above zero are written.
template <unsigned Channels>
void NoiseSuppressor::Filter(int16_t* samples, size_t frames, bool mixAny)
{
    std::array<BiquadState, Channels> highPass;
    std::array<BiquadState, Channels> lowShelf;
    std::copy_n(m_highPassState.begin(), Channels, highPass.begin());
    std::copy_n(m_lowShelfState.begin(), Channels, lowShelf.begin());
    const BiquadCoefficients hp = m_highPass;
    const BiquadCoefficients ls = m_lowShelf;
    for (size_t f = 0; f < frames; ++f) {
        int16_t* frame = samples + f * Channels;
        const double mix = mixAny ? m_mix[f] : 0.0;
        for (unsigned c = 0; c < Channels; ++c) {
            const double x = frame[c];
            const double y = RunBiquad(ls, lowShelf[c], RunBiquad(hp, highPass[c], x));
            if (mix > 0.0) {
                frame[c] = Saturate(x + mix * (y - x));
            }
        }
    }
    std::copy_n(highPass.begin(), Channels, m_highPassState.begin());
    std::copy_n(lowShelf.begin(), Channels, m_lowShelfState.begin());
}

}  // namespace ovix
