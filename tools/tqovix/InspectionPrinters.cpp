// The inspection as text for a terminal and as one JSON object.
#include <cinttypes>
#include <cstdio>

#include "Commands.h"
#include "Inspection.h"

namespace {

const char* Processed(int answer) { return answer == 20 ? "true" : answer == 0 ? "false" : "null"; }

}  // namespace

void PrintInspectionJson(const Inspection& in)
{
    std::printf("{\"file\":%s,\"atoms\":[", JsonString(in.path).c_str());
    for (size_t i = 0; i < in.atoms.size(); ++i) {
        const InspectedAtom& a = in.atoms[i];
        std::printf("%s{\"offset\":%" PRIu64 ",\"size\":%" PRIu64 ",\"type\":%s,\"depth\":%d}", i ? "," : "", a.offset,
                    a.size, JsonString(a.type).c_str(), a.depth);
    }
    std::printf("],\"tracks\":[");
    for (size_t i = 0; i < in.tracks.size(); ++i) {
        const InspectedTrack& t = in.tracks[i];
        std::printf("%s{\"handler\":%s,\"codec\":%s,\"timeScale\":%u,\"rate\":%.3f", i ? "," : "",
                    JsonString(t.handler).c_str(), JsonString(t.codec).c_str(), t.timeScale, t.rate);
        std::printf(",\"samples\":%" PRIu64 ",\"chunks\":%zu", t.samples, t.chunks);
        if (t.handler == "soun") {
            std::printf(",\"channels\":%u,\"bits\":%u,\"aac\":%s", t.channels, t.bits, t.aac ? "true" : "false");
        }
        std::printf("}");
    }
    std::printf("],\"trim\":");
    if (in.trim) {
        std::printf("{\"removedFrameForward\":%u,\"removedFrameBackward\":%u,\"frameRate\":[%u,%u]}",
                    in.trim->removedForward, in.trim->removedBackward, in.trim->rateNumerator, in.trim->rateDenominator);
    } else {
        std::printf("null");
    }
    std::printf(",\"afInformationBytes\":%" PRIu64 ",\"audioLevelBytes\":%" PRIu64
                ",\"processed\":%s,\"libraryAnswer\":%d,\"libraryMessage\":%s,\"refusal\":%s}\n",
                in.afBytes, in.levelBytes, Processed(in.libraryAnswer), in.libraryAnswer,
                JsonString(DescribeResult(in.libraryAnswer)).c_str(),
                in.refusal.empty() ? "null" : JsonString(in.refusal).c_str());
}

void PrintInspectionText(const Inspection& in)
{
    std::printf("%s\n%12s %12s  %s\n", in.path.c_str(), "offset", "size", "type");
    for (const InspectedAtom& a : in.atoms) {
        std::printf("%12" PRIu64 " %12" PRIu64 "  %*s%s\n", a.offset, a.size, a.depth * 2, "", a.type.c_str());
    }
    std::printf("\ntracks\n");
    for (const InspectedTrack& t : in.tracks) {
        const bool sound = t.handler == "soun";
        std::printf("  %-4s  %-4s  %.*f %s", t.handler.c_str(), t.codec.c_str(), sound ? 0 : 3, t.rate,
                    sound ? "Hz" : "fps");
        if (sound) {
            std::printf("  %u ch  %s", t.channels, t.aac ? "AAC" : (std::to_string(t.bits) + " bit").c_str());
        }
        if (t.known) {
            std::printf("  %" PRIu64 " %s  %zu chunks", t.samples, t.aac ? "packets" : "samples", t.chunks);
        }
        std::printf("\n");
    }
    if (in.trim) {
        std::printf("trim tags: %u frames removed forward, %u backward, frame rate %u/%u\n", in.trim->removedForward,
                    in.trim->removedBackward, in.trim->rateNumerator, in.trim->rateDenominator);
    } else {
        std::printf("trim tags: none\n");
    }
    std::printf("AF information: %s\n", in.afBytes ? (std::to_string(in.afBytes) + " bytes").c_str() : "none");
    std::printf("audio level information: %s\n",
                in.levelBytes ? (std::to_string(in.levelBytes) + " bytes").c_str() : "none");
    std::printf("AF information processed: %s\n", in.libraryAnswer == 20  ? "yes"
                                                  : in.libraryAnswer == 0 ? "no"
                                                                          : ("unknown: " + DescribeResult(in.libraryAnswer)).c_str());
    if (!in.refusal.empty()) {
        std::printf("the library would refuse it: %s\n", in.refusal.c_str());
    }
}
