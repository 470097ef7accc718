// Abort storms: many jobs aborted at random points while a second thread keeps asking
// whether movies can be processed. No deadlock, no leaked thread or descriptor.
#include <gtest/gtest.h>

#include <dirent.h>

#include <atomic>
#include <filesystem>
#include <chrono>
#include <random>
#include <thread>

#include "host/JobHarness.h"

namespace {

size_t CountEntries(const char* directory)
{
    size_t count = 0;
    if (DIR* dir = opendir(directory)) {
        while (readdir(dir) != nullptr) {
            ++count;
        }
        closedir(dir);
    }
    return count;
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
    const size_t threadsBefore = CountEntries("/proc/self/task");
    const size_t descriptorsBefore = CountEntries("/proc/self/fd");

    std::atomic<bool> stop{false};
    std::atomic<int> badAnswers{0};
    std::thread asker([&] {
        while (!stop) {
            for (const std::string& source : sources) {
                badAnswers += TqGetPropertyOVIX(source.c_str()) != 0 ? 1 : 0;
            }
        }
    });

    std::mt19937 random(20261123);
    int aborted = 0;
    auto longest = std::chrono::steady_clock::duration::zero();
    for (int job = 0; job < 200; ++job) {
        const auto start = std::chrono::steady_clock::now();
        // An aborted job leaves the path as it found it: start each from an empty one.
        std::filesystem::remove(destination);
        ASSERT_EQ(TqExecuteOVIX(sources[job % 2].c_str(), destination.c_str()), 0) << "job " << job;
        // Abort somewhere between at once and well into the job.
        std::this_thread::sleep_for(std::chrono::microseconds(random() % 20000));
        TqAbortOVIX();
        const int state = jobtest::WaitForJob(std::chrono::seconds(30));
        ASSERT_TRUE(state == 200 || state == 1) << "job " << job << " ended with " << state;
        EXPECT_EQ(jobtest::Exists(destination), state == 1) << "job " << job;
        aborted += state == 200 ? 1 : 0;
        longest = std::max(longest, std::chrono::steady_clock::now() - start);
    }
    stop = true;
    asker.join();
    EXPECT_EQ(badAnswers, 0);
    EXPECT_GT(aborted, 100) << "most aborts must land inside a job";
    RecordProperty("aborted", aborted);
    RecordProperty("longest_job_ms",
                   static_cast<int>(std::chrono::duration_cast<std::chrono::milliseconds>(longest).count()));

    // The engine joins its close threads by the next job or its close at the latest.
    TqCloseOVIX();
    ASSERT_EQ(TqInitializeOVIX(), 0);
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (CountEntries("/proc/self/task") > threadsBefore && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    EXPECT_EQ(CountEntries("/proc/self/task"), threadsBefore);
    EXPECT_EQ(CountEntries("/proc/self/fd"), descriptorsBefore);
}

}  // namespace
