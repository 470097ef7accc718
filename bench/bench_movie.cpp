// Writes the benchmark movies: a 1280×720 camera movie with video chunks of realistic
// size and stereo sound, 48 kHz 16-bit PCM or AAC, or 96 kHz 24-bit PCM as current cameras
// record it, of a chosen length or file size. "aac-scene" is a scene as a camera records it:
// a chord over room ambience, a lens motor driving through two AF intervals (1 s from 20 s,
// 2 s from 40 s), encoded by ffmpeg's AAC encoder at 256 kb/s.
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include <fstream>
#include <iterator>
#include <vector>

#include "Movie.h"
#include "support/MotorSound.h"

namespace {

constexpr uint32_t kSceneRate = 48000;

// The scene's sound as ffmpeg encodes it, as raw packets; empty when ffmpeg fails.
std::vector<moviekit::Bytes> SceneAacPackets(unsigned long seconds, const std::vector<moviekit::AfInterval>& intervals,
                                             const std::string& scratch)
{
    const uint64_t frames = uint64_t{seconds} * kSceneRate;
    std::vector<testsupport::MotorSpan> spans;
    for (const moviekit::AfInterval& interval : intervals) {
        spans.push_back({interval.startFrame, interval.endFrame});
    }
    const std::vector<int16_t> pcm = testsupport::ToPcm(testsupport::Sum(
        testsupport::Sum(testsupport::Chord(frames, 2, kSceneRate, 1200.0), testsupport::Ambience(frames, 2, 300.0)),
        testsupport::MotorNoise(frames, 2, kSceneRate, spans, 2500.0)));
    const std::string raw = scratch + ".raw";
    const std::string adts = scratch + ".aac";
    std::ofstream(raw, std::ios::binary)
        .write(reinterpret_cast<const char*>(pcm.data()), static_cast<std::streamsize>(pcm.size() * 2));
    const std::string command = "ffmpeg -v error -nostdin -y -f s16le -ar 48000 -ac 2 -i '" + raw +
                                "' -c:a aac -b:a 256k -f adts '" + adts + "'";
    const int status = std::system(command.c_str());
    std::remove(raw.c_str());
    std::ifstream in(adts, std::ios::binary);
    const std::vector<uint8_t> stream((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    std::remove(adts.c_str());
    std::vector<moviekit::Bytes> packets;
    for (size_t at = 0; status == 0 && at + 7 <= stream.size();) {
        const uint8_t* h = stream.data() + at;
        const size_t header = (h[1] & 0x01) != 0 ? 7 : 9;
        const size_t length = (size_t{h[3] & 0x03u} << 11) | (size_t{h[4]} << 3) | (h[5] >> 5);
        if (h[0] != 0xFF || length <= header || at + length > stream.size()) {
            return {};
        }
        packets.emplace_back(stream.begin() + static_cast<std::ptrdiff_t>(at + header),
                             stream.begin() + static_cast<std::ptrdiff_t>(at + length));
        at += length;
    }
    return packets;
}

}  // namespace

int main(int argc, char** argv)
{
    if (argc < 3) {
        std::fprintf(stderr, "usage: bench_movie DST pcm|pcm24-96k|aac|aac-scene [SECONDS] [FRAME_BYTES]\n");
        return 2;
    }
    const bool scene = std::strcmp(argv[2], "aac-scene") == 0;
    const bool aac = scene || std::strcmp(argv[2], "aac") == 0;
    const bool deep = std::strcmp(argv[2], "pcm24-96k") == 0;
    const unsigned long seconds = argc > 3 ? std::strtoul(argv[3], nullptr, 10) : 60;
    // About 140 MB a minute: what a camera's 1280×720 stream at ~18 Mbit/s comes to.
    const unsigned long frameBytes = argc > 4 ? std::strtoul(argv[4], nullptr, 10) : 77800;

    moviekit::MovieRecipe recipe;
    recipe.video.format = "jpeg";
    recipe.video.width = 1280;
    recipe.video.height = 720;
    recipe.video.frameCount = static_cast<uint32_t>(seconds * 30000 / 1001);
    recipe.video.frameSize = static_cast<uint32_t>(frameBytes);
    recipe.video.framesPerChunk = 15;
    recipe.sound.codec = aac ? moviekit::SoundCodec::Aac : moviekit::SoundCodec::Twos;
    if (deep) {
        recipe.sound.bits = 24;
        recipe.sound.sampleRate = 96000;
    }
    if (aac) {
        recipe.sound.esds.averageBitRate = 256000;
        recipe.sound.esds.maxBitRate = 256000;
    }
    if (scene) {
        const std::vector<moviekit::AfInterval> intervals = {{20 * kSceneRate, 21 * kSceneRate, 1000},
                                                             {40 * kSceneRate, 42 * kSceneRate, 1000}};
        recipe.sound.aacPackets = SceneAacPackets(seconds, intervals, argv[1]);
        if (recipe.sound.aacPackets.empty()) {
            std::fprintf(stderr, "bench_movie: ffmpeg did not encode the scene\n");
            return 1;
        }
        recipe.maker.afIntervals = intervals;
    }
    recipe.keepSoundBytes = false;
    moviekit::MovieLayout layout;
    std::string error;
    if (!moviekit::WriteMovie(argv[1], recipe, &layout, &error)) {
        std::fprintf(stderr, "bench_movie: %s\n", error.c_str());
        return 1;
    }
    std::printf("%s: %llu bytes\n", argv[1], static_cast<unsigned long long>(layout.fileSize));
    return 0;
}
