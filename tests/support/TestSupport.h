// Shared test helpers: a per-test scratch directory, file I/O shortcuts and a
// way to run external judges such as ffprobe.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace testsupport {

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

uint32_t GetBE32(const std::vector<uint8_t>& bytes, size_t at);
void PutBE32(std::vector<uint8_t>& bytes, size_t at, uint32_t value);

}  // namespace testsupport
