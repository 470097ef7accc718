// The exported interface as a host sees it: what the library exports, the engine's
// lifecycle, the refusals of a job start, abort and the host's progress callback, and the
// property query. Everything goes through the eight exported functions.
#include "host/JobHarness.h"

#include <grp.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <mutex>
#include <set>
#include <sstream>
#include <thread>
#include <utility>

namespace {

using jobtest::Exists;
using jobtest::FileStamp;
using jobtest::StampFile;
using jobtest::WaitForJob;

// ---- The host's progress callback: what it answers and what it was shown. ----

std::mutex g_callbackMutex;
std::vector<std::pair<int, int>> g_callbackSeen;
std::atomic<int> g_callbackAnswer{0};

int HostCallback(int first, int second)
{
    std::lock_guard lock(g_callbackMutex);
    g_callbackSeen.emplace_back(first, second);
    return g_callbackAnswer.load();
}

void ResetCallback(int answer)
{
    std::lock_guard lock(g_callbackMutex);
    g_callbackSeen.clear();
    g_callbackAnswer.store(answer);
}

std::vector<std::pair<int, int>> CallbackSeen()
{
    std::lock_guard lock(g_callbackMutex);
    return g_callbackSeen;
}

size_t CountEntries(const char* directory)
{
    size_t count = 0;
    for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator(directory)) {
        ++count;
    }
    return count;
}

class ApiTest : public jobtest::HostTest {
protected:
    void SetUp() override
    {
        HostTest::SetUp();
        ResetCallback(0);
    }

    // About a minute of 48 kHz stereo PCM beside small frames: a job on it is still
    // running when the host's next call arrives.
    std::string WriteLong(const std::string& name)
    {
        moviekit::MovieSpec recipe;
        recipe.video.width = 16;
        recipe.video.height = 16;
        recipe.video.frameCount = 1800;
        return Write(recipe, name);
    }
};

// ---- Exports ----

TEST(ApiExports, OnlyTheEightFunctionsAndTheEnginePointer)
{
    ASSERT_TRUE(testsupport::HaveCommand("nm"));
    std::string output;
    ASSERT_EQ(testsupport::RunCommand("nm -D --defined-only " + testsupport::ShellQuote(TQOVIX_UTILITY_FILE), &output),
              0);
    std::set<std::string> names;
    std::istringstream lines(output);
    for (std::string line; std::getline(lines, line);) {
        const size_t cut = line.find_last_of(' ');
        if (!line.empty()) {
            names.insert(line.substr(cut == std::string::npos ? 0 : cut + 1));
        }
    }
    const std::set<std::string> expected = {
        "TqInitializeOVIX", "TqCloseOVIX",  "TqGetPropertyOVIX", "TqSetCallBackNotifyProgressOVIX",
        "TqExecuteOVIX",    "TqIsFinishedOVIX", "TqAbortOVIX",   "TqGetProgressOVIX",
        "g_pMainFrame"};
    EXPECT_EQ(names, expected) << output;
}

// ---- Lifecycle ----

TEST_F(ApiTest, WithoutAnEngineEveryCallIsRefusedAndCloseIsHarmless)
{
    const std::string source = Write(moviekit::MovieSpec{}, "src.mov");
    const std::string destination = m_dir.File("dst.mov");
    const FileStamp before = StampFile(source);
    TqCloseOVIX();

    g_callbackAnswer.store(131);  // would end the job below with 131 if it were ever installed
    EXPECT_EQ(TqIsFinishedOVIX(), 190);
    EXPECT_EQ(TqGetPropertyOVIX(source.c_str()), 190);
    EXPECT_EQ(TqSetCallBackNotifyProgressOVIX(HostCallback), 190);
    EXPECT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 190);
    int first = -7;
    int second = -7;
    EXPECT_EQ(TqGetProgressOVIX(&first, &second), 190);
    EXPECT_EQ(first, -7);
    EXPECT_EQ(second, -7);
    TqAbortOVIX();
    TqCloseOVIX();
    EXPECT_EQ(TqIsFinishedOVIX(), 190);
    EXPECT_FALSE(Exists(destination));
    EXPECT_EQ(StampFile(source), before);

    ASSERT_EQ(TqInitializeOVIX(), 0);
    EXPECT_EQ(TqIsFinishedOVIX(), 1);
    EXPECT_EQ(Run(source, destination), 1);
    EXPECT_TRUE(CallbackSeen().empty());
}

TEST_F(ApiTest, IdleEngineAnswersAndIgnoresAbort)
{
    EXPECT_EQ(TqIsFinishedOVIX(), 1);
    EXPECT_EQ(TqGetProgressOVIX(nullptr, nullptr), 0);
    int first = -7;
    int second = -7;
    EXPECT_EQ(TqGetProgressOVIX(&first, nullptr), 0);
    EXPECT_EQ(TqGetProgressOVIX(nullptr, &second), 0);
    EXPECT_EQ(first, 0);
    EXPECT_EQ(second, 0);

    TqAbortOVIX();
    EXPECT_EQ(TqIsFinishedOVIX(), 1);

    const std::string destination = m_dir.File("dst.mov");
    EXPECT_EQ(TqExecuteOVIX(m_dir.File("absent.mov").c_str(), destination.c_str()), 110);
    TqAbortOVIX();
    EXPECT_EQ(TqIsFinishedOVIX(), 110);

    const std::string source = Write(moviekit::MovieSpec{}, "src.mov");
    EXPECT_EQ(Run(source, destination), 1);
    TqAbortOVIX();
    EXPECT_EQ(TqIsFinishedOVIX(), 1);
    EXPECT_TRUE(Exists(destination));
}

TEST_F(ApiTest, SecondInitializeLeavesTheEngineInPlace)
{
    // A failed start gives the engine a state a fresh one would not have.
    EXPECT_EQ(TqExecuteOVIX(m_dir.File("absent.mov").c_str(), m_dir.File("x.mov").c_str()), 110);
    EXPECT_EQ(TqInitializeOVIX(), 190);
    EXPECT_EQ(TqIsFinishedOVIX(), 110);

    const std::string source = Write(moviekit::MovieSpec{}, "src.mov");
    const std::string destination = m_dir.File("dst.mov");
    EXPECT_EQ(Run(source, destination), 1);
    EXPECT_TRUE(Exists(destination));
}

TEST_F(ApiTest, RepeatedCyclesReleaseThreadsAndDescriptors)
{
    const std::string source = WriteLong("long.mov");
    const std::string destination = m_dir.File("dst.mov");
    TqCloseOVIX();
    // Sanitizer runtimes start a helper thread with the first thread: start one first.
    std::thread([] {}).join();
    const size_t threads = CountEntries("/proc/self/task");
    const size_t descriptors = CountEntries("/proc/self/fd");

    for (int cycle = 0; cycle < 200; ++cycle) {
        ASSERT_EQ(TqInitializeOVIX(), 0) << "cycle " << cycle;
        if (cycle % 4 == 0) {
            ASSERT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 0) << "cycle " << cycle;
        }
        TqCloseOVIX();
        ASSERT_FALSE(Exists(destination)) << "cycle " << cycle;
    }

    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while ((CountEntries("/proc/self/task") != threads || CountEntries("/proc/self/fd") != descriptors) &&
           std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    EXPECT_EQ(CountEntries("/proc/self/task"), threads);
    EXPECT_EQ(CountEntries("/proc/self/fd"), descriptors);
}

// ---- Refused job starts ----

TEST_F(ApiTest, SecondJobIsRefusedWhileOneRuns)
{
    const std::string source = WriteLong("long.mov");
    const std::string destination = m_dir.File("dst.mov");
    const std::string other = m_dir.File("other.mov");
    const std::vector<uint8_t> otherBytes = {1, 2, 3};
    ASSERT_TRUE(testsupport::WriteFile(other, otherBytes));
    ASSERT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 0);
    EXPECT_EQ(TqExecuteOVIX(source.c_str(), other.c_str()), 190);
    EXPECT_EQ(WaitForJob(), 1);
    EXPECT_TRUE(Exists(destination));
    EXPECT_EQ(testsupport::ReadFile(other), otherBytes);
}

TEST_F(ApiTest, MissingSourceRemovesAnExistingDestination)
{
    const std::string destination = m_dir.File("dst.mov");
    ASSERT_TRUE(testsupport::WriteFile(destination, {1, 2, 3}));
    EXPECT_EQ(TqExecuteOVIX(m_dir.File("absent.mov").c_str(), destination.c_str()), 110);
    EXPECT_EQ(TqIsFinishedOVIX(), 110);
    EXPECT_FALSE(Exists(destination));
}

TEST_F(ApiTest, MissingDestinationDirectoryGives111)
{
    const std::string source = Write(moviekit::MovieSpec{}, "src.mov");
    const FileStamp before = StampFile(source);
    const std::string destination = m_dir.File("absent/dst.mov");
    EXPECT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 111);
    EXPECT_EQ(TqIsFinishedOVIX(), 111);
    EXPECT_FALSE(Exists(destination));
    EXPECT_EQ(StampFile(source), before);
}

enum class Spelling { Identical, Relative, DotSegment, Symlink };

struct SpellingCase {
    const char* name;
    Spelling spelling;
};

class SameFileTest : public ApiTest, public ::testing::WithParamInterface<SpellingCase> {};

TEST_P(SameFileTest, IsRefusedAndSourceUntouched)
{
    const std::string source = Write(moviekit::MovieSpec{}, "src.mov");
    const FileStamp before = StampFile(source);
    std::string destination;
    switch (GetParam().spelling) {
    case Spelling::Identical: destination = source; break;
    case Spelling::Relative: destination = std::filesystem::relative(source).string(); break;
    case Spelling::DotSegment: destination = m_dir.Path() + "/./src.mov"; break;
    case Spelling::Symlink:
        destination = m_dir.File("link.mov");
        ASSERT_EQ(symlink(source.c_str(), destination.c_str()), 0);
        break;
    }
    EXPECT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 190);
    EXPECT_EQ(TqIsFinishedOVIX(), 190);
    EXPECT_EQ(StampFile(source), before);
    struct stat info {};
    EXPECT_EQ(lstat(destination.c_str(), &info), 0);
}

INSTANTIATE_TEST_SUITE_P(Spellings, SameFileTest,
                         ::testing::Values(SpellingCase{"IdenticalString", Spelling::Identical},
                                           SpellingCase{"Relative", Spelling::Relative},
                                           SpellingCase{"DotSegment", Spelling::DotSegment},
                                           SpellingCase{"Symlink", Spelling::Symlink}),
                         [](const auto& info) { return std::string(info.param.name); });

// ---- Host progress callback ----

TEST_F(ApiTest, CallbackCannotBeSetWhileJobRuns)
{
    const std::string source = WriteLong("long.mov");
    const std::string destination = m_dir.File("dst.mov");
    g_callbackAnswer.store(131);  // ends the job with 131 if the refused callback got in
    ASSERT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 0);
    EXPECT_EQ(TqSetCallBackNotifyProgressOVIX(HostCallback), 190);
    EXPECT_EQ(TqSetCallBackNotifyProgressOVIX(nullptr), 190);
    EXPECT_EQ(WaitForJob(), 1);
    TqCloseOVIX();  // returns once the library's thread has left every callback
    EXPECT_TRUE(CallbackSeen().empty());
    EXPECT_TRUE(Exists(destination));
}

// Answers other than 0 are judged with whole jobs (job suite) and the scripted library
// (engine suite); here the host sees the progress of a job it lets run.
TEST_F(ApiTest, CallbackSeesRisingProgress)
{
    moviekit::MovieLayout layout;
    const std::string source = Write(moviekit::MovieSpec{}, "src.mov", &layout);
    ASSERT_EQ(TqSetCallBackNotifyProgressOVIX(HostCallback), 0);
    EXPECT_EQ(Run(source, m_dir.File("dst.mov")), 1);
    TqCloseOVIX();  // returns once the library's thread has left every callback
    const std::vector<std::pair<int, int>> seen = CallbackSeen();
    const int total = static_cast<int>(layout.soundSampleCount);
    ASSERT_GE(seen.size(), 2u);
    for (size_t k = 0; k < seen.size(); ++k) {
        EXPECT_EQ(seen[k].second, total) << "call " << k;
        if (k > 0) {
            EXPECT_GE(seen[k].first, seen[k - 1].first) << "call " << k;
        }
    }
    EXPECT_EQ(seen.back().first, total);
}

// ---- Property query ----

enum class Target { Movie, Missing, Empty, Directory, Unreadable };

struct PropertyCase {
    const char* name;
    Target target;
    void (*edit)(moviekit::MovieSpec&);
    int expected;
};

// Runs the query in a child process that has given up root, so that file modes apply.
int PropertyAsNobody(const std::string& path)
{
    const pid_t child = fork();
    if (child == 0) {
        if (setgroups(0, nullptr) != 0 || setgid(65534) != 0 || setuid(65534) != 0) {
            _exit(251);
        }
        if (access(path.c_str(), R_OK) == 0) {
            _exit(252);
        }
        _exit(TqGetPropertyOVIX(path.c_str()));
    }
    if (child < 0) {
        return -1;
    }
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    int status = 0;
    while (waitpid(child, &status, WNOHANG) == 0) {
        if (std::chrono::steady_clock::now() > deadline) {
            kill(child, SIGKILL);
            waitpid(child, &status, 0);
            return -2;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -3;
}

class PropertyTest : public ApiTest, public ::testing::WithParamInterface<PropertyCase> {};

TEST_P(PropertyTest, Verdict)
{
    const PropertyCase& row = GetParam();
    const bool file = row.target == Target::Movie || row.target == Target::Unreadable;
    std::string path = m_dir.File("movie.mov");
    if (file) {
        moviekit::MovieSpec recipe;
        if (row.edit != nullptr) {
            row.edit(recipe);
        }
        path = Write(recipe, "movie.mov");
    } else if (row.target == Target::Empty) {
        path.clear();
    } else if (row.target == Target::Directory) {
        path = m_dir.Path();
    }
    const FileStamp before = file ? StampFile(path) : FileStamp{};

    int result = -1;
    if (row.target == Target::Unreadable) {
        ASSERT_EQ(chmod(m_dir.Path().c_str(), 0755), 0);
        ASSERT_EQ(chmod(path.c_str(), 0), 0);
        result = geteuid() == 0 ? PropertyAsNobody(path) : TqGetPropertyOVIX(path.c_str());
        ASSERT_EQ(chmod(path.c_str(), 0644), 0);
    } else {
        result = TqGetPropertyOVIX(path.c_str());
    }
    EXPECT_EQ(result, row.expected);
    if (file) {
        EXPECT_EQ(StampFile(path), before);
    }
    EXPECT_EQ(TqIsFinishedOVIX(), 1);  // the query leaves the engine's state alone
}

INSTANTIATE_TEST_SUITE_P(
    Movies, PropertyTest,
    ::testing::Values(
        PropertyCase{"Accepted", Target::Movie, nullptr, 0},
        PropertyCase{"AlreadyProcessed", Target::Movie, [](moviekit::MovieSpec& r) { r.maker.afProcessed = true; },
                     20},
        PropertyCase{"AfIntervalsOverlap", Target::Movie,
                     [](moviekit::MovieSpec& r) {
                         r.maker.afIntervals = std::vector<moviekit::AfInterval>{{100, 400, 500}, {200, 300, 500}};
                     },
                     9},
        PropertyCase{"AfPayloadTooShort", Target::Movie,
                     [](moviekit::MovieSpec& r) { r.maker.afPayload = moviekit::Bytes{'A', 'F'}; }, 7},
        PropertyCase{"NoAfAtom", Target::Movie, [](moviekit::MovieSpec& r) { r.maker.afInformation = false; }, 8},
        PropertyCase{"WrongMajorBrand", Target::Movie, [](moviekit::MovieSpec& r) { r.majorBrand = "isom"; }, 8},
        PropertyCase{"Missing", Target::Missing, nullptr, 110},
        PropertyCase{"EmptyPath", Target::Empty, nullptr, 110},
        PropertyCase{"Directory", Target::Directory, nullptr, 190},
        PropertyCase{"Unreadable", Target::Unreadable, nullptr, 120}),
    [](const auto& info) { return std::string(info.param.name); });

}  // namespace
