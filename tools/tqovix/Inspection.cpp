#include "Inspection.h"

#include "api/TqOVIXUtility.h"
#include "atom/CTqovixAtomControl.h"
#include "atom/CTqovixContainerAtom.h"
#include "atom/TqovixAtomType.h"
#include "atom/TqovixEndian.h"
#include "atom/TqovixTrackAtoms.h"
#include "file/CTqovixFile.h"
#include "visitor/CTqovixAudioInformationVisitor.h"
#include "visitor/CTqovixMakerBlockVisitor.h"
#include "visitor/CTqovixMovieDataVisitor.h"
#include "visitor/CTqovixTrimInformationVisitor.h"

namespace {

// The leaf at `types` (concatenated four-character codes) below `parent`, as a payload.
TqovixPayload Payload(const CTqovixAtom* parent, const std::string& types)
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
    const uint8_t* data = parent != nullptr ? parent->GetData() : nullptr;
    return data == nullptr ? TqovixPayload{} : TqovixPayload{data, static_cast<size_t>(parent->GetDataSize())};
}

// The movie header's duration in seconds; negative without a readable one.
double MovieSeconds(const TqovixAtomList& atoms)
{
    for (const auto& top : atoms) {
        if (top->GetType() != TqovixAtom::kMoov) {
            continue;
        }
        const TqovixPayload mvhd = Payload(top.get(), "mvhd");
        const bool wide = mvhd.size() >= 1 && mvhd.data()[0] == 1;
        if (mvhd.size() < (wide ? 32u : 20u)) {
            return -1;
        }
        const uint32_t scale = TqovixReadBE32(mvhd.data() + (wide ? 20 : 12));
        const uint64_t duration = wide ? TqovixReadBE64(mvhd.data() + 24) : TqovixReadBE32(mvhd.data() + 16);
        return scale == 0 ? -1 : static_cast<double>(duration) / scale;
    }
    return -1;
}

std::vector<InspectedTrack> CollectTracks(const CTqovixAtomControl& tree, const TqovixAtomList& atoms)
{
    std::vector<InspectedTrack> tracks;
    for (const auto& top : atoms) {
        const auto* moov = dynamic_cast<const CTqovixContainerAtom*>(top.get());
        for (const auto& trak : moov && top->GetType() == TqovixAtom::kMoov ? moov->GetChildren() : TqovixAtomList{}) {
            if (trak->GetType() != TqovixAtom::kTrak) {
                continue;
            }
            InspectedTrack track;
            const auto handler = TqovixTrackAtoms::ParseHandler(Payload(trak.get(), "mdiahdlr"));
            track.handler = handler ? TqovixAtomTypeName(handler->subtype) : "?";
            track.timeScale = TqovixTrackAtoms::ParseMediaTimeScale(Payload(trak.get(), "mdiamdhd")).value_or(0);
            const TqovixPayload stts = Payload(trak.get(), "mdiaminfstblstts");
            const uint32_t delta = stts.size() >= 16 ? TqovixReadBE32(stts.data() + 12) : 0;
            track.rate = delta != 0 ? static_cast<double>(track.timeScale) / delta : 0;
            tracks.push_back(track);
        }
    }
    // What the library's own walk reads of every track: format, chunks, samples.
    CTqovixTrackListVisitor list;
    if (!TqovixFailed(tree.Analyze(list))) {
        for (const TqovixTrackTables& tables : list.GetTracks()) {
            if (tables.index >= tracks.size()) {
                continue;
            }
            InspectedTrack& track = tracks[tables.index];
            track.codec = TqovixAtomTypeName(tables.format);
            const bool sound = tables.IsHandler("soun");
            if (sound && tables.soundEntry) {
                track.rate = tables.soundEntry->sampleRateHz;
                track.channels = tables.soundEntry->channels;
                track.bits = tables.soundEntry->bitsPerChannel;
                track.aac = TqovixSoundEntry::IsAac(*tables.soundEntry);
                std::string why;
                const auto layout = TqovixSoundEntry::IsPcmFormat(*tables.soundEntry)
                                        ? TqovixSoundEntry::ReadPcmLayout(*tables.soundEntry, why)
                                        : std::nullopt;
                track.pcmKnown = layout.has_value();
                track.floatingPoint = layout && layout->floating;
                track.littleEndian = layout && layout->littleEndian;
            }
            const uint32_t frameBytes = sound && tables.soundEntry && TqovixSoundEntry::IsPcmFormat(*tables.soundEntry)
                                            ? TqovixSoundEntry::FrameBytes(*tables.soundEntry)
                                            : 0;
            std::vector<TqovixChunkInformation> chunks;
            track.known = !TqovixFailed(TqovixBuildChunkList(tables, frameBytes, chunks));
            for (const TqovixChunkInformation& chunk : chunks) {
                track.samples += chunk.sampleCount;
            }
            track.chunks = chunks.size();
        }
    }
    // The processed sound track's channels as its decoder configuration gives them.
    CTqovixAudioInformationVisitor sound;
    if (!TqovixFailed(tree.Analyze(sound)) && sound.GetTrackIndex() < tracks.size()) {
        tracks[sound.GetTrackIndex()].channels = sound.GetChannel();
    }
    return tracks;
}

}  // namespace

Inspection Inspect(const std::string& path)
{
    Inspection inspection;
    inspection.path = path;
    inspection.structure = ScanStructure(path);
    if (!inspection.structure.atomic) {
        inspection.kind = NonMovieKind(path);
    }
    int answer = TqInitializeOVIX();
    if (answer == 0) {
        answer = TqGetPropertyOVIX(path.c_str());
        TqCloseOVIX();
    }
    inspection.verdict = answer == 0 ? Verdict{} : Explain(answer, path);
    if (answer == 0) {
        inspection.aacWhole = AacWholeReason(path);
    }
    CTqovixFile file;
    CTqovixAtomControl tree;
    if (TqovixFailed(file.Open(path.c_str(), 1)) || TqovixFailed(tree.Initialize(file))) {
        return inspection;
    }
    inspection.parsed = true;
    TqovixAtomList atoms;
    tree.GetAtoms(atoms);
    inspection.tracks = CollectTracks(tree, atoms);
    CTqovixAudioInformationVisitor sound;
    inspection.aacProcessable = answer == 0 && !TqovixFailed(tree.Analyze(sound)) &&
                                sound.GetTrackIndex() < inspection.tracks.size() &&
                                inspection.tracks[sound.GetTrackIndex()].aac;
    inspection.seconds = MovieSeconds(atoms);
    CTqovixTrimInformationVisitor trim;
    if (tree.Analyze(trim) == eTqovixSuccess) {
        inspection.trim = InspectedTrim{trim.GetRemovedFrameForward(), trim.GetRemovedFrameBackward(),
                                        trim.GetFrameRateNumerator(), trim.GetFrameRateDenominator()};
    }
    CTqovixAFInformationVisitor af;
    inspection.afBytes = TqovixFailed(tree.Analyze(af)) ? 0 : af.GetAFInformationSize();
    CTqovixAudioLevelInformationVisitor level;
    inspection.levelBytes = TqovixFailed(tree.Analyze(level)) ? 0 : level.GetAudioLevelInformationSize();
    return inspection;
}
