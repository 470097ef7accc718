#include "support/TestSupport.h"

#include "support/ProcessedRegions.h"

#include <cstdio>
#include <fcntl.h>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <grp.h>
#include <iterator>
#include <sstream>

namespace testsupport {

TempDir::TempDir()
{
    std::string pattern = (std::filesystem::temp_directory_path() / "tqovix-test-XXXXXX").string();
    if (mkdtemp(pattern.data()) != nullptr) {
        m_path = pattern;
    }
}

TempDir::~TempDir()
{
    if (!m_path.empty()) {
        std::error_code ignored;
        std::filesystem::permissions(m_path, std::filesystem::perms::owner_all,
                                     std::filesystem::perm_options::add, ignored);
        std::filesystem::remove_all(m_path, ignored);
    }
}

bool WriteFile(const std::string& path, const std::vector<uint8_t>& bytes)
{
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out.write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
    return static_cast<bool>(out);
}

std::vector<uint8_t> ReadFile(const std::string& path)
{
    std::ifstream in(path, std::ios::binary);
    return std::vector<uint8_t>(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

int RunCommand(const std::string& command, std::string* output)
{
    FILE* pipe = popen(command.c_str(), "r");
    if (pipe == nullptr) {
        return -1;
    }
    std::string text;
    char buffer[4096];
    size_t count = 0;
    while ((count = fread(buffer, 1, sizeof buffer, pipe)) > 0) {
        text.append(buffer, count);
    }
    const int status = pclose(pipe);
    if (output != nullptr) {
        *output = text;
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

bool HaveCommand(const std::string& name)
{
    return RunCommand("command -v " + name + " >/dev/null 2>&1", nullptr) == 0;
}

std::string ShellQuote(const std::string& text)
{
    std::string quoted = "'";
    for (char c : text) {
        if (c == '\'') {
            quoted += "'\\''";
        } else {
            quoted += c;
        }
    }
    return quoted + "'";
}

std::string Shell(const std::string& command)
{
    std::string output;
    const int status = RunCommand(command + " 2>&1", &output);
    return status == 0 ? "" : output.empty() ? "exit " + std::to_string(status) : output;
}

size_t ThreadCount()
{
    return static_cast<size_t>(std::distance(std::filesystem::directory_iterator("/proc/self/task"), {}));
}

size_t DescriptorCount()
{
    return static_cast<size_t>(std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {}));
}

std::set<std::string> ExportedNames(const std::string& library)
{
    std::string output;
    std::set<std::string> names;
    if (RunCommand("nm -D --defined-only " + ShellQuote(library), &output) != 0) {
        return names;
    }
    std::istringstream lines(output);
    for (std::string line; std::getline(lines, line);) {
        std::istringstream fields(line);
        std::string address, kind, name;
        fields >> address >> kind >> name;
        if (kind != "A") {
            names.insert(name);
        }
    }
    return names;
}

bool UnnamedFilesIn(const std::string& directory)
{
    const int descriptor = open(directory.c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC, 0600);
    if (descriptor >= 0) {
        close(descriptor);
    }
    return descriptor >= 0 && access("/proc/self/fd", X_OK) == 0;
}

bool DropRoot()
{
    return geteuid() != 0 || (setgroups(0, nullptr) == 0 && setgid(65534) == 0 && setuid(65534) == 0);
}

uint32_t GetBE32(const std::vector<uint8_t>& bytes, size_t at)
{
    return uint32_t{bytes[at]} << 24 | uint32_t{bytes[at + 1]} << 16 | uint32_t{bytes[at + 2]} << 8 | bytes[at + 3];
}

void PutBE32(std::vector<uint8_t>& bytes, size_t at, uint32_t value)
{
    for (int k = 0; k < 4; ++k) {
        bytes[at + k] = static_cast<uint8_t>(value >> (24 - 8 * k));
    }
}

bool EncodeAacPackets(const std::vector<int16_t>& pcm, uint32_t sampleRate, uint16_t channels, uint32_t bitRate,
                      std::vector<std::vector<uint8_t>>& packets)
{
    TempDir scratch;
    const std::string raw = scratch.File("in.raw");
    const std::string adts = scratch.File("out.aac");
    std::vector<uint8_t> bytes(pcm.size() * 2);
    for (size_t k = 0; k < pcm.size(); ++k) {
        const auto bits = static_cast<uint16_t>(pcm[k]);
        bytes[2 * k] = static_cast<uint8_t>(bits);
        bytes[2 * k + 1] = static_cast<uint8_t>(bits >> 8);
    }
    if (!WriteFile(raw, bytes)) {
        return false;
    }
    std::string output;
    const std::string command = "ffmpeg -v error -nostdin -f s16le -ar " + std::to_string(sampleRate) + " -ac " +
                                std::to_string(channels) + " -i " + ShellQuote(raw) + " -c:a aac -b:a " +
                                std::to_string(bitRate) + " -f adts " + ShellQuote(adts) + " 2>&1";
    if (RunCommand(command, &output) != 0 || !output.empty()) {
        return false;
    }
    const std::vector<uint8_t> stream = ReadFile(adts);
    packets.clear();
    for (size_t at = 0; at + 7 <= stream.size();) {
        const uint8_t* h = stream.data() + at;
        // Sync word, one raw data block per frame, header of 7 bytes or 9 with its CRC.
        if (h[0] != 0xFF || (h[1] & 0xF0) != 0xF0 || (h[6] & 0x03) != 0) {
            return false;
        }
        const size_t header = (h[1] & 0x01) != 0 ? 7 : 9;
        const size_t length = (size_t{h[3] & 0x03u} << 11) | (size_t{h[4]} << 3) | (h[5] >> 5);
        if (length <= header || at + length > stream.size()) {
            return false;
        }
        packets.emplace_back(stream.begin() + static_cast<std::ptrdiff_t>(at + header),
                             stream.begin() + static_cast<std::ptrdiff_t>(at + length));
        at += length;
    }
    return !packets.empty();
}

std::vector<std::vector<uint8_t>> MotorAacPackets(uint64_t count, uint32_t rate, const std::vector<uint64_t>& spans,
                                                  uint32_t bitRate)
{
    std::vector<FrameSpan> frames;
    for (size_t k = 0; k + 1 < spans.size(); k += 2) {
        frames.push_back({spans[k], spans[k + 1]});
    }
    std::vector<std::vector<uint8_t>> packets;
    if (!EncodeAacPackets(MotorOverSpans(count * 1024, 2, rate, frames, 0.6), rate, 2, bitRate, packets) ||
        packets.size() < count) {
        return {};
    }
    packets.resize(count);
    return packets;
}

}  // namespace testsupport
