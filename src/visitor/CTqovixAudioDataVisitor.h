// The sound track's chunk list: read from its sample tables while opening,
// and written back (sample sizes and chunk offsets) for the destination.
#pragma once

#include "visitor/CTqovixSampleTableVisitor.h"

class CTqovixAudioDataVisitor : public CTqovixSampleTableVisitor {
public:
    CTqovixAudioDataVisitor() : CTqovixSampleTableVisitor("soun") {}

    eTqovixErrorCode IsSoundMediaTrack(const CTqovixLeafAtom& handler) const;
    // `bytesPerFrame` is the frame size of uncompressed sound, 0 for compressed sound.
    eTqovixErrorCode GetAudioChunkInformation(std::vector<TqovixChunkInformation>& out, unsigned int bytesPerFrame) const
    {
        return BuildChunkList(out, bytesPerFrame);
    }
    // For the first sound track; SetTrackChunks names another by its index.
    void SetAudioChunkInformation(const std::vector<TqovixChunkInformation>& chunks)
    {
        SetFirstTrackChunks(chunks, true);
    }
};
