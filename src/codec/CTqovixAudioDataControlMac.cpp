#include "codec/CTqovixAudioDataControlMac.h"

#include <algorithm>
#include <new>

#include "bridge/TqovixInterfaceConvert.h"
#include "codec/AACDecoder.h"
#include "movie/CTqovixMovControl.h"

namespace {

constexpr uint32_t kPcmFlags = 12;  // signed integer, packed, host order
constexpr double kFloorBitRatePerChannel = 64000;

}  // namespace

CTqovixAudioDataControlMac::~CTqovixAudioDataControlMac()
{
    // The base destructor cannot reach our overrides any more.
    CloseDecoderAAC();
    CloseEncoderAAC();
}

eTqovixErrorCode CTqovixAudioDataControlMac::SetAACInformation(
    const CTqovixMovControl* movControl, const void* audioSpecificConfig, unsigned int audioSpecificConfigSize,
    const TqovixInterfaceConvert::TqovixAudioInformation& information, unsigned int bitRate)
{
    try {
        if (!m_pAACFormat) {
            m_pAACFormat = std::make_unique<ACFormat>();
        }
        if (!m_pPCMFormat) {
            m_pPCMFormat = std::make_unique<ACFormat>();
        }
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    const double rate = static_cast<double>(information.sampleRate);
    const auto channels = static_cast<uint32_t>(information.channels);
    const auto bits = static_cast<uint32_t>(information.bitsPerSample);
    *m_pAACFormat = ACFormat{rate, ACFormatAAC, 0, 0, 1024, 0, channels, 0};
    const uint32_t frameBytes = (bits / 8) * channels;
    *m_pPCMFormat = ACFormat{rate, ACFormatLinearPCM, kPcmFlags, frameBytes, 1, frameBytes, channels, bits};
    // Natural for a second call on one opened movie: the previous codecs go first.
    CloseDecoderAAC();
    CloseEncoderAAC();
    return CTqovixAudioDataControl::SetAACInformation(movControl, audioSpecificConfig, audioSpecificConfigSize,
                                                      information, bitRate);
}

eTqovixErrorCode CTqovixAudioDataControlMac::OpenDecoderAAC(const void* audioSpecificConfig,
                                                            unsigned int audioSpecificConfigSize)
{
    if (audioSpecificConfig == nullptr || audioSpecificConfigSize == 0 || !m_pAACFormat || !m_pPCMFormat) {
        return eTqovixErrorInternal;
    }
    try {
        m_pDecoder = std::make_unique<AACDecoder>();
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    // A decoder that cannot open ends the job at its start, with the converter's reason.
    const eTqovixErrorCode opened = ConvertOVIXResult(m_pDecoder->Initialize(*m_pAACFormat, *m_pPCMFormat));
    if (TqovixFailed(opened)) {
        m_pDecoder.reset();
    }
    return opened;
}

eTqovixErrorCode CTqovixAudioDataControlMac::OpenEncoderAAC(
    const CTqovixMovControl* movControl, const TqovixInterfaceConvert::TqovixAudioInformation&, unsigned int bitRate)
{
    if (!m_pAACFormat || !m_pPCMFormat) {
        return eTqovixErrorInternal;
    }
    // The source's average rate says what its sound cost, not what the processed sound needs:
    // a track of near silence averages a few kb/s, which no encoder takes. Quality has a floor.
    if (bitRate != 0) {
        // 64 kb/s a channel, less at low rates, where a frame holds fewer bits.
        const double perChannel = std::min(kFloorBitRatePerChannel, m_pAACFormat->sampleRate * 4 / 3);
        const auto floor = static_cast<unsigned int>(perChannel * m_pAACFormat->channelsPerFrame);
        bitRate = std::max(bitRate, floor);
        // No more than a packet may carry: 6144 bits a channel.
        const double ceiling = 6 * m_pAACFormat->sampleRate * m_pAACFormat->channelsPerFrame;
        bitRate = std::min(bitRate, static_cast<unsigned int>(ceiling));
    }
    auto* sink = static_cast<CTqovixAacSplicer::Sink*>(const_cast<CTqovixMovControl*>(movControl));
    const eTqovixErrorCode opened = m_splicer.Open(*m_pPCMFormat, *m_pAACFormat, bitRate, sink);
    m_bEncoderOpen = !TqovixFailed(opened);
    return opened;
}

void CTqovixAudioDataControlMac::CloseDecoderAAC() { m_pDecoder.reset(); }

void CTqovixAudioDataControlMac::CloseEncoderAAC()
{
    m_splicer.Close();
    m_bEncoderOpen = false;
}

eTqovixErrorCode CTqovixAudioDataControlMac::PopAudioData(void* buffer, unsigned long* size, unsigned long requested)
{
    const eTqovixErrorCode result = CTqovixAudioDataControl::PopAudioData(buffer, size, requested);
    if (!TqovixFailed(result) && m_bEncoderOpen) {
        m_splicer.KeepServed(buffer, *size);
    }
    return result;
}

eTqovixErrorCode CTqovixAudioDataControlMac::DecodeAAC2PCM(void* pcm, unsigned int* pcmSize, unsigned int* usedSize,
                                                           const void* packet, unsigned int packetSize)
{
    if (pcm == nullptr || pcmSize == nullptr || usedSize == nullptr || packet == nullptr || packetSize == 0 ||
        !m_pDecoder) {
        return eTqovixErrorInternal;
    }
    return ConvertOVIXResult(m_pDecoder->Decode(pcm, pcmSize, usedSize, packet, packetSize));
}

eTqovixErrorCode CTqovixAudioDataControlMac::EncodePCM2AAC(void* pcm, unsigned int pcmSize)
{
    if (pcm == nullptr || pcmSize == 0 || !m_bEncoderOpen) {
        return eTqovixErrorInternal;
    }
    return m_splicer.Push(pcm, pcmSize);
}

eTqovixErrorCode CTqovixAudioDataControlMac::EncodeDone()
{
    if (!m_bEncoderOpen) {
        return eTqovixErrorInternal;
    }
    return m_splicer.Finish();
}
