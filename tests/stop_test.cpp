// Stops while the destination is still being copied: the sound is done, the library has
// nothing more to report, and the kernel copy of a large movie is most of the job. A stop
// asked then, by the host's answer, an abort request or closing the library, must end the
// job with nothing published; and until the copy ends the progress must not say done.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <string>
#include <thread>

#include "Movie.h"
#include "bridge/TqovixInterfaceConvert.h"
#include "engine/CTqovixMainFrame.h"
#include "file/CTqovixFile.h"
#include "support/TestSupport.h"

namespace {

enum class Stop { None, HostAnswer, AbortRequest, Close };

struct StopRow {
    const char* name;
    Stop stop;
    // The copy thread's file call held until the job is inside its wait for the copy: its first
    // (below the sound that changes), or one past it (the job writes nothing there). A call held
    // where the job still has to write would hold the job too.
    int heldCall;
    bool existing;  // a file already stands at the destination
    moviekit::SoundCodec codec = moviekit::SoundCodec::Twos;
};
void PrintTo(const StopRow& row, std::ostream* out) { *out << row.name; }

// Threads are told apart by their first file call: the test's own, then the library's worker
// (it reads sound before anything is written), then the copy's.
std::mutex g_mutex;
std::thread::id g_testThread;
std::thread::id g_worker;
std::atomic<int> g_heldCall{0};
std::atomic<int> g_copyCalls{0};
std::atomic<bool> g_held{false};
std::atomic<bool> g_released{false};

bool WaitFor(const std::atomic<bool>& flag)
{
    for (int k = 0; k < 30000 && !flag; ++k) {
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return flag;
}

int HoldTheCopy(eTqovixFileOperation operation)
{
    const std::thread::id me = std::this_thread::get_id();
    {
        std::lock_guard lock(g_mutex);
        if (me == g_testThread) {
            return 0;
        }
        if (g_worker == std::thread::id()) {
            g_worker = me;
        }
        if (me == g_worker || operation != eTqovixFileOperation::Read) {
            return 0;
        }
    }
    if (++g_copyCalls == g_heldCall) {
        g_held = true;
        WaitFor(g_released);
    }
    return 0;
}

// What the host's callback saw while the job waited for the copy.
CTqovixMainFrame* g_engine = nullptr;
Stop g_stop = Stop::None;
std::atomic<bool> g_inCopyWait{false};
std::atomic<bool> g_closing{false};
std::atomic<int> g_waitFirst{0};
std::atomic<int> g_waitSecond{0};
std::atomic<int> g_lastFirst{0};
std::atomic<int> g_lastSecond{0};
std::atomic<bool> g_wentBack{false};

int OnProgress(int first, int second)
{
    g_wentBack = g_wentBack || first < g_lastFirst;
    g_lastFirst = first;
    g_lastSecond = second;
    // The library has finished the sound, the copy is held and the job still runs: this call
    // comes from the job's wait for the copy.
    const bool waiting = g_held && !g_released && g_engine->IsProcessing() &&
                         TqovixInterfaceConvert::TqovixIsSessionFinished() == eTqovixFinished;
    if (!waiting) {
        return 0;
    }
    g_waitFirst = first;
    g_waitSecond = second;
    g_inCopyWait = true;
    switch (g_stop) {
    case Stop::None: break;
    case Stop::HostAnswer: g_released = true; return 200;
    case Stop::AbortRequest: g_engine->Abort(); break;
    case Stop::Close: WaitFor(g_closing); break;
    }
    g_released = true;
    return 0;
}

class StopTest : public ::testing::TestWithParam<StopRow> {
protected:
    void SetUp() override
    {
        g_testThread = std::this_thread::get_id();
        g_worker = std::thread::id();
        g_heldCall = GetParam().heldCall;
        g_copyCalls = 0;
        g_held = g_released = g_inCopyWait = g_closing = g_wentBack = false;
        g_waitFirst = g_waitSecond = g_lastFirst = g_lastSecond = 0;
        g_stop = GetParam().stop;
        CTqovixFile::SetFaultHook(HoldTheCopy);
    }
    void TearDown() override
    {
        g_released = true;
        CTqovixFile::SetFaultHook(nullptr);
    }
    testsupport::TempDir m_dir;
};

TEST_P(StopTest, NothingIsPublishedAndTheProgressWaitsForTheCopy)
{
    const StopRow& row = GetParam();
    moviekit::MovieRecipe recipe;
    recipe.video.frameSize = 1 << 20;  // 60 MiB of video: pieces enough to stop between
    recipe.video.frameCount = 60;
    recipe.video.framesPerChunk = 15;
    // Sound changes only in the first chunk: the copy is never held where the sound is written.
    recipe.maker.afIntervals = std::vector<moviekit::AfInterval>{{4800, 12000, 1000}};
    if (row.codec == moviekit::SoundCodec::Aac) {
        // Re-encoded packets over the copy, in the first chunk, which leads the media data.
        constexpr uint64_t kPackets = 94;  // as long as the video
        recipe.sound.codec = row.codec;
        recipe.sound.aacPackets = testsupport::MotorAacPackets(kPackets, 48000, {4800, 12000}, 192000);
        ASSERT_EQ(recipe.sound.aacPackets.size(), kPackets);
        recipe.soundFirstInPeriod = true;
    }
    const std::string source = m_dir.File("source.mov");
    const std::string destination = m_dir.File("destination.mov");
    std::string error;
    ASSERT_TRUE(moviekit::WriteMovie(source, recipe, nullptr, &error)) << error;
    const std::vector<uint8_t> old = {'o', 'l', 'd'};
    if (row.existing) {
        ASSERT_TRUE(testsupport::WriteFile(destination, old));
    }
    std::thread([] {}).join();  // sanitizer runtimes start their helpers with the first thread
    const size_t threadsBefore = testsupport::ThreadCount();

    {
        CTqovixMainFrame engine;
        g_engine = &engine;
        g_pMainFrame = &engine;
        ASSERT_EQ(engine.Initialize(), eTqovixSuccess);
        ASSERT_EQ(engine.SetCallback(OnProgress), eTqovixSuccess);
        ASSERT_EQ(engine.Execute(source.c_str(), destination.c_str(), 0), eTqovixSuccess);
        eTqovixErrorCode ended = eTqovixRunning;
        if (row.stop == Stop::Close) {
            ASSERT_TRUE(WaitFor(g_inCopyWait)) << "the job never waited for its copy";
            std::thread closer([&] {
                g_closing = true;
                engine.Close();
            });
            closer.join();
        } else {
            const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
            while (engine.GetProcessingState() == eTqovixRunning && std::chrono::steady_clock::now() < deadline) {
                std::this_thread::sleep_for(std::chrono::milliseconds(1));
            }
            ended = engine.GetProcessingState();
            engine.Close();
        }
        g_pMainFrame = nullptr;
        g_engine = nullptr;

        EXPECT_TRUE(g_inCopyWait) << "the job never waited for its copy";
        // Sound done, copy not: the progress shown must not say the movie is.
        EXPECT_GT(g_waitSecond.load(), 0);
        EXPECT_LT(g_waitFirst.load(), g_waitSecond.load());
        EXPECT_FALSE(g_wentBack) << "the progress went backwards";
        if (row.stop == Stop::None) {
            EXPECT_EQ(ended, eTqovixFinished);
            EXPECT_EQ(g_lastFirst.load(), g_lastSecond.load()) << "a finished job ends at its end";
        } else if (row.stop != Stop::Close) {
            EXPECT_EQ(ended, eTqovixErrorAborted);
        }
    }

    if (row.stop == Stop::None) {
        EXPECT_GT(std::filesystem::file_size(destination), 60u << 20);
    } else if (row.existing) {
        EXPECT_TRUE(testsupport::ReadFile(destination) == old) << "a stopped job replaced the destination";
    } else {
        EXPECT_FALSE(std::filesystem::exists(destination)) << "a stopped job published its destination";
    }
    const auto entries = std::distance(std::filesystem::directory_iterator(m_dir.Path()), {});
    EXPECT_EQ(entries, row.stop == Stop::None || row.existing ? 2 : 1) << "something was left beside the movies";
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (testsupport::ThreadCount() > threadsBefore && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    // Fewer is fine: a thread of an earlier test may still have been ending when counted.
    EXPECT_LE(testsupport::ThreadCount(), threadsBefore) << "a thread outlived the job";
}

INSTANTIATE_TEST_SUITE_P(
    DuringTheCopy, StopTest,
    ::testing::Values(StopRow{"NoStop", Stop::None, 1, false},
                      StopRow{"HostAnswerAtTheFirstPiece", Stop::HostAnswer, 1, false},
                      StopRow{"HostAnswerLaterOverAFile", Stop::HostAnswer, 4, true},
                      StopRow{"AbortAtTheFirstPiece", Stop::AbortRequest, 1, false},
                      StopRow{"AbortLaterOverAFile", Stop::AbortRequest, 4, true},
                      StopRow{"CloseAtTheFirstPiece", Stop::Close, 1, true},
                      StopRow{"CloseLater", Stop::Close, 4, false},
                      StopRow{"AacNoStop", Stop::None, 1, false, moviekit::SoundCodec::Aac},
                      StopRow{"AacHostAnswerAtTheFirstPiece", Stop::HostAnswer, 1, false, moviekit::SoundCodec::Aac},
                      StopRow{"AacAbortLaterOverAFile", Stop::AbortRequest, 4, true, moviekit::SoundCodec::Aac},
                      StopRow{"AacCloseLater", Stop::Close, 4, false, moviekit::SoundCodec::Aac}),
    [](const ::testing::TestParamInfo<StopRow>& info) { return std::string(info.param.name); });

}  // namespace
