// Every file operation of a whole job failed in turn: each run must end with an error
// code, leave no destination behind and leave the source as it was.
#include <gtest/gtest.h>

#include <sys/stat.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <filesystem>
#include <thread>

#include "Movie.h"
#include "engine/CTqovixMainFrame.h"
#include "support/TestSupport.h"

namespace {

std::atomic<long> g_calls{0};
std::atomic<long> g_failAt{0};
std::atomic<int> g_errno{EIO};

int CountingFault(eTqovixFileOperation)
{
    const long call = ++g_calls;
    return call == g_failAt.load() ? g_errno.load() : 0;
}

struct Outcome {
    eTqovixErrorCode started = eTqovixSuccess;
    eTqovixErrorCode ended = eTqovixSuccess;
};

// One job with the Nth file operation failing (0: none); bounded wait for its end.
Outcome RunJob(const std::string& source, const std::string& destination, long failAt)
{
    g_calls = 0;
    g_failAt = failAt;
    CTqovixMainFrame engine;
    g_pMainFrame = &engine;
    Outcome outcome;
    EXPECT_EQ(engine.Initialize(), eTqovixSuccess);
    outcome.started = engine.Execute(source.c_str(), destination.c_str(), 0);
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (engine.GetProcessingState() == eTqovixRunning && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::microseconds(200));
    }
    outcome.ended = engine.GetProcessingState();
    engine.Close();
    g_pMainFrame = nullptr;
    return outcome;
}

class FaultTest : public ::testing::TestWithParam<moviekit::SoundCodec> {
protected:
    void SetUp() override { CTqovixFile::SetFaultHook(CountingFault); }
    void TearDown() override { CTqovixFile::SetFaultHook(nullptr); }
};

TEST_P(FaultTest, EveryFailedOperationEndsTheJobCleanly)
{
    testsupport::TempDir dir;
    moviekit::MovieRecipe recipe;
    recipe.sound.codec = GetParam();
    recipe.video.frameCount = 20;
    recipe.video.framesPerChunk = 5;
    const std::string source = dir.File("src.mov");
    const std::string destination = dir.File("dst.mov");
    std::string error;
    ASSERT_TRUE(moviekit::WriteMovie(source, recipe, nullptr, &error)) << error;
    const std::vector<uint8_t> original = testsupport::ReadFile(source);

    const Outcome clean = RunJob(source, destination, 0);
    ASSERT_EQ(clean.ended, eTqovixFinished);
    const long total = g_calls;
    ASSERT_GT(total, 20);
    // A failed job leaves the destination's path as it found it: here, the clean run's movie.
    const std::vector<uint8_t> finished = testsupport::ReadFile(destination);
    ASSERT_FALSE(finished.empty());

    int survived = 0;
    for (long n = 1; n <= total; ++n) {
        g_errno = n % 3 == 0 ? ENOSPC : (n % 3 == 1 ? EIO : EACCES);
        const Outcome outcome = RunJob(source, destination, n);
        const eTqovixErrorCode code = TqovixFailed(outcome.started) ? outcome.started : outcome.ended;
        EXPECT_TRUE(TqovixFailed(code)) << "operation " << n << " of " << total << " failed unnoticed: " << code;
        const bool untouched = testsupport::ReadFile(destination) == finished;
        EXPECT_TRUE(untouched) << "operation " << n;
        EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir.Path()), {}), 2) << "operation " << n
                                                                                          << ": a file left behind";
        survived += TqovixFailed(code) && untouched ? 1 : 0;
    }
    EXPECT_EQ(testsupport::ReadFile(source), original);
    EXPECT_EQ(survived, total);
    RecordProperty("injected_faults", static_cast<int>(total));
}

INSTANTIATE_TEST_SUITE_P(Codecs, FaultTest,
                         ::testing::Values(moviekit::SoundCodec::Twos, moviekit::SoundCodec::Sowt,
                                           moviekit::SoundCodec::Aac),
                         [](const auto& info) {
                             switch (info.param) {
                             case moviekit::SoundCodec::Twos: return std::string("twos");
                             case moviekit::SoundCodec::Sowt: return std::string("sowt");
                             default: return std::string("aac");
                             }
                         });

}  // namespace
