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
    LoadRecords(chunks, false);
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
        // Extra records are ignored; entries without a record leave the table as it was.
        const eTqovixErrorCode written = RewriteOffsets(payload, type, false);
        if (written != eTqovixSuccess) {
            return written;
        }
    }
    return FinishUpdate(atom, payload, 3, eTqovixVisitSkip);
}
