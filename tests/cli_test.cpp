// tqovix as people run it: the built tool in a child process, judged by its exit status and
// what it prints; the progress bar and Ctrl-C through a real terminal (tmux).
#include "Movie.h"
#include "support/TestSupport.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

namespace {

using testsupport::ShellQuote;
using testsupport::TempDir;
using Recipe = moviekit::MovieRecipe;

struct Outcome {
    int status;
    std::string output;  // standard output and standard error together
};

// Every run is bounded: `timeout` ends a tool that hangs with status 124.
Outcome Tool(const std::string& arguments, int seconds = 120)
{
    Outcome outcome{};
    outcome.status = testsupport::RunCommand(
        "timeout " + std::to_string(seconds) + " " + ShellQuote(TQOVIX_TOOL) + " " + arguments + " 2>&1",
        &outcome.output);
    return outcome;
}

std::string Q(const std::string& text) { return ShellQuote(text); }
bool Exists(const std::string& path) { return std::filesystem::exists(path); }

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

void Processed(Recipe& recipe) { recipe.maker.afProcessed = true; }
void ForeignBrand(Recipe& recipe)
{
    recipe.majorBrand = "isom";
    recipe.compatibleBrands = {"isom"};
}
void NoAfInformation(Recipe& recipe) { recipe.maker.afInformation = false; }

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
}

TEST(CliTest, CheckGivesEachFileItsReason)
{
    TempDir dir;
    std::ofstream(dir.File("notes.txt")) << "not a movie\n";
    struct Row {
        const char* name;
        std::string path;
        const char* words;
    };
    const Row rows[] = {
        {"camera movie", Movie(dir, "good.mov"), "processable"},
        {"processed already", Movie(dir, "done.mov", Processed), "not processable: already processed"},
        {"foreign brand", Movie(dir, "isom.mp4", ForeignBrand), "not processable: not a camera movie (brand 'isom')"},
        {"no AF information", Movie(dir, "noaf.mov", NoAfInformation), "not processable: no AF information"},
        {"text file", dir.File("notes.txt"), "not processable: no AF information, or not a camera movie"},
        {"missing file", dir.File("missing.mov"), "not processable: file not found"},
    };
    std::string all;
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        const Outcome outcome = Tool("check " + Q(row.path));
        EXPECT_EQ(outcome.status, std::string(row.words) == "processable" ? 0 : 1);
        EXPECT_EQ(outcome.output.rfind(row.path + ": " + row.words, 0), 0u) << outcome.output;
        EXPECT_EQ(std::count(outcome.output.begin(), outcome.output.end(), '\n'), 1) << outcome.output;
        all += " " + Q(row.path);
    }
    const Outcome together = Tool("check" + all);
    EXPECT_EQ(together.status, 1);
    EXPECT_EQ(std::count(together.output.begin(), together.output.end(), '\n'), std::size(rows));
    EXPECT_EQ(Tool("check " + Q(rows[0].path)).output, rows[0].path + ": processable\n");
}

// Plain and JSON reports of a job done, a destination kept and a source refused.
TEST(CliTest, ProcessReportsAndKeepsExistingDestinations)
{
    TempDir dir;
    const std::string source = Movie(dir, "in.mov");
    const std::string foreign = Movie(dir, "isom.mp4", ForeignBrand);
    const std::string destination = dir.File("out.mov");
    const std::string kept = dir.File("kept.mov");
    std::ofstream(kept) << "someone's file\n";
    struct Row {
        std::string arguments;
        int status;
        std::vector<std::string> fragments;
    };
    const Row rows[] = {
        {"process " + Q(source) + " " + Q(destination), 0, {destination + ": done"}},
        {"process " + Q(source) + " " + Q(kept), 2, {"destination exists"}},
        {"process " + Q(foreign) + " " + Q(dir.File("x.mov")), 1, {"no AF information, or not a camera movie"}},
        {"process " + Q(source) + " " + Q(dir.File("json.mov")) + " --json", 0,
         {"{\"source\":\"" + source + "\"", "\"destination\":", "\"result\":0,", "\"message\":\"done\"",
          "\"seconds\":"}},
        {"process " + Q(source) + " " + Q(kept) + " --json", 2,
         {"\"source\":", "\"destination\":", "\"result\":null", "\"message\":\"destination exists", "\"seconds\":"}},
        {"process " + Q(foreign) + " " + Q(dir.File("x.mov")) + " --json", 1,
         {"\"source\":", "\"destination\":", "\"result\":8,", "\"message\":\"no AF information", "\"seconds\":"}},
        {"inspect " + Q(source) + " --json", 0,
         {"\"atoms\":[{\"offset\":0,", "\"handler\":\"soun\",\"codec\":\"twos\"", "\"handler\":\"vide\"",
          "\"trim\":{\"removedFrameForward\":0", "\"afInformationBytes\":", "\"processed\":false"}},
        {"inspect " + Q(destination) + " --json", 0, {"\"processed\":true", "\"libraryAnswer\":20"}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.arguments);
        const Outcome outcome = Tool(row.arguments);
        EXPECT_EQ(outcome.status, row.status) << outcome.output;
        for (const std::string& fragment : row.fragments) {
            EXPECT_NE(outcome.output.find(fragment), std::string::npos) << fragment << " in " << outcome.output;
        }
        if (row.arguments.ends_with("--json")) {  // one object on one line
            ASSERT_FALSE(outcome.output.empty());
            EXPECT_EQ(outcome.output.front(), '{') << outcome.output;
            EXPECT_EQ(outcome.output.substr(outcome.output.size() - 2), "}\n") << outcome.output;
            EXPECT_EQ(std::count(outcome.output.begin(), outcome.output.end(), '\n'), 1) << outcome.output;
        }
    }
    EXPECT_EQ(std::filesystem::file_size(kept), 15u);  // untouched by both refusals
    EXPECT_FALSE(Exists(dir.File("x.mov")));
    EXPECT_EQ(Tool("check " + Q(destination)).output, destination + ": not processable: already processed\n");

    const Outcome forced = Tool("process " + Q(source) + " " + Q(kept) + " --force --quiet");
    EXPECT_EQ(forced.status, 0) << forced.output;
    EXPECT_EQ(forced.output, "");
    EXPECT_EQ(std::filesystem::file_size(kept), std::filesystem::file_size(destination));
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
    EXPECT_TRUE(Exists(dir.File("out/one.mov")));
    EXPECT_TRUE(Exists(dir.File("out/two.mov")));
    EXPECT_FALSE(Exists(dir.File("out/bad.mp4")));
    std::istringstream lines(outcome.output.substr(outcome.output.find("\nfile ")));
    std::vector<std::string> summary;
    for (std::string line; std::getline(lines, line);) {
        summary.push_back(line);
    }
    ASSERT_EQ(summary.size(), 6u) << outcome.output;  // blank, header, three rows, total
    EXPECT_EQ(summary[2].rfind(good1 + " ", 0), 0u) << summary[2];
    EXPECT_NE(summary[2].find("  done "), std::string::npos) << summary[2];
    EXPECT_EQ(summary[3].rfind(bad + " ", 0), 0u) << summary[3];
    EXPECT_NE(summary[3].find("  failed: no AF information"), std::string::npos) << summary[3];
    EXPECT_EQ(summary[5], "3 files: 2 done, 1 failed");
}

TEST(CliTest, MakeSampleWritesAacAndPaddedMovies)
{
    TempDir dir;
    EXPECT_EQ(Tool("make-sample " + Q(dir.File("aac.mov")) + " --aac --seconds 2").status, 0);
    const Outcome inspected = Tool("inspect " + Q(dir.File("aac.mov")));
    EXPECT_NE(inspected.output.find("soun  mp4a  48000 Hz  2 ch  AAC"), std::string::npos) << inspected.output;
    EXPECT_EQ(Tool("check " + Q(dir.File("aac.mov"))).status, 0);
    EXPECT_EQ(Tool("make-sample " + Q(dir.File("big.mov")) + " --seconds 1 --size-gib 0.05").status, 0);
    const double target = 0.05 * (1 << 30);
    EXPECT_NEAR(static_cast<double>(std::filesystem::file_size(dir.File("big.mov"))), target, target * 0.02);
    EXPECT_EQ(Tool("make-sample " + Q(dir.File("x.mov")) + " --aac --little-endian").status, 2);
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

// `command` in a 100×20 pane of a tmux server of our own, its socket in the test's directory,
// gone with the object; the pane's command ends by itself too.
class Terminal {
public:
    Terminal(const TempDir& dir, const std::string& command) : m_socket(dir.File("tmux")), m_status(dir.File("status"))
    {
        std::filesystem::remove(m_status);
        const std::string script = command + "; echo $? > " + Q(m_status) + "; sleep 120";
        EXPECT_EQ(Tmux("new-session -d -s cli -x 100 -y 20 " + Q(script)), 0);
    }
    ~Terminal() { Tmux("kill-server"); }
    int Tmux(const std::string& arguments, std::string* output = nullptr) const
    {
        return testsupport::RunCommand("timeout 10 tmux -S " + Q(m_socket) + " -f /dev/null " + arguments +
                                           (output ? "" : " >/dev/null") + " 2>&1",
                                       output);
    }
    std::string Screen() const
    {
        std::string text;
        Tmux("capture-pane -p -t cli", &text);
        return text;
    }
    // The command's exit status; empty while it runs.
    std::string Status() const
    {
        const std::vector<uint8_t> text = testsupport::ReadFile(m_status);
        return std::string(text.begin(), text.end());
    }

private:
    std::string m_socket;
    std::string m_status;
};

// A job run to its end draws the bar to 100 %; Ctrl-C aborts a long one and removes its destination.
TEST(CliTerminalTest, ProgressBarAndCtrlC)
{
    if (!testsupport::HaveCommand("tmux")) {
        GTEST_SKIP() << "tmux is not installed (scripts/setup installs it)";
    }
    TempDir dir;
    ASSERT_EQ(Tool("make-sample " + Q(dir.File("short.mov"))).status, 0);
    ASSERT_EQ(Tool("make-sample " + Q(dir.File("long.mov")) + " --seconds 600", 300).status, 0);
    for (const bool interrupt : {false, true}) {
        SCOPED_TRACE(interrupt ? "Ctrl-C" : "to the end");
        const std::string destination = dir.File(interrupt ? "aborted.mov" : "out.mov");
        const Terminal terminal(dir, Q(TQOVIX_TOOL) + " process " + Q(dir.File(interrupt ? "long.mov" : "short.mov")) +
                                         " " + Q(destination));
        // The bar is drawn from the first poll on: the job is running.
        ASSERT_TRUE(WaitFor([&] { return terminal.Screen().find('%') != std::string::npos; }, 60)) << terminal.Screen();
        if (interrupt) {
            ASSERT_EQ(terminal.Tmux("send-keys -t cli C-c"), 0);
        }
        ASSERT_TRUE(WaitFor([&] { return !terminal.Status().empty(); }, 120)) << terminal.Screen();
        const std::string screen = terminal.Screen();
        EXPECT_EQ(terminal.Status(), interrupt ? "130\n" : "0\n") << screen;
        EXPECT_EQ(Exists(destination), !interrupt);
        if (interrupt) {
            EXPECT_NE(screen.find("aborted"), std::string::npos) << screen;
        } else {
            EXPECT_NE(screen.find("[" + std::string(50, '#') + "] 100%"), std::string::npos) << screen;
            EXPECT_NE(screen.find(destination + ": done"), std::string::npos) << screen;
        }
    }
}

}  // namespace
