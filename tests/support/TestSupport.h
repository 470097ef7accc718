// Shared test helpers: a per-test scratch directory, file I/O shortcuts and a
// way to run external judges such as ffprobe.
#pragma once

#include <sys/wait.h>
#include <unistd.h>

#include <cstdint>
#include <optional>
#include <ostream>
#include <set>
#include <string>
#include <vector>

namespace testsupport {

// Rows of parameterised tests print, and name their cases, by their `name` (a suite takes
// PrintTo in with `using testsupport::PrintTo;`).
template <typename Row>
    requires requires(const Row& row) { std::string(row.name); }
void PrintTo(const Row& row, std::ostream* os)
{
    *os << row.name;
}
inline constexpr auto ByName = [](const auto& info) { return std::string(info.param.name); };

// A fresh directory under the system's temporary directory, removed with everything in it.
class TempDir {
public:
    TempDir();
    ~TempDir();
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::string& Path() const { return m_path; }
    std::string File(const std::string& name) const { return m_path + "/" + name; }

private:
    std::string m_path;
};

bool WriteFile(const std::string& path, const std::vector<uint8_t>& bytes);
std::vector<uint8_t> ReadFile(const std::string& path);

// Runs a shell command; returns its exit status and fills `output` with its standard output.
int RunCommand(const std::string& command, std::string* output);
bool HaveCommand(const std::string& name);
std::string ShellQuote(const std::string& text);
// Runs a shell command with its errors; empty when it succeeds, else what it said.
std::string Shell(const std::string& command);
// Threads and open descriptors of this process.
size_t ThreadCount();
size_t DescriptorCount();

// Raw AAC-LC packets (ADTS headers removed) that ffmpeg's encoder makes of interleaved s16.
bool EncodeAacPackets(const std::vector<int16_t>& pcm, uint32_t sampleRate, uint16_t channels, uint32_t bitRate,
                      std::vector<std::vector<uint8_t>>& packets);
// `count` packets of stereo sound that processing must change inside each span (frames of the
// decoded sound: loud motor-like rumble, see MotorOverSpans) and leave alone elsewhere,
// encoded by ffmpeg; empty when ffmpeg fails.
std::vector<std::vector<uint8_t>> MotorAacPackets(uint64_t count, uint32_t rate, const std::vector<uint64_t>& spans,
                                                  uint32_t bitRate);

// The names a shared library defines for the dynamic linker, version nodes aside.
std::set<std::string> ExportedNames(const std::string& library);

// Runs `body` in a forked child that an alarm ends after `seconds`: what it returned (a trivially
// copyable value), or nothing when the child died first.
template <typename Body>
auto InChild(Body body, unsigned seconds = 300) -> std::optional<decltype(body())>
{
    int channel[2];
    if (pipe(channel) != 0) {
        return std::nullopt;
    }
    const pid_t child = fork();
    if (child == 0) {
        close(channel[0]);
        alarm(seconds);
        const auto result = body();
        _exit(write(channel[1], &result, sizeof result) == static_cast<ssize_t>(sizeof result) ? 0 : 1);
    }
    close(channel[1]);
    decltype(body()) result{};
    const bool got = child > 0 && read(channel[0], &result, sizeof result) == static_cast<ssize_t>(sizeof result);
    close(channel[0]);
    int status = 0;
    if (child > 0) {
        waitpid(child, &status, 0);
    }
    return got ? std::optional(result) : std::nullopt;
}
// Whether `directory` takes unnamed files, and /proc is there to name them through.
bool UnnamedFilesIn(const std::string& directory);
// In such a child: gives up root for "nobody", so that file modes apply. False when that fails.
bool DropRoot();

uint32_t GetBE32(const std::vector<uint8_t>& bytes, size_t at);
void PutBE32(std::vector<uint8_t>& bytes, size_t at, uint32_t value);

}  // namespace testsupport
