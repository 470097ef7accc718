// Abort storms: many jobs aborted at chosen points while a second thread keeps asking
// whether movies can be processed. No deadlock, no leaked thread or descriptor.
#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <chrono>
#include <random>
#include <thread>

#include "host/JobHarness.h"

namespace {

// The progress callback's abort point, as a share of the job (above 1: never).
std::atomic<double> g_abortAt{2.0};

int AbortAtProgress(int first, int second)
{
    if (second > 0 && static_cast<double>(first) >= g_abortAt.load() * second) {
        g_abortAt = 2.0;
        TqAbortOVIX();
    }
    return 0;
}

class StormTest : public jobtest::HostTest {};

TEST_F(StormTest, AbortedJobsBesideQueriesLeaveNothingBehind)
{
    moviekit::MovieRecipe pcm;
    pcm.video.frameCount = 300;
    moviekit::MovieRecipe aac = pcm;
    aac.sound.codec = moviekit::SoundCodec::Aac;
    const std::string sources[] = {Write(pcm, "pcm.mov"), Write(aac, "aac.mov")};
    const std::string destination = m_dir.File("dst.mov");
    // Sanitizer runtimes start helper threads with the first thread: start one first.
    std::thread([] {}).join();
    const size_t threadsBefore = testsupport::ThreadCount();
    const size_t descriptorsBefore = testsupport::DescriptorCount();

    std::atomic<bool> stop{false};
    std::atomic<int> badAnswers{0};
    std::thread asker([&] {
        while (!stop) {
            for (const std::string& source : sources) {
                badAnswers += TqGetPropertyOVIX(source.c_str()) != 0 ? 1 : 0;
            }
        }
    });

    // Where each abort lands is chosen by progress, not by the clock: at once from the host
    // (it lands at the library's first call), from the progress callback at a random point
    // (it lands at the next call), and from the host once the progress has passed a random
    // point (it may come after the end: either ending is right).
    std::mt19937 random(20261123);
    TqSetCallBackNotifyProgressOVIX(AbortAtProgress);
    int aborted = 0;
    int certain = 0;
    auto longest = std::chrono::steady_clock::duration::zero();
    for (int job = 0; job < 150; ++job) {
        const auto start = std::chrono::steady_clock::now();
        // An aborted job leaves the path as it found it: start each from an empty one.
        std::filesystem::remove(destination);
        const int way = job % 3;
        const double point = static_cast<double>(random() % 900) / 1000.0;
        g_abortAt = way == 1 ? point : 2.0;
        // The callback's point is taken on the AAC job, whose progress is the library's alone
        // (a PCM job's may wait for its copy until the last notification, after the end).
        const std::string& source = way == 1 ? sources[1] : sources[job / 3 % 2];
        ASSERT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 0) << "job " << job;
        if (way == 0) {
            TqAbortOVIX();
        } else if (way == 2) {
            int first = 0;
            int second = 0;
            while (TqIsFinishedOVIX() == 0 &&
                   (TqGetProgressOVIX(&first, &second) != 0 || second == 0 || first < point * second)) {
                std::this_thread::yield();
            }
            TqAbortOVIX();
        }
        const int state = jobtest::WaitForJob(std::chrono::seconds(30));
        ASSERT_TRUE(state == 200 || state == 1) << "job " << job << " ended with " << state;
        if (way != 2) {
            ++certain;
            EXPECT_EQ(state, 200) << "job " << job << ": an abort asked while the job ran did not land";
        }
        EXPECT_EQ(jobtest::Exists(destination), state == 1) << "job " << job;
        aborted += state == 200 ? 1 : 0;
        longest = std::max(longest, std::chrono::steady_clock::now() - start);
    }
    TqSetCallBackNotifyProgressOVIX(nullptr);
    stop = true;
    asker.join();
    EXPECT_EQ(badAnswers, 0);
    EXPECT_GE(aborted, certain);
    RecordProperty("aborted", aborted);
    RecordProperty("longest_job_ms",
                   static_cast<int>(std::chrono::duration_cast<std::chrono::milliseconds>(longest).count()));

    // The engine joins its close threads by the next job or its close at the latest.
    TqCloseOVIX();
    ASSERT_EQ(TqInitializeOVIX(), 0);
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (testsupport::ThreadCount() > threadsBefore && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    EXPECT_EQ(testsupport::ThreadCount(), threadsBefore);
    EXPECT_EQ(testsupport::DescriptorCount(), descriptorsBefore);
}

}  // namespace
