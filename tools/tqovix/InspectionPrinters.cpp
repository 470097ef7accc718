// The inspection as text for a terminal and as one JSON object.
#include <cinttypes>
#include <cstdio>

#include "Inspection.h"
#include "Json.h"

namespace {

// Whether the AF information is processed already: unknown when the library refuses the
// file for another reason.
const char* Processed(const Verdict& verdict)
{
    return verdict.reason == Reason::AlreadyProcessed ? "yes" : verdict.reason == Reason::None ? "no" : nullptr;
}

std::string TrackJson(const InspectedTrack& t)
{
    JsonObject track;
    track.Add("handler", t.handler).Add("codec", t.codec).Add("timeScale", t.timeScale).Add("rate", t.rate);
    track.Add("samples", t.samples).Add("chunks", static_cast<uint64_t>(t.chunks));
    if (t.handler == "soun") {
        track.Add("channels", t.channels).Add("bits", t.bits).Add("aac", t.aac);
        if (t.pcmKnown) {
            track.Add("float", t.floatingPoint).Add("littleEndian", t.littleEndian);
        }
    }
    return track.Text();
}

}  // namespace

std::string InspectionJson(const Inspection& in, bool whole)
{
    JsonObject report = whole ? JsonObject::Report() : JsonObject();
    report.Add("file", in.path);
    if (in.structure.atomic) {
        report.Add("kind", "movie");
    } else if (in.kind.empty()) {
        report.Add("kind", "unknown");
    } else {
        report.Add("kind", in.kind);
    }
    if (in.seconds >= 0) {
        report.Add("seconds", in.seconds);
    } else {
        report.AddNull("seconds");
    }
    std::vector<std::string> atoms;
    for (const ScannedAtom& a : in.structure.atoms) {
        atoms.push_back(JsonObject().Add("offset", a.offset).Add("size", a.size).Add("type", a.type).Add("depth", a.depth).Text());
    }
    report.AddJson("atoms", JsonArray(atoms));
    if (in.structure.fault.empty()) {
        report.AddNull("malformed");
    } else {
        report.Add("malformed", in.structure.fault);
    }
    std::vector<std::string> tracks;
    for (const InspectedTrack& t : in.tracks) {
        tracks.push_back(TrackJson(t));
    }
    report.AddJson("tracks", JsonArray(tracks));
    if (in.trim) {
        report.AddJson("trim", JsonObject()
                                   .Add("removedFrameForward", in.trim->removedForward)
                                   .Add("removedFrameBackward", in.trim->removedBackward)
                                   .AddJson("frameRate", JsonArray({std::to_string(in.trim->rateNumerator),
                                                                    std::to_string(in.trim->rateDenominator)}))
                                   .Text());
    } else {
        report.AddNull("trim");
    }
    report.Add("afInformationBytes", in.afBytes).Add("audioLevelBytes", in.levelBytes);
    const char* processed = Processed(in.verdict);
    if (processed == nullptr) {
        report.AddNull("processed");
    } else {
        report.Add("processed", processed[0] == 'y');
    }
    report.Add("libraryAnswer", in.verdict.code).Add("reason", in.verdict.Key());
    if (in.verdict.text.empty()) {
        report.AddNull("message");
    } else {
        report.Add("message", in.verdict.text);
    }
    if (in.aacWhole.empty()) {
        report.AddNull("aacReencodedWhole");
    } else {
        report.Add("aacReencodedWhole", in.aacWhole);
    }
    return report.Text();
}

void PrintInspectionText(const Inspection& in, bool summaryOnly)
{
    if (in.structure.atomic) {
        std::printf("%s: QuickTime/ISO movie", in.path.c_str());
        if (!in.structure.brand.empty()) {
            std::printf(", brand '%s'", in.structure.brand.c_str());
        }
        if (in.seconds >= 0) {
            std::printf(", %.3f s", in.seconds);
        }
        std::printf("\n");
    } else {
        std::printf("%s: %s\n", in.path.c_str(), in.kind.empty() ? "not a movie" : (in.kind + ", not a movie").c_str());
    }
    if (!in.tracks.empty()) {
        std::printf("  tracks:");
        for (size_t i = 0; i < in.tracks.size(); ++i) {
            const InspectedTrack& t = in.tracks[i];
            const bool sound = t.handler == "soun";
            std::printf("%s %s %s %.*f %s", i ? "," : "", t.handler.c_str(), t.codec.c_str(), sound ? 0 : 3, t.rate,
                        sound ? "Hz" : "fps");
            if (sound) {
                std::printf(" %u ch", t.channels);
            }
        }
        std::printf("\n");
    }
    const char* processed = Processed(in.verdict);
    std::printf("  AF information processed: %s\n", processed != nullptr ? processed : "unknown");
    if (in.verdict.reason != Reason::None && in.verdict.reason != Reason::AlreadyProcessed) {
        std::printf("  the library would refuse it: %s\n", in.verdict.text.c_str());
    }
    if (!in.aacWhole.empty()) {
        std::printf("  AAC sound: re-encoded whole, because %s\n", in.aacWhole.c_str());
    } else if (in.aacProcessable) {
        std::printf("  AAC sound: the source's packets kept, re-encoded only around the AF intervals\n");
    }
    // The atoms of a still or a note are noise.
    if (summaryOnly || (!in.structure.atomic && in.structure.atoms.empty())) {
        return;
    }
    std::printf("\n%12s %12s  %s\n", "offset", "size", "type");
    for (const ScannedAtom& a : in.structure.atoms) {
        std::printf("%12" PRIu64 " %12" PRIu64 "  %*s%s\n", a.offset, a.size, a.depth * 2, "", a.type.c_str());
    }
    if (!in.structure.fault.empty()) {
        std::printf("  malformed: %s\n", in.structure.fault.c_str());
    }
    if (in.parsed) {
        std::printf("\ntracks\n");
        for (const InspectedTrack& t : in.tracks) {
            const bool sound = t.handler == "soun";
            std::printf("  %-4s  %-4s  %.*f %s", t.handler.c_str(), t.codec.c_str(), sound ? 0 : 3, t.rate,
                        sound ? "Hz" : "fps");
            if (sound) {
                const std::string kind = t.aac        ? "AAC"
                                         : !t.pcmKnown ? std::to_string(t.bits) + " bit"
                                                       : std::to_string(t.bits) + (t.floatingPoint ? " bit float" : " bit") +
                                                             (t.littleEndian ? " little-endian" : " big-endian");
                std::printf("  %u ch  %s", t.channels, kind.c_str());
            }
            if (t.known) {
                std::printf("  %" PRIu64 " %s  %zu chunks", t.samples, t.aac ? "packets" : "samples", t.chunks);
            }
            std::printf("\n");
        }
        if (in.trim) {
            std::printf("trim tags: %u frames removed forward, %u backward, frame rate %u/%u\n",
                        in.trim->removedForward, in.trim->removedBackward, in.trim->rateNumerator,
                        in.trim->rateDenominator);
        } else {
            std::printf("trim tags: none\n");
        }
        std::printf("AF information: %s\n", in.afBytes ? (std::to_string(in.afBytes) + " bytes").c_str() : "none");
        std::printf("audio level information: %s\n",
                    in.levelBytes ? (std::to_string(in.levelBytes) + " bytes").c_str() : "none");
    }
}
