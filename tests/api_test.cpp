// The exported interface as a host sees it: exports, the engine's lifecycle, the refusals
// of a job start and the property query, all through the eight exported functions.
#include "host/JobHarness.h"
#include "MakerInjector.h"

#include <grp.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <csignal>
#include <filesystem>
#include <set>
#include <sstream>
#include <thread>
#include <utility>

namespace {

using jobtest::Exists;
using jobtest::StampFile;
using Recipe = moviekit::MovieRecipe;

// Answers 131, which would end a job with 131 if a refused installation had got in.
std::atomic<int> g_callbackCalls{0};
int HostCallback(int, int) { ++g_callbackCalls; return 131; }

// Threads and open descriptors of this process.
std::pair<size_t, size_t> Census() { return {testsupport::ThreadCount(), testsupport::DescriptorCount()}; }

using ApiTest = jobtest::HostTest;

// About a minute of 48 kHz stereo PCM beside small frames: still running at the host's next call.
Recipe LongRecipe()
{
    Recipe recipe;
    recipe.video.width = recipe.video.height = 16;
    recipe.video.frameCount = 1800;
    return recipe;
}

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
    TqCloseOVIX();
    EXPECT_EQ(TqIsFinishedOVIX(), 190);
    EXPECT_EQ(TqGetPropertyOVIX(source.c_str()), 190);
    EXPECT_EQ(TqSetCallBackNotifyProgressOVIX(HostCallback), 190);
    EXPECT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 190);
    int first = -7;
    EXPECT_EQ(TqGetProgressOVIX(&first, nullptr), 190);
    EXPECT_EQ(first, -7);
    TqAbortOVIX();
    TqCloseOVIX();
    EXPECT_FALSE(Exists(destination));

    ASSERT_EQ(TqInitializeOVIX(), 0);
    EXPECT_EQ(Run(source, destination), 1);
    EXPECT_EQ(g_callbackCalls, 0);
}

// A failed start leaves its code (abort and a second initialisation keep it) and leaves
// what stood at the destination as it was.
TEST_F(ApiTest, IdleEngineAndRefusedStarts)
{
    EXPECT_EQ(TqIsFinishedOVIX(), 1);
    const std::string source = Write(Recipe{}, "src.mov");
    const auto before = StampFile(source);
    const std::string destination = m_dir.File("dst.mov");
    ASSERT_TRUE(testsupport::WriteFile(destination, {1, 2, 3}));
    EXPECT_EQ(TqExecuteOVIX(m_dir.File("absent.mov").c_str(), destination.c_str()), 110);
    EXPECT_EQ(testsupport::ReadFile(destination), (std::vector<uint8_t>{1, 2, 3}));
    TqAbortOVIX();
    EXPECT_EQ(TqInitializeOVIX(), 190);
    EXPECT_EQ(TqIsFinishedOVIX(), 110);

    EXPECT_EQ(TqExecuteOVIX(source.c_str(), m_dir.File("absent/dst.mov").c_str()), 111);
    EXPECT_EQ(TqIsFinishedOVIX(), 111);
    EXPECT_EQ(StampFile(source), before);
}

TEST_F(ApiTest, RepeatedCyclesReleaseThreadsAndDescriptors)
{
    const std::string source = Write(LongRecipe(), "long.mov");
    const std::string destination = m_dir.File("dst.mov");
    TqCloseOVIX();
    // Sanitizer runtimes start a helper thread with the first thread: start one first.
    std::thread([] {}).join();
    const std::pair<size_t, size_t> before = Census();

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
    const std::string source = Write(LongRecipe(), "long.mov");
    const std::string other = m_dir.File("other.mov");
    ASSERT_TRUE(testsupport::WriteFile(other, {1, 2, 3}));
    ASSERT_EQ(TqExecuteOVIX(source.c_str(), m_dir.File("dst.mov").c_str()), 0);
    EXPECT_EQ(TqSetCallBackNotifyProgressOVIX(HostCallback), 190);
    EXPECT_EQ(TqExecuteOVIX(source.c_str(), other.c_str()), 190);
    EXPECT_EQ(jobtest::WaitForJob(), 1);
    TqCloseOVIX();  // returns once the library's thread has left every callback
    EXPECT_EQ(g_callbackCalls, 0);
    EXPECT_EQ(testsupport::ReadFile(other), (std::vector<uint8_t>{1, 2, 3}));
}

// ---- A failed job costs no file ----

enum class Failure { MissingSource, DirectorySource, NotAMovie, ProcessedMovie, SameFile, SameFileRelative,
                     SameFileDotted, SameFileLinked, AbortHalfway, FullVolume };
struct FailedJob {
    const char* name;
    Failure failure;
    int expected;  // what the start answers, or else how the job ends
};
void PrintTo(const FailedJob& row, std::ostream* out) { *out << row.name; }

class FailedJobTest : public ApiTest, public ::testing::WithParamInterface<FailedJob> {};

std::atomic<bool> g_abortHalfway{false};
int AbortAtHalf(int done, int total)
{
    if (g_abortHalfway && total > 0 && done >= total / 2) {
        TqAbortOVIX();
    }
    return 0;
}

// The job in a child whose file size limit stands in for a full volume; its final state.
int RunWithFileSizeLimit(const std::string& source, const std::string& destination)
{
    const pid_t child = fork();
    if (child == 0) {
        signal(SIGXFSZ, SIG_IGN);
        const rlimit limit{64 * 1024, 64 * 1024};
        if (setrlimit(RLIMIT_FSIZE, &limit) != 0 || TqExecuteOVIX(source.c_str(), destination.c_str()) != 0) {
            _exit(250);
        }
        const int state = jobtest::WaitForJob();
        TqCloseOVIX();
        _exit(state < 0 ? 252 : state);
    }
    int status = 0;
    return child > 0 && waitpid(child, &status, 0) == child && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST_P(FailedJobTest, TheDestinationKeepsItsOldBytes)
{
    const FailedJob& row = GetParam();
    Recipe recipe = row.failure == Failure::AbortHalfway ? LongRecipe() : Recipe{};
    recipe.maker.afProcessed = row.failure == Failure::ProcessedMovie;
    std::string source = Write(recipe, "src.mov");
    std::string destination = m_dir.File("dst.mov");
    const std::vector<uint8_t> old = {'s', 'o', 'm', 'e', 'o', 'n', 'e', '\'', 's'};
    ASSERT_TRUE(testsupport::WriteFile(destination, old));
    switch (row.failure) {
    case Failure::MissingSource: source = m_dir.File("absent.mov"); break;
    case Failure::DirectorySource: source = m_dir.Path(); break;
    case Failure::NotAMovie: ASSERT_TRUE(testsupport::WriteFile(source, {'t', 'e', 'x', 't', '\n'})); break;
    case Failure::SameFile: destination = source; break;
    case Failure::SameFileRelative: destination = std::filesystem::relative(source).string(); break;
    case Failure::SameFileDotted: destination = m_dir.Path() + "/./src.mov"; break;
    case Failure::SameFileLinked:
        ASSERT_TRUE(std::filesystem::remove(destination));
        std::filesystem::create_symlink(source, destination);
        break;
    default: break;
    }
    const bool sourceIsFile = std::filesystem::is_regular_file(source);
    const auto sourceBefore = sourceIsFile ? StampFile(source) : jobtest::FileStamp{};
    const auto destinationBefore = StampFile(destination);
    int ended = 0;
    if (row.failure == Failure::FullVolume) {
        ended = RunWithFileSizeLimit(source, destination);
    } else {
        g_abortHalfway = row.failure == Failure::AbortHalfway;
        ASSERT_EQ(TqSetCallBackNotifyProgressOVIX(AbortAtHalf), 0);
        const int started = TqExecuteOVIX(source.c_str(), destination.c_str());
        ended = started != 0 ? started : jobtest::WaitForJob();
        g_abortHalfway = false;
    }
    EXPECT_EQ(ended, row.expected);
    EXPECT_EQ(StampFile(destination), destinationBefore);  // bytes and time
    EXPECT_EQ(sourceIsFile ? StampFile(source) : jobtest::FileStamp{}, sourceBefore);
    EXPECT_EQ(std::filesystem::is_symlink(destination), row.failure == Failure::SameFileLinked);
    // Nothing else new beside them.
    for (const auto& entry : std::filesystem::directory_iterator(m_dir.Path())) {
        const std::string name = entry.path().filename().string();
        EXPECT_TRUE(name == "src.mov" || name == "dst.mov") << name;
    }
}

INSTANTIATE_TEST_SUITE_P(Failures, FailedJobTest,
                         ::testing::Values(FailedJob{"MissingSource", Failure::MissingSource, 110},
                                           FailedJob{"DirectorySource", Failure::DirectorySource, 190},
                                           FailedJob{"NotAMovie", Failure::NotAMovie, 8},
                                           FailedJob{"ProcessedMovie", Failure::ProcessedMovie, 20},
                                           FailedJob{"SameFile", Failure::SameFile, 190},
                                           FailedJob{"SameFileRelative", Failure::SameFileRelative, 190},
                                           FailedJob{"SameFileDotted", Failure::SameFileDotted, 190},
                                           FailedJob{"SameFileLinked", Failure::SameFileLinked, 190},
                                           FailedJob{"AbortHalfway", Failure::AbortHalfway, 200},
                                           FailedJob{"FullVolume", Failure::FullVolume, 131}),
                         [](const ::testing::TestParamInfo<FailedJob>& info) { return std::string(info.param.name); });

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

struct PropertyRow {
    const char* name;
    void (*edit)(Recipe&);
    int expected;
};
void PrintTo(const PropertyRow& row, std::ostream* out) { *out << row.name; }

class PropertyVerdictTest : public ApiTest, public ::testing::WithParamInterface<PropertyRow> {};

TEST_P(PropertyVerdictTest, LeavesFileAndEngineAlone)
{
    Recipe recipe;
    GetParam().edit(recipe);
    const std::string path = Write(recipe, "movie.mov");
    const auto before = StampFile(path);
    EXPECT_EQ(TqGetPropertyOVIX(path.c_str()), GetParam().expected);
    EXPECT_EQ(StampFile(path), before);
    EXPECT_EQ(TqIsFinishedOVIX(), 1);
    // What the query promises, a job's start keeps: refused at once with the same code, or
    // started and ended with the library's verdict.
    const std::string destination = m_dir.File("out.mov");
    const int started = TqExecuteOVIX(path.c_str(), destination.c_str());
    if (GetParam().expected == 8) {
        EXPECT_EQ(started, 8);
    } else {
        ASSERT_EQ(started, 0);
        EXPECT_EQ(jobtest::WaitForJob(std::chrono::seconds(30)), GetParam().expected == 0 ? 1 : GetParam().expected);
    }
    EXPECT_EQ(jobtest::Exists(destination), GetParam().expected == 0);
}

INSTANTIATE_TEST_SUITE_P(
    Verdicts, PropertyVerdictTest,
    ::testing::Values(
        PropertyRow{"Camera", [](Recipe&) {}, 0},
        PropertyRow{"Processed", [](Recipe& r) { r.maker.afProcessed = true; }, 20},
        PropertyRow{"OverlappingIntervals",
                    [](Recipe& r) { r.maker.afIntervals = std::vector<moviekit::AfInterval>{{100, 400, 500}, {200, 300, 500}}; },
                    9},
        PropertyRow{"ShortAfBlock", [](Recipe& r) { r.maker.afPayload = moviekit::Bytes{'A', 'F'}; }, 7},
        PropertyRow{"NoAfBlock", [](Recipe& r) { r.maker.afInformation = false; }, 8},
        PropertyRow{"OtherBrand", [](Recipe& r) { r.majorBrand = "isom"; }, 8},
        PropertyRow{"NoTagAtom", [](Recipe& r) { r.maker.tagAtom = false; }, 8},
        PropertyRow{"NoTrimTags", [](Recipe& r) { r.maker.tags = std::vector<moviekit::Tag>{}; }, 8}),
    [](const ::testing::TestParamInfo<PropertyRow>& info) { return std::string(info.param.name); });

TEST_F(ApiTest, PropertyQueryNamesMissingDirectoryAndUnreadable)
{
    EXPECT_EQ(TqGetPropertyOVIX(m_dir.File("absent.mov").c_str()), 110);
    EXPECT_EQ(TqGetPropertyOVIX(m_dir.Path().c_str()), 190);

    const std::string locked = Write(Recipe{}, "locked.mov");
    ASSERT_EQ(chmod(m_dir.Path().c_str(), 0755) | chmod(locked.c_str(), 0), 0);
    EXPECT_EQ(geteuid() == 0 ? PropertyAsNobody(locked) : TqGetPropertyOVIX(locked.c_str()), 120);
}

}  // namespace

namespace {

// What a host may rely on around its own process: its working directory stays where it is,
// a movie whose AF block is far too large is refused before it is loaded, and setting the
// progress callback while jobs end is safe (ThreadSanitizer watches this one).
TEST_F(ApiTest, TheHostsProcessIsLeftAlone)
{
    const std::filesystem::path before = std::filesystem::current_path();
    const std::string movie = Write(Recipe{}, "movie.mov");
    for (const std::string& path : {m_dir.Path(), std::string("/usr/share"), movie, m_dir.File("absent.mov")}) {
        TqGetPropertyOVIX(path.c_str());
        EXPECT_EQ(std::filesystem::current_path(), before) << "after asking about " << path;
    }

    Recipe huge;
    huge.maker.afPayload = moviekit::Bytes(20u << 20, 0x41);  // past the processing library's 16 MiB
    const std::string hugeMovie = Write(huge, "huge.mov");
    EXPECT_EQ(TqGetPropertyOVIX(hugeMovie.c_str()), 8);
    EXPECT_EQ(TqExecuteOVIX(hugeMovie.c_str(), m_dir.File("huge-out.mov").c_str()), 8);
    EXPECT_FALSE(Exists(m_dir.File("huge-out.mov")));

    Recipe shortMovie;
    shortMovie.video.frameCount = 10;
    const std::string source = Write(shortMovie, "short.mov");
    g_callbackCalls = 0;
    std::atomic<bool> stop{false};
    std::atomic<long> settings{0};
    std::atomic<long> refusedSettings{0};
    std::thread setter([&] {
        while (!stop) {
            // Refused while a job runs (190), accepted between jobs (0); nothing else.
            for (auto callback : {HostCallback, static_cast<int (*)(int, int)>(nullptr)}) {
                const int result = TqSetCallBackNotifyProgressOVIX(callback);
                ++(result == 0 ? settings : refusedSettings);
                if (result != 0 && result != 190) {
                    ADD_FAILURE() << "setting the callback answered " << result;
                }
            }
        }
    });
    // The jobs start once the setter is at work, and it works until they are all done.
    while (settings + refusedSettings == 0) {
        std::this_thread::yield();
    }
    int done = 0;
    int answered = 0;
    for (int job = 0; job < 10; ++job) {
        const std::string destination = m_dir.File("out" + std::to_string(job) + ".mov");
        ASSERT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 0);
        // Done, or ended by the callback's answer when it was installed as the job began.
        const int result = jobtest::WaitForJob();
        if (result == 1) {
            ++done;
            EXPECT_EQ(TqGetPropertyOVIX(destination.c_str()), 20) << "job " << job;
        } else {
            ++answered;
            EXPECT_EQ(result, 131) << "job " << job;
            EXPECT_FALSE(Exists(destination)) << "job " << job;
        }
    }
    stop = true;
    setter.join();
    EXPECT_EQ(done + answered, 10);
    EXPECT_GT(settings + refusedSettings, 0);
    // A job that the callback ended heard from it.
    EXPECT_GE(g_callbackCalls.load(), answered);
}

}  // namespace

namespace {

// ---- Movies edited byte by byte: forms other writers make ----

using Bytes = std::vector<uint8_t>;

using testsupport::GetBE32;
using testsupport::PutBE32;
using testsupport::Shell;

struct Node {
    size_t offset;
    size_t size;
    size_t header;
    std::string type;
    int parent;
};

// The atoms of the movie's tree down to the sample entries and what they hold.
void Walk(const Bytes& b, size_t begin, size_t end, int parent, std::vector<Node>& out)
{
    for (size_t at = begin; at + 8 <= end;) {
        uint64_t size = GetBE32(b, at);
        size_t header = 8;
        if (size == 1) {
            size = uint64_t{GetBE32(b, at + 8)} << 32 | GetBE32(b, at + 12);
            header = 16;
        } else if (size == 0) {
            size = end - at;
        }
        if (size < header || size > end - at) {
            return;
        }
        const std::string type(b.begin() + static_cast<std::ptrdiff_t>(at + 4), b.begin() + static_cast<std::ptrdiff_t>(at + 8));
        const int self = static_cast<int>(out.size());
        out.push_back({at, static_cast<size_t>(size), header, type, parent});
        size_t inner = 0;
        if (type == "moov" || type == "trak" || type == "mdia" || type == "minf" || type == "stbl" || type == "wave") {
            inner = header;
        } else if (type == "stsd") {
            inner = header + 8;
        } else if (parent >= 0 && out[static_cast<size_t>(parent)].type == "stsd" && size >= header + 28) {
            const unsigned version = b[at + header + 8] << 8 | b[at + header + 9];
            inner = header + 28 + (version == 1 ? 16 : version == 2 ? 36 : 0);
        }
        if (inner != 0 && inner <= size) {
            Walk(b, at + inner, at + size, self, out);
        }
        at += size;
    }
}

std::vector<Node> Tree(const Bytes& b)
{
    std::vector<Node> nodes;
    Walk(b, 0, b.size(), -1, nodes);
    return nodes;
}

// The first atom of `type` inside the sound track (the one with an "smhd").
int SoundAtom(const std::vector<Node>& nodes, const std::string& type)
{
    int soundTrack = -1;
    for (const Node& node : nodes) {
        if (node.type == "smhd") {
            for (int up = node.parent; up >= 0 && soundTrack < 0; up = nodes[static_cast<size_t>(up)].parent) {
                soundTrack = nodes[static_cast<size_t>(up)].type == "trak" ? up : -1;
            }
            break;
        }
    }
    for (size_t k = 0; k < nodes.size() && soundTrack >= 0; ++k) {
        int up = nodes[k].parent;
        while (up >= 0 && up != soundTrack) {
            up = nodes[static_cast<size_t>(up)].parent;
        }
        if (up == soundTrack && nodes[k].type == type) {
            return static_cast<int>(k);
        }
    }
    return -1;
}

// Gives atom `index` a new payload; every atom around it grows or shrinks with it. The movie
// atom must come after the media, so that no chunk moves.
void ReplacePayload(Bytes& b, const std::vector<Node>& nodes, int index, const Bytes& payload)
{
    const Node& node = nodes[static_cast<size_t>(index)];
    const auto delta = static_cast<int64_t>(payload.size()) - static_cast<int64_t>(node.size - node.header);
    const auto begin = b.begin() + static_cast<std::ptrdiff_t>(node.offset + node.header);
    b.erase(begin, begin + static_cast<std::ptrdiff_t>(node.size - node.header));
    b.insert(b.begin() + static_cast<std::ptrdiff_t>(node.offset + node.header), payload.begin(), payload.end());
    for (int up = index; up >= 0; up = nodes[static_cast<size_t>(up)].parent) {
        const Node& around = nodes[static_cast<size_t>(up)];
        ASSERT_EQ(around.header, 8u) << around.type;
        PutBE32(b, around.offset, static_cast<uint32_t>(static_cast<int64_t>(around.size) + delta));
    }
}

bool MoovIsLast(const std::vector<Node>& nodes)
{
    size_t moov = 0;
    size_t media = 0;
    for (const Node& node : nodes) {
        moov = node.parent < 0 && node.type == "moov" ? node.offset : moov;
        media = node.parent < 0 && node.type == "mdat" ? std::max(media, node.offset) : media;
    }
    return moov > media;
}

// A descriptor list with every size written in `width` bytes (ES and decoder-configuration
// descriptors hold more descriptors after their fixed fields).
Bytes Resized(const Bytes& in, size_t at, size_t end, int width)
{
    Bytes out;
    while (at < end) {
        const uint8_t tag = in[at++];
        size_t size = 0;
        for (int k = 0; k < 4; ++k) {
            const uint8_t byte = in[at++];
            size = size << 7 | (byte & 0x7F);
            if ((byte & 0x80) == 0) {
                break;
            }
        }
        const size_t fixed = tag == 3 ? 3 : tag == 4 ? 13 : size;
        EXPECT_TRUE(tag != 3 || in[at + 2] == 0) << "ES flags the edit does not expect";
        Bytes body(in.begin() + static_cast<std::ptrdiff_t>(at), in.begin() + static_cast<std::ptrdiff_t>(at + fixed));
        const Bytes inner = Resized(in, at + fixed, at + size, width);
        body.insert(body.end(), inner.begin(), inner.end());
        out.push_back(tag);
        for (int k = width - 1; k >= 0; --k) {
            out.push_back(static_cast<uint8_t>(((body.size() >> (7 * k)) & 0x7F) | (k > 0 ? 0x80 : 0)));
        }
        out.insert(out.end(), body.begin(), body.end());
        at += size;
    }
    return out;
}

// A track of near silence averages a few kb/s, below what any encoder takes: the job
// re-encodes at a usable rate instead of refusing what the query accepted.
TEST_F(ApiTest, AacOfNearSilenceIsProcessed)
{
    const std::string source = m_dir.File("quiet.mov");
    ASSERT_EQ(Shell("ffmpeg -v error -nostdin -y -f lavfi -i testsrc=size=64x36:rate=30:d=2 -f lavfi -i "
                    "anullsrc=r=48000:cl=mono -t 2 -map 0:v -map 1:a -c:v mjpeg -c:a aac " +
                    testsupport::ShellQuote(source)),
              "");
    std::string rate;
    ASSERT_EQ(testsupport::RunCommand("ffprobe -v error -select_streams a -show_entries stream=bit_rate -of csv=p=0 " +
                                          testsupport::ShellQuote(source),
                                      &rate),
              0);
    ASSERT_LT(std::stol(rate), 8000) << "the source must average below the encoder's lowest rate";
    Recipe recipe;
    std::string error;
    ASSERT_TRUE(moviekit::AddMakerData(source, recipe, 48000, &error)) << error;
    ASSERT_EQ(TqGetPropertyOVIX(source.c_str()), 0);
    const std::string destination = m_dir.File("out.mov");
    EXPECT_EQ(Run(source, destination), 1);
    EXPECT_EQ(jobtest::ProbeErrors(destination), "");
    EXPECT_EQ(TqGetPropertyOVIX(destination.c_str()), 20);
}

// Another muxer's esds: sizes in the two-byte form 80 NN. ffprobe still reads the movie,
// and the library takes and processes it.
TEST_F(ApiTest, AacWithTwoByteDescriptorSizes)
{
    const std::string source = m_dir.File("aac.mov");
    ASSERT_EQ(Shell("ffmpeg -v error -nostdin -y -f lavfi -i testsrc=size=64x36:rate=30:d=2 -f lavfi -i "
                    "\"sine=frequency=700:sample_rate=48000:d=2\" -map 0:v -map 1:a -c:v mjpeg -c:a aac -ac 2 " +
                    testsupport::ShellQuote(source)),
              "");
    Recipe recipe;
    std::string error;
    ASSERT_TRUE(moviekit::AddMakerData(source, recipe, 96000, &error)) << error;
    Bytes movie = testsupport::ReadFile(source);
    std::vector<Node> nodes = Tree(movie);
    ASSERT_TRUE(MoovIsLast(nodes));
    const int esds = SoundAtom(nodes, "esds");
    ASSERT_GE(esds, 0);
    const Node& atom = nodes[static_cast<size_t>(esds)];
    const size_t payload = atom.offset + atom.header;
    Bytes rewritten(movie.begin() + static_cast<std::ptrdiff_t>(payload), movie.begin() + static_cast<std::ptrdiff_t>(payload + 4));
    const Bytes descriptors = Resized(movie, payload + 4, atom.offset + atom.size, 2);
    rewritten.insert(rewritten.end(), descriptors.begin(), descriptors.end());
    ASSERT_LT(rewritten.size(), atom.size - atom.header) << "the sizes were not written shorter";
    ASSERT_EQ(rewritten[5], 0x80) << "the ES descriptor's size in two bytes";
    ReplacePayload(movie, nodes, esds, rewritten);
    ASSERT_EQ(SoundAtom(Tree(movie), "esds"), esds) << "the edited tree no longer reads";
    ASSERT_TRUE(testsupport::WriteFile(source, movie));
    ASSERT_EQ(jobtest::ProbeErrors(source), "");
    std::vector<int16_t> sound;
    ASSERT_TRUE(jobtest::DecodeSound(source, sound)) << "ffmpeg no longer decodes the edited movie";
    ASSERT_FALSE(sound.empty());

    EXPECT_EQ(TqGetPropertyOVIX(source.c_str()), 0);
    const std::string destination = m_dir.File("processed.mov");
    ASSERT_EQ(Run(source, destination), 1);
    EXPECT_EQ(jobtest::ProbeErrors(destination), "");
    EXPECT_EQ(jobtest::PacketCount(destination, "a:0"), jobtest::PacketCount(source, "a:0"));
}

// A sound chunk that holds no samples (a muxer's empty interleave slot): the property query's
// verdict and the job's outcome agree.
class EmptyChunkTest : public ApiTest, public ::testing::WithParamInterface<moviekit::SoundCodec> {};

TEST_P(EmptyChunkTest, QueryAndJobAgree)
{
    Recipe recipe;
    recipe.sound.codec = GetParam();
    recipe.video.frameCount = 90;
    const std::string source = Write(recipe, "src.mov");
    Bytes movie = testsupport::ReadFile(source);
    std::vector<Node> nodes = Tree(movie);
    ASSERT_TRUE(MoovIsLast(nodes));
    const int stsc = SoundAtom(nodes, "stsc");
    const int stco = SoundAtom(nodes, "stco");
    ASSERT_TRUE(stsc >= 0 && stco >= 0);
    const auto payloadOf = [&](int index) {
        const Node& node = nodes[static_cast<size_t>(index)];
        return Bytes(movie.begin() + static_cast<std::ptrdiff_t>(node.offset + node.header),
                     movie.begin() + static_cast<std::ptrdiff_t>(node.offset + node.size));
    };
    const Bytes runs = payloadOf(stsc);
    const Bytes offsets = payloadOf(stco);
    const uint32_t chunks = GetBE32(offsets, 4);
    ASSERT_GE(chunks, 3u);
    std::vector<uint32_t> counts(chunks);
    for (uint32_t r = 0, entries = GetBE32(runs, 4); r < entries; ++r) {
        const uint32_t first = GetBE32(runs, 8 + 12 * r);
        const uint32_t next = r + 1 < entries ? GetBE32(runs, 8 + 12 * (r + 1)) : chunks + 1;
        for (uint32_t c = first; c < next; ++c) {
            counts[c - 1] = GetBE32(runs, 8 + 12 * r + 4);
        }
    }
    // An empty chunk between the first and the second, where the second begins.
    counts.insert(counts.begin() + 1, 0);
    Bytes newOffsets(8 + 4 * (chunks + 1));
    PutBE32(newOffsets, 4, chunks + 1);
    for (uint32_t c = 0; c <= chunks; ++c) {
        const uint32_t from = c <= 1 ? c : c - 1;
        PutBE32(newOffsets, 8 + 4 * c, GetBE32(offsets, 8 + 4 * from));
    }
    Bytes newRuns(8);
    uint32_t entries = 0;
    for (uint32_t c = 0; c < counts.size(); ++c) {
        if (c == 0 || counts[c] != counts[c - 1]) {
            newRuns.resize(newRuns.size() + 12);
            PutBE32(newRuns, newRuns.size() - 12, c + 1);
            PutBE32(newRuns, newRuns.size() - 8, counts[c]);
            PutBE32(newRuns, newRuns.size() - 4, 1);
            ++entries;
        }
    }
    PutBE32(newRuns, 4, entries);
    ReplacePayload(movie, nodes, stco, newOffsets);
    nodes = Tree(movie);  // the atoms around have new sizes
    ReplacePayload(movie, nodes, SoundAtom(nodes, "stsc"), newRuns);
    ASSERT_TRUE(testsupport::WriteFile(source, movie));

    const int promised = TqGetPropertyOVIX(source.c_str());
    const std::string destination = m_dir.File("dst.mov");
    const int ended = Run(source, destination);
    EXPECT_EQ(ended, promised == 0 ? 1 : promised) << "the query promised " << promised;
    // Uncompressed sound passes an empty chunk by; the AAC writer cannot, and the query says so.
    const bool aac = GetParam() == moviekit::SoundCodec::Aac;
    EXPECT_EQ(promised, aac ? 8 : 0);
    if (ended == 1) {
        EXPECT_EQ(jobtest::ProbeErrors(destination), "");
        EXPECT_EQ(jobtest::PacketCount(destination, "a:0"), jobtest::PacketCount(source, "a:0"));
    } else {
        EXPECT_FALSE(Exists(destination));
    }
}

INSTANTIATE_TEST_SUITE_P(Codecs, EmptyChunkTest,
                         ::testing::Values(moviekit::SoundCodec::Aac, moviekit::SoundCodec::Sowt),
                         [](const auto& info) { return std::string(info.param == moviekit::SoundCodec::Aac ? "aac" : "sowt"); });

}  // namespace
