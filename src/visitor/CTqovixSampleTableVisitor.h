// What the sound and video sample-table visitors share: reading a track's
// sample-to-chunk, sample size and chunk offset tables into a chunk list, and
// writing new chunk offsets back. The track is chosen by its handler subtype.
#pragma once

#include <cstdint>
#include <vector>

#include "atom/CTqovixAtomVisitor.h"
#include "visitor/TqovixChunkInformation.h"

class CTqovixSampleTableVisitor : public CTqovixAtomVisitor {
public:
    // Tables beyond this many entries are refused rather than held in memory.
    static constexpr uint64_t kMaxTableEntries = 1ULL << 24;

    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom& atom) const override;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixContainerAtom& atom) const override;
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const override;
    void SetNeedAnalyzeMediaTime(bool) const override {}

    bool IsNecessary(const TqovixAtomPath& path) const;

protected:
    CTqovixSampleTableVisitor(const char (&handlerSubtype)[5], bool emptyPathIsError);
    ~CTqovixSampleTableVisitor() = default;

    // The first steps of a leaf update, common to both tracks: 155/156 to answer
    // at once, or 0 with `payload` holding a copy to rewrite.
    eTqovixErrorCode BeginUpdate(const TqovixAtomPath& path, CTqovixLeafAtom& atom, std::vector<uint8_t>& payload) const;
    // Writes offsets of the first `count` records into an "stco" or "co64"
    // payload; 36864 for an offset an "stco" cannot hold.
    eTqovixErrorCode WriteOffsets(std::vector<uint8_t>& payload, bool wide, uint64_t count) const;
    // Builds the chunk list from the tables read; 4359 when they contradict
    // each other. `bytesPerSample` scales a common sample size.
    eTqovixErrorCode BuildChunkList(std::vector<TqovixChunkInformation>& out, uint32_t bytesPerSample) const;

    mutable std::vector<TqovixChunkInformation> m_chunkTable{1};
    mutable std::vector<TqovixSampleInfomation> m_sampleToChunkTable{1};
    mutable std::vector<uint32_t> m_sampleSizeTable{0};
    mutable uint32_t m_constantSampleSize = 0;
    mutable uint32_t m_analyzedTableCount = 0;
    mutable bool m_bTrack = false;

private:
    eTqovixErrorCode ReadTable(eTqovixAtomType type, const uint8_t* payload, uint64_t size) const;

    const char (&m_handlerSubtype)[5];
    bool m_bEmptyPathIsError;
    // Entries the tables actually held, apart from the placeholder records.
    mutable uint64_t m_offsetEntries = 0;
    mutable uint64_t m_runEntries = 0;
    mutable uint64_t m_sizeEntries = 0;
};
