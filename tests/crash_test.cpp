// A job killed at any moment (SIGKILL: a power cut, the OOM killer, a crashing host) leaves
// the destination's path holding either nothing new or the complete processed movie, never a
// part of one; and where no unnamed files exist, only hidden partial files (which tqovix clears
// once they are old: cli_test).
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <mutex>
#include <thread>

#include "Movie.h"
#include "engine/CTqovixMainFrame.h"
#include "file/CTqovixFile.h"
#include "support/TestSupport.h"

namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

// The job in a child process; its exit status says how it ended (0 done).
pid_t StartJob(const std::string& source, const std::string& destination)
{
    const pid_t child = fork();
    if (child != 0) {
        return child;
    }
    CTqovixMainFrame engine;
    g_pMainFrame = &engine;
    int status = 2;
    if (engine.Initialize() == eTqovixSuccess && engine.Execute(source.c_str(), destination.c_str(), 0) == eTqovixSuccess) {
        while (engine.GetProcessingState() == eTqovixRunning) {
            std::this_thread::sleep_for(std::chrono::microseconds(100));
        }
        status = engine.GetProcessingState() == eTqovixFinished ? 0 : 1;
    }
    engine.Close();
    _exit(status);
}

bool IsCompleteMovie(const std::string& path)
{
    std::string output;
    const int status = testsupport::RunCommand(
        "ffprobe -v error -show_packets -of compact " + testsupport::ShellQuote(path) + " 2>&1 >/dev/null", &output);
    if (status != 0 || !output.empty()) {
        return false;
    }
    CTqovixMainFrame engine;
    const bool processed = engine.Initialize() == eTqovixSuccess && engine.GetProperty(path.c_str()) == eTqovixVerdict20;
    engine.Close();
    return processed;
}

struct CrashRow {
    const char* name;
    moviekit::SoundCodec codec;
    bool unnamed;        // the file system's unnamed files, or the hidden-name fallback
    bool replacing;      // a file stands at the destination's path before the job
};
void PrintTo(const CrashRow& row, std::ostream* out) { *out << row.name; }

class CrashTest : public ::testing::TestWithParam<CrashRow> {
protected:
    void TearDown() override { CTqovixFile::SetUnnamedDestinations(true); }

    static void WriteSource(const CrashRow& row, const std::string& source)
    {
        moviekit::MovieRecipe recipe;
        recipe.sound.codec = row.codec;
        recipe.video.frameCount = 150;
        recipe.video.frameSize = 60000;  // about 10 MB, so that kills land inside the job
        if (row.codec == moviekit::SoundCodec::Aac) {
            // Sound that processing changes inside the default intervals: the job carries the
            // source's packets and re-encodes spans, as it does for a camera's movie.
            constexpr uint64_t kPackets = 235;  // as long as the video
            constexpr uint64_t n = kPackets * 1024;
            recipe.sound.aacPackets = testsupport::MotorAacPackets(kPackets, 48000, {n / 4, n / 4 + n / 10, n / 2, n / 2 + n / 8}, 192000);
            ASSERT_EQ(recipe.sound.aacPackets.size(), kPackets);
        }
        std::string error;
        ASSERT_TRUE(moviekit::WriteMovie(source, recipe, nullptr, &error)) << error;
    }

    // After a kill: the name holds nothing new or the complete movie, and beside it only
    // hidden partial files. True when the complete movie is there.
    bool ExpectNoDamage(const CrashRow& row, const std::string& kill, const std::vector<uint8_t>& earlier)
    {
        const std::string destination = m_dir.File("dst.mov");
        bool complete = false;
        if (fs::exists(destination) && testsupport::ReadFile(destination) != earlier) {
            EXPECT_TRUE(IsCompleteMovie(destination)) << kill << ": a part of a movie under the name";
            complete = true;
        } else if (!row.replacing) {
            EXPECT_FALSE(fs::exists(destination)) << kill;
        }
        for (const fs::directory_entry& entry : fs::directory_iterator(m_dir.Path())) {
            const std::string name = entry.path().filename().string();
            if (name == "src.mov" || name == "dst.mov") {
                continue;
            }
            EXPECT_TRUE(name.starts_with(".dst.mov.") && name.ends_with(CTqovixFile::kPartialSuffix)) << name;
            // Unnamed files need a hidden name only to replace one; a kill in that instant
            // leaves the complete movie under it, never a part.
            if (row.unnamed) {
                EXPECT_TRUE(row.replacing) << kill << " left " << name;
                EXPECT_TRUE(IsCompleteMovie(entry.path().string())) << kill << " left " << name;
            }
        }
        return complete;
    }

    testsupport::TempDir m_dir;
};

TEST_P(CrashTest, KilledAnywhereTheNameHoldsNothingNewOrTheWholeMovie)
{
    const CrashRow& row = GetParam();
    CTqovixFile::SetUnnamedDestinations(row.unnamed);
    const std::string source = m_dir.File("src.mov");
    const std::string destination = m_dir.File("dst.mov");
    ASSERT_NO_FATAL_FAILURE(WriteSource(row, source));
    const std::vector<uint8_t> earlier = {'o', 'l', 'd'};

    // A clean run gives the job's length, over which the kills are spread.
    const Clock::time_point begun = Clock::now();
    int status = 0;
    waitpid(StartJob(source, destination), &status, 0);
    ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    const auto length = Clock::now() - begun;
    ASSERT_TRUE(IsCompleteMovie(destination));

    constexpr int kKills = 8;
    int complete = 0;
    for (int k = 0; k <= kKills; ++k) {
        fs::remove(destination);
        if (row.replacing) {
            ASSERT_TRUE(testsupport::WriteFile(destination, earlier));
        }
        const pid_t child = StartJob(source, destination);
        std::this_thread::sleep_until(Clock::now() + length * k / kKills);
        kill(child, SIGKILL);
        waitpid(child, &status, 0);
        complete += ExpectNoDamage(row, "kill " + std::to_string(k), earlier) ? 1 : 0;
    }
    RecordProperty("kills_after_completion", complete);
}

// Kills placed by what the job is doing, not by the clock: the child stops for good at the
// first file call of the stage (telling the test through a pipe), and is killed there.
enum class Stage { BeforeOutput, Sound, Copy, Publishing, Renaming };

const char* StageName(Stage stage)
{
    switch (stage) {
    case Stage::BeforeOutput: return "before any output";
    case Stage::Sound: return "while the sound is written";
    case Stage::Copy: return "during the copy";
    case Stage::Publishing: return "while publishing";
    case Stage::Renaming: return "between the hidden link and the rename";
    }
    return "";
}

std::thread::id g_mainThread;
std::thread::id g_worker;
std::mutex g_threads;
Stage g_stage = Stage::BeforeOutput;
int g_stagePipe = -1;
int g_workerWrites = 0;

int StopAtStage(eTqovixFileOperation operation)
{
    const std::thread::id me = std::this_thread::get_id();
    bool reached = false;
    {
        std::lock_guard lock(g_threads);
        if (me != g_mainThread && g_worker == std::thread::id()) {
            g_worker = me;  // the library's worker reads sound before anything else happens
        }
        const bool worker = me == g_worker;
        const bool other = me != g_mainThread && !worker;  // the copy's thread
        switch (g_stage) {
        case Stage::BeforeOutput: reached = worker && operation == eTqovixFileOperation::Read; break;
        case Stage::Sound:
            g_workerWrites += worker && operation == eTqovixFileOperation::Write ? 1 : 0;
            reached = g_workerWrites == 3;
            break;
        case Stage::Copy: reached = other; break;
        case Stage::Publishing:
            reached = operation == eTqovixFileOperation::Link || operation == eTqovixFileOperation::Rename;
            break;
        case Stage::Renaming: reached = operation == eTqovixFileOperation::Rename; break;
        }
    }
    if (reached) {
        const char byte = 1;
        if (write(g_stagePipe, &byte, 1) == 1) {
            for (;;) {
                pause();
            }
        }
    }
    return 0;
}

TEST_P(CrashTest, KilledAtEveryStage)
{
    const CrashRow& row = GetParam();
    CTqovixFile::SetUnnamedDestinations(row.unnamed);
    const std::string source = m_dir.File("src.mov");
    const std::string destination = m_dir.File("dst.mov");
    ASSERT_NO_FATAL_FAILURE(WriteSource(row, source));
    const std::vector<uint8_t> earlier = {'o', 'l', 'd'};
    // The copy-then-patch writer's own thread too, for AAC as for PCM.
    std::vector<Stage> stages = {Stage::BeforeOutput, Stage::Sound, Stage::Copy, Stage::Publishing};
    if (row.replacing) {
        stages.push_back(Stage::Renaming);  // replacing goes through a hidden link
    }
    for (const Stage stage : stages) {
        fs::remove(destination);
        if (row.replacing) {
            ASSERT_TRUE(testsupport::WriteFile(destination, earlier));
        }
        int pipeEnds[2];
        ASSERT_EQ(pipe(pipeEnds), 0);
        const pid_t child = fork();
        if (child == 0) {
            close(pipeEnds[0]);
            g_mainThread = std::this_thread::get_id();
            g_stage = stage;
            g_stagePipe = pipeEnds[1];
            CTqovixFile::SetFaultHook(StopAtStage);
            CTqovixMainFrame engine;
            g_pMainFrame = &engine;
            if (engine.Initialize() == eTqovixSuccess &&
                engine.Execute(source.c_str(), destination.c_str(), 0) == eTqovixSuccess) {
                while (engine.GetProcessingState() == eTqovixRunning) {
                    std::this_thread::sleep_for(std::chrono::microseconds(100));
                }
            }
            _exit(3);  // the stage never came
        }
        close(pipeEnds[1]);
        char byte = 0;
        const bool reached = read(pipeEnds[0], &byte, 1) == 1;  // end of file: the child exited
        close(pipeEnds[0]);
        kill(child, SIGKILL);
        int status = 0;
        waitpid(child, &status, 0);
        EXPECT_TRUE(reached) << StageName(stage) << ": the job never got there";
        const bool complete = ExpectNoDamage(row, StageName(stage), earlier);
        // Until the name is given, a kill leaves nothing new under it.
        EXPECT_FALSE(complete) << StageName(stage);
    }
}

INSTANTIATE_TEST_SUITE_P(Writers, CrashTest,
                         ::testing::Values(CrashRow{"PcmUnnamedNew", moviekit::SoundCodec::Twos, true, false},
                                           CrashRow{"AacUnnamedReplacing", moviekit::SoundCodec::Aac, true, true},
                                           CrashRow{"PcmHiddenReplacing", moviekit::SoundCodec::Sowt, false, true},
                                           CrashRow{"AacHiddenNew", moviekit::SoundCodec::Aac, false, false}),
                         [](const ::testing::TestParamInfo<CrashRow>& info) { return std::string(info.param.name); });

}  // namespace
