// Interleaved signed 16-bit PCM to raw AAC-LC packets with libavcodec's AAC encoder.
// Primed at creation so that every 1024 frames taken give one packet at once, and so
// that the stream's priming is 2112 frames: libavcodec's 1024 and 1088 of silence.
#pragma once

#include "ConverterObject.h"
#include "LibavHandles.h"

#include <cstdint>
#include <deque>
#include <memory>
#include <vector>

namespace atcompat {

class AacEncoderConverter final : public OpaqueAudioConverter {
public:
    static constexpr UInt32 kPrimingFrames = 2112;
    static constexpr UInt32 kLeadingSilenceFrames = 1088;

    // May throw std::bad_alloc, like every member; the C entry points turn it into a status.
    // `pcm` and `aac` must already form a pair that CheckAacPcmPair accepted.
    static OSStatus Create(const AudioStreamBasicDescription& pcm, const AudioStreamBasicDescription& aac,
                           int aacRate, std::unique_ptr<AacEncoderConverter>* converter);

    AacEncoderConverter(const AudioStreamBasicDescription& pcm, const AudioStreamBasicDescription& aac,
                        int aacRate);

    OSStatus GetProperty(AudioConverterPropertyID id, UInt32* size, void* data) override;
    OSStatus SetProperty(AudioConverterPropertyID id, UInt32 size, const void* data) override;
    OSStatus Fill(AudioConverterComplexInputDataProc proc, void* userData, UInt32* packets,
                  AudioBufferList* output, AudioStreamPacketDescription* descriptions) override;

private:
    // Builds and primes an encoder; the current one stays in place when that fails.
    // 0 lets libavcodec choose the bit rate.
    OSStatus Open(int64_t bitRate);
    OSStatus TakeInput(AudioConverterComplexInputDataProc proc, void* userData);
    // Encodes `frames` (at most 1024) from the front of the held PCM, or drains with 0.
    OSStatus EncodeHeld(size_t frames);
    OSStatus Drain();
    OSStatus CollectPackets();
    UInt32 MaximumPacketSize() const;
    size_t HeldFrames() const;

    AudioStreamBasicDescription m_input;
    AudioStreamBasicDescription m_output;
    int m_aacRate;
    UInt32 m_bitRate = 0;
    CodecContextPtr m_context;
    ResamplerPtr m_resampler;
    FramePtr m_frame;
    PacketPtr m_packet;
    // PCM taken from the input procedure, interleaved; from m_pcmRead on not yet encoded.
    std::vector<int16_t> m_pcm;
    size_t m_pcmRead = 0;
    std::deque<std::vector<uint8_t>> m_packets;
    int64_t m_nextPts = 0;
    bool m_bStarted = false;
    bool m_bEnded = false;
};

}  // namespace atcompat
