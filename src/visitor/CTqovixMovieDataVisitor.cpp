#include "visitor/CTqovixMovieDataVisitor.h"

#include "atom/CTqovixLeafAtom.h"
#include "visitor/TqovixTrackPath.h"

using namespace TqovixTrackPath;

eTqovixErrorCode CTqovixMovieDataVisitor::IsVideoMediaTrack(const CTqovixLeafAtom& handler) const
{
    return HandlerAnswer(handler, "vide");
}

void CTqovixMovieDataVisitor::SetOffset(const std::vector<TqovixChunkInformation>& chunks)
{
    if (chunks.empty()) {
        return;
    }
    m_chunkTable.resize(chunks.size());
    for (size_t j = 0; j < chunks.size(); ++j) {
        m_chunkTable[j].offset = chunks[j].offset;
    }
}

eTqovixErrorCode CTqovixMovieDataVisitor::Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const
{
    std::vector<uint8_t> payload;
    const eTqovixErrorCode begun = BeginUpdate(path, atom, payload);
    if (begun != eTqovixSuccess) {
        return begun;
    }
    const eTqovixAtomType type = atom.GetType();
    if (type == kCo64 || type == kStco) {
        const uint64_t width = type == kCo64 ? 8 : 4;
        const uint64_t entries = payload.size() >= 8 ? (payload.size() - 8) / width : 0;
        // Extra records are ignored; entries without a record leave the table as it was.
        if (entries > m_chunkTable.size()) {
            return eTqovixErrorInternal;
        }
        const eTqovixErrorCode written = WriteOffsets(payload, type == kCo64, entries);
        if (written != eTqovixSuccess) {
            return written;
        }
    }
    atom.SetData(payload.data(), payload.size());
    if (++m_analyzedTableCount < 3) {
        return eTqovixVisitSkip;
    }
    m_analyzedTableCount = 0;
    return eTqovixSuccess;
}
