// tqovix as people run it: the built tool in a child process, judged by its exit status and
// what it prints; Ctrl-C through a real terminal (tmux).
#include "MakerInjector.h"
#include "Movie.h"
#include "support/TestSupport.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

namespace {

using testsupport::TempDir;
using Recipe = moviekit::MovieRecipe;

std::string Q(const std::string& text) { return testsupport::ShellQuote(text); }
bool Exists(const std::string& path) { return std::filesystem::exists(path); }

struct Outcome {
    int status;
    std::string output;  // standard output and standard error together
};

// Every run is bounded: `timeout` ends a tool that hangs with status 124.
Outcome Tool(const std::string& arguments, int seconds = 120)
{
    Outcome outcome{};
    outcome.status = testsupport::RunCommand(
        "timeout " + std::to_string(seconds) + " " + Q(TQOVIX_TOOL) + " " + arguments + " 2>&1",
        &outcome.output);
    return outcome;
}

// A small camera-style movie; `edit` changes the recipe before it is written.
std::string Movie(const TempDir& dir, const std::string& name, void (*edit)(Recipe&) = nullptr)
{
    Recipe recipe;
    recipe.video.frameCount = 60;
    if (edit != nullptr) {
        edit(recipe);
    }
    std::string error;
    EXPECT_TRUE(moviekit::WriteMovie(dir.File(name), recipe, nullptr, &error)) << error;
    return dir.File(name);
}

void ForeignBrand(Recipe& recipe) { recipe.majorBrand = "isom"; recipe.compatibleBrands = {"isom"}; }

TEST(CliTest, HelpVersionAndUsageErrors)
{
    for (const char* command : {"check", "process", "batch", "inspect", "make-sample"}) {
        SCOPED_TRACE(command);
        const Outcome help = Tool(std::string(command) + " --help");
        EXPECT_EQ(help.status, 0);
        EXPECT_NE(help.output.find(std::string("usage: tqovix ") + command), std::string::npos) << help.output;
        EXPECT_EQ(Tool(command).status, 2);  // every command needs at least one argument
    }
    EXPECT_EQ(Tool("--version").status, 0);
    EXPECT_EQ(Tool("process only-one-path").status, 2);
    EXPECT_EQ(Tool("batch -o /nonexistent-directory x.mov").status, 2);
    EXPECT_EQ(Tool("no-such-command").status, 2);
    EXPECT_EQ(Tool("make-sample x.mov --aac --little-endian").status, 2);
}

// Each refusal with its reason and status, and the keys of every JSON report.
TEST(CliTest, ReportsAndRefusals)
{
    TempDir dir;
    const std::string source = Movie(dir, "in.mov");
    const std::string done = Movie(dir, "done.mov", [](Recipe& r) { r.maker.afProcessed = true; });
    const std::string foreign = Movie(dir, "isom.mp4", ForeignBrand);
    const std::string noAf = Movie(dir, "noaf.mov", [](Recipe& r) { r.maker.afInformation = false; });
    const std::string tenChannels = Movie(dir, "ten.mov", [](Recipe& r) { r.sound.channels = 10; });
    const std::string text = dir.File("notes.txt");
    std::ofstream(text) << "not a movie\n";
    const std::string kept = dir.File("kept.mov");
    std::ofstream(kept) << "someone's file\n";
    const std::string json = dir.File("json.mov");
    const std::string check = "check " + Q(source) + " ";  // beside a processable file: the worst verdict counts
    struct Row {
        std::string arguments;
        int status;
        std::vector<std::string> fragments;
    };
    const Row rows[] = {
        {"check " + Q(source), 0, {source + ": processable\n"}},
        {check + Q(done), 1, {done + ": not processable: already processed\n"}},
        {check + Q(foreign), 1, {foreign + ": not processable: not a camera movie (brand 'isom')\n"}},
        {check + Q(noAf), 1, {noAf + ": not processable: no AF information"}},
        // The parser words what the exported code cannot tell apart.
        {check + Q(tenChannels), 1, {tenChannels + ": not processable: sound has 10 channels; 1 to 8 are processed\n"}},
        {check + Q(text), 1, {text + ": not processable: no AF information, or not a camera movie"}},
        {check + Q(dir.File("missing.mov")), 1, {"missing.mov: not processable: file not found\n"}},
        {"process " + Q(source) + " " + Q(json) + " --json", 0,
         {"{\"source\":\"" + source + "\"", "\"destination\":", "\"result\":0,", "\"message\":\"done\"",
          "\"seconds\":"}},
        {"process " + Q(source) + " " + Q(kept) + " --json", 2,
         {"\"source\":", "\"destination\":", "\"result\":null", "\"message\":\"destination exists", "\"seconds\":"}},
        {"process " + Q(foreign) + " " + Q(dir.File("x.mov")) + " --json", 1,
         {"\"source\":", "\"destination\":", "\"result\":8,", "\"message\":\"no AF information", "\"seconds\":"}},
        {"inspect " + Q(source) + " --json", 0,
         {"\"atoms\":[{\"offset\":0,", "\"handler\":\"soun\",\"codec\":\"twos\"", "\"handler\":\"vide\"",
          "\"trim\":{\"removedFrameForward\":0", "\"afInformationBytes\":", "\"processed\":false"}},
        {"inspect " + Q(json) + " --json", 0, {"\"processed\":true", "\"libraryAnswer\":20"}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.arguments);
        const Outcome outcome = Tool(row.arguments);
        EXPECT_EQ(outcome.status, row.status) << outcome.output;
        for (const std::string& fragment : row.fragments) {
            EXPECT_NE(outcome.output.find(fragment), std::string::npos) << fragment << " in " << outcome.output;
        }
        if (row.arguments.ends_with("--json")) {  // one object on one line
            EXPECT_TRUE(outcome.output.starts_with("{") && outcome.output.ends_with("}\n")) << outcome.output;
            EXPECT_EQ(std::count(outcome.output.begin(), outcome.output.end(), '\n'), 1) << outcome.output;
        }
    }
    EXPECT_EQ(std::filesystem::file_size(kept), 15u);  // untouched by the refusal
    EXPECT_FALSE(Exists(dir.File("x.mov")));
}

TEST(CliTest, BatchGoesOnPastAFailingFile)
{
    TempDir dir;
    std::filesystem::create_directory(dir.File("out"));
    const std::string good1 = Movie(dir, "one.mov");
    const std::string bad = Movie(dir, "bad.mp4", ForeignBrand);
    const std::string good2 = Movie(dir, "two.mov");
    const Outcome outcome =
        Tool("batch -o " + Q(dir.File("out")) + " -j 2 " + Q(good1) + " " + Q(bad) + " " + Q(good2));
    EXPECT_EQ(outcome.status, 1) << outcome.output;
    EXPECT_TRUE(Exists(dir.File("out/one.mov")) && Exists(dir.File("out/two.mov")));
    EXPECT_FALSE(Exists(dir.File("out/bad.mp4")));
    EXPECT_TRUE(outcome.output.ends_with("\n3 files: 2 done, 1 failed\n")) << outcome.output;
}

// Waits (up to `seconds`) until `ready` holds.
template <typename Ready>
bool WaitFor(Ready ready, int seconds)
{
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
    while (!ready() && std::chrono::steady_clock::now() < end) {
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    return ready();
}

// A tmux server of our own, its socket in the test's directory, gone with the object.
struct Tmux {
    std::string socket;
    ~Tmux() { Run("kill-server"); }
    std::string Run(const std::string& arguments) const
    {
        std::string output;
        testsupport::RunCommand("timeout 10 tmux -S " + Q(socket) + " -f /dev/null " + arguments + " 2>&1", &output);
        return output;
    }
};

// Ctrl-C in a real terminal aborts the job, removes its destination and exits with 130.
TEST(CliTerminalTest, CtrlCAbortsAJob)
{
    if (!testsupport::HaveCommand("tmux")) {
        GTEST_SKIP() << "tmux is not installed (scripts/setup installs it)";
    }
    TempDir dir;
    ASSERT_EQ(Tool("make-sample " + Q(dir.File("long.mov")) + " --seconds 600", 300).status, 0);
    const std::string destination = dir.File("aborted.mov");
    const std::string status = dir.File("status");
    const Tmux tmux{dir.File("tmux")};
    // The pane's command ends by itself too.
    EXPECT_EQ(tmux.Run("new-session -d -s cli -x 100 -y 20 " +
                       Q(Q(TQOVIX_TOOL) + " process " + Q(dir.File("long.mov")) + " " + Q(destination) +
                         "; echo $? > " + Q(status) + "; sleep 120")),
              "");
    const auto screen = [&] { return tmux.Run("capture-pane -p -t cli"); };
    // The bar is drawn from the first poll on: the job is running.
    ASSERT_TRUE(WaitFor([&] { return screen().find('%') != std::string::npos; }, 60)) << screen();
    ASSERT_EQ(tmux.Run("send-keys -t cli C-c"), "");
    ASSERT_TRUE(WaitFor([&] { return Exists(status) && !testsupport::ReadFile(status).empty(); }, 120)) << screen();
    EXPECT_EQ(testsupport::ReadFile(status), (std::vector<uint8_t>{'1', '3', '0', '\n'})) << screen();
    EXPECT_FALSE(Exists(destination));
    EXPECT_NE(screen().find("aborted"), std::string::npos) << screen();
}

}  // namespace

namespace {

// Every number that follows `key` in a JSON text.
std::vector<double> Numbers(const std::string& json, const std::string& key)
{
    std::vector<double> values;
    const std::string quoted = "\"" + key + "\":";
    for (size_t at = json.find(quoted); at != std::string::npos; at = json.find(quoted, at + 1)) {
        values.push_back(std::stod(json.substr(at + quoted.size())));
    }
    return values;
}

// compare on what a job did: the removal measured per interval, nothing else moved, no offset,
// the picture where the intervals lie; and a clear refusal for a movie that is no such result.
TEST(CliCompareTest, MeasuresDrawsAndRefuses)
{
    TempDir dir;
    const std::string source = dir.File("src.mov");
    const std::string processed = dir.File("dst.mov");
    ASSERT_EQ(Tool("make-sample " + Q(source) + " --seconds 4").status, 0);
    ASSERT_EQ(Tool("process " + Q(source) + " " + Q(processed) + " --quiet").status, 0);

    const Outcome measured = Tool("compare " + Q(source) + " " + Q(processed) + " --json --png " +
                                  Q(dir.File("picture.png")));
    ASSERT_EQ(measured.status, 0) << measured.output;
    const std::vector<double> reductions = Numbers(measured.output, "reductionDb");
    ASSERT_EQ(reductions.size(), 2u) << measured.output;
    for (double reduction : reductions) {
        // The shelf takes the motor band down by up to 24 dB; on the sample's broadband bursts
        // that is a few dB of the whole level.
        EXPECT_GT(reduction, 3.0) << measured.output;
    }
    EXPECT_EQ(Numbers(measured.output, "differingFrames"), std::vector<double>{0}) << "PCM outside the intervals";
    EXPECT_EQ(Numbers(measured.output, "offsetFrames"), std::vector<double>{0});

    const Outcome itself = Tool("compare " + Q(source) + " " + Q(source) + " --json");
    ASSERT_EQ(itself.status, 0) << itself.output;
    EXPECT_EQ(Numbers(itself.output, "reductionDb"), (std::vector<double>{0, 0}));
    EXPECT_EQ(Numbers(itself.output, "largestDifference"), std::vector<double>{0});

    // The picture: its size, and the marks above the source panel exactly over the intervals.
    std::string size;
    testsupport::RunCommand("ffprobe -v error -show_entries stream=width,height -of csv=p=0 " +
                                Q(dir.File("picture.png")),
                            &size);
    EXPECT_EQ(size, "1600,900\n");
    const std::string raw = dir.File("picture.rgb");
    ASSERT_EQ(testsupport::RunCommand("ffmpeg -v error -nostdin -i " + Q(dir.File("picture.png")) +
                                          " -f rawvideo -pix_fmt rgb24 " + Q(raw),
                                      &size),
              0);
    const std::vector<uint8_t> pixels = testsupport::ReadFile(raw);
    ASSERT_EQ(pixels.size(), 1600u * 900u * 3u);
    const double frames = Numbers(measured.output, "frames").at(0);
    const double perColumn = std::ceil(frames / 1400);
    const auto marked = [&](double frame) {
        const size_t x = 90 + static_cast<size_t>(frame / perColumn);
        const size_t y = 40 - 8 + 2;  // inside the mark strip above the source panel
        const uint8_t* p = pixels.data() + (y * 1600 + x) * 3;
        return p[0] == 0x40 && p[1] == 0xC0 && p[2] == 0xFF;
    };
    const std::vector<double> starts = Numbers(measured.output, "startFrame");
    const std::vector<double> ends = Numbers(measured.output, "endFrame");
    ASSERT_EQ(starts.size(), 2u);
    for (size_t i = 0; i < starts.size(); ++i) {
        EXPECT_TRUE(marked((starts[i] + ends[i]) / 2)) << "interval " << i;
        EXPECT_FALSE(marked(starts[i] - 3 * perColumn)) << "before interval " << i;
        EXPECT_FALSE(marked(ends[i] + 3 * perColumn)) << "after interval " << i;
    }

    // Not the processed form of the source: another movie, or no movie at all.
    const std::string other = dir.File("other.mov");
    ASSERT_EQ(Tool("make-sample " + Q(other) + " --seconds 3").status, 0);
    const Outcome different = Tool("compare " + Q(source) + " " + Q(other));
    EXPECT_EQ(different.status, 1);
    EXPECT_NE(different.output.find("not the processed form"), std::string::npos) << different.output;
    const std::string text = dir.File("notes.txt");
    std::ofstream(text) << "not a movie\n";
    const Outcome none = Tool("compare " + Q(source) + " " + Q(text));
    EXPECT_EQ(none.status, 1);
    EXPECT_NE(none.output.find("notes.txt: not a movie"), std::string::npos) << none.output;
}

// AAC re-encoded by a job: no offset against the source, and a close match outside the intervals.
TEST(CliCompareTest, AacDestinationsMatchTheirSourceWithoutOffset)
{
    TempDir dir;
    const std::string source = dir.File("src.mov");
    std::string output;
    ASSERT_EQ(testsupport::RunCommand("ffmpeg -v error -nostdin -f lavfi -i testsrc=size=64x36:rate=30:d=3 -f lavfi "
                                      "-i \"aevalsrc='0.3*sin(2*PI*(180*t+260*t*t))':s=48000:d=3\" -map 0:v -map 1:a "
                                      "-c:v mjpeg -c:a aac -ac 2 " + Q(source) + " 2>&1",
                                      &output),
              0)
        << output;
    Recipe recipe;
    recipe.maker.afIntervals = std::vector<moviekit::AfInterval>{{48000, 72000, 1000}};
    std::string error;
    ASSERT_TRUE(moviekit::AddMakerData(source, recipe, 3 * 48000, &error)) << error;
    const std::string processed = dir.File("dst.mov");
    ASSERT_EQ(Tool("process " + Q(source) + " " + Q(processed) + " --quiet").status, 0);
    const Outcome measured = Tool("compare " + Q(source) + " " + Q(processed) + " --json");
    ASSERT_EQ(measured.status, 0) << measured.output;
    EXPECT_EQ(Numbers(measured.output, "offsetFrames"), std::vector<double>{0}) << measured.output;
    EXPECT_GT(Numbers(measured.output, "correlation").at(0), 0.99) << measured.output;
}

}  // namespace
