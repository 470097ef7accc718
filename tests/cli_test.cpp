// tqovix as people run it: the built tool in a child process, judged by its exit status and
// what it prints; Ctrl-C through a real terminal (tmux).
#include "MakerInjector.h"
#include "Movie.h"
#include "support/TestSupport.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <csignal>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cmath>
#include <chrono>
#include <filesystem>
#include <map>
#include <fstream>
#include <thread>

#include <sys/stat.h>

namespace {

using testsupport::TempDir;
using Recipe = moviekit::MovieRecipe;
using testsupport::GetBE32;
using testsupport::PutBE32;

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
std::string Movie(const std::string& path, void (*edit)(Recipe&) = nullptr)
{
    Recipe recipe;
    recipe.video.frameCount = 60;
    if (edit != nullptr) {
        edit(recipe);
    }
    std::string error;
    EXPECT_TRUE(moviekit::WriteMovie(path, recipe, nullptr, &error)) << error;
    return path;
}

void WriteText(const std::string& path, const std::string& text) { std::ofstream(path) << text; }

void ForeignBrand(Recipe& recipe) { recipe.majorBrand = "isom"; recipe.compatibleBrands = {"isom"}; }

class CliCommandTest : public ::testing::TestWithParam<const char*> {};

TEST_P(CliCommandTest, HelpAndUsage)
{
    const std::string command = GetParam();
    for (const char* help : {" --help", " -h"}) {
        const Outcome outcome = Tool(command + help);
        EXPECT_EQ(outcome.status, 0);
        EXPECT_NE(outcome.output.find("usage: tqovix " + command), std::string::npos) << outcome.output;
    }
    EXPECT_EQ(Tool(command).status, 2);  // every command needs at least one argument
}

INSTANTIATE_TEST_SUITE_P(Commands, CliCommandTest,
                         ::testing::Values("check", "process", "batch", "inspect", "make-sample", "compare"),
                         [](const ::testing::TestParamInfo<const char*>& info) {
                             std::string name = info.param;
                             std::ranges::replace(name, '-', '_');
                             return name;
                         });

TEST(CliTest, Version)
{
    const Outcome version = Tool("--version");
    EXPECT_EQ(version.status, 0);
    for (const char* part : {"tqovix ", "libTqOVIXUtility ", "libavcodec "}) {
        EXPECT_NE(version.output.find(part), std::string::npos) << version.output;
    }
}

// --size-gib is reached, or a warning says why not; the help's frame rate is the one inspect reads.
TEST(CliTest, SampleSizeAndFrameRate)
{
    TempDir dir;
    const Outcome reached = Tool("make-sample -q --seconds 2 --size-gib 0.02 " + Q(dir.File("a.mov")));
    EXPECT_EQ(reached.status, 0);
    EXPECT_EQ(reached.output, "");
    EXPECT_NEAR(static_cast<double>(std::filesystem::file_size(dir.File("a.mov"))), 0.02 * (1 << 30), 0.0002 * (1 << 30));
    const Outcome overshot = Tool("make-sample -q --seconds 2 --size-gib 0.001 " + Q(dir.File("b.mov")));
    EXPECT_EQ(overshot.status, 0);
    EXPECT_NE(overshot.output.find("warning: the movie is 0.010 GiB, not the 0.001 GiB asked"), std::string::npos)
        << overshot.output;
    EXPECT_NE(Tool("make-sample --help").output.find(" 29.97 fps "), std::string::npos);
    EXPECT_NE(Tool("inspect -q " + Q(dir.File("a.mov"))).output.find(" 29.970 fps"), std::string::npos);
}

// A usage error is one line, naming what was likely meant; "help CMD" is CMD's own help.
TEST(CliTest, UsageErrorsSuggestWhatWasMeant)
{
    const std::pair<std::string, std::string> rows[] = {
        {"proces a b", "unknown command 'proces'; did you mean 'process'?"},
        {"inpsect a", "did you mean 'inspect'?"},
        {"batch --dryrun -o out a", "unknown option '--dryrun'; did you mean '--dry-run'?"},
        {"check -json a", "unknown option '-json'; did you mean '--json'?"},
        {"compare --pn x a b", "did you mean '--png'?"},
        {"process -z a b", "unknown option '-z' ("},
        {"--jsn check a", "did you mean '--json'"},
        {"help nosuch", "unknown command 'nosuch' ("},
        {"process a", "SRC and DST are needed"},
    };
    for (const auto& [arguments, said] : rows) {
        const Outcome outcome = Tool(arguments);
        EXPECT_EQ(outcome.status, 2) << arguments;
        EXPECT_NE(outcome.output.find(said), std::string::npos) << arguments << "\n" << outcome.output;
        EXPECT_EQ(std::ranges::count(outcome.output, '\n'), 1) << arguments << "\n" << outcome.output;
    }
    EXPECT_EQ(Tool("help make-sample").output, Tool("make-sample --help").output);
    EXPECT_NE(Tool("help").output.find("usage: tqovix COMMAND"), std::string::npos);
}

// -q, before the command or after it: a run that succeeds says nothing, one that fails says why.
TEST(CliTest, QuietRunsSayOnlyWhatWentWrong)
{
    TempDir dir;
    const std::string movie = dir.File("in.mov");
    const std::string text = dir.File("notes.txt");
    WriteText(text, "notes\n");
    const std::pair<std::string, int> rows[] = {
        {"-q make-sample --seconds 2 " + Q(movie), 0},
        {"make-sample -q --seconds 2 " + Q(dir.File("second.mov")), 0},
        {"-q check " + Q(movie), 0},
        {"--quiet process " + Q(movie) + " " + Q(dir.File("out.mov")), 0},
        {"-q compare " + Q(movie) + " " + Q(dir.File("out.mov")), 0},
        {"-q batch -o " + Q(dir.File("card")) + " " + Q(movie), 0},
    };
    for (const auto& [arguments, status] : rows) {
        const Outcome outcome = Tool(arguments);
        EXPECT_EQ(outcome.status, status) << arguments << "\n" << outcome.output;
        EXPECT_EQ(outcome.output, "") << arguments;
    }
    const Outcome refused = Tool("-q check " + Q(movie) + " " + Q(text));
    EXPECT_EQ(refused.status, 1);
    EXPECT_EQ(refused.output, text + ": not processable: not a QuickTime/ISO movie\n");
    const Outcome passedOver = Tool("batch -q -o " + Q(dir.File("card")) + " " + Q(text));
    EXPECT_EQ(passedOver.status, 0) << "not a movie: skipped, nothing said";
    EXPECT_EQ(passedOver.output, "");
}

// Every spelling people use for options, and the ones refused as usage errors.
TEST(CliTest, ArgumentForms)
{
    TempDir dir;
    const std::string source = Movie(dir.File("-dash.mov"));  // a name only "--" can pass
    const std::string out = dir.File("out");
    struct Form {
        std::string arguments;
        int status;
    };
    const Form forms[] = {
        {"check -- " + Q(source), 0},
        {"check -qv -- " + Q(source), 0},
        {"batch -j2 -o " + Q(out) + " -- " + Q(source), 0},
        {"batch -j 2 --output=" + Q(out + "2") + " -r -- " + Q(source), 0},
        {"batch --jobs=2 --output " + Q(out + "3") + " -- " + Q(source), 0},
        {"process -q -- " + Q(source) + " " + Q(dir.File("p.mov")), 0},
        {"process -fq -- " + Q(source) + " " + Q(dir.File("p.mov")), 0},
        {"inspect --json -- " + Q(source), 0},
        {"check -dash.mov", 2},  // a leading dash is an option
        {"check --json=yes -- " + Q(source), 2},
        {"batch -o " + Q(out) + " -j 0 -- " + Q(source), 2},
        {"batch -o " + Q(out) + " -j", 2},
        {"process -z -- " + Q(source) + " x.mov", 2},
        {"compare --png", 2},
        {"make-sample --bits 20 " + Q(dir.File("s.mov")), 2},
        {"make-sample --aac --bits 24 " + Q(dir.File("s.mov")), 2},
        {"make-sample --aac --rate 96000 " + Q(dir.File("s.mov")), 2},
        {"make-sample --rate 7999 " + Q(dir.File("s.mov")), 2},
        {"make-sample --aac --little-endian " + Q(dir.File("s.mov")), 2},
    };
    for (const Form& form : forms) {
        const Outcome outcome = Tool(form.arguments);
        EXPECT_EQ(outcome.status, form.status) << form.arguments << "\n" << outcome.output;
    }
    EXPECT_TRUE(Exists(out + "/-dash.mov") && Exists(out + "2/-dash.mov") && Exists(out + "3/-dash.mov"));
    // Existing files are refused with status 1 (not a usage error), and left alone.
    const std::string kept = dir.File("kept.mov");
    std::ofstream(kept) << "someone's file\n";
    EXPECT_EQ(Tool("process -- " + Q(source) + " " + Q(kept)).status, 1);
    EXPECT_EQ(Tool("process -n -- " + Q(source) + " " + Q(kept)).status, 1);
    EXPECT_EQ(Tool("make-sample " + Q(kept)).status, 1);
    EXPECT_EQ(std::filesystem::file_size(kept), 15u);
    const Outcome uncreatable = Tool("make-sample " + Q(dir.File("absent/x.mov")));
    EXPECT_EQ(uncreatable.status, 1);
    EXPECT_NE(uncreatable.output.find("No such file or directory"), std::string::npos) << uncreatable.output;
}

// Hidden names in `folder`: what a job writes under before its movie is complete.
std::vector<std::string> HiddenFiles(const std::string& folder)
{
    std::vector<std::string> names;
    std::error_code error;
    for (std::filesystem::directory_iterator it(folder, error), end; !error && it != end; it.increment(error)) {
        if (it->path().filename().string().starts_with(".")) {
            names.push_back(it->path().filename().string());
        }
    }
    return names;
}

// One reason per refusal, worded the same by check, process --json and inspect.
struct ReasonCase {
    const char* name;
    void (*make)(const TempDir& dir, const std::string& path);
    std::string text;
    const char* key;
    int result;  // process --json's: the reason's code, whatever the library answered
};
void PrintTo(const ReasonCase& row, std::ostream* out) { *out << row.name; }


const ReasonCase kReasons[] = {
    {"SourceMissing", [](const TempDir&, const std::string&) {}, "file not found", "source-missing", 110},
    {"SourceIsDirectory", [](const TempDir&, const std::string& path) { std::filesystem::create_directory(path); },
     "the source is a directory", "source-is-directory", 190},
    {"EmptyFile", [](const TempDir&, const std::string& path) { WriteText(path, ""); }, "empty file", "empty-file", 8},
    {"NotAMovie", [](const TempDir&, const std::string& path) { WriteText(path, "not a movie at all\n"); },
     "not a QuickTime/ISO movie", "not-a-movie", 8},
    {"WrongBrand", [](const TempDir&, const std::string& path) { Movie(path, ForeignBrand); },
     "not a camera movie (brand 'isom')", "wrong-brand", 8},
    {"Truncated",
     [](const TempDir&, const std::string& path) {
         Movie(path);
         std::filesystem::resize_file(path, 300'000);  // a copy broken off
     },
     "truncated: 300.0 of ", "truncated", 8},
    {"MalformedAtom",
     [](const TempDir&, const std::string& path) {
         Movie(path);
         std::vector<uint8_t> bytes = testsupport::ReadFile(path);
         const auto header = std::search(bytes.begin(), bytes.end(), std::begin("mvhd"), std::end("mvhd") - 1);
         testsupport::PutBE32(bytes, static_cast<size_t>(header - bytes.begin()) - 4, 4);  // smaller than a header
         testsupport::WriteFile(path, bytes);
     },
     "malformed atom: 'mvhd' at offset ", "malformed-atom", 8},
    {"NoSoundTrack", [](const TempDir&, const std::string& path) { Movie(path, [](Recipe& r) { r.sound.present = false; }); },
     "no sound track", "no-sound-track", 8},
    {"UnsupportedSound",
     [](const TempDir&, const std::string& path) { Movie(path, [](Recipe& r) { r.sound.channels = 10; }); },
     "unsupported sound: sound has 10 channels; 1 to 8 are processed", "unsupported-sound", 8},
    {"NoAFInformation",
     [](const TempDir&, const std::string& path) { Movie(path, [](Recipe& r) { r.maker.afInformation = false; }); },
     "no AF information", "no-af-information", 8},
    {"AFInformationUnusable",
     [](const TempDir&, const std::string& path) { Movie(path, [](Recipe& r) { r.maker.afPayload = moviekit::Bytes{'A', 'F'}; }); },
     "the processing library cannot use the AF information", "af-information-unusable", 9},
    {"AlreadyProcessed",
     [](const TempDir&, const std::string& path) { Movie(path, [](Recipe& r) { r.maker.afProcessed = true; }); },
     "already processed", "already-processed", 20},
};

class CliReasonTest : public ::testing::TestWithParam<ReasonCase> {};

TEST_P(CliReasonTest, EveryCommandGivesTheSameReason)
{
    const ReasonCase& row = GetParam();
    TempDir dir;
    const std::string source = dir.File("in.mov");
    row.make(dir, source);
    // check and inspect search a folder for movies; process refuses it.
    const bool folder = row.text == "the source is a directory";
    const Outcome check = Tool("check " + Q(source));
    EXPECT_EQ(check.status, 1);
    const std::string checked = folder ? source + ": no movies found" : source + ": not processable: " + row.text;
    EXPECT_NE(check.output.find(checked), std::string::npos) << check.output;
    const Outcome process = Tool("process --json " + Q(source) + " " + Q(dir.File("out.mov")));
    EXPECT_EQ(process.status, 1);
    EXPECT_NE(process.output.find("\"message\":\"" + row.text), std::string::npos) << process.output;
    EXPECT_NE(process.output.find(std::string("\"reason\":\"") + row.key + "\""), std::string::npos) << process.output;
    EXPECT_NE(process.output.find("\"result\":" + std::to_string(row.result) + ","), std::string::npos) << process.output;
    EXPECT_FALSE(Exists(dir.File("out.mov")));
    // Refused at once: the reason alone, no progress before it.
    const Outcome text = Tool("process " + Q(source) + " " + Q(dir.File("out.mov")));
    EXPECT_EQ(text.status, 1);
    EXPECT_TRUE(text.output.starts_with("tqovix: " + source + ": " + row.text)) << text.output;
    const Outcome inspect = Tool("inspect " + Q(source));
    if (row.text == "already processed") {
        EXPECT_NE(inspect.output.find("AF information processed: yes"), std::string::npos) << inspect.output;
    } else {
        const bool refusedWhole = row.text == "file not found" || folder;
        EXPECT_EQ(inspect.status, refusedWhole ? 1 : 0) << inspect.output;
        const std::string said = folder         ? checked
                                 : refusedWhole ? source + ": " + row.text
                                                : "the library would refuse it: " + row.text;
        EXPECT_NE(inspect.output.find(said), std::string::npos) << inspect.output;
    }
}

INSTANTIATE_TEST_SUITE_P(Reasons, CliReasonTest, ::testing::ValuesIn(kReasons),
                         [](const ::testing::TestParamInfo<ReasonCase>& info) { return std::string(info.param.name); });

// check and inspect over a card: files named are taken as they are, folders searched for movies
// by content (-r: subfolders too); inspect names what a file that is no movie seems to be.
TEST(CliTest, CheckAndInspectSearchFoldersAndNameOtherFiles)
{
    TempDir dir;
    const std::string card = dir.File("card");
    std::filesystem::create_directories(card + "/SUB");
    std::filesystem::create_directories(dir.File("empty"));
    Movie(card + "/A.MOV");
    Movie(card + "/SUB/B.MOV", [](Recipe& r) { r.maker.afProcessed = true; });
    const std::pair<std::string, std::string> others[] = {
        {"STILL.JPG", "\xff\xd8\xff\xe0 a still"}, {"LOGO.PNG", "\x89PNG\r\n\x1a\n...."},
        {"RAW.CR2", std::string("II*\0\x10\0\0\0", 8)}, {"CLIP.XML", "\xef\xbb\xbf<?xml version=\"1.0\"?>"},
        {"notes.txt", "notes\n"}};
    std::string named;
    for (const auto& [name, bytes] : others) {
        WriteText(card + "/" + name, bytes);
        named.append(" ").append(Q(card + "/" + name));
    }
    const Outcome flat = Tool("check " + Q(card));
    EXPECT_EQ(flat.status, 0) << flat.output;
    EXPECT_EQ(flat.output, card + "/A.MOV: processable\n");
    const Outcome deep = Tool("check --json -r " + Q(card));
    EXPECT_EQ(deep.status, 1) << deep.output;
    EXPECT_NE(deep.output.find(R"("files":[{"file":")" + card + R"(/A.MOV","processable":true)"), std::string::npos);
    EXPECT_NE(deep.output.find(R"(/SUB/B.MOV","processable":false)"), std::string::npos) << deep.output;
    const Outcome empty = Tool("check " + Q(dir.File("empty")));
    EXPECT_EQ(empty.status, 1);
    EXPECT_NE(empty.output.find("no movies found (-r searches subfolders)"), std::string::npos) << empty.output;

    // The summary comes first; -q gives it alone.
    const Outcome whole = Tool("inspect " + Q(card + "/A.MOV"));
    EXPECT_EQ(whole.status, 0);
    EXPECT_TRUE(whole.output.starts_with(card + "/A.MOV: QuickTime/ISO movie, brand 'qt  ', 2.002 s\n"
                                         "  tracks: vide raw  29.970 fps, soun twos 48000 Hz 2 ch\n"
                                         "  AF information processed: no\n\n"))
        << whole.output;
    EXPECT_NE(whole.output.find("mvhd"), std::string::npos);
    const Outcome summary = Tool("-q inspect " + Q(card + "/A.MOV"));
    EXPECT_EQ(summary.output, whole.output.substr(0, whole.output.find("\n\n") + 1));
    const Outcome kinds = Tool("inspect -q" + named);
    EXPECT_EQ(kinds.status, 0) << kinds.output;
    for (const char* said : {"STILL.JPG: a JPEG image, not a movie", "LOGO.PNG: a PNG image, not a movie",
                             "RAW.CR2: a TIFF image or raw still, not a movie",
                             "CLIP.XML: an XML file (a sidecar), not a movie", "notes.txt: plain text, not a movie"}) {
        EXPECT_NE(kinds.output.find(said), std::string::npos) << said << "\n" << kinds.output;
    }
    const Outcome rows = Tool("inspect --json -r " + Q(card));
    EXPECT_EQ(rows.status, 0);
    EXPECT_TRUE(rows.output.starts_with(R"({"version":1,"files":[{"file":")" + card + R"(/A.MOV","kind":"movie")"))
        << rows.output;
    EXPECT_NE(rows.output.find(R"(/SUB/B.MOV","kind":"movie","seconds":2.002,)"), std::string::npos) << rows.output;
}

// A folder stands for the source's name in it; "-" is no file to read or write; a name as long
// as a file system allows still leaves room for the hidden name beside it.
TEST(CliTest, DestinationNames)
{
    TempDir dir;
    const std::string source = Movie(dir.File("in.mov"));
    std::filesystem::create_directory(dir.File("folder"));
    for (const std::string& folder : {dir.File("folder"), dir.File("folder") + "/"}) {
        const Outcome outcome = Tool("process -f -q " + Q(source) + " " + Q(folder));
        EXPECT_EQ(outcome.status, 0) << outcome.output;
        EXPECT_NE(Tool("check " + Q(dir.File("folder/in.mov"))).output.find("already processed"), std::string::npos);
    }
    for (const std::string& arguments : {"process " + Q(source) + " -", "process - " + Q(dir.File("x.mov")),
                                         std::string("make-sample -")}) {
        const Outcome outcome = Tool(arguments);
        EXPECT_EQ(outcome.status, 2) << arguments;
        EXPECT_NE(outcome.output.find("'-' is not a file"), std::string::npos) << outcome.output;
    }
    std::string longest;
    while (longest.size() + 2 <= 251) {
        longest += "\xc3\xa9";
    }
    longest += ".mov";
    const Outcome outcome = Tool("process -n -q " + Q(source) + " " + Q(dir.File(longest)));
    EXPECT_EQ(outcome.status, 0) << outcome.output;
    EXPECT_TRUE(Exists(dir.File(longest)));
    EXPECT_EQ(HiddenFiles(dir.Path()), std::vector<std::string>{});
}

// What stands at the destination is the destination's reason, named with its path; process
// --json answers each with that reason's code, also where the library's own answer is another
// (130 for a volume that takes no files) or it was never asked.
struct DestinationJsonCase {
    const char* name;
    const char* destination;  // under the test's folder; "{SRC}" is the source itself
    const char* said;
    const char* key;
    int result;
};
void PrintTo(const DestinationJsonCase& row, std::ostream* out) { *out << row.name; }

class CliDestinationJsonTest : public ::testing::TestWithParam<DestinationJsonCase> {};

TEST_P(CliDestinationJsonTest, ResultIsTheReasonsCode)
{
    const DestinationJsonCase& row = GetParam();
    if (std::string(row.destination).starts_with("locked/") && geteuid() == 0) {
        GTEST_SKIP() << "root writes a read-only folder";
    }
    TempDir dir;
    const std::string source = Movie(dir.File("in.mov"));
    const std::vector<uint8_t> original = testsupport::ReadFile(source);
    // A folder where the movie would go inside the folder named: "folder/in.mov" is one too.
    std::filesystem::create_directories(dir.File("folder/in.mov"));
    std::filesystem::create_directory(dir.File("locked"));
    std::filesystem::permissions(dir.File("locked"), std::filesystem::perms::owner_read | std::filesystem::perms::owner_exec);
    const std::string named = row.destination;
    const std::string destination = named == "{SRC}" ? source : named.starts_with("/") ? named : dir.File(named);
    const Outcome text = Tool("process -f " + Q(source) + " " + Q(destination));
    const Outcome process = Tool("process --json -f " + Q(source) + " " + Q(destination));
    std::filesystem::permissions(dir.File("locked"), std::filesystem::perms::owner_all);
    EXPECT_EQ(text.status, 1) << text.output;
    EXPECT_NE(text.output.find(": " + std::string(row.said)), std::string::npos) << text.output;
    EXPECT_EQ(process.status, 1) << process.output;
    EXPECT_NE(process.output.find(std::string("\"reason\":\"") + row.key + "\""), std::string::npos) << process.output;
    EXPECT_NE(process.output.find("\"result\":" + std::to_string(row.result) + ","), std::string::npos)
        << process.output;
    if (std::string(row.key) == "same-file") {
        EXPECT_EQ(testsupport::ReadFile(source), original) << "the source was written";
    } else if (named != "folder") {
        EXPECT_FALSE(Exists(destination));
    }
}

const DestinationJsonCase kDestinationJson[] = {
    {"ReadOnlyFolder", "locked/out.mov", "cannot write the destination", "destination-access-denied", 121},
    // No room measured there, so the library says 130; root cannot write there either.
    {"SystemFolder", "/proc/tqovix-out.mov", "cannot write the destination", "destination-access-denied", 121},
    {"FolderMissing", "absent/out.mov", "the destination's directory does not exist", "destination-directory-missing",
     111},
    {"FolderMissingNamedAsFolder", "absent/", "the destination's directory does not exist",
     "destination-directory-missing", 111},
    {"IsAFolder", "folder", "the destination is a directory", "destination-is-directory", 190},
    {"SameFile", "{SRC}", "source and destination are the same file", "same-file", 190},
    {"SameFileSpelledOtherwise", "./in.mov", "source and destination are the same file", "same-file", 190},
};

INSTANTIATE_TEST_SUITE_P(Rows, CliDestinationJsonTest, ::testing::ValuesIn(kDestinationJson),
                         [](const ::testing::TestParamInfo<DestinationJsonCase>& info) {
                             return std::string(info.param.name);
                         });

// A FIFO nobody writes and a device are refused at once by check, process and batch, never
// waited on: each run is ended by `timeout` (status 124) if it blocks.
TEST(CliTest, NotRegularFilesAreRefusedAtOnce)
{
    TempDir dir;
    const std::string fifo = dir.File("pipe.mov");
    ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
    for (const std::string& source : {fifo, std::string("/dev/null")}) {
        const Outcome check = Tool("check " + Q(source), 30);
        EXPECT_EQ(check.status, 1) << check.output;
        EXPECT_NE(check.output.find(source + ": not processable: not a regular file"), std::string::npos) << check.output;
        const Outcome process = Tool("process --json " + Q(source) + " " + Q(dir.File("out.mov")), 30);
        EXPECT_EQ(process.status, 1) << process.output;
        EXPECT_NE(process.output.find("\"reason\":\"not-a-regular-file\""), std::string::npos) << process.output;
        EXPECT_NE(process.output.find("\"result\":110"), std::string::npos) << process.output;
        EXPECT_FALSE(Exists(dir.File("out.mov")));
        const Outcome batch = Tool("batch -o " + Q(dir.File("batch")) + " " + Q(source), 30);
        EXPECT_EQ(batch.status, 1) << batch.output;
        EXPECT_NE(batch.output.find("not a regular file"), std::string::npos) << batch.output;
        const Outcome inspect = Tool("inspect " + Q(source), 30);
        EXPECT_EQ(inspect.status, 1) << inspect.output;
        EXPECT_NE(inspect.output.find("not a regular file"), std::string::npos) << inspect.output;
        const Outcome compare = Tool("compare " + Q(source) + " " + Q(source), 30);
        EXPECT_EQ(compare.status, 1) << compare.output;
    }
}

// The keys of every JSON report; each is one valid UTF-8 object even for a name that is not.
TEST(CliTest, JsonReports)
{
    TempDir dir;
    const std::string source = Movie(dir.File("in\xff\xfe\xc0\xaf\xed\xa0\x80.mov"));  // stray, overlong, surrogate
    const std::string destination = dir.File("out\xc3.mov");
    const std::string strict = "python3 -c 'import json,sys; d=json.loads(sys.stdin.buffer.read().decode(\"utf-8\")); "
                               "assert d[\"version\"] == 1' 2>&1";
    const std::pair<std::string, std::vector<std::string>> rows[] = {
        {"check --json " + Q(source), {"\"processable\":true", "\"reason\":\"none\""}},
        {"process --json " + Q(source) + " " + Q(destination),
         {"\"result\":0,", "\"reason\":\"none\"", "\"message\":\"done\"", "\"libraryResult\":0,", "\"seconds\":"}},
        {"process --json " + Q(source) + " " + Q(destination),
         {"\"result\":null", "\"reason\":\"destination-exists\""}},
        {"inspect --json " + Q(destination),
         {"\"atoms\":[{\"offset\":0,", "\"handler\":\"soun\",\"codec\":\"twos\"", "\"trim\":{\"removedFrameForward\":0",
          "\"processed\":true", "\"reason\":\"already-processed\""}},
        {"inspect --json " + Q(dir.File("absent\xff")), {"\"reason\":\"source-missing\""}},
        {"batch --json -o " + Q(dir.File("o\xff")) + " " + Q(source) + " " + Q(destination),
         {"\"status\":\"done\"", "\"status\":\"skipped\"", "\"done\":1,\"skipped\":1,\"failed\":0"}},
        {"compare --json " + Q(source) + " " + Q(destination), {"\"intervals\":[{"}},
    };
    for (const auto& [arguments, fragments] : rows) {
        SCOPED_TRACE(arguments);
        const Outcome outcome = Tool(arguments + " 2>/dev/null");
        for (const std::string& fragment : fragments) {
            EXPECT_NE(outcome.output.find(fragment), std::string::npos) << fragment << " in " << outcome.output;
        }
        EXPECT_TRUE(outcome.output.starts_with("{") && outcome.output.ends_with("}\n")) << outcome.output;
        std::string parsed;
        EXPECT_EQ(testsupport::RunCommand("printf '%s' " + Q(outcome.output) + " | " + strict, &parsed), 0) << parsed;
    }
}

// A card: movies beside stills and notes, in folders; the layout is kept, the rest passed over.
// Times a source is given, so that a destination can be seen to keep them.
const timespec kFilmed[2] = {{1'600'000'000, 250'000'000}, {1'500'000'000, 123'456'789}};  // access, modification

void SetTimes(const std::string& path) { ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), kFilmed, 0), 0) << path; }

// The source's modification time, and its access time as our reading left it (reading moves
// an old access time on once).
void ExpectTimesKept(const std::string& source, const std::string& path)
{
    struct stat status {};
    struct stat original {};
    ASSERT_EQ(stat(path.c_str(), &status), 0) << path;
    ASSERT_EQ(stat(source.c_str(), &original), 0) << source;
    EXPECT_EQ(status.st_mtim.tv_sec, kFilmed[1].tv_sec) << path;
    EXPECT_EQ(status.st_mtim.tv_nsec, kFilmed[1].tv_nsec) << path;
    EXPECT_EQ(status.st_atim.tv_sec, original.st_atim.tv_sec) << path;
    EXPECT_EQ(status.st_atim.tv_nsec, original.st_atim.tv_nsec) << path;
}

// Per source in a batch's JSON: its status and reason; a plan's "would process" read as "done".
std::map<std::string, std::string> Outcomes(const std::string& json, bool planned)
{
    const auto field = [&json](const std::string& key, size_t from) {
        const size_t at = json.find("\"" + key + "\":\"", from);
        const size_t begin = at + key.size() + 4;
        return at == std::string::npos ? std::string() : json.substr(begin, json.find('"', begin) - begin);
    };
    std::map<std::string, std::string> outcomes;
    const size_t files = json.find("\"files\":[");
    const size_t end = json.find("],", files);
    for (size_t at = json.find("{\"source\"", files); at < end; at = json.find("{\"source\"", at + 1)) {
        std::string status = field("status", at);
        status = planned && status == "would process" ? "done" : status;
        outcomes[field("source", at)] = status + " " + field("reason", at);
    }
    return outcomes;
}

// A card's life: planned, processed, run again (nothing to do), a clip added, a destination
// that holds something else; every destination with its source's dates.
TEST(CliTest, BatchOverACardsFolders)
{
    TempDir dir;
    const std::string card = dir.File("card");
    std::filesystem::create_directories(card + "/DCIM/100CAM");
    std::filesystem::create_directories(card + "/MISC");
    Movie(dir.File("card/DCIM/100CAM/PCM.MOV"));
    Movie(dir.File("card/DCIM/100CAM/AAC.MOV"), [](Recipe& r) { r.sound.codec = moviekit::SoundCodec::Aac; });
    Movie(dir.File("card/DCIM/DONE.MOV"), [](Recipe& r) { r.maker.afProcessed = true; });
    Movie(dir.File("card/FOREIGN.MP4"), ForeignBrand);
    WriteText(card + "/DCIM/100CAM/STILL.JPG", "\xff\xd8\xff\xe0 a still");
    WriteText(card + "/MISC/notes.txt", "a sidecar\n");
    SetTimes(card + "/DCIM/100CAM/PCM.MOV");
    SetTimes(card + "/DCIM/100CAM/AAC.MOV");
    const std::string out = dir.File("out/nested");  // created, parents too

    const Outcome plan = Tool("batch --dry-run -r -o " + Q(out) + " " + Q(card));
    EXPECT_EQ(plan.status, 0);
    EXPECT_NE(plan.output.find("would process " + card + "/DCIM/100CAM/AAC.MOV -> " + out + "/DCIM/100CAM/AAC.MOV"),
              std::string::npos) << plan.output;
    EXPECT_FALSE(Exists(out));

    const Outcome flat = Tool("batch -o " + Q(out) + " " + Q(card));  // without -r: the top folder only
    EXPECT_EQ(flat.status, 0) << flat.output;
    EXPECT_NE(flat.output.find("1 movie: 0 done, 1 skipped"), std::string::npos) << flat.output;

    const Outcome outcome = Tool("batch -r -j 2 -o " + Q(out) + " " + Q(card));
    EXPECT_EQ(outcome.status, 0) << outcome.output;
    EXPECT_TRUE(Exists(out + "/DCIM/100CAM/PCM.MOV") && Exists(out + "/DCIM/100CAM/AAC.MOV")) << outcome.output;
    for (const char* passed : {"/DCIM/DONE.MOV", "/FOREIGN.MP4", "/DCIM/100CAM/STILL.JPG", "/MISC/notes.txt", "/MISC"}) {
        EXPECT_FALSE(Exists(out + passed)) << passed;
    }
    EXPECT_NE(outcome.output.find("skipped: already processed"), std::string::npos) << outcome.output;
    EXPECT_NE(outcome.output.find("skipped: not a camera movie (brand 'isom')"), std::string::npos) << outcome.output;
    EXPECT_EQ(outcome.output.find("STILL.JPG"), std::string::npos) << outcome.output;
    EXPECT_NE(outcome.output.find("4 movies: 2 done, 2 skipped, 0 failed"), std::string::npos) << outcome.output;
    ExpectTimesKept(card + "/DCIM/100CAM/PCM.MOV", out + "/DCIM/100CAM/PCM.MOV");
    ExpectTimesKept(card + "/DCIM/100CAM/AAC.MOV", out + "/DCIM/100CAM/AAC.MOV");
    for (const char* options : {"-q", "-q -f"}) {  // a name kept free, or whatever stands there replaced
        ASSERT_EQ(Tool(std::string("process ") + options + " " + Q(card + "/DCIM/100CAM/PCM.MOV") + " " + Q(dir.File("one.mov"))).status, 0);
        ExpectTimesKept(card + "/DCIM/100CAM/PCM.MOV", dir.File("one.mov"));
    }

    // Run again: nothing left to do, and the plan says so first.
    const Outcome replan = Tool("batch --dry-run --json -r -o " + Q(out) + " " + Q(card));
    EXPECT_EQ(replan.status, 0) << replan.output;
    EXPECT_EQ(replan.output.find("would process"), std::string::npos) << replan.output;
    EXPECT_NE(replan.output.find(R"("status":"skipped","reason":"already-in-output","message":"already in )" + out),
              std::string::npos) << replan.output;
    const Outcome again = Tool("batch -r -o " + Q(out) + " " + Q(card));
    EXPECT_EQ(again.status, 0) << again.output;
    EXPECT_NE(again.output.find("4 movies: 0 done, 4 skipped, 0 failed"), std::string::npos) << again.output;
    EXPECT_NE(again.output.find("AAC.MOV: skipped: already in " + out), std::string::npos) << again.output;

    // A clip added to the card is the only one done; a destination that holds the unprocessed
    // movie is not this movie processed: it fails, and -f replaces it.
    Movie(dir.File("card/DCIM/100CAM/NEW.MOV"));
    std::filesystem::copy_file(card + "/DCIM/100CAM/PCM.MOV", out + "/DCIM/100CAM/PCM.MOV",
                               std::filesystem::copy_options::overwrite_existing);
    const Outcome foreseen = Tool("batch --dry-run --json -r -o " + Q(out) + " " + Q(card));
    const Outcome added = Tool("batch --json -r -o " + Q(out) + " " + Q(card));
    EXPECT_EQ(Outcomes(foreseen.output, true), Outcomes(added.output, false)) << foreseen.output << "\n" << added.output;
    EXPECT_EQ(added.status, 1) << added.output;
    EXPECT_NE(added.output.find(R"("done":1,"skipped":3,"failed":1)"), std::string::npos) << added.output;
    EXPECT_NE(added.output.find(R"(PCM.MOV","status":"failed","reason":"destination-exists")"), std::string::npos)
        << added.output;
    const Outcome forced = Tool("batch -f -r -o " + Q(out) + " " + Q(card));
    EXPECT_EQ(forced.status, 0) << forced.output;
    EXPECT_NE(Tool("check " + Q(out + "/DCIM/100CAM/PCM.MOV")).output.find("already processed"), std::string::npos);

    // --all: the whole card, its other files as they were, with their dates.
    const std::string whole = dir.File("whole");
    SetTimes(card + "/DCIM/100CAM/STILL.JPG");
    for (int run = 0; run < 2; ++run) {
        const Outcome all = Tool("batch --all -r -o " + Q(whole) + " " + Q(card));
        EXPECT_EQ(all.status, 0) << all.output;
        EXPECT_NE(all.output.find(run == 0 ? "4 other files: 4 copied" : "4 other files: 0 copied (0.0 KB), 4 already there"),
                  std::string::npos) << all.output;
        if (run == 0) {
            ExpectTimesKept(card + "/DCIM/100CAM/STILL.JPG", whole + "/DCIM/100CAM/STILL.JPG");
        }
    }
    for (const char* other : {"/DCIM/100CAM/STILL.JPG", "/MISC/notes.txt", "/DCIM/DONE.MOV", "/FOREIGN.MP4"}) {
        EXPECT_EQ(testsupport::ReadFile(whole + other), testsupport::ReadFile(card + other)) << other;
    }
    EXPECT_NE(Tool("check " + Q(whole + "/DCIM/100CAM/NEW.MOV")).output.find("already processed"), std::string::npos);
}

// The summary's columns line up on a terminal whatever script the names are in: an accent
// takes two bytes and one column, a Japanese character three bytes and two columns.
TEST(CliTest, SummaryLinesUpNamesOfAnyScript)
{
    TempDir dir;
    std::filesystem::create_directory(dir.File("card"));
    for (const char* name : {"ABCDEFGH.MOV", "Café.MOV", "日本.MOV"}) {
        Movie(dir.File(std::string("card/") + name));
    }
    const Outcome outcome = Tool("batch -o " + Q(dir.File("out")) + " " + Q(dir.File("card")));
    ASSERT_EQ(outcome.status, 0) << outcome.output;
    // ABCDEFGH.MOV takes 12 columns, the other two 8: they get 4 spaces more.
    for (const char* line : {"/ABCDEFGH.MOV  done ", "/Café.MOV      done ", "/日本.MOV      done "}) {
        EXPECT_NE(outcome.output.find(line), std::string::npos) << line << "\n" << outcome.output;
    }
}

// A volume too small for the card: the batch says what is missing before it writes anything,
// and a single job says it in megabytes. A small tmpfs stands in for a full card reader's
// volume (mounting it needs root: skipped otherwise).
TEST(CliTest, TooLittleSpaceIsToldBeforeAnythingIsWritten)
{
    TempDir dir;
    const std::string small = dir.File("small");
    std::filesystem::create_directory(small);
    if (testsupport::RunCommand("mount -t tmpfs -o size=1m tmpfs " + Q(small) + " 2>/dev/null", nullptr) != 0) {
        GTEST_SKIP() << "cannot mount a small volume here (needs root)";
    }
    struct Unmount {
        std::string path;
        ~Unmount() { testsupport::RunCommand("umount " + Q(path), nullptr); }
    } unmount{small};
    std::filesystem::create_directory(dir.File("card"));
    for (const char* name : {"card/A.MOV", "card/B.MOV"}) {
        Movie(dir.File(name), [](Recipe& r) { r.video.frameCount = 120; });
    }
    const Outcome plan = Tool("batch --dry-run -o " + Q(small + "/out") + " " + Q(dir.File("card")));
    EXPECT_EQ(plan.status, 1) << plan.output;
    EXPECT_NE(plan.output.find("would stop: not enough free space for this batch: about "), std::string::npos)
        << plan.output;
    const Outcome batch = Tool("batch -o " + Q(small + "/out") + " " + Q(dir.File("card")));
    EXPECT_EQ(batch.status, 1) << batch.output;
    EXPECT_NE(batch.output.find(" MB needed, 1.0 MB free ("), std::string::npos) << batch.output;
    EXPECT_NE(batch.output.find(" MB missing)"), std::string::npos) << batch.output;
    EXPECT_TRUE(std::filesystem::is_empty(small)) << "nothing written, no folder made";
    const Outcome one = Tool("process --json " + Q(dir.File("card/A.MOV")) + " " + Q(small + "/A.MOV"));
    EXPECT_NE(one.output.find(R"("reason":"no-space")"), std::string::npos) << one.output;
    EXPECT_NE(one.output.find(" MB needed, "), std::string::npos) << one.output;
}

// A file that someone else makes at the destination while a job runs (a second run, another
// program): kept, and the job failed, unless --force was given.
struct LateFileCase {
    const char* name;
    const char* command;  // {SRC}, {DST} and {OUT} are filled in
    bool replaced;
    const char* said;  // after "DST: " for process, in the summary for batch
};
void PrintTo(const LateFileCase& row, std::ostream* out) { *out << row.name; }

class CliLateFileTest : public ::testing::TestWithParam<LateFileCase> {
protected:
    static void SetUpTestSuite()
    {
        s_samples = new TempDir;
        // Long enough that the job is still running when the test has seen it start.
        ASSERT_EQ(Tool("make-sample " + Q(s_samples->File("long.mov")) + " --seconds 60").status, 0);
    }
    static void TearDownTestSuite()
    {
        delete s_samples;
        s_samples = nullptr;
    }
    static TempDir* s_samples;
};
TempDir* CliLateFileTest::s_samples = nullptr;

std::string Filled(std::string text, const std::string& key, const std::string& value)
{
    for (size_t at = text.find(key); at != std::string::npos; at = text.find(key, at + value.size())) {
        text.replace(at, key.size(), value);
    }
    return text;
}

TEST_P(CliLateFileTest, KeptUnlessForced)
{
    const LateFileCase& row = GetParam();
    TempDir dir;
    const std::string out = dir.File("out");
    std::filesystem::create_directory(out);
    const std::string destination = out + "/long.mov";
    const std::string errors = dir.File("stderr");
    std::string command = Filled(row.command, "{SRC}", Q(s_samples->File("long.mov")));
    command = Filled(Filled(command, "{DST}", Q(destination)), "{OUT}", Q(out));
    Outcome outcome{};
    std::atomic<bool> ended{false};
    const auto makeTheirs = [&] {
        const int made = open(destination.c_str(), O_CREAT | O_EXCL | O_WRONLY | O_CLOEXEC, 0644);
        const bool written = made >= 0 && write(made, "theirs", 6) == 6;
        if (made >= 0) {
            close(made);
        }
        return written;
    };
    // Replacing takes whatever stands there when the job ends, early or late: made first, so
    // that a fast job cannot end before it.
    const bool early = row.replaced && makeTheirs();
    std::thread job([&] {
        outcome.status = testsupport::RunCommand("timeout 120 " + Q(TQOVIX_TOOL) + " " + command + " 2>" + Q(errors),
                                                 &outcome.output);
        ended = true;
    });
    // Running: its hidden file is there, or it has drawn its progress.
    const auto running = [&] {
        return !HiddenFiles(out).empty() || (Exists(errors) && testsupport::ReadFile(errors).size() > 0);
    };
    while (!ended && !running()) {
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    const bool written = early || makeTheirs();
    job.join();
    ASSERT_TRUE(written) << "the job named its destination before the test could make a file there\n" << outcome.output;
    const std::vector<uint8_t> told = testsupport::ReadFile(errors);
    const std::string said(told.begin(), told.end());
    if (row.replaced) {
        EXPECT_EQ(outcome.status, 0) << outcome.output << said;
        EXPECT_NE(Tool("check " + Q(destination)).output.find("already processed"), std::string::npos);
    } else {
        EXPECT_EQ(outcome.status, 1) << outcome.output << said;
        EXPECT_NE((outcome.output + said).find(Filled(row.said, "{DST}", destination)), std::string::npos)
            << outcome.output << said;
        EXPECT_EQ(testsupport::ReadFile(destination), (std::vector<uint8_t>{'t', 'h', 'e', 'i', 'r', 's'}));
    }
    EXPECT_EQ(HiddenFiles(out), std::vector<std::string>{});
}

// A job killed while it runs leaves no destination, only a hidden file of the recognised form,
// which a later job in that folder removes once it is old.
// Ctrl-C in the middle of a card: the running movie is stopped, the others are not started,
// no folder is left for them, and running the batch again finishes the card.
TEST_F(CliLateFileTest, InterruptedBatchIsFinishedByTheNextRun)
{
    TempDir dir;
    const std::string card = dir.File("card");
    for (const char* folder : {"A", "B", "C"}) {
        std::filesystem::create_directories(card + "/" + folder);
        std::filesystem::create_hard_link(s_samples->File("long.mov"), card + "/" + folder + "/long.mov");
    }
    const std::string out = dir.File("out");
    std::filesystem::create_directory(out);
    const std::string pidFile = dir.File("pid");
    Outcome interrupted{};
    std::atomic<bool> ended{false};
    std::thread batch([&] {
        const std::string inner = "echo $$ > " + Q(pidFile) + "; exec " + Q(TQOVIX_TOOL) + " batch -r -j 1 -o " + Q(out) +
                                  " " + Q(card);
        interrupted.status = testsupport::RunCommand("sh -c " + Q(inner) + " 2>&1", &interrupted.output);
        ended = true;
    });
    while (!ended && (!Exists(out + "/A") || HiddenFiles(out + "/A").empty())) {
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    const std::vector<uint8_t> pid = testsupport::ReadFile(pidFile);
    if (!ended && !pid.empty()) {
        kill(std::stoi(std::string(pid.begin(), pid.end() - 1)), SIGINT);
    }
    batch.join();
    ASSERT_EQ(interrupted.status, 130) << "the batch ended before it could be interrupted\n" << interrupted.output;
    EXPECT_NE(interrupted.output.find("3 movies: 0 done, 0 skipped, 0 failed, 1 stopped, 2 not started"), std::string::npos)
        << interrupted.output;
    EXPECT_TRUE(std::filesystem::is_empty(out)) << "no movie, no folder, no partial file";

    const Outcome rerun = Tool("batch -r -j 1 -o " + Q(out) + " " + Q(card));  // one after the other
    EXPECT_EQ(rerun.status, 0) << rerun.output;
    EXPECT_NE(rerun.output.find("3 movies: 3 done, 0 skipped, 0 failed"), std::string::npos) << rerun.output;
}

// On a terminal a batch shows its running jobs and the whole batch while they run, then
// erases that display before each finished movie's line; elsewhere only those lines.
TEST_F(CliLateFileTest, BatchShowsItsRunningJobsOnATerminal)
{
    if (!testsupport::HaveCommand("script")) {
        GTEST_SKIP() << "no script command to give the batch a terminal";
    }
    TempDir dir;
    const std::string batch = Q(TQOVIX_TOOL) + " batch -o " + Q(dir.File("out")) + " " + Q(s_samples->File("long.mov"));
    std::string shown;
    ASSERT_EQ(testsupport::RunCommand("script -qfec " + Q(batch) + " /dev/null", &shown), 0) << shown;
    EXPECT_NE(shown.find("  long.mov "), std::string::npos) << shown;
    EXPECT_NE(shown.find("[0/1] "), std::string::npos) << shown;
    EXPECT_NE(shown.find("\033[A\033[2K[1/1] " + s_samples->File("long.mov") + ": done"), std::string::npos) << shown;
    std::filesystem::remove_all(dir.File("out"));
    const Outcome plain = Tool("batch -o " + Q(dir.File("out")) + " " + Q(s_samples->File("long.mov")));
    EXPECT_EQ(plain.output.find("[0/1] "), std::string::npos) << plain.output;
    EXPECT_EQ(plain.output.find('\033'), std::string::npos) << plain.output;
}

TEST_F(CliLateFileTest, KilledJobLeavesOnlyAPartialFileThatIsClearedLater)
{
    TempDir dir;
    const std::string out = dir.File("out");
    std::filesystem::create_directory(out);
    const std::string pidFile = dir.File("pid");
    int status = -1;
    std::atomic<bool> ended{false};
    std::thread job([&] {
        std::string output;
        const std::string inner = "echo $$ > " + Q(pidFile) + "; exec " + Q(TQOVIX_TOOL) + " process -q " +
                                  Q(s_samples->File("long.mov")) + " " + Q(out + "/long.mov");
        status = testsupport::RunCommand("sh -c " + Q(inner) + " 2>&1", &output);
        ended = true;
    });
    while (!ended && HiddenFiles(out).empty()) {
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    const std::vector<uint8_t> pid = testsupport::ReadFile(pidFile);
    const std::string killed(pid.begin(), pid.end() - (pid.empty() ? 0 : 1));
    if (!ended) {
        kill(std::stoi(killed), SIGKILL);
    }
    job.join();
    ASSERT_NE(status, 0) << "the job ended before it could be killed";
    EXPECT_FALSE(Exists(out + "/long.mov"));
    const std::vector<std::string> left = HiddenFiles(out);
    ASSERT_EQ(left.size(), 1u);
    EXPECT_TRUE(left[0].starts_with(".long.mov." + killed + "-") && left[0].ends_with(".tqovix-partial")) << left[0];
    std::filesystem::last_write_time(out + "/" + left[0],
                                     std::filesystem::file_time_type::clock::now() - std::chrono::hours(25));
    // One younger than a day may belong to a running job, and one whose writer runs does: they
    // stay, whatever dates the running job has given its movie.
    const std::string fresh = ".long.mov.1-2.tqovix-partial";
    WriteText(out + "/" + fresh, "running");
    const std::string running = ".long.mov." + std::to_string(getpid()) + "-3.tqovix-partial";
    WriteText(out + "/" + running, "running");
    std::filesystem::last_write_time(out + "/" + running,
                                     std::filesystem::file_time_type::clock::now() - std::chrono::hours(25));
    const Outcome next = Tool("process -q " + Q(Movie(dir.File("small.mov"))) + " " + Q(out + "/small.mov"));
    EXPECT_EQ(next.status, 0) << next.output;
    EXPECT_NE(next.output.find("removed " + out + "/" + left[0]), std::string::npos) << next.output;
    std::vector<std::string> kept = HiddenFiles(out);
    std::vector<std::string> expected = {fresh, running};
    std::sort(kept.begin(), kept.end());
    std::sort(expected.begin(), expected.end());
    EXPECT_EQ(kept, expected);
}

const LateFileCase kLateFiles[] = {
    {"ProcessByDefault", "process {SRC} {DST}", false, "{DST}: the destination exists"},
    {"ProcessNoOverwrite", "process -n {SRC} {DST}", false, "{DST}: the destination exists"},
    {"ProcessNoOverwriteJson", "process -n --json {SRC} {DST}", false,
     "\"result\":null,\"reason\":\"destination-exists\""},
    {"ProcessForce", "process -f {SRC} {DST}", true, ""},
    {"Batch", "batch -o {OUT} {SRC}", false, "long.mov: failed: the destination exists"},
};

INSTANTIATE_TEST_SUITE_P(Rows, CliLateFileTest, ::testing::ValuesIn(kLateFiles),
                         [](const ::testing::TestParamInfo<LateFileCase>& info) { return std::string(info.param.name); });

// Outputs whose names differ only in letter case are one file on a FAT or exFAT card. Here
// a link spells the second name to the first, as such a volume resolves it: the first movie
// is processed, the second fails and says why, with --force too; elsewhere both are written.
TEST(CliTest, BatchNamesThatDifferOnlyInCase)
{
    TempDir dir;
    std::filesystem::create_directories(dir.File("a"));
    std::filesystem::create_directories(dir.File("b"));
    const std::string upper = Movie(dir.File("a/CLIP.MOV"));
    const std::string lower = Movie(dir.File("b/clip.mov"), [](Recipe& r) { r.video.frameCount = 90; });
    for (const char* force : {"", "-f "}) {
        for (const bool folding : {true, false}) {
            SCOPED_TRACE(std::string(force) + (folding ? "case-insensitive" : "case-sensitive"));
            const std::string out = dir.File(std::string("out") + (folding ? "i" : "s") + (*force ? "f" : ""));
            std::filesystem::create_directories(out);
            if (folding) {
                std::filesystem::create_symlink("CLIP.MOV", out + "/clip.mov");
            }
            const Outcome outcome =
                Tool("batch -j 2 " + std::string(force) + "-o " + Q(out) + " " + Q(upper) + " " + Q(lower));
            const std::string first = Tool("inspect --json " + Q(out + "/CLIP.MOV")).output;
            EXPECT_NE(first.find("\"processed\":true"), std::string::npos) << first;
            EXPECT_NE(first.find("\"samples\":60,"), std::string::npos) << "not CLIP.MOV's movie: " << first;
            if (folding) {
                EXPECT_EQ(outcome.status, 1) << outcome.output;
                EXPECT_NE(outcome.output.find(lower + ": failed: the destination exists: another movie of this batch (" +
                                              upper + ") has the same name on this case-insensitive volume"),
                          std::string::npos)
                    << outcome.output;
                EXPECT_NE(outcome.output.find("2 movies: 1 done, 0 skipped, 1 failed"), std::string::npos)
                    << outcome.output;
                EXPECT_TRUE(std::filesystem::is_symlink(out + "/clip.mov"));
            } else {
                EXPECT_EQ(outcome.status, 0) << outcome.output;
                EXPECT_NE(outcome.output.find("2 movies: 2 done"), std::string::npos) << outcome.output;
                EXPECT_NE(Tool("check " + Q(out + "/clip.mov")).output.find("already processed"), std::string::npos);
            }
            EXPECT_EQ(HiddenFiles(out), std::vector<std::string>{});
        }
    }
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

// compare on what a job did, for every depth and kind of PCM: a motor taken out of both intervals,
// not a byte moved elsewhere, no offset, the sound's format said, and the picture's marks over the
// intervals and nowhere near them; inspect names the same format.
struct DepthRow {
    const char* name;
    std::string options;  // make-sample's
    std::string format;   // compare's JSON
    std::string track;    // inspect's JSON of the sound track
};
void PrintTo(const DepthRow& row, std::ostream* out) { *out << row.name; }

class CliCompareDepthTest : public ::testing::TestWithParam<DepthRow> {};

TEST_P(CliCompareDepthTest, MeasuresAndDrawsEveryDepth)
{
    const DepthRow& row = GetParam();
    TempDir dir;
    const std::string source = dir.File("src.mov");
    const std::string processed = dir.File("dst.mov");
    ASSERT_EQ(Tool("make-sample -q --seconds 3 " + row.options + " " + Q(source)).status, 0);
    const Outcome inspected = Tool("inspect --json " + Q(source));
    EXPECT_NE(inspected.output.find(row.track), std::string::npos) << inspected.output;
    ASSERT_EQ(Tool("process -q " + Q(source) + " " + Q(processed)).status, 0);
    const std::string picture = dir.File("picture.png");
    const Outcome measured = Tool("compare --json --png " + Q(picture) + " " + Q(source) + " " + Q(processed));
    ASSERT_EQ(measured.status, 0) << measured.output;
    EXPECT_NE(measured.output.find(row.format), std::string::npos) << measured.output;
    const std::vector<double> reductions = Numbers(measured.output, "reductionDb");
    ASSERT_EQ(reductions.size(), 2u) << measured.output;
    for (double reduction : reductions) {
        EXPECT_GT(reduction, 0.5) << measured.output;
    }
    EXPECT_EQ(Numbers(measured.output, "differingFrames"), std::vector<double>{0});
    EXPECT_EQ(Numbers(measured.output, "largestDifference"), std::vector<double>{0});
    EXPECT_EQ(Numbers(measured.output, "offsetFrames"), std::vector<double>{0});

    const std::string raw = dir.File("picture.rgb");
    std::string said;
    ASSERT_EQ(testsupport::RunCommand("ffmpeg -v error -nostdin -i " + Q(picture) + " -f rawvideo -pix_fmt rgb24 " + Q(raw),
                                      &said),
              0)
        << said;
    const std::vector<uint8_t> pixels = testsupport::ReadFile(raw);
    ASSERT_EQ(pixels.size(), 1600u * 900u * 3u);
    const double perColumn = std::ceil(Numbers(measured.output, "frames").at(0) / 1400);
    const auto marked = [&](double frame) {
        const size_t x = 90 + static_cast<size_t>(frame / perColumn);
        const uint8_t* p = pixels.data() + ((40 - 8 + 2) * 1600 + x) * 3;  // the mark strip above the source panel
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
}

INSTANTIATE_TEST_SUITE_P(
    Depths, CliCompareDepthTest,
    ::testing::Values(DepthRow{"Int16", "", "\"bits\":16,\"float\":false", "\"handler\":\"soun\",\"codec\":\"twos\""},
                      DepthRow{"Int24At96k", "--bits 24 --rate 96000", "\"bits\":24,\"float\":false",
                               "\"codec\":\"lpcm\",\"timeScale\":96000"},
                      DepthRow{"Int32LittleEndian", "--bits 32 --little-endian", "\"bits\":32,\"float\":false",
                               "\"bits\":32,\"aac\":false,\"float\":false,\"littleEndian\":true"}),
    [](const ::testing::TestParamInfo<DepthRow>& info) { return std::string(info.param.name); });

// AAC re-encoded by a job, from our own sample (the PCM sample's tone and motor) and from ffmpeg:
// compare measures the motor's removal, finds no offset against the source, and a close match
// outside the intervals. That ffmpeg, reading the edit lists as any player does, hears no offset
// either is interop_test's to judge, frame for frame.
TEST(CliCompareTest, AacDestinationsMatchTheirSourceWithoutOffset)
{
    TempDir dir;
    ASSERT_EQ(Tool("make-sample -q --aac --seconds 4 " + Q(dir.File("sample.mov"))).status, 0);
    const std::string foreign = dir.File("ffmpeg.mov");
    std::string output;
    ASSERT_EQ(testsupport::RunCommand("ffmpeg -v error -nostdin -f lavfi -i testsrc=size=64x36:rate=30:d=3 -f lavfi "
                                      "-i \"aevalsrc='0.3*sin(2*PI*(180*t+260*t*t))':s=48000:d=3\" -map 0:v -map 1:a "
                                      "-c:v mjpeg -c:a aac -ac 2 " + Q(foreign) + " 2>&1",
                                      &output),
              0)
        << output;
    Recipe recipe;
    recipe.maker.afIntervals = std::vector<moviekit::AfInterval>{{48000, 72000, 1000}};
    std::string error;
    ASSERT_TRUE(moviekit::AddMakerData(foreign, recipe, 3 * 48000, &error)) << error;
    for (const std::string& source : {dir.File("sample.mov"), foreign}) {
        SCOPED_TRACE(source);
        const std::string processed = source + ".out.mov";
        ASSERT_EQ(Tool("process -q " + Q(source) + " " + Q(processed)).status, 0);
        const Outcome measured = Tool("compare --json " + Q(source) + " " + Q(processed));
        ASSERT_EQ(measured.status, 0) << measured.output;
        EXPECT_EQ(Numbers(measured.output, "offsetFrames"), std::vector<double>{0}) << measured.output;
        EXPECT_GT(Numbers(measured.output, "correlation").at(0), 0.99) << measured.output;
        if (source == foreign) {
            continue;  // a sweep, no motor: nothing to measure inside
        }
        const std::vector<double> before = Numbers(measured.output, "beforeDb");
        const std::vector<double> reductions = Numbers(measured.output, "reductionDb");
        ASSERT_EQ(before.size(), 2u) << measured.output;
        ASSERT_EQ(reductions.size(), 2u) << measured.output;
        for (size_t i = 0; i < 2; ++i) {
            EXPECT_GT(before[i], -30) << measured.output;
            EXPECT_GT(reductions[i], 0.5) << measured.output;
        }
    }
}

// ---- compare: destinations whose sound is not all there, or not the same shape ----

// Where the sound track's table `type` starts (its size field) in the movie atom; 0 if absent.
size_t SoundTable(const std::vector<uint8_t>& bytes, const std::string& type)
{
    size_t moov = 0;
    for (size_t at = 0; at + 8 <= bytes.size();) {
        uint64_t size = GetBE32(bytes, at);
        if (size == 1 && at + 16 <= bytes.size()) {
            size = uint64_t{GetBE32(bytes, at + 8)} << 32 | GetBE32(bytes, at + 12);
        }
        if (std::string(bytes.begin() + at + 4, bytes.begin() + at + 8) == "moov") {
            moov = at;
            break;
        }
        if (size < 8) {
            return 0;
        }
        at += size;
    }
    const auto find = [&](const std::string& name, size_t from) {
        const auto found = std::search(bytes.begin() + from, bytes.end(), name.begin(), name.end());
        return found == bytes.end() ? size_t{0} : static_cast<size_t>(found - bytes.begin()) - 4;
    };
    const size_t sound = moov == 0 ? 0 : find("smhd", moov);
    return sound == 0 ? 0 : find(type, sound);
}

// The processed movie with its sound track's tables edited in place.
std::string EditedCopy(const TempDir& dir, const std::string& processed, const std::string& name,
                       void (*edit)(std::vector<uint8_t>&, size_t))
{
    std::vector<uint8_t> bytes = testsupport::ReadFile(processed);
    const std::string path = dir.File(name);
    edit(bytes, bytes.size());
    EXPECT_TRUE(testsupport::WriteFile(path, bytes));
    return path;
}

// The processed movie's sound remuxed by ffmpeg with `filters` (original samples, other shape).
std::string Remuxed(const TempDir& dir, const std::string& processed, const std::string& name,
                    const std::string& filters)
{
    const std::string path = dir.File(name);
    std::string output;
    EXPECT_EQ(testsupport::RunCommand("ffmpeg -v error -nostdin -i " + Q(processed) + " -map 0:a " + filters +
                                          " -c:a pcm_s16be -f mov " + Q(path) + " 2>&1",
                                      &output),
              0)
        << output;
    return path;
}

struct ShapeRow {
    const char* name;
    std::string (*make)(const TempDir& dir, const std::string& processed);
    int status;
    const char* reason;  // the JSON report's; "" for a comparison that succeeds
    const char* said;     // in the text
};
void PrintTo(const ShapeRow& row, std::ostream* os) { *os << row.name; }

class CliCompareShapeTest : public ::testing::TestWithParam<ShapeRow> {
protected:
    static void SetUpTestSuite()
    {
        s_dir = new TempDir;
        ASSERT_EQ(Tool("make-sample " + Q(s_dir->File("src.mov")) + " --seconds 4").status, 0);
        ASSERT_EQ(Tool("process " + Q(s_dir->File("src.mov")) + " " + Q(s_dir->File("dst.mov")) + " --quiet").status,
                  0);
    }
    static void TearDownTestSuite()
    {
        delete s_dir;
        s_dir = nullptr;
    }
    static TempDir* s_dir;
};
TempDir* CliCompareShapeTest::s_dir = nullptr;

// Each side must give all the sound its tables promise, at the same rate and channel count and
// for as long as the other: otherwise compare fails and says what differs, in text and JSON.
TEST_P(CliCompareShapeTest, FailsNamingWhatDiffers)
{
    const ShapeRow& row = GetParam();
    const std::string source = s_dir->File("src.mov");
    const std::string destination = row.make(*s_dir, s_dir->File("dst.mov"));
    const Outcome text = Tool("compare " + Q(source) + " " + Q(destination));
    EXPECT_EQ(text.status, row.status) << text.output;
    EXPECT_NE(text.output.find(row.said), std::string::npos) << text.output;
    Outcome json{};
    json.status = testsupport::RunCommand(
        Q(TQOVIX_TOOL) + " compare --json " + Q(source) + " " + Q(destination) + " 2>/dev/null", &json.output);
    EXPECT_EQ(json.status, row.status) << json.output;
    const std::string verdict = *row.reason == 0 ? "\"compared\":true"
                                                 : "\"compared\":false,\"reason\":\"" + std::string(row.reason) + "\"";
    EXPECT_NE(json.output.find(verdict), std::string::npos) << json.output;
    EXPECT_TRUE(json.output.starts_with("{\"version\":1,") && json.output.ends_with("}\n")) << json.output;
}

INSTANTIATE_TEST_SUITE_P(
    Destinations, CliCompareShapeTest,
    ::testing::Values(
        ShapeRow{"Processed", [](const TempDir&, const std::string& processed) { return processed; }, 0, "",
                 "0 frames differ"},
        // A movie is not its own processed form, nor is a copy of it, another movie or no movie.
        ShapeRow{"Itself", [](const TempDir& dir, const std::string&) { return dir.File("src.mov"); }, 1, "same-file",
                 "SRC and DST are the same file"},
        ShapeRow{"Copy",
                 [](const TempDir& dir, const std::string&) {
                     std::filesystem::copy_file(dir.File("src.mov"), dir.File("copy.mov"),
                                                std::filesystem::copy_options::overwrite_existing);
                     return dir.File("copy.mov");
                 },
                 1, "not-processed", "copy.mov: not the processed form"},
        ShapeRow{"AnotherMovie",
                 [](const TempDir& dir, const std::string&) {
                     if (!Exists(dir.File("other.mov"))) {
                         EXPECT_EQ(Tool("make-sample -q --seconds 3 " + Q(dir.File("other.mov"))).status, 0);
                     }
                     return dir.File("other.mov");
                 },
                 1, "length-differs", "other.mov: not the processed form"},
        ShapeRow{"NoMovie",
                 [](const TempDir& dir, const std::string&) {
                     WriteText(dir.File("notes.txt"), "not a movie\n");
                     return dir.File("notes.txt");
                 },
                 1, "unreadable", "notes.txt: not a movie"},
        // The last sample-to-chunk run cut to 100 samples: the time table still counts them all.
        ShapeRow{"LastRunCut",
                 [](const TempDir& dir, const std::string& processed) {
                     return EditedCopy(dir, processed, "cut.mov", [](std::vector<uint8_t>& bytes, size_t) {
                         const size_t stsc = SoundTable(bytes, "stsc");
                         ASSERT_NE(stsc, 0u);
                         const uint32_t runs = GetBE32(bytes, stsc + 12);
                         ASSERT_GT(runs, 0u);
                         PutBE32(bytes, stsc + 16 + 12 * (runs - 1) + 4, 100);
                     });
                 },
                 1, "tables-inconsistent", "cut.mov: the sound track's tables promise more sound than its chunks hold"},
        // Consistent tables, but the last chunk lies at the file's end: its sound stops early.
        ShapeRow{"LastChunkPastTheEnd",
                 [](const TempDir& dir, const std::string& processed) {
                     return EditedCopy(dir, processed, "past.mov", [](std::vector<uint8_t>& bytes, size_t size) {
                         const size_t stco = SoundTable(bytes, "stco");
                         ASSERT_NE(stco, 0u);
                         const uint32_t chunks = GetBE32(bytes, stco + 12);
                         ASSERT_GT(chunks, 0u);
                         PutBE32(bytes, stco + 16 + 4 * (chunks - 1), static_cast<uint32_t>(size - 100));
                     });
                 },
                 1, "sound-stops-early", "past.mov: its sound stops at"},
        ShapeRow{"Stretched",
                 [](const TempDir& dir, const std::string& processed) {
                     return Remuxed(dir, processed, "long.mov", "-af apad=pad_dur=0.5");
                 },
                 1, "length-differs", "its sound differs in length"},
        ShapeRow{"Resampled",
                 [](const TempDir& dir, const std::string& processed) {
                     return Remuxed(dir, processed, "44k.mov", "-ar 44100");
                 },
                 1, "rate-differs", "its sound differs in rate: 44100 Hz against 48000 Hz"}),
    [](const ::testing::TestParamInfo<ShapeRow>& info) { return std::string(info.param.name); });

}  // namespace
