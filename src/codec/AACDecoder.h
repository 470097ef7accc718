// AAC packets to PCM, one packet per call, through a platform audio converter. The PCM
// of the first packets (one by default) is dropped: it is the encoder's priming.
#pragma once

#include "codec/AudioConverterBase.h"

class AACDecoder : public AudioConverterBase {
public:
    // Bytes one Decode may write into the caller's PCM buffer, whatever its size.
    static constexpr unsigned int kMaxPcmSize = 4096;

    AACDecoder();
    ~AACDecoder() override;

    // Resets the packet count and the delay to one packet, then builds the converter.
    eConverterErrorCode Initialize(const ACFormat& input, const ACFormat& output) override;
    // A delay of one packet when the movie at `path` records 2112 priming frames.
    virtual eConverterErrorCode SetDecoderDelay(const char* path);
    virtual void SetDecoderDelay(unsigned int packets);
    // One packet in; `*pcmSize` PCM bytes out into `pcm` (at least kMaxPcmSize bytes),
    // none while the delay lasts. The whole packet counts as used.
    virtual eConverterErrorCode Decode(void* pcm, unsigned int* pcmSize, unsigned int* usedSize, const void* packet,
                                       unsigned int packetSize);

    static OSStatus DecoderDataProc(AudioConverterRef converter, UInt32* ioNumberDataPackets,
                                    AudioBufferList* ioData, AudioStreamPacketDescription** outPacketDescription,
                                    void* userData);

protected:
    unsigned int m_decodedPackets;
    unsigned int m_decoderDelay;
};
