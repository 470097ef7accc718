#include "host/JobHarness.h"

#include <sys/stat.h>

#include <sstream>
#include <thread>

namespace jobtest {

using testsupport::RunCommand;
using testsupport::ShellQuote;

int WaitForJob(std::chrono::steady_clock::duration patience)
{
    const auto deadline = std::chrono::steady_clock::now() + patience;
    for (;;) {
        const int state = TqIsFinishedOVIX();
        if (state != 0) {
            return state;
        }
        if (std::chrono::steady_clock::now() > deadline) {
            return -1;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
}

FileStamp StampFile(const std::string& path)
{
    FileStamp stamp;
    stamp.bytes = testsupport::ReadFile(path);
    struct stat info {};
    if (stat(path.c_str(), &info) == 0) {
        stamp.modifiedNs = int64_t{info.st_mtim.tv_sec} * 1000000000 + info.st_mtim.tv_nsec;
    }
    return stamp;
}

bool Exists(const std::string& path)
{
    struct stat info {};
    return stat(path.c_str(), &info) == 0;
}

std::vector<std::string> PacketHashes(const std::string& path, const std::string& stream)
{
    std::string output;
    const std::string command = "ffmpeg -v error -nostdin -i " + ShellQuote(path) + " -map 0:" + stream +
                                " -c copy -f framemd5 - 2>&1";
    std::vector<std::string> lines;
    if (RunCommand(command, &output) != 0) {
        lines.push_back("ffmpeg failed: " + output);
        return lines;
    }
    std::istringstream in(output);
    for (std::string line; std::getline(in, line);) {
        if (line.empty() || line[0] == '#') {
            continue;
        }
        // stream, dts, pts, duration, size, hash: keep size and hash.
        const size_t cut = line.rfind(',', line.rfind(',') - 1);
        lines.push_back(line.substr(cut + 1));
    }
    return lines;
}

std::string ProbeErrors(const std::string& path)
{
    std::string output;
    const int status = RunCommand("ffprobe -v error -show_packets -of compact " + ShellQuote(path) +
                                      " 2>&1 >/dev/null",
                                  &output);
    if (status != 0 && output.empty()) {
        output = "ffprobe exited with " + std::to_string(status);
    }
    return output;
}

uint64_t PacketCount(const std::string& path, const std::string& stream)
{
    std::string output;
    RunCommand("ffprobe -v error -select_streams " + stream +
                   " -count_packets -show_entries stream=nb_read_packets -of csv=p=0 " + ShellQuote(path),
               &output);
    return std::strtoull(output.c_str(), nullptr, 10);
}

bool DecodeSound(const std::string& path, std::vector<int16_t>& samples)
{
    testsupport::TempDir scratch;
    const std::string raw = scratch.File("sound.raw");
    std::string output;
    const int status = RunCommand("ffmpeg -v error -nostdin -xerror -i " + ShellQuote(path) +
                                      " -map 0:a:0 -f s16le -acodec pcm_s16le " + ShellQuote(raw) + " 2>&1",
                                  &output);
    if (status != 0 || !output.empty()) {
        return false;
    }
    const std::vector<uint8_t> bytes = testsupport::ReadFile(raw);
    samples.resize(bytes.size() / 2);
    for (size_t k = 0; k < samples.size(); ++k) {
        samples[k] = static_cast<int16_t>(bytes[2 * k] | (bytes[2 * k + 1] << 8));
    }
    return true;
}

void HostTest::SetUp()
{
    ASSERT_TRUE(testsupport::HaveCommand("ffprobe")) << "ffprobe is required";
    ASSERT_EQ(TqInitializeOVIX(), 0);
}

void HostTest::TearDown() { TqCloseOVIX(); }

std::string HostTest::Write(const moviekit::MovieSpec& recipe, const std::string& name,
                            moviekit::MovieLayout* layout)
{
    const std::string path = m_dir.File(name);
    std::string error;
    EXPECT_TRUE(moviekit::WriteMovie(path, recipe, layout, &error)) << error;
    return path;
}

int HostTest::Run(const std::string& source, const std::string& destination)
{
    const int started = TqExecuteOVIX(source.c_str(), destination.c_str());
    if (started != 0) {
        return started;
    }
    return WaitForJob();
}

}  // namespace jobtest
