// The audio data control with real AAC codecs: decodes the source's packets for the
// processing library, and hands its processed PCM to the splicer, which carries the
// source's packets where the sound came back as it went and re-encodes the rest for
// the movie controller's writer. For a PCM track it is the plain control.
#pragma once

#include <memory>

#include "audio/CTqovixAudioDataControl.h"
#include "codec/AACDecoder.h"
#include "codec/AACEncoder.h"
#include "codec/ACEncoderStream.h"
#include "codec/ACFormat.h"
#include "codec/CTqovixAacSplicer.h"
#include "codec/eConverterErrorCode.h"


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
    bool IsAACCodec() override { return m_pDecoder != nullptr || m_bEncoderOpen; }
    // Serves as the base does, and keeps what it served for the splicer to compare with.
    eTqovixErrorCode PopAudioData(void* buffer, unsigned long* size, unsigned long requested) override;
    // The track's packets; `whole` re-encodes them all, for streams we cannot splice into.
    void PlanSplicing(uint64_t packetCount, bool whole) { m_splicer.Plan(packetCount, whole); }
    const CTqovixAacSplicer::Statistics& GetSplicingStatistics() const { return m_splicer.GetStatistics(); }

    const ACFormat* GetAACFormat() const { return m_pAACFormat.get(); }
    const ACFormat* GetPCMFormat() const { return m_pPCMFormat.get(); }

    // Converter results are internal codes already: they go up as they are, so that a codec
    // that cannot open, decode or encode ends the job with its reason.
    static eTqovixErrorCode ConvertOVIXResult(eConverterErrorCode code) { return static_cast<eTqovixErrorCode>(code); }

private:
    std::unique_ptr<AACDecoder> m_pDecoder;
    std::unique_ptr<ACFormat> m_pAACFormat;
    std::unique_ptr<ACFormat> m_pPCMFormat;
    CTqovixAacSplicer m_splicer;
    bool m_bEncoderOpen = false;
};
