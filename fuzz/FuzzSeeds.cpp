// Writes the seed corpora: small camera movies in the forms the parser must accept (movie/),
// tag atom payloads (tag/) and "esds" payloads (esds/).
#include <cstdio>
#include <filesystem>
#include <string>

#include "AacConfig.h"
#include "MakerData.h"
#include "Movie.h"

namespace {

bool WriteBytes(const std::filesystem::path& path, const moviekit::Bytes& bytes)
{
    FILE* file = std::fopen(path.c_str(), "wb");
    if (file == nullptr) {
        return false;
    }
    const bool written = std::fwrite(bytes.data(), 1, bytes.size(), file) == bytes.size();
    return std::fclose(file) == 0 && written;
}

}  // namespace

int main(int argc, char** argv)
{
    if (argc != 2) {
        std::fprintf(stderr, "usage: fuzz_seeds DIR\n");
        return 2;
    }
    const std::filesystem::path directory = argv[1];
    for (const char* kind : {"movie", "tag", "esds"}) {
        std::filesystem::create_directories(directory / kind);
    }
    const auto small = [] {
        moviekit::MovieRecipe recipe;
        recipe.video.frameCount = 6;
        recipe.video.framesPerChunk = 3;
        recipe.video.width = 8;
        recipe.video.height = 4;
        recipe.sound.sampleCount = 2400;
        return recipe;
    };
    std::vector<std::pair<std::string, moviekit::MovieRecipe>> seeds;
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
        if (!moviekit::WriteMovie(directory / "movie" / (name + ".mov"), recipe, nullptr, &error)) {
            std::fprintf(stderr, "fuzz_seeds: %s: %s\n", name.c_str(), error.c_str());
            return 1;
        }
    }

    std::vector<moviekit::Tag> tags = moviekit::MakeTrimTags(12, 34, 30000, 1001);
    tags.push_back(moviekit::MakeAsciiTag(0, moviekit::kSoftwareNameTag, "seed"));
    tags.push_back(moviekit::MakeRationalTag(1, 7, 1, 3));
    bool written = WriteBytes(directory / "tag" / "trim-software-rational.bin", moviekit::SerializeTags(tags));

    const moviekit::Bytes config = moviekit::MakeAudioSpecificConfig(48000, 2);
    moviekit::EsdsRecipe plain;
    moviekit::EsdsRecipe everything;
    everything.esFlags = 0xE0;
    everything.longSizes = true;
    everything.profileLevelAfterConfig = true;
    written = written && WriteBytes(directory / "esds" / "plain.bin", moviekit::MakeEsdsPayload(plain, config, 256000, 256000)) &&
              WriteBytes(directory / "esds" / "flags-long-sizes.bin",
                         moviekit::MakeEsdsPayload(everything, config, 320000, 256000));
    if (!written) {
        std::fprintf(stderr, "fuzz_seeds: cannot write the payload seeds\n");
        return 1;
    }
    return 0;
}
