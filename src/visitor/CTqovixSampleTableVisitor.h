// What the track visitors share: a walk that gathers every track's handler,
// sample description, data references and sample tables, and decides at the end
// of each "trak" (not by counting tables); and an update walk that writes new
// chunk offsets (and sample sizes) into the tracks it was given.
#pragma once

#include <cstdint>
#include <map>
#include <vector>

#include "atom/CTqovixAtomVisitor.h"
#include "visitor/TqovixChunkInformation.h"
#include "visitor/TqovixTrackTables.h"

class CTqovixSampleTableVisitor : public CTqovixAtomVisitor {
public:
    static constexpr uint64_t kMaxTableEntries = TqovixTrackAtoms::kMaxTableEntries;

    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom& atom) const override;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixContainerAtom& atom) const override;
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const override;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const override;
    eTqovixErrorCode Leave(const TqovixAtomPath& path, const CTqovixContainerAtom& atom) const override;
    void SetNeedAnalyzeMediaTime(bool) const override {}

    bool IsNecessary(const TqovixAtomPath& path) const;
    // Every track read by an Analyze walk that matched (all tracks for a visitor without a subtype).
    const std::vector<TqovixTrackTables>& GetTracks() const { return m_tracks; }
    // New chunk offsets (and, with `withSizes`, sample sizes) for the track at `index`.
    void SetTrackChunks(uint32_t index, const std::vector<TqovixChunkInformation>& chunks, bool withSizes);

protected:
    // `handlerSubtype` picks the first track with that media handler and ends the walk
    // there; null gathers every track.
    explicit CTqovixSampleTableVisitor(const char* handlerSubtype);
    ~CTqovixSampleTableVisitor() = default;

    // The chunk list of the first matching track; see TqovixBuildChunkList.
    eTqovixErrorCode BuildChunkList(std::vector<TqovixChunkInformation>& out, uint32_t frameBytes) const;
    // Records for the first matching track met by the update walk, when no index was given.
    void SetFirstTrackChunks(const std::vector<TqovixChunkInformation>& chunks, bool withSizes);

private:
    struct Rewrite {
        std::vector<TqovixChunkInformation> chunks;
        bool withSizes = false;
    };

    bool Matches(const TqovixTrackTables& track) const;
    eTqovixErrorCode ReadLeaf(eTqovixAtomType type, const CTqovixLeafAtom& atom) const;
    eTqovixErrorCode RewriteOffsets(CTqovixLeafAtom& atom, const Rewrite& rewrite) const;
    eTqovixErrorCode RewriteSampleSizes(CTqovixLeafAtom& atom, const Rewrite& rewrite) const;
    const Rewrite* CurrentRewrite() const;

    const char* m_handlerSubtype;
    std::map<uint32_t, Rewrite> m_rewrites;
    std::optional<Rewrite> m_firstRewrite;
    mutable std::vector<TqovixTrackTables> m_tracks;
    mutable TqovixTrackTables m_current;
    mutable int64_t m_trackIndex = -1;
    mutable bool m_bFirstRewriteTaken = false;
    mutable bool m_bFirstRewriteHere = false;
};
