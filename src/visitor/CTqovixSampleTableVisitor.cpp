#include "visitor/CTqovixSampleTableVisitor.h"

#include <cstring>
#include <new>

#include "atom/CTqovixLeafAtom.h"
#include "visitor/TqovixTrackPath.h"

using namespace TqovixTrackPath;

namespace {

constexpr eTqovixAtomType kDref = TqovixMakeAtomType("dref");

TqovixPayload PayloadOf(const CTqovixLeafAtom& atom, bool& loaded)
{
    const uint64_t size = atom.GetDataSize();
    const uint8_t* data = size == 0 ? nullptr : atom.GetData();
    loaded = size == 0 || data != nullptr;
    return data == nullptr ? TqovixPayload{} : TqovixPayload{data, static_cast<size_t>(size)};
}

bool IsTrackPath(const TqovixAtomPath& path)
{
    static const TqovixAtomPath track = TqovixMakeAtomPath("moovtrak");
    return path == track;
}

}  // namespace

CTqovixSampleTableVisitor::CTqovixSampleTableVisitor(const char* handlerSubtype) : m_handlerSubtype(handlerSubtype)
{
}

bool CTqovixSampleTableVisitor::IsNecessary(const TqovixAtomPath& path) const
{
    static const TqovixAtomPath handler = TqovixMakeAtomPath("moovtrakmdiahdlr");
    static const TqovixAtomPath references = TqovixMakeAtomPath("moovtrakmdiaminfdinfdref");
    const eTqovixAtomType last = path.empty() ? eTqovixAtomType{} : path.back();
    if (last == kHdlr) {
        return IsWanted(path, handler, {kHdlr});
    }
    if (path.size() >= 5 && path[4] == TqovixMakeAtomType("dinf")) {
        return IsWanted(path, references, {kDref});
    }
    return IsWanted(path, SampleTablePath(), {kStsd, kStsc, kStsz, kStco, kCo64});
}

bool CTqovixSampleTableVisitor::Matches(const TqovixTrackTables& track) const
{
    if (m_handlerSubtype == nullptr) {
        return true;
    }
    char subtype[5] = {};
    std::memcpy(subtype, m_handlerSubtype, 4);
    return track.handler && TqovixTrackAtoms::IsMediaHandler(*track.handler, subtype);
}

void CTqovixSampleTableVisitor::SetTrackChunks(uint32_t index, const std::vector<TqovixChunkInformation>& chunks,
                                               bool withSizes)
{
    m_rewrites[index] = Rewrite{chunks, withSizes};
}

void CTqovixSampleTableVisitor::SetFirstTrackChunks(const std::vector<TqovixChunkInformation>& chunks, bool withSizes)
{
    m_firstRewrite = Rewrite{chunks, withSizes};
}

eTqovixErrorCode CTqovixSampleTableVisitor::Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom&) const
{
    if (!IsNecessary(path)) {
        return eTqovixVisitSkip;
    }
    if (IsTrackPath(path)) {
        m_current = TqovixTrackTables{};
        m_current.index = static_cast<uint32_t>(++m_trackIndex);
    }
    return eTqovixVisitContinue;
}

eTqovixErrorCode CTqovixSampleTableVisitor::Update(const TqovixAtomPath& path, CTqovixContainerAtom&) const
{
    if (!IsNecessary(path)) {
        return eTqovixVisitSkip;
    }
    if (IsTrackPath(path)) {
        m_current = TqovixTrackTables{};
        m_current.index = static_cast<uint32_t>(++m_trackIndex);
        m_bFirstRewriteHere = false;
    }
    return eTqovixVisitContinue;
}

eTqovixErrorCode CTqovixSampleTableVisitor::Leave(const TqovixAtomPath& path, const CTqovixContainerAtom&) const
{
    // A visitor of every track (or of tracks named by index) is done with the movie atom.
    if (path.size() == 1 && path[0] == TqovixAtom::kMoov) {
        return m_handlerSubtype == nullptr || !m_rewrites.empty() ? eTqovixSuccess : eTqovixVisitSkip;
    }
    if (!IsTrackPath(path) || !Matches(m_current)) {
        return eTqovixVisitSkip;
    }
    try {
        m_tracks.push_back(m_current);
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    // A visitor after one track has it now; one gathering every track goes on.
    return m_handlerSubtype != nullptr && m_rewrites.empty() && !m_firstRewrite ? eTqovixSuccess : eTqovixVisitSkip;
}

eTqovixErrorCode CTqovixSampleTableVisitor::Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const
{
    if (!IsNecessary(path) || path.empty()) {
        return eTqovixVisitSkip;
    }
    return ReadLeaf(atom.GetType(), atom);
}

eTqovixErrorCode CTqovixSampleTableVisitor::ReadLeaf(eTqovixAtomType type, const CTqovixLeafAtom& atom) const
{
    bool loaded = false;
    const TqovixPayload payload = PayloadOf(atom, loaded);
    if (!loaded) {
        return eTqovixVisitSkip;  // the leaf reports its own read failure to the walk
    }
    TqovixTrackTables& track = m_current;
    bool readable = true;
    if (type == kHdlr) {
        track.handler = TqovixTrackAtoms::ParseHandler(payload);
    } else if (type == kStsd) {
        track.soundEntry = TqovixSoundEntry::Parse(payload);
        if (track.soundEntry) {
            track.format = track.soundEntry->format;
            track.soundEntry->children = {};
        } else if (payload.size() >= 16) {
            std::memcpy(&track.format, payload.data() + 12, 4);
        }
    } else if (type == kDref) {
        const std::optional<bool> inFile = TqovixTrackAtoms::ParseDataInFile(payload);
        readable = inFile.has_value();
        track.dataInFile = inFile.value_or(false);
    } else if (type == kStsc) {
        track.runs = TqovixTrackAtoms::ParseSampleToChunk(payload);
        readable = track.runs.has_value();
    } else if (type == kStsz) {
        track.sizes = TqovixTrackAtoms::ParseSampleSizes(payload);
        readable = track.sizes.has_value();
    } else if (type == kStco || type == kCo64) {
        track.wideOffsets = type == kCo64;
        track.offsets = TqovixTrackAtoms::ParseChunkOffsets(payload, track.wideOffsets);
        readable = track.offsets.has_value();
    }
    if (!readable && !TqovixFailed(track.failure)) {
        track.failure = eTqovixErrorInvalidMovie;
    }
    return eTqovixVisitContinue;
}

const CTqovixSampleTableVisitor::Rewrite* CTqovixSampleTableVisitor::CurrentRewrite() const
{
    if (m_bFirstRewriteHere) {
        return &*m_firstRewrite;
    }
    const auto found = m_rewrites.find(m_current.index);
    return found == m_rewrites.end() ? nullptr : &found->second;
}

eTqovixErrorCode CTqovixSampleTableVisitor::Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const
{
    if (!IsNecessary(path) || path.empty()) {
        return eTqovixVisitSkip;
    }
    const eTqovixAtomType type = atom.GetType();
    if (type == kHdlr) {
        ReadLeaf(type, atom);
        if (m_firstRewrite && !m_bFirstRewriteTaken && Matches(m_current)) {
            m_bFirstRewriteTaken = true;
            m_bFirstRewriteHere = true;
        }
        return eTqovixVisitContinue;
    }
    const Rewrite* rewrite = CurrentRewrite();
    if (rewrite == nullptr) {
        return eTqovixVisitSkip;
    }
    if (type == kStco || type == kCo64) {
        return RewriteOffsets(atom, *rewrite);
    }
    if (type == kStsz && rewrite->withSizes) {
        return RewriteSampleSizes(atom, *rewrite);
    }
    return eTqovixVisitSkip;
}

eTqovixErrorCode CTqovixSampleTableVisitor::RewriteOffsets(CTqovixLeafAtom& atom, const Rewrite& rewrite) const
{
    bool loaded = false;
    const TqovixPayload payload = PayloadOf(atom, loaded);
    bool wide = atom.GetType() == kCo64;
    const auto entries = loaded ? TqovixTrackAtoms::ParseChunkOffsets(payload, wide) : std::nullopt;
    // The destination keeps the source's chunk structure: one record per entry.
    if (!entries || entries->size() != rewrite.chunks.size()) {
        return eTqovixErrorInternal;
    }
    std::vector<uint64_t> offsets;
    std::vector<uint8_t> written;
    try {
        offsets.reserve(rewrite.chunks.size());
        for (const TqovixChunkInformation& chunk : rewrite.chunks) {
            offsets.push_back(chunk.offset);
            // An "stco" that cannot say where a chunk lies becomes a "co64".
            wide = wide || chunk.offset > UINT32_MAX;
        }
        written = TqovixTrackAtoms::WriteChunkOffsets(offsets, wide);
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    std::memcpy(written.data(), payload.data(), 4);  // version and flags as they were
    if (wide && atom.GetType() == kStco) {
        atom.SetType(kCo64);
    }
    atom.SetData(written.data(), written.size());
    return eTqovixVisitContinue;
}

eTqovixErrorCode CTqovixSampleTableVisitor::RewriteSampleSizes(CTqovixLeafAtom& atom, const Rewrite& rewrite) const
{
    bool loaded = false;
    const TqovixPayload payload = PayloadOf(atom, loaded);
    const auto sizes = loaded ? TqovixTrackAtoms::ParseSampleSizes(payload) : std::nullopt;
    if (!sizes) {
        return eTqovixErrorInternal;
    }
    TqovixTrackAtoms::SampleSizes rewritten;
    uint64_t total = 0;
    for (const TqovixChunkInformation& chunk : rewrite.chunks) {
        total += chunk.sampleSizes.size();
    }
    if (total == 0) {
        return eTqovixVisitContinue;  // PCM: sizes do not change, the table keeps its form
    }
    // Every sample gets its new size, and no more: the count is the source's.
    if (total != sizes->count) {
        return eTqovixErrorInternal;
    }
    std::vector<uint8_t> written;
    try {
        rewritten.sizes.reserve(total);
        for (const TqovixChunkInformation& chunk : rewrite.chunks) {
            rewritten.sizes.insert(rewritten.sizes.end(), chunk.sampleSizes.begin(), chunk.sampleSizes.end());
        }
        written = TqovixTrackAtoms::WriteSampleSizes(rewritten);
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    std::memcpy(written.data(), payload.data(), 4);
    atom.SetData(written.data(), written.size());
    return eTqovixVisitContinue;
}

eTqovixErrorCode CTqovixSampleTableVisitor::BuildChunkList(std::vector<TqovixChunkInformation>& out,
                                                          uint32_t frameBytes) const
{
    if (m_tracks.empty()) {
        out.clear();
        return eTqovixErrorInvalidMovie;
    }
    return TqovixBuildChunkList(m_tracks.front(), frameBytes, out);
}
