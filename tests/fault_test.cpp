// Every file operation of a whole job failed in turn: each run must end with an error
// code, leave no destination behind and leave the source as it was.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <filesystem>
#include <thread>

#include "Movie.h"
#include "bridge/TqovixCodeTable.h"
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
    if (GetParam() == moviekit::SoundCodec::Aac) {
        // Sound processing changes inside the default intervals: spans, joints and carried packets.
        constexpr uint64_t kPackets = 33;  // as long as the video
        constexpr uint64_t n = kPackets * 1024;
        recipe.sound.aacPackets = testsupport::MotorAacPackets(kPackets, 48000, {n / 4, n / 4 + n / 10, n / 2, n / 2 + n / 8}, 192000);
        ASSERT_EQ(recipe.sound.aacPackets.size(), kPackets);
    }
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

// One operation of a job failed with one error number: the host hears what the error means.
std::atomic<int> g_operation{-1};
std::atomic<long> g_occurrence{0};

int FailOneKind(eTqovixFileOperation operation)
{
    if (static_cast<int>(operation) != g_operation.load()) {
        return 0;
    }
    return ++g_calls == g_occurrence.load() ? g_errno.load() : 0;
}

struct OperationRow {
    const char* name;
    eTqovixFileOperation operation;
    long occurrence;  // which call of that operation in the job, from 1
    int error;
    bool replacing;   // a file stands at the destination
    int exported;
};
void PrintTo(const OperationRow& row, std::ostream* out) { *out << row.name; }

const std::vector<uint8_t> kEarlier = {'o', 'l', 'd'};

// A short camera movie, and the file standing at the destination when the job replaces one.
void PrepareFiles(const std::string& source, const std::string& destination, bool replacing)
{
    moviekit::MovieRecipe recipe;
    recipe.video.frameCount = 20;
    std::string error;
    ASSERT_TRUE(moviekit::WriteMovie(source, recipe, nullptr, &error)) << error;
    if (replacing) {
        ASSERT_TRUE(testsupport::WriteFile(destination, kEarlier));
    }
}

class OperationFaultTest : public ::testing::TestWithParam<OperationRow> {
protected:
    void TearDown() override { CTqovixFile::SetFaultHook(nullptr); }
};

TEST_P(OperationFaultTest, TheHostHearsWhatTheErrorMeans)
{
    const OperationRow& row = GetParam();
    testsupport::TempDir dir;
    const std::string source = dir.File("src.mov");
    const std::string destination = dir.File("dst.mov");
    ASSERT_NO_FATAL_FAILURE(PrepareFiles(source, destination, row.replacing));
    g_operation = static_cast<int>(row.operation);
    g_occurrence = row.occurrence;
    g_errno = row.error;
    CTqovixFile::SetFaultHook(FailOneKind);
    const Outcome outcome = RunJob(source, destination, 0);  // the count restarts: only this kind counts
    CTqovixFile::SetFaultHook(nullptr);
    const eTqovixErrorCode code = TqovixFailed(outcome.started) ? outcome.started : outcome.ended;
    EXPECT_GE(g_calls.load(), row.occurrence) << "the job never reached the operation";
    EXPECT_EQ(TqovixCodes::Exported(code), row.exported) << code;
    EXPECT_EQ(testsupport::ReadFile(destination), row.replacing ? kEarlier : std::vector<uint8_t>{});
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir.Path()), {}), row.replacing ? 2 : 1)
        << "a file left behind";
}

using Op = eTqovixFileOperation;
// The source is opened first, the destination second. A job names its destination by a
// link where the file system has unnamed files, else by renaming its hidden name; a
// replacing job on unnamed files links a hidden name (the second link) and renames it.
INSTANTIATE_TEST_SUITE_P(
    Operations, OperationFaultTest,
    ::testing::Values(OperationRow{"SourceOpenDenied", Op::Open, 1, EACCES, false, 120},
                      OperationRow{"SourceOpenIo", Op::Open, 1, EIO, false, 190},
                      OperationRow{"DestinationOpenNoSpace", Op::Open, 2, ENOSPC, false, 130},
                      OperationRow{"DestinationOpenQuota", Op::Open, 2, EDQUOT, true, 130},
                      OperationRow{"DestinationOpenDenied", Op::Open, 2, EACCES, true, 121},
                      OperationRow{"DestinationOpenReadOnlyVolume", Op::Open, 2, EROFS, false, 121},
                      OperationRow{"DestinationOpenIo", Op::Open, 2, EIO, false, 190}),
    [](const ::testing::TestParamInfo<OperationRow>& info) { return std::string(info.param.name); });

// Naming the destination: which call does it depends on the volume, so each row fails every
// call of its kind and at least one must have been made.
struct NamingRow {
    const char* name;
    eTqovixFileOperation operation;
    int error;
    bool replacing;
    int exported;
};
void PrintTo(const NamingRow& row, std::ostream* out) { *out << row.name; }

std::atomic<int> g_namingOperation{-1};
std::atomic<long> g_namingCalls{0};

int FailEveryOfOneKind(eTqovixFileOperation operation)
{
    if (static_cast<int>(operation) != g_namingOperation.load()) {
        return 0;
    }
    ++g_namingCalls;
    return g_errno.load();
}

class NamingFaultTest : public ::testing::TestWithParam<NamingRow> {
protected:
    void TearDown() override
    {
        CTqovixFile::SetFaultHook(nullptr);
        CTqovixFile::SetUnnamedDestinations(true);
    }
};

TEST_P(NamingFaultTest, TheHostHearsWhatTheErrorMeansAndTheNameKeepsItsFile)
{
    const NamingRow& row = GetParam();
    bool reached = false;
    for (const bool unnamed : {true, false}) {
        CTqovixFile::SetUnnamedDestinations(unnamed);
        testsupport::TempDir dir;
        const std::string source = dir.File("src.mov");
        const std::string destination = dir.File("dst.mov");
        ASSERT_NO_FATAL_FAILURE(PrepareFiles(source, destination, row.replacing));
        g_namingOperation = static_cast<int>(row.operation);
        g_namingCalls = 0;
        g_errno = row.error;
        CTqovixFile::SetFaultHook(FailEveryOfOneKind);
        const Outcome outcome = RunJob(source, destination, 0);
        CTqovixFile::SetFaultHook(nullptr);
        const eTqovixErrorCode code = TqovixFailed(outcome.started) ? outcome.started : outcome.ended;
        const long calls = g_namingCalls.load();
        if (calls == 0) {
            // Only one of the two ways names by this operation (a new name on unnamed files takes no rename).
            EXPECT_EQ(code, eTqovixFinished) << (unnamed ? "unnamed" : "hidden name");
            continue;
        }
        reached = true;
        EXPECT_EQ(TqovixCodes::Exported(code), row.exported) << (unnamed ? "unnamed: " : "hidden name: ") << code;
        EXPECT_EQ(testsupport::ReadFile(destination), row.replacing ? kEarlier : std::vector<uint8_t>{});
        EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir.Path()), {}), row.replacing ? 2 : 1)
            << "a file left behind";
    }
    if (row.operation == Op::Link && !testsupport::UnnamedFilesIn(testsupport::TempDir().Path())) {
        GTEST_SKIP() << "no unnamed files on this volume: nothing is named by a link";
    }
    EXPECT_TRUE(reached) << "no job named its destination by this operation";
}

INSTANTIATE_TEST_SUITE_P(
    Naming, NamingFaultTest,
    ::testing::Values(NamingRow{"LinkNoSpace", Op::Link, ENOSPC, false, 130},
                      NamingRow{"LinkDenied", Op::Link, EACCES, true, 121},
                      NamingRow{"LinkIo", Op::Link, EIO, false, 190},
                      NamingRow{"RenameQuota", Op::Rename, EDQUOT, true, 130},
                      NamingRow{"RenameDenied", Op::Rename, EACCES, true, 121},
                      NamingRow{"RenameIo", Op::Rename, EIO, false, 190}),
    [](const ::testing::TestParamInfo<NamingRow>& info) { return std::string(info.param.name); });

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
