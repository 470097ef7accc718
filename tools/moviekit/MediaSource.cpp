#include "MediaSource.h"

#include <algorithm>
#include <cmath>
#include <numbers>

namespace moviekit {

void MediaSource::VideoFrame(uint64_t index, Bytes& out) const
{
    out.resize(m_plan.videoFrameSize);
    uint64_t state = SplitMix64(index + 1);
    size_t i = 0;
    for (; i + 8 <= out.size(); i += 8) {
        state ^= state << 13;
        state ^= state >> 7;
        state ^= state << 17;
        for (size_t b = 0; b < 8; ++b) {
            out[i + b] = static_cast<uint8_t>(state >> (8 * b));
        }
    }
    for (; i < out.size(); ++i) {
        out[i] = static_cast<uint8_t>(index + i);
    }
}

int16_t MediaSource::ToneSample(uint64_t frame, uint32_t channel) const
{
    // Integer phase, so that the millionth second is as exact as the first.
    const uint64_t rate = m_recipe.sound.sampleRate;
    const uint64_t hz = (uint64_t{m_recipe.sound.toneHz} * (channel + 1)) % rate;
    const uint64_t phase = ((frame % rate) * hz) % rate;
    const double angle = 2.0 * std::numbers::pi * static_cast<double>(phase) / static_cast<double>(rate);
    return static_cast<int16_t>(std::lround(8000.0 * std::sin(angle)));
}

void MediaSource::PcmFrames(uint64_t firstFrame, uint32_t frames, Bytes& out) const
{
    const uint32_t channels = m_recipe.sound.channels;
    out.resize(uint64_t{frames} * channels * 2);
    const std::vector<int16_t>& given = m_recipe.sound.pcm;
    size_t pos = 0;
    for (uint64_t f = firstFrame; f < firstFrame + frames; ++f) {
        for (uint32_t c = 0; c < channels; ++c) {
            const int16_t sample = given.empty() ? ToneSample(f, c) : given[f * channels + c];
            const auto bits = static_cast<uint16_t>(sample);
            const auto high = static_cast<uint8_t>(bits >> 8);
            const auto low = static_cast<uint8_t>(bits);
            out[pos++] = m_plan.littleEndianPcm ? low : high;
            out[pos++] = m_plan.littleEndianPcm ? high : low;
        }
    }
}

void MediaSource::AacPacket(uint64_t index, Bytes& out) const
{
    if (!m_recipe.sound.aacPackets.empty()) {
        out = m_recipe.sound.aacPackets[index];
    } else {
        out = MakeSilentAacPacket(m_recipe.sound.channels, m_plan.aacFillBytes[index], index);
    }
}

bool MediaSource::WriteChunk(const ChunkSlot& slot, Sink& sink, Bytes* soundBytes)
{
    if (!slot.sound) {
        const ChunkLayout& chunk = m_plan.videoChunks[slot.index];
        for (uint64_t frame = chunk.firstSample; frame < chunk.firstSample + chunk.sampleCount; ++frame) {
            VideoFrame(frame, m_buffer);
            if (!sink.Write(m_buffer)) {
                return false;
            }
        }
        return true;
    }
    const ChunkLayout& chunk = m_plan.soundChunks[slot.index];
    constexpr uint32_t kPiece = 65536;
    for (uint32_t done = 0; done < chunk.sampleCount;) {
        uint32_t step = 1;
        if (m_plan.aac) {
            AacPacket(chunk.firstSample + done, m_buffer);
        } else {
            step = std::min(kPiece, chunk.sampleCount - done);
            PcmFrames(chunk.firstSample + done, step, m_buffer);
        }
        if (!sink.Write(m_buffer)) {
            return false;
        }
        if (soundBytes != nullptr) {
            soundBytes->insert(soundBytes->end(), m_buffer.begin(), m_buffer.end());
        }
        done += step;
    }
    return true;
}
}  // namespace moviekit
