// Writes the benchmark movies: a 1280×720 camera movie with video chunks of realistic
// size and stereo sound, 48 kHz 16-bit PCM or AAC, or 96 kHz 24-bit PCM as current cameras
// record it, of a chosen length or file size.
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "Movie.h"

int main(int argc, char** argv)
{
    if (argc < 3) {
        std::fprintf(stderr, "usage: bench_movie DST pcm|pcm24-96k|aac [SECONDS] [FRAME_BYTES]\n");
        return 2;
    }
    const bool aac = std::strcmp(argv[2], "aac") == 0;
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
