// tqovix compare: what a job did to the sound, measured and drawn. Both sounds are decoded
// through our own pipeline and compared frame for frame, streaming.
#include <cinttypes>
#include <cstdio>
#include <string>

#include <sys/stat.h>

#include "CommandLine.h"
#include "Json.h"
#include "SoundComparison.h"
#include "Spectrogram.h"
#include "api/TqOVIXUtility.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix compare [--png FILE] [--json] SRC DST\n"
    "  measures what processing did to SRC's sound in DST: per AF interval the level before\n"
    "  and after and the reduction, elsewhere how many frames differ (PCM of any depth: none\n"
    "  should) or the largest difference (AAC, in 16-bit steps), and DST's offset against SRC\n"
    "  in frames; --png draws both spectrograms with the AF intervals and the level difference\n"
    "  over time; -q prints only why a comparison fails\n"
    "  exit status: 0 compared, 1 DST is not the processed form of SRC (the same file, its AF\n"
    "  information not marked processed, or its sound differs in rate, channels, sample format\n"
    "  or length, or does not match), either sound stops short of what its tables promise, or\n"
    "  a file is unreadable; 2 usage\n";

bool SameFile(const std::string& a, const std::string& b)
{
    struct stat one {};
    struct stat other {};
    return stat(a.c_str(), &one) == 0 && stat(b.c_str(), &other) == 0 && one.st_dev == other.st_dev &&
           one.st_ino == other.st_ino;
}

// The library's word on whether a movie's AF information is marked processed.
bool MarkedProcessed(const std::string& path)
{
    if (TqInitializeOVIX() != 0) {
        return false;
    }
    const int answer = TqGetPropertyOVIX(path.c_str());
    TqCloseOVIX();
    return answer == 20;
}

double Seconds(uint64_t frame, uint32_t rate) { return static_cast<double>(frame) / rate; }

void PrintJson(const std::string& source, const std::string& destination, const SoundComparison& c,
               const std::string& png)
{
    const std::string bits = c.aac ? "null" : std::to_string(c.bits);
    std::printf("{\"version\":1,\"source\":%s,\"destination\":%s,\"compared\":true,\"rate\":%u,\"channels\":%u,\"frames\":%" PRIu64
                ",\"codec\":\"%s\",\"bits\":%s,\"float\":%s,\"intervals\":[",
                JsonString(source).c_str(), JsonString(destination).c_str(), c.rate, c.channels, c.frames,
                c.aac ? "aac" : "pcm", bits.c_str(), c.floatingPoint ? "true" : "false");
    for (size_t i = 0; i < c.intervals.size(); ++i) {
        const IntervalLevels& l = c.intervals[i];
        std::printf("%s{\"startFrame\":%" PRIu64 ",\"endFrame\":%" PRIu64
                    ",\"start\":%.3f,\"end\":%.3f,\"beforeDb\":%.2f,\"afterDb\":%.2f,\"reductionDb\":%.2f}",
                    i ? "," : "", l.interval.start, l.interval.end, Seconds(l.interval.start, c.rate),
                    Seconds(l.interval.end, c.rate), l.beforeDb, l.afterDb, l.beforeDb - l.afterDb);
    }
    std::printf("],\"outside\":{\"differingFrames\":%" PRIu64 ",\"largestDifference\":%d},\"offsetFrames\":%" PRId64
                ",\"correlation\":%.4f,\"png\":%s}\n",
                c.differingFrames, c.largestDifference, c.offset, c.correlation,
                png.empty() ? "null" : JsonString(png).c_str());
}

void PrintText(const std::string& source, const std::string& destination, const SoundComparison& c,
               const std::string& png)
{
    std::printf("%s -> %s: %s, %u Hz, %u channels, %.3f s\n", source.c_str(), destination.c_str(),
                c.format.c_str(), c.rate, c.channels, Seconds(c.frames, c.rate));
    for (size_t i = 0; i < c.intervals.size(); ++i) {
        const IntervalLevels& l = c.intervals[i];
        std::printf("  AF interval %zu: %.3f-%.3f s  before %.1f dB  after %.1f dB  reduction %.1f dB\n", i + 1,
                    Seconds(l.interval.start, c.rate), Seconds(l.interval.end, c.rate), l.beforeDb, l.afterDb,
                    l.beforeDb - l.afterDb);
    }
    if (c.intervals.empty()) {
        std::printf("  no AF intervals\n");
    }
    if (c.aac) {
        std::printf("  outside the intervals: largest difference %d (re-encoded, in 16-bit steps)\n",
                    c.largestDifference);
    } else {
        std::printf("  outside the intervals: %" PRIu64 " frames differ\n", c.differingFrames);
    }
    std::printf("  offset: %" PRId64 " frames (correlation %.4f)\n", c.offset, c.correlation);
    if (!png.empty()) {
        std::printf("  picture: %s\n", png.c_str());
    }
}

}  // namespace

int CompareCommand(const Arguments& arguments)
{
    CommandLine line("compare", kUsage, {{"json", 0, false}, {"png", 0, true}});
    if (const int status = line.Parse(arguments); status >= 0) {
        return status;
    }
    if (line.Operands().size() != 2) {
        return line.Misuse("SRC and DST are needed");
    }
    const bool json = line.Has("json");
    const std::string png = line.Value("png");
    const Arguments& paths = line.Operands();
    // Every refusal says why: with --json in the report, else on standard error.
    const auto refuse = [&](const std::string& reason, const std::string& why) {
        if (json) {
            std::printf("{\"version\":1,\"source\":%s,\"destination\":%s,\"compared\":false,\"reason\":%s,"
                        "\"message\":%s}\n",
                        JsonString(paths[0]).c_str(), JsonString(paths[1]).c_str(), JsonString(reason).c_str(),
                        JsonString(why).c_str());
        } else {
            std::fprintf(stderr, "tqovix compare: %s\n", why.c_str());
        }
        return 1;
    };
    if (SameFile(paths[0], paths[1])) {
        return refuse("same-file", "SRC and DST are the same file: a movie is compared with its processed form");
    }
    // The picture needs the sound's shape before the first block: open it once to learn it.
    Spectrogram picture;
    bool drawing = false;
    if (!png.empty()) {
        SoundStream probe;
        if (const std::string why = probe.Open(paths[0]); !why.empty()) {
            return refuse("unreadable", paths[0] + ": " + why);
        }
        if (const std::string why = picture.Begin(probe.Rate(), probe.Channels(), probe.Frames(), probe.Intervals());
            !why.empty()) {
            return refuse("no-picture", "no picture: " + why);
        }
        drawing = true;
    }
    SoundComparison comparison;
    const std::string why = CompareSounds(paths[0], paths[1], comparison,
                                          [&](const double* a, const double* b, uint64_t first, uint64_t frames) {
                                              if (drawing) {
                                                  picture.Add(a, b, first, frames);
                                              }
                                          });
    if (!why.empty()) {
        return refuse(comparison.reason, why);
    }
    // Sound alike throughout is no proof: a copy of SRC has it too.
    if (!MarkedProcessed(paths[1])) {
        return refuse("not-processed", paths[1] + ": not the processed form of " + paths[0] +
                                           ": its AF information is not marked processed");
    }
    if (drawing) {
        if (const std::string failed = picture.Save(png); !failed.empty()) {
            std::fprintf(stderr, "tqovix compare: %s\n", failed.c_str());
            return 1;
        }
    }
    if (json || !line.Quiet()) {
        (json ? PrintJson : PrintText)(paths[0], paths[1], comparison, png);
    }
    return 0;
}
