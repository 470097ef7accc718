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

    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom&) const override
    {
        return IsNecessary(path) ? eTqovixVisitContinue : eTqovixVisitSkip;
    }
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixContainerAtom&) const override
    {
        return IsNecessary(path) ? eTqovixVisitContinue : eTqovixVisitSkip;
    }
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const override;
    void SetNeedAnalyzeMediaTime(bool) const override {}

    bool IsNecessary(const TqovixAtomPath& path) const;

protected:
    CTqovixSampleTableVisitor(const char (&handlerSubtype)[5], bool emptyPathIsError);
    ~CTqovixSampleTableVisitor() = default;

    // The first steps of a leaf update, common to both tracks: 155/156 to answer
    // at once, or 0 with `payload` holding a copy to rewrite.
    eTqovixErrorCode BeginUpdate(const TqovixAtomPath& path, CTqovixLeafAtom& atom, std::vector<uint8_t>& payload) const;
    // Writes the records' offsets into an "stco" or "co64" payload. 36864 when
    // the table has more entries than there are records (or, with
    // `exactCount`, any other number), or for an offset an "stco" cannot hold.
    eTqovixErrorCode RewriteOffsets(std::vector<uint8_t>& payload, eTqovixAtomType type, bool exactCount) const;
    // Replaces the payload by the rewritten copy and counts the table: 0 once
    // `tablesPerTrack` have been rewritten, `unfinished` before.
    eTqovixErrorCode FinishUpdate(CTqovixLeafAtom& atom, const std::vector<uint8_t>& payload, uint32_t tablesPerTrack,
                                  eTqovixErrorCode unfinished) const;
    // Loads the chunk list an update walk writes; sizes too when `withSizes`.
    void LoadRecords(const std::vector<TqovixChunkInformation>& chunks, bool withSizes);
    // Builds the chunk list from the tables read; 4359 when they contradict
    // each other. `bytesPerSample` scales a common sample size.
    eTqovixErrorCode BuildChunkList(std::vector<TqovixChunkInformation>& out, uint32_t bytesPerSample) const;

    mutable std::vector<TqovixChunkInformation> m_chunkTable{1};
    mutable std::vector<TqovixSampleInfomation> m_sampleToChunkTable{1};
    mutable std::vector<uint32_t> m_sampleSizeTable{0};
    mutable uint32_t m_constantSampleSize = 0;
    mutable uint32_t m_analyzedTableCount = 0;
    mutable bool m_bTrack = false;
    // Records that stand for real chunks (the offset table's entries, or the
    // list loaded), so that the placeholder of construction is never written.
    mutable uint64_t m_recordCount = 0;

private:
    eTqovixErrorCode ReadTable(eTqovixAtomType type, const uint8_t* payload, uint64_t size) const;
    eTqovixErrorCode AnswerHandler(const CTqovixLeafAtom& handler) const;

    const char (&m_handlerSubtype)[5];
    bool m_bEmptyPathIsError;
    // Entries the run and size tables actually held, apart from the placeholders.
    mutable uint64_t m_runEntries = 0;
    mutable uint64_t m_sizeEntries = 0;
};
