// The video track's chunk list: where each chunk lies and how long it is, so
// that the chunks can be copied unchanged, and their new offsets written back.
#pragma once

#include "visitor/CTqovixSampleTableVisitor.h"

class CTqovixMovieDataVisitor : public CTqovixSampleTableVisitor {
public:
    CTqovixMovieDataVisitor() : CTqovixSampleTableVisitor("vide", true) {}

    using CTqovixSampleTableVisitor::Update;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const override;

    eTqovixErrorCode IsVideoMediaTrack(const CTqovixLeafAtom& handler) const;
    eTqovixErrorCode GetOffset(std::vector<TqovixChunkInformation>& out) const { return BuildChunkList(out, 1); }
    void SetOffset(const std::vector<TqovixChunkInformation>& chunks);
};
