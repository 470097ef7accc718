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
    for (const char* kind : {"movie", "tag", "esds", "tables"}) {
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
    // Deeper sound: "in24" whose "wave" holds an "enda", and version-2 "lpcm" past 65535 Hz.
    seeds.emplace_back("in24-enda", small());
    seeds.back().second.sound.codec = moviekit::SoundCodec::Sowt;
    seeds.back().second.sound.bits = 24;
    seeds.emplace_back("lpcm-float-96k", small());
    seeds.back().second.sound.bits = 32;
    seeds.back().second.sound.floatingPoint = true;
    seeds.back().second.sound.sampleRate = 96000;
    seeds.back().second.sound.sampleCount = 4800;
    seeds.emplace_back("fl64", small());
    seeds.back().second.sound.bits = 64;
    seeds.back().second.sound.floatingPoint = true;
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
    // Table payloads for the typed readers: offsets, runs, sizes, edits, sound descriptions.
    const auto words = [](std::initializer_list<uint32_t> values) {
        moviekit::Bytes out;
        for (uint32_t value : values) {
            moviekit::PutU32(out, value);
        }
        return out;
    };
    const moviekit::Bytes esds = moviekit::Atom("esds", moviekit::MakeEsdsPayload(plain, config, 256000, 256000));
    moviekit::Bytes mp4a = moviekit::Concat({{'m', 'p', '4', 'a'}, moviekit::Bytes(6, 0), {0, 1, 0, 1},
                                             moviekit::Bytes(6, 0), {0, 2, 0, 16, 0xFF, 0xFE, 0, 0},
                                             words({48000u << 16, 1024, 0, 4, 2}),
                                             moviekit::Container("wave", {moviekit::Atom("frma", {'m', 'p', '4', 'a'}), esds})});
    const moviekit::Bytes enda = moviekit::Container(
        "wave", {moviekit::Atom("frma", {'i', 'n', '2', '4'}), moviekit::Atom("enda", {0, 1}), moviekit::Bytes(8, 0)});
    const moviekit::Bytes in24 = moviekit::Concat({{'i', 'n', '2', '4'}, moviekit::Bytes(6, 0), {0, 1, 0, 1},
                                                   moviekit::Bytes(6, 0), {0, 2, 0, 16, 0, 0, 0, 0},
                                                   words({48000u << 16, 1, 3, 6, 2}), enda});
    // 96 kHz as a double, 24-bit signed little-endian packed, six bytes a frame.
    const moviekit::Bytes lpcm = moviekit::Concat({{'l', 'p', 'c', 'm'}, moviekit::Bytes(6, 0), {0, 1, 0, 2},
                                                   moviekit::Bytes(6, 0), {0, 3, 0, 16, 0xFF, 0xFE, 0, 0},
                                                   words({0x10000, 72, 0x40F77000, 0, 2, 0x7F000000, 24, 0xC, 6, 1})});
    const std::pair<const char*, moviekit::Bytes> tables[] = {
        {"stsd-in24-enda.bin", moviekit::Concat({words({0, 1, static_cast<uint32_t>(in24.size() + 4)}), in24})},
        {"stsd-lpcm-v2.bin", moviekit::Concat({words({0, 1, static_cast<uint32_t>(lpcm.size() + 4)}), lpcm})},
        {"stco.bin", words({0, 3, 8, 4096, 70000})},
        {"co64.bin", words({0, 2, 1, 0, 0, 64})},
        {"stsc.bin", words({0, 2, 1, 1024, 1, 3, 512, 1})},
        {"stsz.bin", words({0, 0, 3, 371, 402, 388})},
        {"elst-v1.bin", words({0x01000000, 2, 0, 500, 0xFFFFFFFF, 0xFFFFFFFF, 0x10000, 0, 900, 0, 1024, 0x10000})},
        {"stsd-mp4a-wave.bin", moviekit::Concat({words({0, 1, static_cast<uint32_t>(mp4a.size() + 4)}), mp4a})},
    };
    for (const auto& [name, bytes] : tables) {
        written = written && WriteBytes(directory / "tables" / name, bytes);
    }
    if (!written) {
        std::fprintf(stderr, "fuzz_seeds: cannot write the payload seeds\n");
        return 1;
    }
    return 0;
}
