// The video track's chunk list: where each chunk lies and how long it is, so
// that the chunks can be copied unchanged, and their new offsets written back.
#pragma once

#include "visitor/CTqovixSampleTableVisitor.h"

class CTqovixMovieDataVisitor : public CTqovixSampleTableVisitor {
public:
    CTqovixMovieDataVisitor() : CTqovixSampleTableVisitor("vide") {}

    eTqovixErrorCode IsVideoMediaTrack(const CTqovixLeafAtom& handler) const;
    eTqovixErrorCode GetOffset(std::vector<TqovixChunkInformation>& out) const { return BuildChunkList(out, 0); }
    // For the first video track; SetTrackChunks names any other track by its index.
    void SetOffset(const std::vector<TqovixChunkInformation>& chunks) { SetFirstTrackChunks(chunks, false); }
};

// Every track of the movie, whatever its media: what the controller picks the
// sound track from and carries the others with.
class CTqovixTrackListVisitor : public CTqovixSampleTableVisitor {
public:
    CTqovixTrackListVisitor() : CTqovixSampleTableVisitor(nullptr) {}
};
