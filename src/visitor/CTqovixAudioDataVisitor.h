// The sound track's chunk list: read from its sample tables while opening,
// and written back (sample sizes and chunk offsets) for the destination.
#pragma once

#include "visitor/CTqovixSampleTableVisitor.h"

class CTqovixAudioDataVisitor : public CTqovixSampleTableVisitor {
public:
    CTqovixAudioDataVisitor() : CTqovixSampleTableVisitor("soun", false) {}

    using CTqovixSampleTableVisitor::Update;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const override;

    eTqovixErrorCode IsSoundMediaTrack(const CTqovixLeafAtom& handler) const;
    // `bytesPerFrame` turns a common sample size of PCM frames into chunk bytes.
    eTqovixErrorCode GetAudioChunkInformation(std::vector<TqovixChunkInformation>& out, unsigned int bytesPerFrame) const
    {
        return BuildChunkList(out, bytesPerFrame);
    }
    void SetAudioChunkInformation(const std::vector<TqovixChunkInformation>& chunks);

private:
    eTqovixErrorCode RewriteSampleSizes(std::vector<uint8_t>& payload) const;
};
