#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "engine/CTqovixProgressDataControl.h"

namespace {

TEST(ProgressDataControlTest, RecordsPairsOnlyWhileAJobRuns)
{
    CTqovixProgressDataControl progress;
    EXPECT_EQ(progress.GetErrorResult(), eTqovixFinished);
    EXPECT_EQ(progress.GetProgress(nullptr, nullptr), eTqovixSuccess);

    int first = -1;
    int second = -1;
    progress.SetProgress(5, 10);
    progress.GetProgress(&first, &second);
    EXPECT_EQ(first, 0);
    EXPECT_EQ(second, 0);

    progress.SetFinished(eTqovixRunning);
    progress.SetProgress(5, 10);
    progress.GetProgress(&first, nullptr);
    EXPECT_EQ(first, 5);
    progress.GetProgress(nullptr, &second);
    EXPECT_EQ(second, 10);

    progress.SetProgress(0x100000007ULL, 0xFFFFFFFFULL);
    progress.GetProgress(&first, &second);
    EXPECT_EQ(first, 7) << "only the low 32 bits are kept";
    EXPECT_EQ(second, -1);

    progress.Reset();
    progress.GetProgress(&first, &second);
    EXPECT_EQ(first, 0);
    EXPECT_EQ(second, 0);

    // A failed job's code stays and later notifications are still recorded.
    progress.SetFinished(eTqovixErrorAborted);
    EXPECT_EQ(progress.GetErrorResult(), eTqovixErrorAborted);
    progress.SetProgress(3, 4);
    progress.GetProgress(&first, &second);
    EXPECT_EQ(first, 3);
}

TEST(ProgressDataControlTest, ReaderNeverSeesHalfOfTwoNotifications)
{
    CTqovixProgressDataControl progress;
    progress.SetFinished(eTqovixRunning);
    std::atomic<bool> done{false};
    std::thread writer([&] {
        for (unsigned long i = 1; i <= 20000; ++i) {
            progress.SetProgress(i, 2 * i);
        }
        done = true;
    });
    int torn = 0;
    while (!done) {
        int first = 0;
        int second = 0;
        progress.GetProgress(&first, &second);
        torn += second != 2 * first ? 1 : 0;
    }
    writer.join();
    EXPECT_EQ(torn, 0);
}

}  // namespace
