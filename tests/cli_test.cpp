// tqovix as people run it: the built tool in a child process, judged by its exit status and
// what it prints; Ctrl-C through a real terminal (tmux).
#include "Movie.h"
#include "support/TestSupport.h"

#include <gtest/gtest.h>

#include <algorithm>
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
