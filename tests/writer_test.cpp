// The two writers of a PCM job: copying then patching, and laying the destination out
// chunk by chunk. Wherever both can take a movie they must give the same bytes; the copy
// must be taken whenever the layout allows it, and the general writer everywhere else.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cmath>
#include <filesystem>
#include <string>
#include <thread>

#include "MakerInjector.h"
#include "Movie.h"
#include "engine/CTqovixMainFrame.h"
#include "file/CTqovixFile.h"
#include "movie/CTqovixBackgroundCopy.h"
#include "movie/CTqovixMovControl.h"
#include "support/MotorSound.h"
#include "support/TestSupport.h"

namespace {

using moviekit::SoundCodec;
using Recipe = moviekit::MovieRecipe;

std::atomic<long> g_writes{0};

int CountWrites(eTqovixFileOperation operation)
{
    if (operation == eTqovixFileOperation::Write) {
        ++g_writes;
    }
    return 0;
}

// Runs one job to its end; the count of file writes it made, -1 when it did not finish.
long RunJob(const std::string& source, const std::string& destination)
{
    g_writes = 0;
    CTqovixFile::SetFaultHook(CountWrites);
    CTqovixMainFrame engine;
    g_pMainFrame = &engine;
    EXPECT_EQ(engine.Initialize(), eTqovixSuccess);
    EXPECT_EQ(engine.Execute(source.c_str(), destination.c_str(), 0), eTqovixSuccess);
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    while (engine.GetProcessingState() == eTqovixRunning && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::microseconds(200));
    }
    const bool done = engine.GetProcessingState() == eTqovixFinished;
    engine.Close();
    g_pMainFrame = nullptr;
    CTqovixFile::SetFaultHook(nullptr);
    return done ? g_writes.load() : -1;
}

struct Source {
    std::string path;
    uint64_t mediaEnd = 0;  // where the source's media data ends: before it, only processed sound may change
};

// What the copy writes against the general writer: fewer writes where the layout lets the copy be
// taken, the same where it does not; AAC whose packets outgrow their chunks stops patching there.
enum class Writes { Fewer, Same, Any };

struct WriterRow {
    const char* name;
    std::function<Source(const testsupport::TempDir&)> make;  // writes the source
    Writes writes;
    bool motor = false;  // the interval holds a motor, so the job changes samples there
    uint64_t servedLimit = 0;  // if set, the served sound kept to compare with; past it the file is read
};
void PrintTo(const WriterRow& row, std::ostream* out) { *out << row.name; }

// One short interval: most sound leaves as it came, as in a real movie.
const std::vector<moviekit::AfInterval> kInterval = {{12000, 14000, 1000}};

std::function<Source(const testsupport::TempDir&)> Kit(std::function<void(Recipe&)> shape)
{
    return [shape](const testsupport::TempDir& dir) {
        Recipe recipe;
        recipe.maker.afIntervals = kInterval;
        shape(recipe);
        const std::string path = dir.File("source.mov");
        std::string error;
        moviekit::MovieLayout layout;
        EXPECT_TRUE(moviekit::WriteMovie(path, recipe, &layout, &error)) << error;
        return Source{path, layout.moovOffset};
    };
}

// Two seconds of samples of `bits` bits at `rate`: ambience, and a lens motor over an interval
// long enough to be heard.
void DeepWithMotor(Recipe& r, uint16_t bits, uint32_t rate, bool floatingPoint = false)
{
    const uint64_t frames = 2 * uint64_t{rate};
    const uint64_t start = rate / 2;
    const uint64_t end = rate * 6 / 5;
    const std::vector<double> sound = testsupport::Sum(testsupport::Ambience(frames, 2, 40.0),
                                                       testsupport::MotorNoise(frames, 2, rate, {{start, end}}, 4000.0));
    r.sound.widePcm.resize(sound.size());
    for (size_t k = 0; k < sound.size(); ++k) {
        r.sound.widePcm[k] = static_cast<int32_t>(std::llround(sound[k] * 65536.0));
    }
    r.sound.bits = bits;
    r.sound.floatingPoint = floatingPoint;
    r.sound.sampleRate = rate;
    r.maker.afIntervals = {{start, end, 1000}};
    r.video.frameCount = 60;
}

// AAC that processing changes over the interval, encoded at `bitRate`; the description may claim
// another rate, which the job's encoder takes, so that its packets outgrow the source's.
void AacWithMotor(Recipe& r, uint32_t bitRate, uint32_t claimed = 0)
{
    constexpr uint64_t kPackets = 47;
    constexpr uint64_t kStart = 12000, kEnd = 26000;  // long enough for the motor to be heard
    r.sound.codec = SoundCodec::Aac;
    r.maker.afIntervals = {{kStart, kEnd, 1000}};
    r.sound.aacPackets = testsupport::MotorAacPackets(kPackets, 48000, {kStart, kEnd}, bitRate);
    EXPECT_EQ(r.sound.aacPackets.size(), kPackets);
    if (claimed != 0) {
        r.sound.esds.averageBitRate = claimed;
    }
}

// A movie the ffmpeg command writes, given the maker atoms.
std::function<Source(const testsupport::TempDir&)> Ffmpeg(std::string sound)
{
    return [sound](const testsupport::TempDir& dir) {
        const std::string path = dir.File("source.mov");
        std::string output;
        EXPECT_EQ(testsupport::RunCommand("ffmpeg -v error -nostdin -y -f lavfi -i testsrc=size=64x36:rate=30:d=1 "
                                          "-f lavfi -i \"aevalsrc='0.3*sin(2*PI*(300+900*t)*t)':s=48000:d=1\" "
                                          "-map 0:v -map 1:a -c:v mjpeg " + sound + " " + testsupport::ShellQuote(path) +
                                          " 2>&1",
                                          &output),
                  0)
            << output;
        Recipe recipe;
        recipe.maker.afIntervals = kInterval;
        std::string error;
        EXPECT_TRUE(moviekit::AddMakerData(path, recipe, 48000, &error)) << error;
        return Source{path};
    };
}

// The size of the first media data atom at the top level; 0 when there is none.
uint64_t MediaDataSize(const std::vector<uint8_t>& file)
{
    for (uint64_t at = 0; at + 8 <= file.size();) {
        uint64_t size = testsupport::GetBE32(file, at);
        if (size == 1 && at + 16 <= file.size()) {
            size = uint64_t{testsupport::GetBE32(file, at + 8)} << 32 | testsupport::GetBE32(file, at + 12);
        }
        if (std::equal(file.begin() + static_cast<std::ptrdiff_t>(at + 4), file.begin() + static_cast<std::ptrdiff_t>(at + 8),
                       "mdat")) {
            return size;
        }
        if (size < 8) {
            return 0;
        }
        at += size;
    }
    return 0;
}

class WriterTest : public ::testing::TestWithParam<WriterRow> {
protected:
    void TearDown() override
    {
        CTqovixMovControl::SetPatchWriting(true);
        CTqovixMovControl::SetServedSoundLimit(0);
    }
    testsupport::TempDir m_dir;
};

TEST_P(WriterTest, BothWritersGiveTheSameBytes)
{
    const Source made = GetParam().make(m_dir);
    const std::string& source = made.path;
    const std::string copied = m_dir.File("copied.mov");
    const std::string laidOut = m_dir.File("laid-out.mov");
    CTqovixMovControl::SetServedSoundLimit(GetParam().servedLimit);
    CTqovixMovControl::SetPatchWriting(true);
    const long copiedWrites = RunJob(source, copied);
    CTqovixMovControl::SetPatchWriting(false);
    const long laidOutWrites = RunJob(source, laidOut);
    ASSERT_GT(copiedWrites, 0);
    ASSERT_GT(laidOutWrites, 0);
    const std::vector<uint8_t> a = testsupport::ReadFile(copied);
    ASSERT_FALSE(a.empty());
    EXPECT_TRUE(a == testsupport::ReadFile(laidOut)) << "the two writers disagree";
    if (GetParam().motor) {
        // The media data keeps its place, so the sound the job changed shows against the source.
        const std::vector<uint8_t> before = testsupport::ReadFile(source);
        ASSERT_TRUE(made.mediaEnd != 0 && made.mediaEnd <= std::min(a.size(), before.size()));
        EXPECT_FALSE(std::equal(before.begin(), before.begin() + static_cast<std::ptrdiff_t>(made.mediaEnd), a.begin()))
            << "the job changed no sound: the writers were not put to the test";
        // Re-encoded packets that fit keep every chunk in place; outgrown chunks push the rest on.
        if (GetParam().writes == Writes::Any) {
            EXPECT_GT(MediaDataSize(a), MediaDataSize(before)) << "no chunk was outgrown";
        } else {
            EXPECT_EQ(MediaDataSize(a), MediaDataSize(before));
        }
        std::string said;
        EXPECT_EQ(testsupport::RunCommand("ffprobe -v error -show_packets -of compact " + testsupport::ShellQuote(copied) +
                                              " 2>&1 >/dev/null",
                                          &said),
                  0);
        EXPECT_EQ(said, "");
    }
    // The copy writes only the changed sound and the movie atom; the general writer every chunk.
    if (GetParam().writes == Writes::Fewer) {
        EXPECT_LT(copiedWrites, laidOutWrites);
    } else if (GetParam().writes == Writes::Same) {
        EXPECT_EQ(copiedWrites, laidOutWrites);
    }
}

INSTANTIATE_TEST_SUITE_P(
    Layouts, WriterTest,
    ::testing::Values(
        WriterRow{"Twos", Kit([](Recipe&) {}), Writes::Fewer},
        WriterRow{"Sowt", Kit([](Recipe& r) { r.sound.codec = SoundCodec::Sowt; }), Writes::Fewer},
        WriterRow{"TwosUnevenChunks", Kit([](Recipe& r) { r.sound.chunkSampleCounts = {1, 7001, 20000, 3, 21043}; }), Writes::Fewer},
        WriterRow{"SowtSoundFirstCo64", Kit([](Recipe& r) { r.soundFirstInPeriod = r.co64 = true; }), Writes::Fewer},
        WriterRow{"Twos44100Mono", Kit([](Recipe& r) { r.sound.sampleRate = 44100; r.sound.channels = 1; }), Writes::Fewer},
        WriterRow{"FfmpegBigEndianWithTimecode", Ffmpeg("-c:a pcm_s16be -timecode 10:00:00:00"), Writes::Fewer},
        WriterRow{"FfmpegLittleEndianMono", Ffmpeg("-c:a pcm_s16le -ac 1"), Writes::Fewer},
        // Every width, either byte order: changed samples written whole, nothing else.
        WriterRow{"In24LittleEndianMotor", Kit([](Recipe& r) { DeepWithMotor(r, 24, 48000); r.sound.codec = SoundCodec::Sowt; }), Writes::Fewer, true},
        WriterRow{"Lpcm24Bit96kMotor", Kit([](Recipe& r) { DeepWithMotor(r, 24, 96000); }), Writes::Fewer, true},
        // What was served is gone: the copy compares with the file, reversed sample by sample.
        WriterRow{"Lpcm24Bit96kMotorComparedWithTheFile", Kit([](Recipe& r) { DeepWithMotor(r, 24, 96000); }), Writes::Fewer, true,
                  64 << 10},
        WriterRow{"In32UnevenChunksMotor", Kit([](Recipe& r) { DeepWithMotor(r, 32, 48000); r.sound.chunkSampleCounts = {1, 7001, 20000, 3, 68995}; }), Writes::Fewer, true},
        WriterRow{"Fl32Motor", Kit([](Recipe& r) { DeepWithMotor(r, 32, 48000, true); }), Writes::Fewer, true},
        WriterRow{"Fl64LittleEndianMotor", Kit([](Recipe& r) { DeepWithMotor(r, 64, 44100, true); r.sound.codec = SoundCodec::Sowt; }), Writes::Fewer, true},
        WriterRow{"FfmpegFloatBigEndian", Ffmpeg("-c:a pcm_f32be"), Writes::Fewer},
        WriterRow{"In24MotorMoovFirst", Kit([](Recipe& r) { DeepWithMotor(r, 24, 48000); r.moovBeforeMdat = true; }), Writes::Same},
        // Layouts the general writer changes: the copy would not be its result.
        WriterRow{"MoovFirst", Kit([](Recipe& r) { r.moovBeforeMdat = true; }), Writes::Same},
        WriterRow{"ThreeMdats", Kit([](Recipe& r) { r.mdatCount = 3; }), Writes::Same},
        WriterRow{"LargeMdatHeader", Kit([](Recipe& r) { r.largeMdatHeader = true; }), Writes::Same},
        // AAC: re-encoded packets filled out to the bytes of those they replace, run by run or over
        // the chunk; packets that outgrow their chunk move it and everything after it.
        WriterRow{"Aac", Kit([](Recipe& r) { r.sound.codec = SoundCodec::Aac; }), Writes::Fewer},
        WriterRow{"AacMotor", Kit([](Recipe& r) { AacWithMotor(r, 192000); }), Writes::Fewer, true},
        WriterRow{"AacMotorSmallChunks", Kit([](Recipe& r) { AacWithMotor(r, 192000); r.sound.samplesPerChunk = 3; }),
                  Writes::Fewer, true},
        WriterRow{"AacMotorOutgrowingItsChunks", Kit([](Recipe& r) { AacWithMotor(r, 32000, 256000); }), Writes::Any,
                  true}),
    [](const ::testing::TestParamInfo<WriterRow>& info) { return std::string(info.param.name); });

}  // namespace

namespace {

// Writes claimed while the copy runs survive it, wherever they fall against its pieces;
// everything else is the source's.
TEST(BackgroundCopyTest, ClaimedRangesAreNeverCopiedOver)
{
    testsupport::TempDir dir;
    constexpr uint64_t kSize = 40ULL << 20;  // pieces of 8 MiB: claims fall inside and across them
    std::vector<uint8_t> bytes(kSize);
    for (uint64_t k = 0; k < kSize; ++k) {
        bytes[k] = static_cast<uint8_t>(k * 2654435761u >> 13);
    }
    const std::string sourcePath = dir.File("source.bin");
    ASSERT_TRUE(testsupport::WriteFile(sourcePath, bytes));
    CTqovixFile source;
    CTqovixFile destination;
    ASSERT_EQ(source.Open(sourcePath.c_str(), 1), eTqovixSuccess);
    ASSERT_EQ(destination.Open(dir.File("copy.bin").c_str(), 2), eTqovixSuccess);
    CTqovixBackgroundCopy copy;
    copy.Start(destination, source, 0, kSize);
    // Near the start (likely under the copy's current piece), across a piece's end, far ahead.
    const std::vector<std::pair<uint64_t, uint64_t>> claims = {
        {4096, 8192}, {(16ULL << 20) - 100, 300}, {(32ULL << 20) + 5, 4096}, {kSize - 10, 10}};
    for (const auto& [offset, size] : claims) {
        ASSERT_EQ(copy.Claim(offset, size), eTqovixSuccess);
        const std::vector<uint8_t> patch(size, 0xA5);
        ASSERT_EQ(destination.Seek(static_cast<long long>(offset), CTqovixFile::eTqovixSeekBegin), eTqovixSuccess);
        ASSERT_EQ(destination.Write(patch.data(), static_cast<unsigned int>(size)), eTqovixSuccess);
        std::fill_n(bytes.begin() + static_cast<std::ptrdiff_t>(offset), size, 0xA5);
    }
    EXPECT_EQ(copy.Join(), eTqovixSuccess);
    ASSERT_EQ(destination.Flush(), eTqovixSuccess);
    destination.Close();
    EXPECT_TRUE(testsupport::ReadFile(dir.File("copy.bin")) == bytes);

}

// The copy's thread, held at its first piece until the one waiting for it has asked to stop.
std::atomic<bool> g_copyHeld{false};
std::atomic<bool> g_copyReleased{false};
std::thread::id g_testThread;

int HoldTheCopy(eTqovixFileOperation operation)
{
    if (operation == eTqovixFileOperation::Read && std::this_thread::get_id() != g_testThread) {
        g_copyHeld = true;
        for (int k = 0; k < 30000 && !g_copyReleased; ++k) {
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        }
    }
    return 0;
}

// Whoever waits for the copy can stop it: the wait ends with the answer given, the copy's
// thread is gone, and the copy went no further than the piece it was in.
TEST(BackgroundCopyTest, AStopAskedWhileWaitingEndsTheCopy)
{
    testsupport::TempDir dir;
    constexpr uint64_t kSize = 64ULL << 20;
    const std::string sourcePath = dir.File("source.bin");
    {
        std::vector<uint8_t> bytes(kSize, 0x5A);
        ASSERT_TRUE(testsupport::WriteFile(sourcePath, bytes));
    }
    std::thread([] {}).join();  // sanitizer runtimes start their helpers with the first thread
    const size_t threadsBefore = testsupport::ThreadCount();
    CTqovixFile source;
    CTqovixFile destination;
    ASSERT_EQ(source.Open(sourcePath.c_str(), 1), eTqovixSuccess);
    ASSERT_EQ(destination.Open(dir.File("copy.bin").c_str(), 2), eTqovixSuccess);
    g_testThread = std::this_thread::get_id();
    g_copyHeld = false;
    g_copyReleased = false;
    CTqovixFile::SetFaultHook(HoldTheCopy);
    CTqovixBackgroundCopy copy;
    copy.Start(destination, source, 0, kSize);
    int asked = 0;
    uint64_t total = 0;
    const eTqovixErrorCode result = copy.Join([&](uint64_t, uint64_t all) {
        ++asked;
        total = all;
        if (!g_copyHeld) {
            return eTqovixSuccess;
        }
        g_copyReleased = true;
        return eTqovixErrorAborted;
    });
    CTqovixFile::SetFaultHook(nullptr);
    EXPECT_EQ(result, eTqovixErrorAborted);
    EXPECT_GE(asked, 1);
    EXPECT_EQ(total, kSize);
    uint64_t done = 0;
    copy.GetProgress(done, total);
    EXPECT_LT(done, kSize) << "the copy ran on after it was stopped";
    destination.Close();
    EXPECT_LT(std::filesystem::file_size(dir.File("copy.bin")), kSize);
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (testsupport::ThreadCount() > threadsBefore && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    EXPECT_EQ(testsupport::ThreadCount(), threadsBefore);
}

}  // namespace
