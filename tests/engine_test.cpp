// The engine's job lifecycle against a scripted stand-in for the processing library (the
// test plays the library's thread by calling the registered callbacks itself), and the
// progress state with its lock.
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
namespace fakeovix {

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
    int aborts = 0;
    int libraryCloses = 0;
};
Script& Current() { static Script script; return script; }
std::atomic<int> sessionCloses{0};  // close threads count from their own thread

template <typename Slot, typename Value>
unsigned long Keep(Slot& slot, Value value)
{
    slot = value;
    return ovix::kSuccess;
}
template <typename Counter>
unsigned long Tally(Counter& counter)
{
    ++counter;
    return ovix::kSuccess;
}

}  // namespace fakeovix

using fakeovix::Current;
using fakeovix::Keep;
using fakeovix::Tally;

unsigned long TqovixLibraryInitialize() { return Current().initializeResult; }
unsigned long TqovixLibraryClose() { return Tally(Current().libraryCloses); }
unsigned long TqovixIsEnable(void*, unsigned long) { return ovix::kSuccess; }
unsigned long TqovixOpenSession(const TqovixAudioInformation& audio, const TqovixTrimInformation&)
{
    Current().audio = audio;
    return Current().openResult;
}
unsigned long TqovixIsSessionFinished() { return Current().sessionState; }
unsigned long TqovixGetProcessedAFInfo(void* buffer, unsigned long size, unsigned long* count)
{
    const fakeovix::Script& script = Current();
    if (script.processedResult != ovix::kSuccess) {
        return script.processedResult;
    }
    *count = std::min<unsigned long>(size, script.processed.size());
    std::memcpy(buffer, script.processed.data(), *count);
    return ovix::kLastPiece;
}
unsigned long TqovixAbortSession() { return Tally(Current().aborts); }
unsigned long TqovixCloseSession(unsigned long) { return Tally(fakeovix::sessionCloses); }
unsigned long TqovixSetCallbackInputAFInformation(TqovixInputCallback) { return ovix::kSuccess; }
unsigned long TqovixSetCallbackInputAudioLevelInformation(TqovixInputCallback) { return ovix::kSuccess; }
unsigned long TqovixSetCallbackInputAudio(TqovixInputCallback c) { return Keep(Current().inputAudio, c); }
unsigned long TqovixSetCallbackOutputAudio(TqovixOutputCallback c) { return Keep(Current().outputAudio, c); }
unsigned long TqovixSetCallbackNotifyProgress(TqovixProgressCallback c) { return Keep(Current().notify, c); }

namespace {

int g_hostAnswer = 0;
int g_hostCalls = 0;
int HostCallback(int, int)
{
    ++g_hostCalls;
    return g_hostAnswer;
}

class EngineTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        Current() = fakeovix::Script{};
        fakeovix::sessionCloses = 0;
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
    // What the library would do with its first block: pull audio, push it back.
    unsigned long PassAudio(unsigned long bytes)
    {
        std::vector<uint8_t> block(bytes);
        unsigned long delivered = 0;
        const unsigned long pulled = Current().inputAudio(block.data(), &delivered, bytes, 0);
        return pulled != ovix::kSuccess ? pulled : Current().outputAudio(block.data(), delivered);
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
    Current().initializeResult = ovix::kSuccess;
    ASSERT_EQ(m_engine.Initialize(), eTqovixSuccess);
    EXPECT_EQ(m_engine.Initialize(), eTqovixErrorGeneral);

    Current().openResult = ovix::kOutOfMemory;
    EXPECT_EQ(m_engine.Execute(m_source.c_str(), m_destination.c_str(), 0), eTqovixErrorOutOfMemory);
    EXPECT_EQ(m_engine.GetProcessingState(), eTqovixErrorOutOfMemory);
    EXPECT_FALSE(DestinationExists()) << "a session that never opened leaves no destination";
    EXPECT_EQ(Current().audio.sampleRate, 48u);
    EXPECT_EQ(Current().audio.sampleCount, m_layout.soundSampleCount);
}

// The library's session ends with a verdict, a failure, or nothing to give back.
TEST_F(EngineTest, SessionEndsReportedByTheLibrary)
{
    struct Row {
        const char* name;
        unsigned long sessionState, processedResult;
        std::vector<uint8_t> processed;
        eTqovixErrorCode expected;
        bool destinationKept;
    };
    const std::vector<Row> rows = {
        {"verdict 8 keeps the destination", ovix::kVerdictNotAfBlock, ovix::kSuccess, {1}, eTqovixVerdict8, true},
        {"library failure", ovix::kFailure, ovix::kSuccess, {1}, eTqovixErrorGeneral, false},
        {"empty processed AF information", 1, ovix::kSuccess, {}, eTqovixErrorInternal, false},
        {"processed AF information unreadable", 1, ovix::kOutOfMemory, {1}, eTqovixErrorOutOfMemory, false},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        Current().sessionState = 0;
        Current().processedResult = row.processedResult;
        Current().processed = row.processed;
        g_hostCalls = 0;
        g_hostAnswer = 131;  // cannot change the end
        ASSERT_EQ(m_engine.SetCallback(HostCallback), eTqovixSuccess);
        Start();
        ASSERT_EQ(PassAudio(4096), ovix::kSuccess);
        Current().sessionState = row.sessionState;
        Current().notify(1024, 2048);
        EXPECT_EQ(m_engine.GetProcessingState(), row.expected);
        EXPECT_EQ(DestinationExists(), row.destinationKept);
        if (row.sessionState != 1) {
            EXPECT_EQ(g_hostCalls, 1) << "the host still hears of the notification";
        }
        // Once ended, callbacks answer with the end and change nothing.
        unsigned long delivered = 0;
        uint8_t byte = 0;
        EXPECT_EQ(Current().inputAudio(&byte, &delivered, 1, 0),
                  TqovixInterfaceConvert::ConvertToLibraryError(row.expected));
        EXPECT_EQ(m_engine.GetProcessingState(), row.expected);
    }
}

// An abort is acted on at the library's next callback; a close ends the job at once.
TEST_F(EngineTest, AbortAndCloseEndAJob)
{
    Start();
    ASSERT_EQ(PassAudio(4096), ovix::kSuccess);
    m_engine.Abort();
    EXPECT_EQ(m_engine.GetProcessingState(), eTqovixRunning) << "nothing happens on the host thread";
    EXPECT_TRUE(DestinationExists());
    EXPECT_EQ(PassAudio(4096), ovix::kAborted);
    EXPECT_EQ(m_engine.GetProcessingState(), eTqovixErrorAborted);
    EXPECT_EQ(Current().aborts, 1);
    EXPECT_FALSE(DestinationExists());
    EXPECT_EQ(PassAudio(4096), ovix::kAborted) << "a later callback only reports the end";
    EXPECT_EQ(Current().aborts, 1);

    // A notification carrying an abort request does not consult the host.
    ASSERT_EQ(m_engine.SetCallback(HostCallback), eTqovixSuccess);
    Start();
    m_engine.Abort();
    Current().notify(1, 2);
    EXPECT_EQ(g_hostCalls, 0);
    EXPECT_EQ(m_engine.GetProcessingState(), eTqovixErrorAborted);

    // With no job running an abort request is not kept for the next one.
    m_engine.Abort();
    Start();
    EXPECT_EQ(PassAudio(4096), ovix::kSuccess);

    m_engine.Close();
    EXPECT_EQ(Current().libraryCloses, 1);
    EXPECT_FALSE(DestinationExists());
    EXPECT_EQ(m_engine.GetProcessingState(), eTqovixErrorGeneral) << "closed";
    ASSERT_EQ(m_engine.Initialize(), eTqovixSuccess);
    EXPECT_EQ(m_engine.GetProcessingState(), eTqovixFinished);
}

TEST_F(EngineTest, HostAnswersEndTheJob)
{
    const std::vector<std::pair<int, eTqovixErrorCode>> rows = {
        {120, eTqovixErrorSourceAccessDenied}, {200, eTqovixErrorAborted}, {5, eTqovixErrorGeneral}};
    ASSERT_EQ(m_engine.SetCallback(HostCallback), eTqovixSuccess);
    for (const auto& [answer, expected] : rows) {
        SCOPED_TRACE(answer);
        Start();
        EXPECT_EQ(m_engine.SetCallback(HostCallback), eTqovixErrorGeneral) << "refused while a job runs";
        ASSERT_EQ(PassAudio(4096), ovix::kSuccess);
        g_hostAnswer = 0;
        Current().notify(10, 20);
        int first = 0, second = 0;
        m_engine.GetProgress(&first, &second);
        EXPECT_EQ(std::pair(first, second), std::pair(10, 20));
        EXPECT_EQ(m_engine.GetProcessingState(), eTqovixRunning);
        g_hostAnswer = answer;
        Current().notify(11, 20);
        EXPECT_EQ(m_engine.GetProcessingState(), expected);
        EXPECT_FALSE(DestinationExists());
    }
}

// A library that stops pulling before the track's end: the rest of the source sound is
// carried over unprocessed, so the destination still holds every chunk.
TEST_F(EngineTest, EarlyFinishStillWritesAWholeMovie)
{
    Start();
    ASSERT_EQ(PassAudio(6000), ovix::kSuccess);
    Current().sessionState = 1;
    Current().notify(1500, m_layout.soundSampleCount);
    ASSERT_EQ(m_engine.GetProcessingState(), eTqovixFinished);
    // The block passed back unchanged, so every packet of both tracks must match the source's.
    const auto packets = [](const std::string& path) {
        std::string output;
        const int status = testsupport::RunCommand(
            "ffmpeg -v error -nostdin -i " + testsupport::ShellQuote(path) + " -map 0 -c copy -f framemd5 - | grep -v '^#'",
            &output);
        return status == 0 ? output : "ffmpeg failed";
    };
    const std::string expected = packets(m_source);
    ASSERT_GT(expected.size(), 100u) << expected;
    EXPECT_EQ(packets(m_destination), expected);
    EXPECT_GT(fakeovix::sessionCloses.load(), 0);
}

TEST(ProgressDataControlTest, RecordsPairsOnlyWhileAJobRuns)
{
    CTqovixProgressDataControl progress;
    const auto read = [&progress] {
        int first = -1, second = -1;
        progress.GetProgress(&first, &second);
        return std::pair(first, second);
    };
    EXPECT_EQ(progress.GetErrorResult(), eTqovixFinished);
    EXPECT_EQ(progress.GetProgress(nullptr, nullptr), eTqovixSuccess);
    progress.SetProgress(5, 10);
    EXPECT_EQ(read(), std::pair(0, 0));

    progress.SetFinished(eTqovixRunning);
    progress.SetProgress(5, 10);
    int first = -1, second = -1;
    progress.GetProgress(&first, nullptr);
    progress.GetProgress(nullptr, &second);
    EXPECT_EQ(std::pair(first, second), std::pair(5, 10));
    progress.SetProgress(0x100000007ULL, 0xFFFFFFFFULL);
    EXPECT_EQ(read(), std::pair(7, -1)) << "only the low 32 bits are kept";
    progress.Reset();
    EXPECT_EQ(read(), std::pair(0, 0));

    // A failed job's code stays and later notifications are still recorded.
    progress.SetFinished(eTqovixErrorAborted);
    EXPECT_EQ(progress.GetErrorResult(), eTqovixErrorAborted);
    progress.SetProgress(3, 4);
    EXPECT_EQ(read(), std::pair(3, 4));
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
        int first = 0, second = 0;
        progress.GetProgress(&first, &second);
        torn += second != 2 * first ? 1 : 0;
    }
    writer.join();
    EXPECT_EQ(torn, 0);
}

}  // namespace
