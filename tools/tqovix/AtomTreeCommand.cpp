// tqovix inspect: the atom tree as the parser sees it, the tracks, the trim tags and the
// maker blocks as the library's visitors read them, and whether the AF information has
// been processed already.
#include <cinttypes>
#include <cstdio>
#include <optional>

#include "Commands.h"
#include "api/TqOVIXUtility.h"
#include "atom/CTqovixAtomControl.h"
#include "atom/CTqovixContainerAtom.h"
#include "atom/CTqovixLeafAtom.h"
#include "file/CTqovixFile.h"
#include "visitor/CTqovixAudioDataVisitor.h"
#include "visitor/CTqovixAudioInformationVisitor.h"
#include "visitor/CTqovixMakerBlockVisitor.h"
#include "visitor/CTqovixMovieDataVisitor.h"
#include "visitor/CTqovixTrimInformationVisitor.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix inspect FILE [--json]\n"
    "  prints the atom tree (offset, size, type), the tracks, the trim tags, the sizes of\n"
    "  the AF and audio level information and whether the AF information is processed\n";

struct AtomRow {
    uint64_t offset;
    uint64_t size;
    std::string type;
    int depth;
};

struct TrackRow {
    std::string handler;
    std::string codec;
    uint32_t timeScale = 0;
    double rate = 0;  // frames per second, or sound samples per second
    bool known = false;  // the details below come from the library's visitors
    bool aac = false;
    uint32_t channels = 0;
    uint32_t bits = 0;
    uint64_t samples = 0;
    size_t chunks = 0;
};

void CollectAtoms(const TqovixAtomList& atoms, uint64_t offset, int depth, std::vector<AtomRow>& rows)
{
    for (const auto& atom : atoms) {
        const uint64_t size = atom->GetSize();
        rows.push_back({offset, size, TqovixAtomTypeName(atom->GetType()), depth});
        if (const auto* container = dynamic_cast<const CTqovixContainerAtom*>(atom.get())) {
            uint64_t childBytes = 0;
            for (const auto& child : container->GetChildren()) {
                childBytes += child->GetSize();
            }
            CollectAtoms(container->GetChildren(), offset + size - childBytes, depth + 1, rows);
        }
        offset += size;
    }
}

// The atom at `types` (concatenated four-character codes) below `parent`.
const CTqovixAtom* Find(const CTqovixAtom* parent, const std::string& types)
{
    for (size_t at = 0; parent != nullptr && at < types.size(); at += 4) {
        const auto* container = dynamic_cast<const CTqovixContainerAtom*>(parent);
        parent = nullptr;
        for (const auto& child : container ? container->GetChildren() : TqovixAtomList{}) {
            if (TqovixAtomTypeName(child->GetType()) == types.substr(at, 4)) {
                parent = child.get();
                break;
            }
        }
    }
    return parent;
}

// Four bytes of a leaf's payload at `at`, as text or as a big-endian number.
std::string Text4(const CTqovixAtom* leaf, uint64_t at)
{
    const uint8_t* data = leaf && leaf->GetDataSize() >= at + 4 ? leaf->GetData() : nullptr;
    std::string text = data ? std::string(data + at, data + at + 4) : "?";
    for (char& c : text) {
        c = c >= 0x20 && c < 0x7f ? c : '.';
    }
    return text;
}
uint32_t Number4(const CTqovixAtom* leaf, uint64_t at)
{
    const uint8_t* b = leaf && leaf->GetDataSize() >= at + 4 ? leaf->GetData() : nullptr;
    return b ? uint32_t{b[at]} << 24 | uint32_t{b[at + 1]} << 16 | uint32_t{b[at + 2]} << 8 | b[at + 3] : 0;
}

std::vector<TrackRow> CollectTracks(const CTqovixAtomControl& tree, const TqovixAtomList& atoms)
{
    std::vector<TrackRow> tracks;
    for (const auto& top : atoms) {
        const auto* moov = dynamic_cast<const CTqovixContainerAtom*>(top.get());
        for (const auto& trak : moov && top->GetType() == TqovixAtom::kMoov ? moov->GetChildren() : TqovixAtomList{}) {
            if (trak->GetType() != TqovixAtom::kTrak) {
                continue;
            }
            const CTqovixAtom* mdhd = Find(trak.get(), "mdiamdhd");
            TrackRow track;
            track.handler = Text4(Find(trak.get(), "mdiahdlr"), 8);
            const CTqovixAtom* stsd = Find(trak.get(), "mdiaminfstblstsd");
            track.codec = Text4(stsd, 12);
            track.timeScale = Number4(mdhd, Number4(mdhd, 0) >> 24 == 1 ? 20 : 12);  // version 1: 64-bit dates
            const uint32_t delta = Number4(Find(trak.get(), "mdiaminfstblstts"), 12);
            // Sound: the description's 16.16 rate; video: the time scale over the first frame's duration.
            track.rate = track.handler == "soun" ? Number4(stsd, 40) >> 16
                                                 : (delta ? static_cast<double>(track.timeScale) / delta : 0);
            tracks.push_back(track);
        }
    }
    // The details the library itself reads, for the first track of each kind.
    CTqovixAudioInformationVisitor sound;
    CTqovixAudioDataVisitor soundData;
    std::vector<TqovixChunkInformation> soundChunks;
    const bool haveSound = !TqovixFailed(tree.Analyze(sound)) && !TqovixFailed(tree.Analyze(soundData)) &&
                           !TqovixFailed(soundData.GetAudioChunkInformation(
                               soundChunks, (uint32_t{sound.GetSize()} * sound.GetChannel()) >> 3));
    CTqovixMovieDataVisitor video;
    std::vector<TqovixChunkInformation> videoChunks;
    const bool haveVideo = !TqovixFailed(tree.Analyze(video)) && !TqovixFailed(video.GetOffset(videoChunks));
    uint64_t videoSamples = 0;
    for (const TqovixChunkInformation& chunk : videoChunks) {
        videoSamples += chunk.sampleCount;
    }
    bool soundDone = false, videoDone = false;
    for (TrackRow& track : tracks) {
        if (track.handler == "soun" && haveSound && !soundDone) {
            soundDone = track.known = true;
            track.aac = track.codec == "mp4a";
            track.channels = sound.GetChannel();
            track.bits = sound.GetSize();
            track.samples = sound.GetCount();
            track.chunks = soundChunks.size();
        } else if (track.handler == "vide" && haveVideo && !videoDone) {
            videoDone = track.known = true;
            track.samples = videoSamples;
            track.chunks = videoChunks.size();
        }
    }
    return tracks;
}

}  // namespace

int InspectCommand(Arguments arguments)
{
    const bool json = std::erase(arguments, std::string("--json")) > 0;
    if (arguments.size() != 1 || arguments[0].starts_with("-")) {
        const bool help = arguments.size() == 1 && arguments[0] == "--help";
        std::fputs(kUsage, help ? stdout : stderr);
        return help ? 0 : 2;
    }
    const std::string path = arguments[0];
    CTqovixFile file;
    CTqovixAtomControl tree;
    eTqovixErrorCode result = file.Open(path.c_str(), 1);
    if (!TqovixFailed(result)) {
        result = tree.Initialize(file);
    }
    if (TqovixFailed(result)) {
        std::fprintf(stderr, "tqovix: %s: %s (code %d)\n", path.c_str(), DescribeInternalCode(result).c_str(), result);
        return 1;
    }
    TqovixAtomList atoms;
    tree.GetAtoms(atoms);
    std::vector<AtomRow> rows;
    CollectAtoms(atoms, 0, 0, rows);
    const std::vector<TrackRow> tracks = CollectTracks(tree, atoms);
    CTqovixTrimInformationVisitor trim;
    const bool haveTrim = tree.Analyze(trim) == eTqovixSuccess;
    CTqovixAFInformationVisitor af;
    const uint64_t afBytes = TqovixFailed(tree.Analyze(af)) ? 0 : af.GetAFInformationSize();
    CTqovixAudioLevelInformationVisitor level;
    const uint64_t levelBytes = TqovixFailed(tree.Analyze(level)) ? 0 : level.GetAudioLevelInformationSize();
    // 0, 20 (processed) or the reason the library gives for not processing the movie.
    int answer = TqInitializeOVIX();
    if (answer == 0) {
        answer = TqGetPropertyOVIX(path.c_str());
        TqCloseOVIX();
    }
    const char* processed = answer == 20 ? "true" : answer == 0 ? "false" : "null";

    if (json) {
        std::printf("{\"file\":%s,\"atoms\":[", JsonString(path).c_str());
        for (size_t i = 0; i < rows.size(); ++i) {
            std::printf("%s{\"offset\":%" PRIu64 ",\"size\":%" PRIu64 ",\"type\":%s,\"depth\":%d}", i ? "," : "",
                        rows[i].offset, rows[i].size, JsonString(rows[i].type).c_str(), rows[i].depth);
        }
        std::printf("],\"tracks\":[");
        for (size_t i = 0; i < tracks.size(); ++i) {
            const TrackRow& t = tracks[i];
            std::printf("%s{\"handler\":%s,\"codec\":%s,\"timeScale\":%u,\"rate\":%.3f", i ? "," : "",
                        JsonString(t.handler).c_str(), JsonString(t.codec).c_str(), t.timeScale, t.rate);
            std::printf(",\"samples\":%" PRIu64 ",\"chunks\":%zu", t.samples, t.chunks);
            if (t.handler == "soun") {
                std::printf(",\"channels\":%u,\"bits\":%u,\"aac\":%s", t.channels, t.bits, t.aac ? "true" : "false");
            }
            std::printf("}");
        }
        std::printf("],\"trim\":");
        if (haveTrim) {
            std::printf("{\"removedFrameForward\":%u,\"removedFrameBackward\":%u,\"frameRate\":[%u,%u]}",
                        trim.GetRemovedFrameForward(), trim.GetRemovedFrameBackward(), trim.GetFrameRateNumerator(),
                        trim.GetFrameRateDenominator());
        } else {
            std::printf("null");
        }
        std::printf(",\"afInformationBytes\":%" PRIu64 ",\"audioLevelBytes\":%" PRIu64
                    ",\"processed\":%s,\"libraryAnswer\":%d,\"libraryMessage\":%s}\n",
                    afBytes, levelBytes, processed, answer, JsonString(DescribeResult(answer)).c_str());
        return 0;
    }
    std::printf("%s\n%12s %12s  %s\n", path.c_str(), "offset", "size", "type");
    for (const AtomRow& row : rows) {
        std::printf("%12" PRIu64 " %12" PRIu64 "  %*s%s\n", row.offset, row.size, row.depth * 2, "", row.type.c_str());
    }
    std::printf("\ntracks\n");
    for (const TrackRow& t : tracks) {
        const bool sound = t.handler == "soun";
        std::printf("  %-4s  %-4s  %.*f %s", t.handler.c_str(), t.codec.c_str(), sound ? 0 : 3, t.rate,
                    sound ? "Hz" : "fps");
        if (t.known && t.handler == "soun") {
            std::printf("  %u ch  %s", t.channels, t.aac ? "AAC" : (std::to_string(t.bits) + " bit").c_str());
        }
        if (t.known) {
            std::printf("  %" PRIu64 " %s  %zu chunks", t.samples, t.aac ? "packets" : "samples", t.chunks);
        }
        std::printf("\n");
    }
    if (haveTrim) {
        std::printf("trim tags: %u frames removed forward, %u backward, frame rate %u/%u\n",
                    trim.GetRemovedFrameForward(), trim.GetRemovedFrameBackward(), trim.GetFrameRateNumerator(),
                    trim.GetFrameRateDenominator());
    } else {
        std::printf("trim tags: none\n");
    }
    std::printf("AF information: %s\n", afBytes ? (std::to_string(afBytes) + " bytes").c_str() : "none");
    std::printf("audio level information: %s\n", levelBytes ? (std::to_string(levelBytes) + " bytes").c_str() : "none");
    std::printf("AF information processed: %s\n",
                answer == 20 ? "yes" : answer == 0 ? "no" : ("unknown: " + DescribeResult(answer)).c_str());
    return 0;
}
