// AAC-LC packets to interleaved signed 16-bit PCM with libavcodec's AAC decoder:
// each packet taken from the input procedure yields its 1024 frames at once.
#pragma once

#include "ConverterObject.h"
#include "LibavHandles.h"

#include <cstdint>
#include <memory>
#include <vector>

namespace atcompat {

class AacDecoderConverter final : public OpaqueAudioConverter {
public:
    // May throw std::bad_alloc, like every member; the C entry points turn it into a status.
    // `aac` and `pcm` must already form a pair that CheckAacPcmPair accepted.
    static OSStatus Create(const AudioStreamBasicDescription& aac, const AudioStreamBasicDescription& pcm,
                           int aacRate, std::unique_ptr<AacDecoderConverter>* converter);

    OSStatus GetProperty(AudioConverterPropertyID id, UInt32* size, void* data) override;
    OSStatus SetProperty(AudioConverterPropertyID id, UInt32 size, const void* data) override;
    OSStatus Fill(AudioConverterComplexInputDataProc proc, void* userData, UInt32* packets,
                  AudioBufferList* output, AudioStreamPacketDescription* descriptions) override;

    AacDecoderConverter(const AudioStreamBasicDescription& aac, const AudioStreamBasicDescription& pcm,
                        int aacRate);

private:
    // Builds a decoder for `config`; the current one stays in place when that fails.
    OSStatus Open(const std::vector<uint8_t>& config);
    OSStatus TakeInput(AudioConverterComplexInputDataProc proc, void* userData);
    OSStatus DecodePacket(const uint8_t* data, UInt32 size);
    OSStatus AppendFrame(const AVFrame& frame);

    AudioStreamBasicDescription m_input;
    AudioStreamBasicDescription m_output;
    int m_aacRate;
    std::vector<uint8_t> m_config;
    CodecContextPtr m_context;
    ResamplerPtr m_resampler;
    FramePtr m_frame;
    PacketPtr m_packet;
    // Decoded frames not yet handed out, interleaved; m_pcmRead samples of it are gone.
    std::vector<int16_t> m_pcm;
    size_t m_pcmRead = 0;
    bool m_bEnded = false;
};

}  // namespace atcompat
