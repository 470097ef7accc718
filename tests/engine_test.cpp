// The engine against a scripted stand-in for the processing library, whose thread the test
// plays by calling the registered callbacks itself; and the progress state with its lock.
#include <gtest/gtest.h>

#include <ovix/Ovix.h>

#include <atomic>
#include <cstring>
#include <filesystem>
#include <thread>

#include "Movie.h"
#include "engine/CTqovixMainFrame.h"
#include "support/TestSupport.h"

// The stand-in: these definitions take the place of libOVIX.so's in this executable.
namespace {
struct Script {
    unsigned long initializeResult = ovix::kSuccess;
    unsigned long openResult = ovix::kSuccess;
    unsigned long sessionState = 0;  // 0 running, 1 finished, anything else a verdict or failure
    std::vector<uint8_t> processed = {0, 0, 0, 12, 'O', 'P', '0', '1', 'A', 'F', 'R', '1'};
    unsigned long processedResult = ovix::kSuccess;  // replaces the answer when not success
    TqovixInputCallback inputAudio = nullptr;
    TqovixOutputCallback outputAudio = nullptr;
    TqovixProgressCallback notify = nullptr;
    TqovixAudioInformation audio{};
    int libraryCloses = 0;
};
Script& Current() { static Script script; return script; }
constexpr unsigned long kOk = ovix::kSuccess;

int g_hostAnswer = 0;
int g_hostCalls = 0;
int HostCallback(int, int) { ++g_hostCalls; return g_hostAnswer; }
}  // namespace

unsigned long TqovixLibraryInitialize() { return Current().initializeResult; }
unsigned long TqovixLibraryClose() { ++Current().libraryCloses; return kOk; }
unsigned long TqovixIsEnable(void*, unsigned long) { return kOk; }
unsigned long TqovixOpenSession(const TqovixAudioInformation& audio, const TqovixTrimInformation&)
{
    Current().audio = audio;
    return Current().openResult;
}
unsigned long TqovixIsSessionFinished() { return Current().sessionState; }
unsigned long TqovixGetProcessedAFInfo(void* buffer, unsigned long size, unsigned long* count)
{
    const Script& script = Current();
    if (script.processedResult != kOk) {
        return script.processedResult;
    }
    *count = std::min<unsigned long>(size, script.processed.size());
    std::memcpy(buffer, script.processed.data(), *count);
    return ovix::kLastPiece;
}
unsigned long TqovixAbortSession() { return kOk; }
unsigned long TqovixCloseSession(unsigned long) { return kOk; }
unsigned long TqovixSetCallbackInputAFInformation(TqovixInputCallback) { return kOk; }
unsigned long TqovixSetCallbackInputAudioLevelInformation(TqovixInputCallback) { return kOk; }
unsigned long TqovixSetCallbackInputAudio(TqovixInputCallback c) { Current().inputAudio = c; return kOk; }
unsigned long TqovixSetCallbackOutputAudio(TqovixOutputCallback c) { Current().outputAudio = c; return kOk; }
unsigned long TqovixSetCallbackNotifyProgress(TqovixProgressCallback c) { Current().notify = c; return kOk; }

namespace {

using testsupport::PrintTo;

class EngineTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        Current() = Script{};
        g_hostAnswer = g_hostCalls = 0;
        std::string error;
        ASSERT_TRUE(moviekit::WriteMovie(m_source, {}, &m_layout, &error)) << error;
        g_pMainFrame = &m_engine;
        ASSERT_EQ(m_engine.Initialize(), eTqovixSuccess);
    }
    void TearDown() override
    {
        m_engine.Close();
        g_pMainFrame = nullptr;
    }
    void Start()
    {
        ASSERT_EQ(m_engine.Execute(m_source.c_str(), m_destination.c_str(), 0), eTqovixSuccess);
        ASSERT_EQ(m_engine.GetProcessingState(), eTqovixRunning);
    }
    bool DestinationExists() const { return std::filesystem::exists(m_destination); }

    testsupport::TempDir m_dir;
    const std::string m_source = m_dir.File("src.mov");
    const std::string m_destination = m_dir.File("dst.mov");
    moviekit::MovieLayout m_layout;
    CTqovixMainFrame m_engine;
};

TEST_F(EngineTest, LibraryRefusalsAtStart)
{
    m_engine.Close();
    Current().initializeResult = ovix::kFailure;
    EXPECT_EQ(m_engine.Initialize(), eTqovixErrorGeneral);
    EXPECT_EQ(m_engine.GetProcessingState(), eTqovixErrorGeneral) << "a failed initialisation leaves it closed";
    Current().initializeResult = kOk;
    ASSERT_EQ(m_engine.Initialize(), eTqovixSuccess);

    Current().openResult = ovix::kOutOfMemory;
    EXPECT_EQ(m_engine.Execute(m_source.c_str(), m_destination.c_str(), 0), eTqovixErrorOutOfMemory);
    EXPECT_EQ(m_engine.GetProcessingState(), eTqovixErrorOutOfMemory);
    EXPECT_FALSE(DestinationExists()) << "a session that never opened leaves no destination";
    EXPECT_EQ(Current().audio.sampleRate, 48u);
    EXPECT_EQ(Current().audio.sampleCount, m_layout.soundSampleCount);
}

struct SessionEndRow {
    const char* name;
    unsigned long sessionState, processedResult;
    std::vector<uint8_t> processed;
    eTqovixErrorCode expected;
    int hostAnswer;  // heard only while the library reports no end of its own
};

class SessionEndTest : public EngineTest, public ::testing::WithParamInterface<SessionEndRow> {};

// The library's session ends with a verdict, a failure, or nothing to give back; none publishes.
TEST_P(SessionEndTest, EndsTheJobWithoutADestination)
{
    const SessionEndRow& row = GetParam();
    ASSERT_EQ(m_engine.SetCallback(HostCallback), eTqovixSuccess);
    Current().sessionState = 0;
    Current().processedResult = row.processedResult;
    Current().processed = row.processed;
    g_hostCalls = 0;
    g_hostAnswer = row.hostAnswer;
    Start();
    std::vector<uint8_t> block(4096);  // what the library does with its first block
    unsigned long delivered = 0;
    ASSERT_EQ(Current().inputAudio(block.data(), &delivered, 4096, 0), kOk);
    ASSERT_EQ(Current().outputAudio(block.data(), delivered), kOk);
    Current().sessionState = row.sessionState;
    Current().notify(1024, 2048);
    EXPECT_EQ(m_engine.GetProcessingState(), row.expected);
    EXPECT_FALSE(DestinationExists());
    if (row.sessionState != 1) {
        EXPECT_EQ(g_hostCalls, 1) << "the host still hears of the notification";
    }
    // Once ended, callbacks answer with the end and change nothing.
    EXPECT_EQ(Current().inputAudio(block.data(), &delivered, 1, 0),
              TqovixInterfaceConvert::ConvertToLibraryError(row.expected));
    EXPECT_EQ(m_engine.GetProcessingState(), row.expected);
}

INSTANTIATE_TEST_SUITE_P(
    Ends, SessionEndTest,
    ::testing::Values(SessionEndRow{"Verdict8", ovix::kVerdictNotAfBlock, kOk, {1}, eTqovixVerdict8, 131},
                      SessionEndRow{"LibraryFailure", ovix::kFailure, kOk, {1}, eTqovixErrorGeneral, 131},
                      SessionEndRow{"EmptyProcessedAfInformation", 1, kOk, {}, eTqovixErrorInternal, 131},
                      SessionEndRow{"ProcessedAfInformationUnreadable", 1, ovix::kOutOfMemory, {1},
                                    eTqovixErrorOutOfMemory, 131},
                      SessionEndRow{"UnknownHostAnswer", 0, kOk, {1}, eTqovixErrorGeneral, 5}), testsupport::ByName);

// A close ends a running job at once.
TEST_F(EngineTest, CloseMidJob)
{
    Start();
    m_engine.Close();
    EXPECT_EQ(Current().libraryCloses, 1);
    EXPECT_FALSE(DestinationExists());
    EXPECT_EQ(m_engine.GetProcessingState(), eTqovixErrorGeneral) << "closed";
}

TEST(ProgressDataControlTest, RecordsPairsOnlyWhileAJobRuns)
{
    CTqovixProgressDataControl progress;
    const auto read = [&progress] {
        int first = -1, second = -1;
        progress.GetProgress(&first, &second);
        return std::pair(first, second);
    };
    progress.SetProgress(5, 10);
    EXPECT_EQ(read(), std::pair(0, 0));
    progress.SetFinished(eTqovixRunning);
    progress.SetProgress(0x100000007ULL, 0xFFFFFFFFULL);
    EXPECT_EQ(read(), std::pair(7, -1)) << "only the low 32 bits are kept";
    // A failed job's code stays and later notifications are still recorded.
    progress.SetFinished(eTqovixErrorAborted);
    progress.SetProgress(3, 4);
    EXPECT_EQ(read(), std::pair(3, 4));
}

TEST(ProgressDataControlTest, ReaderNeverSeesHalfOfTwoNotifications)
{
    CTqovixProgressDataControl progress;
    progress.SetFinished(eTqovixRunning);
    constexpr long kReads = 20000;
    std::atomic<long> reads{0};
    std::atomic<bool> done{false};
    unsigned long written = 0;
    // The writer starts once the reader reads and goes on until it has read often: reads and
    // writes overlap, however the two threads are scheduled.
    std::thread writer([&] {
        while (reads == 0) {
            std::this_thread::yield();
        }
        for (unsigned long i = 1; (i <= 20000 || reads < kReads) && i < (1ul << 30); ++i) {
            progress.SetProgress(i, 2 * i);
            written = i;
        }
        done = true;
    });
    int torn = 0;
    while (!done) {
        int first = 0, second = 0;
        progress.GetProgress(&first, &second);
        torn += second != 2 * first ? 1 : 0;
        ++reads;
    }
    writer.join();
    EXPECT_EQ(torn, 0);
    EXPECT_GE(reads.load(), kReads);
    ASSERT_GE(written, 20000u);
    int first = 0, second = 0;
    progress.GetProgress(&first, &second);
    EXPECT_EQ(std::pair(first, second), std::pair(static_cast<int>(written), static_cast<int>(2 * written)))
        << "the last notification is what the reader sees";
}

}  // namespace
