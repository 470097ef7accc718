// The fuzzed entry points over every kept input in fuzz/regressions and over deterministic
// mutations of moviekit movies, so each compiler's sanitizers see them on every run.
#include <gtest/gtest.h>

#include <filesystem>
#include <random>

#include "FuzzTargets.h"
#include "Movie.h"
#include "support/TestSupport.h"

namespace {

using Target = int (*)(const uint8_t*, size_t);

TEST(FuzzReplayTest, KeptInputsRunCleanly)
{
    const std::filesystem::path root = TQOVIX_FUZZ_REGRESSIONS;
    size_t inputs = 0;
    for (const auto& [name, target] : {std::pair<const char*, Target>{"atomtree", fuzztarget::AtomTree},
                                       {"tagcursor", fuzztarget::TagCursor},
                                       {"esds", fuzztarget::Esds},
                                       {"trackatoms", fuzztarget::TrackAtoms},
                                       {"property", fuzztarget::Property},
                                       {"job", fuzztarget::Job}}) {
        // Every target keeps at least one input: a folder gone missing is a replay that silently stopped.
        const std::filesystem::path directory = root / name;
        ASSERT_TRUE(std::filesystem::is_directory(directory)) << directory << " is missing";
        size_t kept = 0;
        for (const auto& entry : std::filesystem::directory_iterator(directory)) {
            SCOPED_TRACE(entry.path().string());
            const std::vector<uint8_t> bytes = testsupport::ReadFile(entry.path().string());
            EXPECT_EQ(target(bytes.data(), bytes.size()), 0) << "a property of the target does not hold";
            ++kept;
        }
        EXPECT_GT(kept, 0u) << directory << " holds no input";
        inputs += kept;
    }
    RecordProperty("inputs", static_cast<int>(inputs));
}

// Truncations and byte changes of a real movie: every one must end in a result, not a crash.
TEST(FuzzReplayTest, MutatedMoviesRunCleanly)
{
    moviekit::MovieRecipe pcm;
    pcm.video.frameCount = 6;
    pcm.video.framesPerChunk = 3;
    pcm.sound.sampleCount = 2400;
    moviekit::MovieRecipe aac = pcm;
    aac.sound.codec = moviekit::SoundCodec::Aac;
    aac.sound.sampleCount = 4;
    // Deeper sound in the two descriptions that carry it: "in24" with "enda", version-2 "lpcm".
    moviekit::MovieRecipe in24 = pcm;
    in24.sound.bits = 24;
    in24.sound.codec = moviekit::SoundCodec::Sowt;
    moviekit::MovieRecipe lpcm = pcm;
    lpcm.sound.bits = 32;
    lpcm.sound.floatingPoint = true;
    lpcm.sound.sampleRate = 96000;
    lpcm.sound.sampleCount = 4800;
    std::mt19937 random(7);
    for (const moviekit::MovieRecipe& recipe : {pcm, aac, in24, lpcm}) {
        const std::vector<uint8_t> movie = moviekit::BuildMovie(recipe);
        ASSERT_FALSE(movie.empty());
        for (int k = 0; k < 120; ++k) {
            std::vector<uint8_t> bytes = movie;
            if (k % 4 == 0) {
                bytes.resize(random() % bytes.size());
            } else {
                for (int flips = 1 + k % 3; flips > 0; --flips) {
                    bytes[random() % bytes.size()] = static_cast<uint8_t>(random());
                }
            }
            EXPECT_EQ(fuzztarget::AtomTree(bytes.data(), bytes.size()), 0);
            EXPECT_EQ(fuzztarget::Property(bytes.data(), bytes.size()), 0);
            if (k % 6 == 0) {
                EXPECT_EQ(fuzztarget::Job(bytes.data(), bytes.size()), 0);
            }
        }
    }
}

}  // namespace
