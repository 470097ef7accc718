// tqovix make-sample: a camera-style movie to try the tools on.
#include <cstdio>
#include <cstdlib>
#include <string>

#include "Commands.h"
#include "Movie.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix make-sample DST [--seconds N] [--little-endian]\n"
    "  writes a 30 fps camera-style movie with 48 kHz stereo PCM sound, AF information,\n"
    "  audio level information and trim tags\n"
    "  --seconds N       length of the movie (default 10)\n"
    "  --little-endian   store the sound as \"sowt\" instead of \"twos\"\n";

}  // namespace

int MakeSampleCommand(const Arguments& arguments)
{
    std::string destination;
    unsigned long seconds = 10;
    bool littleEndian = false;
    for (size_t i = 0; i < arguments.size(); ++i) {
        const std::string& argument = arguments[i];
        if (argument == "--help") {
            std::fputs(kUsage, stdout);
            return 0;
        }
        if (argument == "--seconds" && i + 1 < arguments.size()) {
            char* end = nullptr;
            seconds = std::strtoul(arguments[++i].c_str(), &end, 10);
            if (*end != '\0' || seconds == 0 || seconds > 24 * 3600) {
                std::fprintf(stderr, "tqovix: --seconds takes a whole number from 1 to 86400\n");
                return 2;
            }
        } else if (argument == "--little-endian") {
            littleEndian = true;
        } else if (destination.empty() && !argument.starts_with("--")) {
            destination = argument;
        } else {
            std::fputs(kUsage, stderr);
            return 2;
        }
    }
    if (destination.empty()) {
        std::fputs(kUsage, stderr);
        return 2;
    }

    moviekit::MovieSpec recipe;
    recipe.video.width = 320;
    recipe.video.height = 180;
    recipe.video.frameCount = static_cast<uint32_t>(seconds * 30000 / 1001);
    recipe.sound.codec = littleEndian ? moviekit::SoundCodec::Sowt : moviekit::SoundCodec::Twos;
    recipe.keepSoundBytes = false;
    moviekit::MovieLayout layout;
    std::string error;
    if (!moviekit::WriteMovie(destination, recipe, &layout, &error)) {
        std::fprintf(stderr, "tqovix: %s: %s\n", destination.c_str(), error.c_str());
        return 1;
    }
    std::printf("%s: %llu bytes, %zu video chunks, %zu sound chunks\n", destination.c_str(),
                static_cast<unsigned long long>(layout.fileSize), layout.videoChunks.size(),
                layout.soundChunks.size());
    return 0;
}
