// The exported interface as a host sees it: exports, the engine's lifecycle, the refusals
// of a job start and the property query, all through the eight exported functions.
#include "host/JobHarness.h"
#include "MakerInjector.h"

#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <csignal>
#include <filesystem>
#include <set>
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
using testsupport::PrintTo;

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
    EXPECT_EQ(testsupport::ExportedNames(TQOVIX_UTILITY_FILE),
              (std::set<std::string>{"TqInitializeOVIX", "TqCloseOVIX", "TqGetPropertyOVIX",
                                     "TqSetCallBackNotifyProgressOVIX", "TqExecuteOVIX", "TqIsFinishedOVIX",
                                     "TqAbortOVIX", "TqGetProgressOVIX", "g_pMainFrame"}));
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

enum class Failure { MissingSource, DirectorySource, NotAMovie, ProcessedMovie, SameFile, SameFileLinked,
                     AbortHalfway, FullVolume };
struct FailedJob {
    const char* name;
    Failure failure;
    int expected;  // what the start answers, or else how the job ends
};

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
    return testsupport::InChild([&] {
        signal(SIGXFSZ, SIG_IGN);
        const rlimit limit{64 * 1024, 64 * 1024};
        if (setrlimit(RLIMIT_FSIZE, &limit) != 0 || TqExecuteOVIX(source.c_str(), destination.c_str()) != 0) {
            return 250;
        }
        const int state = jobtest::WaitForJob();
        TqCloseOVIX();
        return state;
    }).value_or(-1);
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
                                           FailedJob{"SameFileLinked", Failure::SameFileLinked, 190},
                                           FailedJob{"AbortHalfway", Failure::AbortHalfway, 200},
                                           FailedJob{"FullVolume", Failure::FullVolume, 131}), testsupport::ByName);

// Runs the query in a child process that has given up root, so that file modes apply.
int PropertyAsNobody(const std::string& path)
{
    return testsupport::InChild([&] {
        return !testsupport::DropRoot() ? 251 : access(path.c_str(), R_OK) == 0 ? 252 : TqGetPropertyOVIX(path.c_str());
    }, 60).value_or(-1);
}

struct PropertyRow {
    const char* name;
    void (*edit)(Recipe&);
    int expected;
};

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
    testsupport::ByName);

TEST_F(ApiTest, PropertyQueryNamesMissingDirectoryAndUnreadable)
{
    EXPECT_EQ(TqGetPropertyOVIX(m_dir.File("absent.mov").c_str()), 110);
    EXPECT_EQ(TqGetPropertyOVIX(m_dir.Path().c_str()), 190);

    const std::string locked = Write(Recipe{}, "locked.mov");
    ASSERT_EQ(chmod(m_dir.Path().c_str(), 0755) | chmod(locked.c_str(), 0), 0);
    EXPECT_EQ(geteuid() == 0 ? PropertyAsNobody(locked) : TqGetPropertyOVIX(locked.c_str()), 120);
}

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

using Bytes = std::vector<uint8_t>;

// A track of near silence averages a few kb/s, below what any encoder takes: the job
// re-encodes at a usable rate instead of refusing what the query accepted.
TEST_F(ApiTest, AacOfNearSilenceIsProcessed)
{
    const std::string source = m_dir.File("quiet.mov");
    ASSERT_EQ(testsupport::Shell("ffmpeg -v error -nostdin -y -f lavfi -i testsrc=size=64x36:rate=30:d=2 -f lavfi -i "
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

struct Node {
    size_t offset, size;
    std::string type;
    int parent;
};

// The atoms down to the sample tables, each with the index of the one around it.
void Walk(const Bytes& b, size_t begin, size_t end, int parent, std::vector<Node>& out)
{
    for (size_t at = begin; at + 8 <= end;) {
        const size_t size = testsupport::GetBE32(b, at);
        if (size < 8 || size > end - at) {
            return;
        }
        const std::string type(b.begin() + static_cast<std::ptrdiff_t>(at + 4), b.begin() + static_cast<std::ptrdiff_t>(at + 8));
        out.push_back({at, size, type, parent});
        if (type == "moov" || type == "trak" || type == "mdia" || type == "minf" || type == "stbl") {
            Walk(b, at + 8, at + size, static_cast<int>(out.size()) - 1, out);
        }
        at += size;
    }
}

// Gives the sound track's atom `type` a new payload; every atom around it grows or shrinks
// with it. The movie atom must come after the media, so that no chunk moves.
void ReplaceInSoundTrack(Bytes& b, const std::string& type, const Bytes& payload)
{
    std::vector<Node> nodes;
    Walk(b, 0, b.size(), -1, nodes);
    const auto soundTable = [&](const Node& n) {
        const int minf = n.parent < 0 ? -1 : nodes[static_cast<size_t>(n.parent)].parent;
        return n.type == type && std::ranges::any_of(nodes, [&](const Node& m) { return m.parent == minf && m.type == "smhd"; });
    };
    const auto found = std::ranges::find_if(nodes, soundTable);
    ASSERT_NE(found, nodes.end()) << type;
    const auto delta = static_cast<int64_t>(payload.size()) - static_cast<int64_t>(found->size - 8);
    const auto begin = b.begin() + static_cast<std::ptrdiff_t>(found->offset + 8);
    b.insert(b.erase(begin, begin + static_cast<std::ptrdiff_t>(found->size - 8)), payload.begin(), payload.end());
    for (int up = static_cast<int>(found - nodes.begin()); up >= 0; up = nodes[static_cast<size_t>(up)].parent) {
        const Node& around = nodes[static_cast<size_t>(up)];
        testsupport::PutBE32(b, around.offset, static_cast<uint32_t>(static_cast<int64_t>(around.size) + delta));
    }
}

// A sound chunk that holds no samples (a muxer's empty interleave slot): the property query's
// verdict and the job's outcome agree.
class EmptyChunkTest : public ApiTest, public ::testing::WithParamInterface<moviekit::SoundCodec> {};

TEST_P(EmptyChunkTest, QueryAndJobAgree)
{
    Recipe recipe;
    recipe.sound.codec = GetParam();
    recipe.video.frameCount = 90;
    moviekit::MovieLayout layout;
    const std::string source = Write(recipe, "src.mov", &layout);
    ASSERT_GE(layout.soundChunks.size(), 3u);
    ASSERT_GT(layout.moovOffset, layout.mdatOffsets.back());
    // An empty chunk between the first and the second, where the second begins.
    std::vector<moviekit::ChunkLayout> chunks = layout.soundChunks;
    chunks.insert(chunks.begin() + 1, moviekit::ChunkLayout{chunks[1].offset, 0, 0, 0, {}});
    Bytes offsets(8), runs(8);
    for (size_t c = 0; c < chunks.size(); ++c) {
        moviekit::PutU32(offsets, static_cast<uint32_t>(chunks[c].offset));
        if (c == 0 || chunks[c].sampleCount != chunks[c - 1].sampleCount) {
            for (uint32_t field : {static_cast<uint32_t>(c + 1), chunks[c].sampleCount, 1u}) {
                moviekit::PutU32(runs, field);
            }
        }
    }
    testsupport::PutBE32(offsets, 4, static_cast<uint32_t>(chunks.size()));
    testsupport::PutBE32(runs, 4, static_cast<uint32_t>((runs.size() - 8) / 12));
    Bytes movie = testsupport::ReadFile(source);
    ASSERT_NO_FATAL_FAILURE(ReplaceInSoundTrack(movie, "stco", offsets));
    ASSERT_NO_FATAL_FAILURE(ReplaceInSoundTrack(movie, "stsc", runs));
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
