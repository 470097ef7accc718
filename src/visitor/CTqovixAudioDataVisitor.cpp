#include "visitor/CTqovixAudioDataVisitor.h"

#include "atom/CTqovixLeafAtom.h"
#include "atom/TqovixEndian.h"
#include "visitor/TqovixTrackPath.h"

using namespace TqovixTrackPath;

eTqovixErrorCode CTqovixAudioDataVisitor::IsSoundMediaTrack(const CTqovixLeafAtom& handler) const
{
    return HandlerAnswer(handler, "soun");
}

void CTqovixAudioDataVisitor::SetAudioChunkInformation(const std::vector<TqovixChunkInformation>& chunks)
{
    LoadRecords(chunks, true);
}

eTqovixErrorCode CTqovixAudioDataVisitor::Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const
{
    std::vector<uint8_t> payload;
    const eTqovixErrorCode begun = BeginUpdate(path, atom, payload);
    if (begun != eTqovixSuccess) {
        return begun;
    }
    const eTqovixAtomType type = atom.GetType();
    if (type == kStsc) {
        return eTqovixVisitContinue;
    }
    if (type == kCo64 || type == kStco) {
        // The destination keeps the source's chunk structure: one record per entry.
        const eTqovixErrorCode written = RewriteOffsets(payload, type, true);
        if (written != eTqovixSuccess) {
            return written;
        }
    } else if (type == kStsz) {
        if (payload.size() < 8) {
            return eTqovixErrorInternal;
        }
        if (TqovixReadBE32(payload.data() + 4) == 0) {
            const eTqovixErrorCode written = RewriteSampleSizes(payload);
            if (written != eTqovixSuccess) {
                return written;
            }
        }
    } else {
        return eTqovixErrorInternal;
    }
    return FinishUpdate(atom, payload, 2, eTqovixVisitContinue);
}

eTqovixErrorCode CTqovixAudioDataVisitor::RewriteSampleSizes(std::vector<uint8_t>& payload) const
{
    uint64_t total = 0;
    for (uint64_t j = 0; j < m_recordCount; ++j) {
        total += m_chunkTable[j].sampleSizes.size();
    }
    // Every entry is replaced, and by exactly as many sizes as the table holds.
    if (payload.size() < 12 || (payload.size() - 12) / 4 != total) {
        return eTqovixErrorInternal;
    }
    uint8_t* entry = payload.data() + 12;
    for (uint64_t j = 0; j < m_recordCount; ++j) {
        for (uint32_t sampleSize : m_chunkTable[j].sampleSizes) {
            TqovixWriteBE32(entry, sampleSize);
            entry += 4;
        }
    }
    return eTqovixSuccess;
}
