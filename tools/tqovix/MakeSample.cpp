// tqovix make-sample: a camera-style movie to try the tools on.
#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <numbers>
#include <string>
#include <vector>

#include "CommandLine.h"
#include <sys/stat.h>
#include "Movie.h"
#include "codec/AACEncoder.h"
#include "MoviePlan.h"
#include "Pattern.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix make-sample [--pcm|--aac] [--seconds N] [--size-gib N] [--little-endian] [-f] DST\n"
    "  writes a 29.97 fps camera-style movie with 48 kHz stereo sound, AF information, audio\n"
    "  level information and trim tags\n"
    "  --pcm             16-bit PCM sound: a tone, with a motor's whine and hiss while the AF motor runs\n"
    "                    (the default; movies over 20 minutes get the tone alone)\n"
    "  --aac             AAC sound: the same tone and motor, encoded (over 20 minutes, silent packets)\n"
    "  --seconds N       length of the movie (default 10)\n"
    "  --size-gib N      pad the video frames so that the file reaches about N GiB (a warning\n"
    "                    says when the movie's length makes it larger)\n"
    "  --little-endian   store PCM sound as \"sowt\" instead of \"twos\"\n"
    "  -f, --force       replace an existing DST\n"
    "  -q, --quiet       no line about what was written\n"
    "  exit status: 0 written, 1 DST exists or cannot be written, 2 usage error\n";

constexpr uint32_t kSampleRate = 48000;
constexpr uint16_t kChannels = 2;
// Explicit samples are held in memory: 20 minutes of stereo are 230 MB.
constexpr unsigned long kMaxExplicitSoundSeconds = 20 * 60;
// Video frames are generated in memory one at a time; keep each one modest.
constexpr uint64_t kMaxFrameBytes = 64ULL << 20;

// A steady tone, and inside each AF interval the noise a lens motor makes: a whine whose pitch
// rises as the motor speeds up, holds, and falls as it brakes, with two harmonics and a hiss,
// as loud as the interval's strength says.
std::vector<int16_t> ToneWithMotorNoise(uint64_t frames, const std::vector<moviekit::AfInterval>& intervals)
{
    std::vector<int16_t> samples(frames * kChannels);
    for (uint64_t f = 0; f < frames; ++f) {
        const double phase = 2 * std::numbers::pi * static_cast<double>(f % kSampleRate) / kSampleRate;
        samples[f * kChannels] = static_cast<int16_t>(std::lround(6000 * std::sin(1000 * phase)));
        samples[f * kChannels + 1] = static_cast<int16_t>(std::lround(6000 * std::sin(1500 * phase)));
    }
    for (const moviekit::AfInterval& interval : intervals) {
        const uint64_t end = std::min<uint64_t>(interval.endFrame, frames);
        if (interval.startFrame >= end) {
            continue;
        }
        const double length = static_cast<double>(end - interval.startFrame);
        double whine = 0.0;
        for (uint64_t f = interval.startFrame; f < end; ++f) {
            const double at = static_cast<double>(f - interval.startFrame) / length;
            const double speed = std::min({1.0, at * 4.0, (1.0 - at) * 4.0});
            whine += 2 * std::numbers::pi * (250.0 + 650.0 * speed) / kSampleRate;
            const double tone = std::sin(whine) + 0.5 * std::sin(2 * whine) + 0.25 * std::sin(3 * whine);
            for (uint64_t c = 0; c < kChannels; ++c) {
                const auto hiss = static_cast<double>(moviekit::SplitMix64(f * kChannels + c) % 4001) - 2000.0;
                const double noise = (5000.0 * tone + hiss) * interval.strength / 1000.0;
                const int64_t mixed = samples[f * kChannels + c] + std::llround(noise);
                samples[f * kChannels + c] = static_cast<int16_t>(std::clamp<int64_t>(mixed, -32768, 32767));
            }
        }
    }
    return samples;
}

// The sound as a camera records it in AAC: through the encoder jobs use, whose packets decode
// to one packet of priming and then the sound, which the movie's edit skips. `packets` of them.
bool EncodeAac(std::vector<int16_t> pcm, uint64_t packets, std::vector<moviekit::Bytes>& out)
{
    struct Collected {
        std::vector<moviekit::Bytes>* packets;
        uint64_t wanted;
    } collected{&out, packets};
    ACEncoderStream stream;
    stream.userData = &collected;
    stream.resultProc = [](void* self, unsigned char* data, unsigned int size) {
        auto* into = static_cast<Collected*>(static_cast<ACEncoderStream*>(self)->userData);
        if (into->packets->size() < into->wanted) {
            into->packets->emplace_back(data, data + size);
        }
        return eTqovixSuccess;
    };
    constexpr uint32_t kFrameBytes = 2 * kChannels;
    const ACFormat aac{kSampleRate, ACFormatAAC, 0, 0, 1024, 0, kChannels, 0};
    const ACFormat linear{kSampleRate, ACFormatLinearPCM, 12, kFrameBytes, 1, kFrameBytes, kChannels, 16};
    AACEncoder encoder;
    if (encoder.Initialize(linear, aac, 128000, &stream) != eConverterSuccess) {
        return false;
    }
    // Pushed a second at a time: one push is limited to what an unsigned int counts.
    constexpr size_t kPush = kSampleRate * kChannels;
    for (size_t at = 0; at < pcm.size(); at += kPush) {
        const size_t count = std::min(kPush, pcm.size() - at);
        if (encoder.Encode(pcm.data() + at, static_cast<unsigned int>(count * sizeof(int16_t))) != eConverterSuccess) {
            return false;
        }
    }
    return encoder.EncodeDone() == eConverterSuccess && out.size() == packets;
}

}  // namespace

int MakeSampleCommand(const Arguments& arguments)
{
    CommandLine line("make-sample", kUsage,
                     {{"pcm", 0, false}, {"aac", 0, false}, {"seconds", 0, true}, {"size-gib", 0, true},
                      {"little-endian", 0, false}, {"force", 'f', false}});
    if (const int status = line.Parse(arguments); status >= 0) {
        return status;
    }
    if (line.Operands().size() != 1) {
        return line.Misuse("one DST is needed");
    }
    const std::string destination = line.Operands()[0];
    if (destination == "-") {
        return line.Misuse("'-' is not a file: a movie cannot be written to standard output");
    }
    long seconds = 10;
    int status = 2;
    if (!line.Number("seconds", 1, 24 * 3600, seconds, status)) {
        return status;
    }
    double sizeGib = 0;
    if (line.Has("size-gib")) {
        const std::string text = line.Value("size-gib");
        char* end = nullptr;
        sizeGib = std::strtod(text.c_str(), &end);
        if (text.empty() || *end != '\0' || !(sizeGib > 0 && sizeGib <= 1024)) {
            return line.Misuse("--size-gib takes a number above 0 and up to 1024");
        }
    }
    const bool aac = line.Has("aac");
    const bool littleEndian = line.Has("little-endian");
    if (aac && (littleEndian || line.Has("pcm"))) {
        return line.Misuse(littleEndian ? "--little-endian is for PCM sound" : "--pcm and --aac exclude each other");
    }
    struct stat existing {};
    if (!line.Has("force") && lstat(destination.c_str(), &existing) == 0) {
        std::fprintf(stderr, "tqovix: %s: the file exists (use --force to replace it)\n", destination.c_str());
        return 1;
    }

    moviekit::MovieRecipe recipe;
    recipe.video.width = 320;
    recipe.video.height = 180;
    recipe.video.frameCount = static_cast<uint32_t>(seconds * 30000L / 1001);
    recipe.sound.sampleRate = kSampleRate;
    recipe.sound.channels = kChannels;
    recipe.sound.codec = aac ? moviekit::SoundCodec::Aac
                             : (littleEndian ? moviekit::SoundCodec::Sowt : moviekit::SoundCodec::Twos);
    recipe.keepSoundBytes = false;
    const uint64_t frames = moviekit::FramesForVideo(recipe.video, recipe.video.frameCount, kSampleRate);
    const uint64_t n = aac ? moviekit::DivCeil(frames, 1024) * 1024 : frames;
    const std::vector<moviekit::AfInterval> intervals = {{n / 4, n / 4 + n / 10, 800}, {n / 2, n / 2 + n / 8, 500}};
    recipe.maker.afIntervals = intervals;
    if (static_cast<unsigned long>(seconds) <= kMaxExplicitSoundSeconds) {
        if (!aac) {
            recipe.sound.pcm = ToneWithMotorNoise(frames, intervals);
        } else if (!EncodeAac(ToneWithMotorNoise(n, intervals), n / 1024, recipe.sound.aacPackets)) {
            std::fprintf(stderr, "tqovix make-sample: the AAC encoder is not available (libavcodec)\n");
            return 1;
        }
    }
    if (sizeGib > 0) {
        // Sound and the atoms besides the frames are small beside the video: the frames take the rest.
        const auto target = static_cast<uint64_t>(sizeGib * (1ULL << 30));
        const uint64_t sound = aac ? frames / 4 : frames * kChannels * 2;
        const uint64_t natural = uint64_t{recipe.video.width} * recipe.video.height * 3;
        const uint64_t frameBytes = target > sound ? (target - sound) / recipe.video.frameCount : 0;
        if (frameBytes > kMaxFrameBytes) {
            std::fprintf(stderr, "tqovix: %.1f GiB needs video frames over 64 MiB; give more --seconds\n", sizeGib);
            return 2;
        }
        recipe.video.frameSize = static_cast<uint32_t>(std::max(natural, frameBytes));
    }
    moviekit::MovieLayout layout;
    std::string error;
    if (!moviekit::WriteMovie(destination, recipe, &layout, &error)) {
        std::fprintf(stderr, "tqovix: %s\n", error.c_str());
        std::remove(destination.c_str());
        return 1;
    }
    // Frames are never cut below their natural size: a short target is overshot, and said so.
    const double written = static_cast<double>(layout.fileSize) / (1ULL << 30);
    if (sizeGib > 0 && std::abs(written - sizeGib) > sizeGib / 100) {
        std::fprintf(stderr,
                     "tqovix make-sample: warning: the movie is %.3f GiB, not the %g GiB asked: its %ld seconds "
                     "need more; give fewer --seconds\n",
                     written, sizeGib, seconds);
    }
    if (line.Quiet()) {
        return 0;
    }
    std::printf("%s: %llu bytes, %zu video chunks, %zu sound chunks (%s)\n", destination.c_str(),
                static_cast<unsigned long long>(layout.fileSize), layout.videoChunks.size(),
                layout.soundChunks.size(), aac ? "AAC" : littleEndian ? "PCM sowt" : "PCM twos");
    return 0;
}
