// Finds the sound track and reads its format: rate, channels, sample size,
// sample count, the AAC decoder configuration and bit rate, and the media
// time of its first edit.
#pragma once

#include <cstdint>
#include <vector>

#include "atom/CTqovixAtomVisitor.h"

class CTqovixAudioInformationVisitor : public CTqovixAtomVisitor {
public:
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom& atom) const override;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixContainerAtom& atom) const override;
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const override;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const override;
    void SetNeedAnalyzeMediaTime(bool needMediaTime) const override { m_bNeedMediaTime = needMediaTime; }

    bool IsNecessary(const TqovixAtomPath& path) const;
    eTqovixErrorCode IsSoundMediaTrack(const CTqovixLeafAtom& handler) const;
    bool Analyze_ESDSAtom(const char* data, unsigned int size) const;
    bool Analyze_ESDescrTag(const char* data, unsigned int size) const;
    bool Analyze_DecoderConfigDescrTag(const char* data, unsigned int size) const;

    uint32_t GetRate() const { return m_rate; }
    uint16_t GetChannel() const { return m_channelCount; }
    uint16_t GetSize() const { return m_sampleBits; }
    uint32_t GetCount() const { return m_sampleTotal; }
    uint32_t GetAudioSpecificConfigSize() const { return m_audioSpecificConfigSize; }
    const uint8_t* GetAudioSpecificConfigData() const { return m_audioSpecificConfig.data(); }
    uint32_t GetAverageBitRate() const { return m_averageBitRate; }
    // Frames the track's encoder put in front of the sound (none for little-endian PCM).
    uint32_t GetPriming() const { return m_bBigEndianPcm ? 1024 : 0; }
    uint32_t GetMediaTime() const { return m_mediaTime; }
    bool IsBigEndianFormat() const { return m_audioSpecificConfigSize == 0 && m_bBigEndianPcm; }

private:
    eTqovixErrorCode AnalyzeSampleDescription(const uint8_t* payload, uint64_t size) const;
    eTqovixErrorCode AnalyzeTimeToSample(const uint8_t* payload, uint64_t size) const;
    eTqovixErrorCode CountLeaf() const;

    mutable uint32_t m_rate = 0;
    mutable uint16_t m_channelCount = 0;
    mutable uint16_t m_sampleBits = 0;
    mutable uint32_t m_sampleTotal = 0;
    mutable uint32_t m_leafCounter = 0;
    mutable uint32_t m_averageBitRate = 0;
    mutable uint32_t m_audioSpecificConfigSize = 0;
    mutable uint32_t m_mediaTime = 0;
    mutable std::vector<uint8_t> m_audioSpecificConfig;
    mutable bool m_bBigEndianPcm = true;
    mutable bool m_bSoundTrack = false;
    mutable bool m_bNeedMediaTime = true;
};
