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
    if (chunks.empty()) {
        return;
    }
    m_chunkTable.resize(chunks.size());
    for (size_t j = 0; j < chunks.size(); ++j) {
        m_chunkTable[j].offset = chunks[j].offset;
        m_chunkTable[j].size = chunks[j].size;
        if (m_constantSampleSize == 0) {
            m_chunkTable[j].sampleSizes = chunks[j].sampleSizes;
        }
    }
}

eTqovixErrorCode CTqovixAudioDataVisitor::Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const
{
    std::vector<uint8_t> payload;
    const eTqovixErrorCode begun = BeginUpdate(path, atom, payload);
    if (begun != eTqovixSuccess) {
        return begun;
    }
    const eTqovixAtomType type = atom.GetType();
    const uint64_t size = payload.size();
    if (type == kStsc) {
        return eTqovixVisitContinue;
    }
    if (type == kCo64 || type == kStco) {
        // The destination keeps the source's chunk structure: one record per entry.
        const uint64_t width = type == kCo64 ? 8 : 4;
        if (size < 8 || (size - 8) / width != m_chunkTable.size()) {
            return eTqovixErrorInternal;
        }
        const eTqovixErrorCode written = WriteOffsets(payload, type == kCo64, m_chunkTable.size());
        if (written != eTqovixSuccess) {
            return written;
        }
    } else if (type == kStsz) {
        if (size < 8) {
            return eTqovixErrorInternal;
        }
        if (TqovixReadBE32(payload.data() + 4) == 0) {
            uint64_t total = 0;
            for (const TqovixChunkInformation& chunk : m_chunkTable) {
                total += chunk.sampleSizes.size();
            }
            if (size < 12 || (size - 12) / 4 != total) {
                return eTqovixErrorInternal;
            }
            uint8_t* entry = payload.data() + 12;
            for (const TqovixChunkInformation& chunk : m_chunkTable) {
                for (uint32_t sampleSize : chunk.sampleSizes) {
                    TqovixWriteBE32(entry, sampleSize);
                    entry += 4;
                }
            }
        }
    } else {
        return eTqovixErrorInternal;
    }
    atom.SetData(payload.data(), payload.size());
    if (++m_analyzedTableCount < 2) {
        return eTqovixVisitContinue;
    }
    m_analyzedTableCount = 0;
    return eTqovixSuccess;
}
