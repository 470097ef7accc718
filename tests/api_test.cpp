// The exported interface as a host sees it: what the library exports, the engine's
// lifecycle, the refusals of a job start, abort and the host's progress callback, and the
// property query. Everything goes through the eight exported functions.
#include "host/JobHarness.h"

#include <grp.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <iterator>
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
using Recipe = moviekit::MovieRecipe;

// The host's progress callback: what it answers and what it was shown.
std::mutex g_callbackMutex;
std::vector<std::pair<int, int>> g_callbackSeen;
std::atomic<int> g_callbackAnswer{0};

int HostCallback(int first, int second)
{
    std::lock_guard lock(g_callbackMutex);
    g_callbackSeen.emplace_back(first, second);
    return g_callbackAnswer.load();
}

std::vector<std::pair<int, int>> CallbackSeen()
{
    std::lock_guard lock(g_callbackMutex);
    return g_callbackSeen;
}

// Threads and open descriptors of this process.
std::pair<long, long> Census()
{
    using std::filesystem::directory_iterator;
    return {std::distance(directory_iterator("/proc/self/task"), directory_iterator()),
            std::distance(directory_iterator("/proc/self/fd"), directory_iterator())};
}

class ApiTest : public jobtest::HostTest {
protected:
    void SetUp() override
    {
        HostTest::SetUp();
        std::lock_guard lock(g_callbackMutex);
        g_callbackSeen.clear();
        g_callbackAnswer.store(0);
    }

    // About a minute of 48 kHz stereo PCM beside small frames: a job on it is still
    // running when the host's next call arrives.
    std::string WriteLong(const std::string& name)
    {
        Recipe recipe;
        recipe.video.width = 16;
        recipe.video.height = 16;
        recipe.video.frameCount = 1800;
        return Write(recipe, name);
    }
};

TEST(ApiExports, OnlyTheEightFunctionsAndTheEnginePointer)
{
    ASSERT_TRUE(testsupport::HaveCommand("nm"));
    std::string output;
    ASSERT_EQ(testsupport::RunCommand("nm -D --defined-only " + testsupport::ShellQuote(TQOVIX_UTILITY_FILE), &output),
              0);
    std::set<std::string> names;
    std::istringstream lines(output);
    for (std::string line; std::getline(lines, line);) {
        names.insert(line.substr(line.find_last_of(' ') + 1));  // the name is the last field
    }
    const std::set<std::string> expected = {"TqInitializeOVIX", "TqCloseOVIX", "TqGetPropertyOVIX",
                                            "TqSetCallBackNotifyProgressOVIX", "TqExecuteOVIX", "TqIsFinishedOVIX",
                                            "TqAbortOVIX", "TqGetProgressOVIX", "g_pMainFrame"};
    EXPECT_EQ(names, expected) << output;
}

TEST_F(ApiTest, WithoutAnEngineEveryCallIsRefusedAndCloseIsHarmless)
{
    const std::string source = Write(Recipe{}, "src.mov");
    const std::string destination = m_dir.File("dst.mov");
    const FileStamp before = StampFile(source);
    TqCloseOVIX();

    g_callbackAnswer.store(131);  // would end the job below with 131 if it were ever installed
    EXPECT_EQ(TqIsFinishedOVIX(), 190);
    EXPECT_EQ(TqGetPropertyOVIX(source.c_str()), 190);
    EXPECT_EQ(TqSetCallBackNotifyProgressOVIX(HostCallback), 190);
    EXPECT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 190);
    int first = -7, second = -7;
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

// A failed start leaves its code (abort and a second initialisation keep it) and removes
// what stood at the destination; the engine still takes the next job.
TEST_F(ApiTest, IdleEngineAndRefusedStarts)
{
    EXPECT_EQ(TqIsFinishedOVIX(), 1);
    EXPECT_EQ(TqGetProgressOVIX(nullptr, nullptr), 0);
    int first = -7, second = -7;
    EXPECT_EQ(TqGetProgressOVIX(&first, nullptr), 0);
    EXPECT_EQ(TqGetProgressOVIX(nullptr, &second), 0);
    EXPECT_EQ(first, 0);
    EXPECT_EQ(second, 0);
    TqAbortOVIX();
    EXPECT_EQ(TqIsFinishedOVIX(), 1);

    const std::string source = Write(Recipe{}, "src.mov");
    const FileStamp before = StampFile(source);
    const std::string destination = m_dir.File("dst.mov");
    ASSERT_TRUE(testsupport::WriteFile(destination, {1, 2, 3}));
    EXPECT_EQ(TqExecuteOVIX(m_dir.File("absent.mov").c_str(), destination.c_str()), 110);
    EXPECT_FALSE(Exists(destination));
    TqAbortOVIX();
    EXPECT_EQ(TqIsFinishedOVIX(), 110);
    EXPECT_EQ(TqInitializeOVIX(), 190);
    EXPECT_EQ(TqIsFinishedOVIX(), 110);

    const std::string inAbsentDirectory = m_dir.File("absent/dst.mov");
    EXPECT_EQ(TqExecuteOVIX(source.c_str(), inAbsentDirectory.c_str()), 111);
    EXPECT_EQ(TqIsFinishedOVIX(), 111);
    EXPECT_FALSE(Exists(inAbsentDirectory));
    EXPECT_EQ(StampFile(source), before);

    EXPECT_EQ(Run(source, destination), 1);
    TqAbortOVIX();
    EXPECT_EQ(TqIsFinishedOVIX(), 1);
    EXPECT_TRUE(Exists(destination));
}

TEST_F(ApiTest, RepeatedCyclesReleaseThreadsAndDescriptors)
{
    const std::string source = WriteLong("long.mov");
    const std::string destination = m_dir.File("dst.mov");
    TqCloseOVIX();
    // Sanitizer runtimes start a helper thread with the first thread: start one first.
    std::thread([] {}).join();
    const std::pair<long, long> before = Census();

    for (int cycle = 0; cycle < 200; ++cycle) {
        ASSERT_EQ(TqInitializeOVIX(), 0) << "cycle " << cycle;
        if (cycle % 4 == 0) {
            ASSERT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 0) << "cycle " << cycle;
        }
        TqCloseOVIX();
        ASSERT_FALSE(Exists(destination)) << "cycle " << cycle;
    }

    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (Census() != before && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    EXPECT_EQ(Census(), before) << "threads, descriptors";
}

TEST_F(ApiTest, SecondJobAndCallbackAreRefusedWhileOneRuns)
{
    const std::string source = WriteLong("long.mov");
    const std::string destination = m_dir.File("dst.mov");
    const std::string other = m_dir.File("other.mov");
    const std::vector<uint8_t> otherBytes = {1, 2, 3};
    ASSERT_TRUE(testsupport::WriteFile(other, otherBytes));
    g_callbackAnswer.store(131);  // ends the job with 131 if the refused callback got in
    ASSERT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 0);
    EXPECT_EQ(TqSetCallBackNotifyProgressOVIX(HostCallback), 190);
    EXPECT_EQ(TqSetCallBackNotifyProgressOVIX(nullptr), 190);
    EXPECT_EQ(TqExecuteOVIX(source.c_str(), other.c_str()), 190);
    EXPECT_EQ(WaitForJob(), 1);
    TqCloseOVIX();  // returns once the library's thread has left every callback
    EXPECT_TRUE(CallbackSeen().empty());
    EXPECT_TRUE(Exists(destination));
    EXPECT_EQ(testsupport::ReadFile(other), otherBytes);
}

TEST_F(ApiTest, SameFileUnderAnySpellingIsRefused)
{
    const std::string source = Write(Recipe{}, "src.mov");
    const FileStamp before = StampFile(source);
    const std::string link = m_dir.File("link.mov");
    ASSERT_EQ(symlink(source.c_str(), link.c_str()), 0);
    for (const std::string& destination :
         {source, std::filesystem::relative(source).string(), m_dir.Path() + "/./src.mov", link}) {
        SCOPED_TRACE(destination);
        EXPECT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 190);
        EXPECT_EQ(TqIsFinishedOVIX(), 190);
        EXPECT_EQ(StampFile(source), before);
        EXPECT_TRUE(std::filesystem::is_symlink(link));
    }
}

// Answers other than 0 are judged with whole jobs (job suite) and the scripted library
// (engine suite); here the host sees the progress of a job it lets run.
TEST_F(ApiTest, CallbackSeesRisingProgress)
{
    moviekit::MovieLayout layout;
    const std::string source = Write(Recipe{}, "src.mov", &layout);
    ASSERT_EQ(TqSetCallBackNotifyProgressOVIX(HostCallback), 0);
    EXPECT_EQ(Run(source, m_dir.File("dst.mov")), 1);
    TqCloseOVIX();  // returns once the library's thread has left every callback
    const std::vector<std::pair<int, int>> seen = CallbackSeen();
    const int total = static_cast<int>(layout.soundSampleCount);
    ASSERT_GE(seen.size(), 2u);
    for (size_t k = 0; k < seen.size(); ++k) {
        EXPECT_EQ(seen[k].second, total) << "call " << k;
        EXPECT_GE(seen[k].first, k > 0 ? seen[k - 1].first : 0) << "call " << k;
    }
    EXPECT_EQ(seen.back().first, total);
}

// Runs the query in a child process that has given up root, so that file modes apply.
int PropertyAsNobody(const std::string& path)
{
    const pid_t child = fork();
    if (child == 0) {
        alarm(60);  // a hung query ends the child, so the wait below is bounded
        if (setgroups(0, nullptr) != 0 || setgid(65534) != 0 || setuid(65534) != 0) {
            _exit(251);
        }
        _exit(access(path.c_str(), R_OK) == 0 ? 252 : TqGetPropertyOVIX(path.c_str()));
    }
    int status = 0;
    return child > 0 && waitpid(child, &status, 0) == child && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST_F(ApiTest, PropertyVerdictsLeaveFileAndEngineAlone)
{
    const std::pair<void (*)(Recipe&), int> movies[] = {
        {[](Recipe&) {}, 0},
        {[](Recipe& r) { r.maker.afProcessed = true; }, 20},
        {[](Recipe& r) { r.maker.afIntervals = std::vector<moviekit::AfInterval>{{100, 400, 500}, {200, 300, 500}}; },
         9},  // overlapping intervals
        {[](Recipe& r) { r.maker.afPayload = moviekit::Bytes{'A', 'F'}; }, 7},
        {[](Recipe& r) { r.maker.afInformation = false; }, 8},
        {[](Recipe& r) { r.majorBrand = "isom"; }, 8},
    };
    int row = 0;
    for (const auto& [edit, expected] : movies) {
        SCOPED_TRACE(row);
        Recipe recipe;
        edit(recipe);
        const std::string path = Write(recipe, "movie" + std::to_string(row++) + ".mov");
        const FileStamp before = StampFile(path);
        EXPECT_EQ(TqGetPropertyOVIX(path.c_str()), expected);
        EXPECT_EQ(StampFile(path), before);
        EXPECT_EQ(TqIsFinishedOVIX(), 1);
    }
    EXPECT_EQ(TqGetPropertyOVIX(m_dir.File("absent.mov").c_str()), 110);
    EXPECT_EQ(TqGetPropertyOVIX(""), 110);
    EXPECT_EQ(TqGetPropertyOVIX(m_dir.Path().c_str()), 190);

    const std::string locked = Write(Recipe{}, "locked.mov");
    ASSERT_EQ(chmod(m_dir.Path().c_str(), 0755), 0);
    ASSERT_EQ(chmod(locked.c_str(), 0), 0);
    EXPECT_EQ(geteuid() == 0 ? PropertyAsNobody(locked) : TqGetPropertyOVIX(locked.c_str()), 120);
    EXPECT_EQ(TqIsFinishedOVIX(), 1);
}

}  // namespace
