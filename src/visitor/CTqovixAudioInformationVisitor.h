// Finds the first sound track and reads its format: rate, channels, sample size,
// frame size, sample count, the AAC decoder configuration and bit rate, and the
// media time of its first edit. It decides at the end of each "trak".
#pragma once

#include <cstdint>
#include <vector>

#include "atom/CTqovixAtomVisitor.h"
#include "atom/TqovixSoundEntry.h"

class CTqovixAudioInformationVisitor : public CTqovixAtomVisitor {
public:
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom& atom) const override;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixContainerAtom& atom) const override;
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const override;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const override;
    eTqovixErrorCode Leave(const TqovixAtomPath& path, const CTqovixContainerAtom& atom) const override;
    void SetNeedAnalyzeMediaTime(bool needMediaTime) const override { m_bNeedMediaTime = needMediaTime; }

    bool IsNecessary(const TqovixAtomPath& path) const;
    eTqovixErrorCode IsSoundMediaTrack(const CTqovixLeafAtom& handler) const;
    // An "esds" payload; keeps its decoder configuration and bit rate.
    bool Analyze_ESDSAtom(const char* data, unsigned int size) const;

    uint32_t GetRate() const { return m_rate; }
    uint32_t GetSampleRateHz() const { return m_sampleRateHz; }
    uint16_t GetChannel() const { return m_channelCount; }
    uint16_t GetSize() const { return m_sampleBits; }
    uint32_t GetCount() const { return m_sampleTotal; }
    uint32_t GetAudioSpecificConfigSize() const { return m_audioSpecificConfigSize; }
    const uint8_t* GetAudioSpecificConfigData() const { return m_audioSpecificConfig.data(); }
    uint32_t GetAverageBitRate() const { return m_averageBitRate; }
    // Frames the decoder gives before the track's first sound: one AAC packet. PCM has none.
    uint32_t GetPriming() const { return m_audioSpecificConfigSize != 0 ? 1024 : 0; }
    uint32_t GetMediaTime() const { return m_mediaTime; }
    bool IsBigEndianFormat() const { return m_audioSpecificConfigSize == 0 && m_bBigEndianPcm; }
    // The sample description as read, for the controller's decision on what it can process.
    const TqovixSoundEntry::Entry& GetEntry() const { return m_entry; }
    // Bytes one frame of uncompressed sound takes; 0 for compressed sound.
    uint32_t GetFrameBytes() const;
    // Index among the movie's "trak" atoms of the sound track read.
    uint32_t GetTrackIndex() const { return m_trackIndex; }

private:
    void BeginTrack() const;
    eTqovixErrorCode AnalyzeSampleDescription(std::span<const uint8_t> payload) const;

    mutable uint32_t m_rate = 0;
    mutable uint32_t m_sampleRateHz = 0;
    mutable uint16_t m_channelCount = 0;
    mutable uint16_t m_sampleBits = 0;
    mutable uint32_t m_sampleTotal = 0;
    mutable uint32_t m_averageBitRate = 0;
    mutable uint32_t m_audioSpecificConfigSize = 0;
    mutable uint32_t m_mediaTime = 0;
    mutable std::vector<uint8_t> m_audioSpecificConfig;
    mutable TqovixSoundEntry::Entry m_entry;
    mutable bool m_bBigEndianPcm = true;
    mutable bool m_bSoundTrack = false;
    mutable bool m_bNeedMediaTime = true;
    mutable bool m_bDescription = false;
    mutable bool m_bTimeToSample = false;
    mutable bool m_bEditList = false;
    mutable int64_t m_tracksSeen = -1;
    mutable uint32_t m_trackIndex = 0;
    // The first table of the current track that could not be read.
    mutable eTqovixErrorCode m_failure = eTqovixSuccess;
};
