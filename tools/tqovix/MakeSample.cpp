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
    "usage: tqovix make-sample [--pcm|--aac] [--bits N] [--rate HZ] [--seconds N] [--size-gib N]\n"
    "                          [--little-endian] [-f] DST\n"
    "  writes a 29.97 fps camera-style movie with stereo sound (48 kHz unless --rate says), AF\n"
    "  information, audio level information and trim tags\n"
    "  --pcm             PCM sound: a tone, with a motor's whine and hiss while the AF motor runs\n"
    "                    (the default; movies whose sound would take over 230 MB, 20 minutes of\n"
    "                    48 kHz 16-bit stereo, get the tone alone)\n"
    "  --aac             AAC sound: the same tone and motor, encoded (over 20 minutes, silent packets)\n"
    "  --bits N          PCM samples of 16 (the default), 24 or 32 bits: \"twos\", \"in24\", \"in32\"\n"
    "  --rate HZ         sound at HZ, 8000 to 192000 (AAC: up to 48000); past 65535 PCM is\n"
    "                    described as version-2 \"lpcm\"\n"
    "  --seconds N       length of the movie (default 10)\n"
    "  --size-gib N      pad the video frames so that the file reaches about N GiB (a warning\n"
    "                    says when the movie's length makes it larger)\n"
    "  --little-endian   store PCM sound little-endian: \"sowt\" instead of \"twos\", deeper\n"
    "                    samples with an \"enda\" atom or the version-2 flags\n"
    "  -f, --force       replace an existing DST\n"
    "  -q, --quiet       no line about what was written\n"
    "  exit status: 0 written, 1 DST exists or cannot be written, 2 usage error\n";

constexpr uint32_t kDefaultRate = 48000;
constexpr uint16_t kChannels = 2;
// Explicit samples are held in memory: 20 minutes of 48 kHz 16-bit stereo are 230 MB.
constexpr uint64_t kMaxExplicitSoundBytes = 20ULL * 60 * kDefaultRate * kChannels * 2;
constexpr unsigned long kMaxAacPacketsSeconds = 20 * 60;
// Video frames are generated in memory one at a time; keep each one modest.
constexpr uint64_t kMaxFrameBytes = 64ULL << 20;

// A steady tone, and inside each AF interval the noise a lens motor makes: a whine whose pitch
// rises as the motor speeds up, holds, and falls as it brakes, with two harmonics and a hiss,
// as loud as the interval's strength says. On the 16-bit scale, with the fractions a deeper
// recording keeps.
std::vector<double> ToneWithMotorNoise(uint64_t frames, uint32_t rate, const std::vector<moviekit::AfInterval>& intervals)
{
    std::vector<double> samples(frames * kChannels);
    for (uint64_t f = 0; f < frames; ++f) {
        const double phase = 2 * std::numbers::pi * static_cast<double>(f % rate) / rate;
        samples[f * kChannels] = 6000 * std::sin(1000 * phase);
        samples[f * kChannels + 1] = 6000 * std::sin(1500 * phase);
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
            whine += 2 * std::numbers::pi * (250.0 + 650.0 * speed) / rate;
            const double tone = std::sin(whine) + 0.5 * std::sin(2 * whine) + 0.25 * std::sin(3 * whine);
            for (uint64_t c = 0; c < kChannels; ++c) {
                const auto hiss = static_cast<double>(moviekit::SplitMix64(f * kChannels + c) % 4001) - 2000.0;
                const double noise = (5000.0 * tone + hiss) * interval.strength / 1000.0;
                samples[f * kChannels + c] = std::clamp(samples[f * kChannels + c] + noise, -32768.0, 32767.0);
            }
        }
    }
    return samples;
}

std::vector<int16_t> Narrow(const std::vector<double>& levels)
{
    std::vector<int16_t> samples(levels.size());
    for (size_t k = 0; k < levels.size(); ++k) {
        samples[k] = static_cast<int16_t>(std::lround(levels[k]));
    }
    return samples;
}

std::vector<int32_t> Wide(const std::vector<double>& levels)
{
    std::vector<int32_t> samples(levels.size());
    for (size_t k = 0; k < levels.size(); ++k) {
        samples[k] = static_cast<int32_t>(std::clamp<long long>(std::llround(levels[k] * 65536.0), INT32_MIN, INT32_MAX));
    }
    return samples;
}

// The sound as a camera records it in AAC: through the encoder jobs use, whose packets decode
// to one packet of priming and then the sound, which the movie's edit skips. `packets` of them.
bool EncodeAac(std::vector<int16_t> pcm, uint32_t rate, uint64_t packets, std::vector<moviekit::Bytes>& out)
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
    const ACFormat aac{static_cast<double>(rate), ACFormatAAC, 0, 0, 1024, 0, kChannels, 0};
    const ACFormat linear{static_cast<double>(rate), ACFormatLinearPCM, 12, kFrameBytes, 1, kFrameBytes, kChannels, 16};
    AACEncoder encoder;
    if (encoder.Initialize(linear, aac, 128000, &stream) != eConverterSuccess) {
        return false;
    }
    // Pushed a second at a time: one push is limited to what an unsigned int counts.
    const size_t kPush = size_t{rate} * kChannels;
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
                     {{"pcm", 0, false}, {"aac", 0, false}, {"bits", 0, true}, {"rate", 0, true}, {"seconds", 0, true},
                      {"size-gib", 0, true}, {"little-endian", 0, false}, {"force", 'f', false}});
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
    if (aac && (littleEndian || line.Has("pcm") || line.Has("bits"))) {
        return line.Misuse(littleEndian      ? "--little-endian is for PCM sound"
                           : line.Has("bits") ? "--bits is for PCM sound"
                                              : "--pcm and --aac exclude each other");
    }
    long bits = 16;
    if (!line.Number("bits", 16, 32, bits, status)) {
        return status;
    }
    if (bits != 16 && bits != 24 && bits != 32) {
        return line.Misuse("--bits takes 16, 24 or 32");
    }
    long rateValue = kDefaultRate;
    if (!line.Number("rate", 8000, aac ? 48000 : 192000, rateValue, status)) {
        return status;
    }
    const auto rate = static_cast<uint32_t>(rateValue);
    struct stat existing {};
    if (!line.Has("force") && lstat(destination.c_str(), &existing) == 0) {
        std::fprintf(stderr, "tqovix: %s: the file exists (use --force to replace it)\n", destination.c_str());
        return 1;
    }

    moviekit::MovieRecipe recipe;
    recipe.video.width = 320;
    recipe.video.height = 180;
    recipe.video.frameCount = static_cast<uint32_t>(seconds * 30000L / 1001);
    recipe.sound.sampleRate = rate;
    recipe.sound.channels = kChannels;
    recipe.sound.bits = static_cast<uint16_t>(bits);
    recipe.sound.codec = aac ? moviekit::SoundCodec::Aac
                             : (littleEndian ? moviekit::SoundCodec::Sowt : moviekit::SoundCodec::Twos);
    recipe.keepSoundBytes = false;
    const uint64_t frames = moviekit::FramesForVideo(recipe.video, recipe.video.frameCount, rate);
    const uint64_t n = aac ? moviekit::DivCeil(frames, 1024) * 1024 : frames;
    const std::vector<moviekit::AfInterval> intervals = {{n / 4, n / 4 + n / 10, 800}, {n / 2, n / 2 + n / 8, 500}};
    recipe.maker.afIntervals = intervals;
    const uint64_t heldBytes = frames * kChannels * (bits == 16 ? 2 : 4);
    if (!aac && heldBytes <= kMaxExplicitSoundBytes) {
        const std::vector<double> levels = ToneWithMotorNoise(frames, rate, intervals);
        if (bits == 16) {
            recipe.sound.pcm = Narrow(levels);
        } else {
            recipe.sound.widePcm = Wide(levels);
        }
    } else if (aac && static_cast<unsigned long>(seconds) <= kMaxAacPacketsSeconds &&
               !EncodeAac(Narrow(ToneWithMotorNoise(n, rate, intervals)), rate, n / 1024, recipe.sound.aacPackets)) {
        std::fprintf(stderr, "tqovix make-sample: the AAC encoder is not available (libavcodec)\n");
        return 1;
    }
    if (sizeGib > 0) {
        // Sound and the atoms besides the frames are small beside the video: the frames take the rest.
        const auto target = static_cast<uint64_t>(sizeGib * (1ULL << 30));
        const uint64_t sound = aac ? frames / 4 : frames * kChannels * static_cast<uint64_t>(bits / 8);
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
    const char* format = aac                 ? "AAC"
                         : rate > 0xFFFF       ? (littleEndian ? "PCM lpcm, little-endian" : "PCM lpcm")
                         : bits == 24          ? (littleEndian ? "PCM in24, little-endian" : "PCM in24")
                         : bits == 32          ? (littleEndian ? "PCM in32, little-endian" : "PCM in32")
                         : littleEndian        ? "PCM sowt"
                                               : "PCM twos";
    std::printf("%s: %llu bytes, %zu video chunks, %zu sound chunks (%s, %ld-bit, %u Hz)\n", destination.c_str(),
                static_cast<unsigned long long>(layout.fileSize), layout.videoChunks.size(),
                layout.soundChunks.size(), format, aac ? 16L : bits, rate);
    return 0;
}
