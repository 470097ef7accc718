// The audio data control with real AAC codecs: decodes the source's packets for the
// processing library and encodes its processed PCM, each packet going straight to
// the movie controller's writer. For a PCM track it is the plain control.
#pragma once

#include <memory>

#include "audio/CTqovixAudioDataControl.h"
#include "codec/AACDecoder.h"
#include "codec/AACEncoder.h"
#include "codec/ACEncoderStream.h"
#include "codec/ACFormat.h"
#include "codec/eConverterErrorCode.h"


// What the encoder stream's userData points at: the packet's way to the writer.
struct EncodeCallbackBinding {
    void* object = nullptr;
    void (*function)(void* object, unsigned char* packet, int size) = nullptr;
};

class CTqovixAudioDataControlMac : public CTqovixAudioDataControl {
public:
    CTqovixAudioDataControlMac() = default;
    ~CTqovixAudioDataControlMac() override;
    CTqovixAudioDataControlMac(const CTqovixAudioDataControlMac&) = delete;
    CTqovixAudioDataControlMac& operator=(const CTqovixAudioDataControlMac&) = delete;

    // `information.sampleRate` is in hertz at this call.
    eTqovixErrorCode SetAACInformation(const CTqovixMovControl* movControl, const void* audioSpecificConfig,
                                       unsigned int audioSpecificConfigSize,
                                       const TqovixInterfaceConvert::TqovixAudioInformation& information,
                                       unsigned int bitRate) override;
    eTqovixErrorCode OpenDecoderAAC(const void* audioSpecificConfig, unsigned int audioSpecificConfigSize) override;
    eTqovixErrorCode OpenEncoderAAC(const CTqovixMovControl* movControl,
                                    const TqovixInterfaceConvert::TqovixAudioInformation& information,
                                    unsigned int bitRate) override;
    void CloseDecoderAAC() override;
    void CloseEncoderAAC() override;
    eTqovixErrorCode DecodeAAC2PCM(void* pcm, unsigned int* pcmSize, unsigned int* usedSize, const void* packet,
                                   unsigned int packetSize) override;
    eTqovixErrorCode EncodePCM2AAC(void* pcm, unsigned int pcmSize) override;
    eTqovixErrorCode EncodeDone() override;
    bool IsAACCodec() override { return m_pDecoder != nullptr || m_pEncoder != nullptr; }

    const ACFormat* GetAACFormat() const { return m_pAACFormat.get(); }
    const ACFormat* GetPCMFormat() const { return m_pPCMFormat.get(); }

    // Converter results are internal codes already: they go up as they are, so that a codec
    // that cannot open, decode or encode ends the job with its reason.
    static eTqovixErrorCode ConvertOVIXResult(eConverterErrorCode code) { return static_cast<eTqovixErrorCode>(code); }

private:
    std::unique_ptr<AACDecoder> m_pDecoder;
    std::unique_ptr<AACEncoder> m_pEncoder;
    std::unique_ptr<ACFormat> m_pAACFormat;
    std::unique_ptr<ACFormat> m_pPCMFormat;
    std::unique_ptr<ACEncoderStream> m_pEncoderStream;
    std::unique_ptr<unsigned char[]> m_pStreamBuffer;
    std::unique_ptr<EncodeCallbackBinding> m_pBinding;
};

unsigned char* EncoderRequestProc(void* stream, unsigned int size);
eTqovixErrorCode EncoderResultProc(void* stream, unsigned char* data, unsigned int size);
