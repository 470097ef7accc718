#include "MediaSource.h"

#include <algorithm>
#include <cmath>
#include <cstring>
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
    const SoundRecipe& sound = m_recipe.sound;
    const uint32_t channels = sound.channels;
    const uint32_t width = m_plan.sampleBytes;
    out.resize(uint64_t{frames} * channels * width);
    const std::vector<int16_t>& given = sound.pcm;
    uint8_t* at = out.data();
    for (uint64_t f = firstFrame; f < firstFrame + frames; ++f) {
        for (uint32_t c = 0; c < channels; ++c, at += width) {
            const int16_t narrow = given.empty() ? ToneSample(f, c) : given[f * channels + c];
            uint64_t bits = static_cast<uint16_t>(narrow);
            if (m_plan.deepPcm) {
                // Full scale at 2^31; a tone made here gets low bits, as a deeper recording has.
                int64_t wide = sound.widePcm.empty() ? int64_t{narrow} * 65536 : sound.widePcm[f * channels + c];
                if (sound.widePcm.empty() && given.empty()) {
                    wide += static_cast<int64_t>(SplitMix64(f * channels + c) % 65536);
                }
                if (sound.floatingPoint && width == 4) {
                    uint32_t word = 0;
                    const auto value = static_cast<float>(static_cast<double>(wide) / 2147483648.0);
                    std::memcpy(&word, &value, 4);
                    bits = word;
                } else if (sound.floatingPoint) {
                    const double value = static_cast<double>(wide) / 2147483648.0;
                    std::memcpy(&bits, &value, 8);
                } else {
                    bits = static_cast<uint64_t>(wide >> (32 - sound.bits));
                }
            }
            for (uint32_t b = 0; b < width; ++b) {
                const auto byte = static_cast<uint8_t>(bits >> (8 * b));
                at[m_plan.littleEndianPcm ? b : width - 1 - b] = byte;
            }
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
