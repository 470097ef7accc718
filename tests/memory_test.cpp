// Memory a job takes on movies whose chunk and atom sizes the file chooses: a job runs in a
// child process and its peak resident size, less what it held before, must stay far below
// the sizes in the file.
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>

#include "host/JobHarness.h"

namespace {

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define TQOVIX_SANITIZED 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer) || __has_feature(memory_sanitizer)
#define TQOVIX_SANITIZED 1
#endif
#endif
#ifdef TQOVIX_SANITIZED
constexpr bool kSanitized = true;
#else
constexpr bool kSanitized = false;
#endif

using testsupport::PrintTo;

constexpr int kDone = 1;
constexpr uint64_t kMiB = 1 << 20;
// What a job may take beyond what the process held before it, whatever the file's sizes.
constexpr uint64_t kAllowedGrowth = 64 * kMiB;
// Written as holes: the test's movies cost no disk and no time to write.
constexpr uint64_t kHoleBytes = 64 << 10;

uint64_t StatusKiB(const char* key)
{
    std::ifstream status("/proc/self/status");
    const std::string prefix = std::string(key) + ":";
    for (std::string line; std::getline(status, line);) {
        if (line.starts_with(prefix)) {
            return std::stoull(line.substr(prefix.size()));
        }
    }
    return 0;
}

struct Measured {
    int state = -1;
    uint64_t growth = 0;  // bytes
};

// The job in a child process, so that its high-water mark is its own.
Measured RunMeasured(const std::string& source, const std::string& destination)
{
    return testsupport::InChild([&] {
        const uint64_t before = StatusKiB("VmRSS");
        int state = -2;
        if (TqExecuteOVIX(source.c_str(), destination.c_str()) == 0) {
            state = jobtest::WaitForJob();
        }
        TqCloseOVIX();  // joins the library's threads before the child goes
        const uint64_t peak = StatusKiB("VmHWM");
        return Measured{state, (peak > before ? peak - before : 0) * 1024};
    }).value_or(Measured{});
}

class MemoryTest : public jobtest::HostTest {
protected:
    void SetUp() override
    {
        if (kSanitized) {
            GTEST_SKIP() << "a sanitizer's shadow memory and quarantine make resident sizes meaningless";
        }
        jobtest::HostTest::SetUp();
    }

    std::string WriteSparse(const moviekit::MovieRecipe& recipe, const std::string& name,
                            moviekit::MovieLayout* layout)
    {
        const std::string path = m_dir.File(name);
        std::string error;
        EXPECT_TRUE(jobtest::WriteSparseMovie(path, recipe, kHoleBytes, layout, &error)) << error;
        return path;
    }
};

// A legal layout that is not interleaved: all the sound in one chunk of 192 MiB behind the video.
TEST_F(MemoryTest, OneHugeSoundChunkIsServedInPieces)
{
    moviekit::MovieRecipe recipe;
    recipe.sound.codec = moviekit::SoundCodec::Sowt;
    recipe.sound.channels = 2;
    constexpr uint32_t kFrames = 48 << 20;  // 192 MiB of 16-bit stereo
    recipe.sound.sampleCount = kFrames;
    recipe.sound.chunkSampleCounts = {kFrames};
    recipe.keepSoundBytes = false;
    moviekit::MovieLayout layout;
    const std::string source = WriteSparse(recipe, "src.mov", &layout);
    ASSERT_EQ(layout.soundChunks.size(), 1u);
    ASSERT_EQ(layout.soundChunks[0].size, uint64_t{kFrames} * 4);

    const std::string destination = m_dir.File("dst.mov");
    const Measured measured = RunMeasured(source, destination);
    ASSERT_EQ(measured.state, kDone);
    RecordProperty("growthMiB", std::to_string(measured.growth >> 20));
    EXPECT_LT(measured.growth, kAllowedGrowth) << (measured.growth >> 20) << " MiB for a chunk of "
                                               << (layout.soundChunks[0].size >> 20) << " MiB";
    EXPECT_EQ(jobtest::PacketCount(destination, "a:0"), jobtest::PacketCount(source, "a:0"));
}

struct VolumeRow {
    const char* name;
    bool otherVolume;  // the destination where the kernel cannot copy from the source
};

class LeadingAtomMemoryTest : public MemoryTest, public ::testing::WithParamInterface<VolumeRow> {};

// A "free" atom of 256 MiB before the movie atom is carried over whole, in pieces; from
// another volume it goes through our own buffer rather than the kernel's copy.
TEST_P(LeadingAtomMemoryTest, HugeFreeAtomIsCopiedInPieces)
{
    std::string volume = m_dir.Path();
    if (GetParam().otherVolume) {
        if (!std::filesystem::is_directory("/dev/shm")) {
            GTEST_SKIP() << "no /dev/shm to stand for another volume";
        }
        volume = m_dir.Path() + "-shm";
        volume = "/dev/shm/" + std::filesystem::path(volume).filename().string();
        ASSERT_TRUE(std::filesystem::create_directory(volume));
    }
    struct Remove {
        std::string path;
        bool active;
        ~Remove()
        {
            if (active) {
                std::filesystem::remove_all(path);
            }
        }
    } remove{volume, GetParam().otherVolume};

    moviekit::MovieRecipe recipe;
    constexpr uint32_t kFreeBytes = 256 << 20;
    recipe.freeSize = kFreeBytes;
    recipe.moovBeforeMdat = true;  // not the source's layout back: the general writer
    moviekit::MovieLayout layout;
    const std::string source = WriteSparse(recipe, "src.mov", &layout);

    const std::string destination = volume + "/dst.mov";
    const Measured measured = RunMeasured(source, destination);
    ASSERT_EQ(measured.state, kDone);
    RecordProperty("growthMiB", std::to_string(measured.growth >> 20));
    EXPECT_LT(measured.growth, kAllowedGrowth) << (measured.growth >> 20) << " MiB for a free atom of "
                                               << (kFreeBytes >> 20) << " MiB";
    bool carried = false;
    for (const jobtest::TopAtom& atom : jobtest::TopLevelAtoms(destination)) {
        carried = carried || (atom.type == "free" && atom.size == 8 + uint64_t{kFreeBytes});
    }
    EXPECT_TRUE(carried) << "the free atom is carried over with its size";
    EXPECT_EQ(jobtest::ProbeErrors(destination), "");
}

INSTANTIATE_TEST_SUITE_P(Volumes, LeadingAtomMemoryTest,
                         ::testing::Values(VolumeRow{"SameVolume", false}, VolumeRow{"OtherVolume", true}),
                         testsupport::ByName);

}  // namespace
