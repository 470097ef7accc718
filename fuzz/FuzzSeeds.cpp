// Writes the seed corpus: small camera movies in the forms the parser must accept.
#include <cstdio>
#include <string>

#include "Movie.h"

int main(int argc, char** argv)
{
    if (argc != 2) {
        std::fprintf(stderr, "usage: fuzz_seeds DIR\n");
        return 2;
    }
    const std::string directory = argv[1];
    const auto small = [] {
        moviekit::MovieSpec recipe;
        recipe.video.frameCount = 6;
        recipe.video.framesPerChunk = 3;
        recipe.video.width = 8;
        recipe.video.height = 4;
        recipe.sound.sampleCount = 2400;
        return recipe;
    };
    std::vector<std::pair<std::string, moviekit::MovieSpec>> seeds;
    seeds.emplace_back("twos", small());
    seeds.emplace_back("sowt", small());
    seeds.back().second.sound.codec = moviekit::SoundCodec::Sowt;
    seeds.emplace_back("aac", small());
    seeds.back().second.sound.codec = moviekit::SoundCodec::Aac;
    seeds.back().second.sound.sampleCount = 4;
    seeds.emplace_back("co64-moov-first", small());
    seeds.back().second.co64 = true;
    seeds.back().second.moovBeforeMdat = true;
    seeds.emplace_back("two-mdat-large-header", small());
    seeds.back().second.mdatCount = 2;
    seeds.back().second.largeMdatHeader = true;
    for (const auto& [name, recipe] : seeds) {
        std::string error;
        if (!moviekit::WriteMovie(directory + "/" + name + ".mov", recipe, nullptr, &error)) {
            std::fprintf(stderr, "fuzz_seeds: %s: %s\n", name.c_str(), error.c_str());
            return 1;
        }
    }
    return 0;
}
