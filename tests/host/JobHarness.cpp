#include "host/JobHarness.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <sstream>
#include <thread>
#include <utility>

#include "MovieWriter.h"
#include "host/ChunkAccount.h"

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

namespace {

std::vector<std::string> HashPackets(const std::string& path, const std::string& stream, const std::string& limit)
{
    std::string output;
    const std::string command = "ffmpeg -v error -nostdin -i " + ShellQuote(path) + " -map 0:" + stream +
                                " -c copy" + limit + " -f framemd5 - 2>&1";
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

}  // namespace

std::vector<std::string> PacketHashes(const std::string& path, const std::string& stream)
{
    return HashPackets(path, stream, "");
}

std::vector<std::string> FirstPacketHashes(const std::string& path, const std::string& stream, uint64_t count)
{
    return HashPackets(path, stream, " -frames " + std::to_string(count));
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

bool DecodeSound(const std::string& path, std::vector<double>& samples)
{
    testsupport::TempDir scratch;
    const std::string raw = scratch.File("sound.raw");
    std::string output;
    const int status = RunCommand("ffmpeg -v error -nostdin -xerror -i " + ShellQuote(path) +
                                      " -map 0:a:0 -f f64le -acodec pcm_f64le " + ShellQuote(raw) + " 2>&1",
                                  &output);
    if (status != 0 || !output.empty()) {
        return false;
    }
    const std::vector<uint8_t> bytes = testsupport::ReadFile(raw);
    samples.resize(bytes.size() / sizeof(double));
    std::memcpy(samples.data(), bytes.data(), samples.size() * sizeof(double));
    return true;
}

std::string CheckReencodedSound(const std::vector<int16_t>& source, const std::vector<int16_t>& destination,
                                unsigned channels, const std::vector<testsupport::FrameSpan>& spans, uint64_t margin,
                                uint64_t leadIn, double keptDb, double changedDb)
{
    if (source.size() != destination.size() || source.empty() || source.size() % channels != 0) {
        return "the sound changed its length";
    }
    const uint64_t frames = source.size() / channels;
    // Region of a frame: 0 outside, 1 + i inside span i, -1 near an edge, in the encoder's lead-in
    // or in its flush at the end (not judged).
    const auto region = [&](uint64_t f) {
        for (size_t i = 0; i < spans.size(); ++i) {
            if (f + margin >= spans[i].start && f < spans[i].end + margin) {
                return f >= spans[i].start + margin && f + margin < spans[i].end ? static_cast<int>(i) + 1 : -1;
            }
        }
        return f < leadIn || f + leadIn >= frames ? -1 : 0;
    };
    const auto decibels = [](double signal, double difference) {
        return difference == 0 ? 999.0 : signal == 0 ? -999.0 : 10.0 * std::log10(signal / difference);
    };
    // Outside, packet by packet, so that one packet out of place or gone quiet shows.
    constexpr uint64_t kBlock = 1024;
    std::ostringstream problems;
    for (unsigned c = 0; c < channels; ++c) {
        std::vector<double> signal(spans.size() + 1);
        std::vector<double> difference(spans.size() + 1);
        double worst = 999.0;
        uint64_t worstAt = 0;
        uint64_t blocks = 0;
        for (uint64_t from = 0; from + kBlock <= frames; from += kBlock) {
            double blockSignal = 0;
            double blockDifference = 0;
            bool outside = true;
            for (uint64_t f = from; f < from + kBlock; ++f) {
                const int r = region(f);
                const double a = source[f * channels + c];
                const double b = destination[f * channels + c];
                outside = outside && r == 0;
                if (r >= 0) {
                    signal[r] += a * a;
                    difference[r] += (a - b) * (a - b);
                }
                blockSignal += a * a;
                blockDifference += (a - b) * (a - b);
            }
            if (outside) {
                ++blocks;
                if (decibels(blockSignal, blockDifference) < worst) {
                    worst = decibels(blockSignal, blockDifference);
                    worstAt = from;
                }
            }
        }
        if (blocks == 0) {
            problems << "no whole block outside the intervals to judge; ";
        } else if (worst < keptDb) {
            problems << "channel " << c << " outside the intervals, frames " << worstAt << " on: " << worst
                     << " dB from the source; ";
        }
        for (size_t r = 1; r < signal.size(); ++r) {
            if (decibels(signal[r], difference[r]) > changedDb) {
                problems << "channel " << c << " in interval " << r - 1 << ": " << decibels(signal[r], difference[r])
                         << " dB from the source, as good as unchanged; ";
            }
        }
    }
    return problems.str();
}

std::string CheckSplicedAac(const std::string& source, const std::string& destination, unsigned channels,
                            const std::vector<moviekit::AfInterval>& intervals, uint64_t away, double jointDb,
                            double peakShare, double* kept, uint64_t priming)
{
    constexpr uint64_t kPacketFrames = 1024;
    const std::vector<std::vector<uint8_t>> before = SoundPackets(source);
    const std::vector<std::vector<uint8_t>> after = SoundPackets(destination);
    const std::vector<std::string> hashesBefore = PacketHashes(source, "a:0");
    const std::vector<std::string> hashesAfter = PacketHashes(destination, "a:0");
    if (before.empty() || after.size() != before.size() || hashesBefore.size() != before.size() ||
        hashesAfter.size() != after.size()) {
        return "the packets cannot be compared: " + std::to_string(before.size()) + " and " +
               std::to_string(after.size()) + " in the tables, " + std::to_string(hashesBefore.size()) + " and " +
               std::to_string(hashesAfter.size()) + " to ffmpeg";
    }
    std::vector<int16_t> a;
    std::vector<int16_t> b;
    if (!DecodeSound(source, a) || !DecodeSound(destination, b) || a.size() != b.size()) {
        return "the sound does not decode to the same length";
    }
    std::ostringstream problems;
    std::vector<bool> same(before.size());
    uint64_t sameCount = 0;
    for (size_t k = 0; k < before.size(); ++k) {
        same[k] = before[k] == after[k];
        sameCount += same[k] ? 1 : 0;
        // Packet k's frame, in frames of the decoded sound: [1024 k - priming, 1024 (k + 2) - priming).
        const auto first = static_cast<int64_t>(k * kPacketFrames) - static_cast<int64_t>(priming);
        const bool isAway = std::ranges::none_of(intervals, [&](const moviekit::AfInterval& interval) {
            return first + static_cast<int64_t>(2 * kPacketFrames + away) > static_cast<int64_t>(interval.startFrame) &&
                   first < static_cast<int64_t>(interval.endFrame + away);
        });
        if (isAway && (!same[k] || hashesBefore[k] != hashesAfter[k])) {
            problems << "packet " << k << " is away from every interval but not the source's own ("
                     << (same[k] ? "ffmpeg's hashes differ" : "its bytes differ") << "); ";
        }
    }
    if (kept != nullptr) {
        *kept = static_cast<double>(sameCount) / static_cast<double>(before.size());
    }
    const uint64_t frames = a.size() / channels;
    for (size_t k = 1; k < same.size(); ++k) {
        if (same[k] == same[k - 1]) {
            continue;
        }
        // Packets k - 1 and k meet in the decoder's output for packet k.
        const auto from = static_cast<int64_t>(k * kPacketFrames) - static_cast<int64_t>(priming);
        if (from < 0 || static_cast<uint64_t>(from) + kPacketFrames > frames) {
            continue;
        }
        for (unsigned c = 0; c < channels; ++c) {
            double signal = 0;
            double difference = 0;
            double peak = 0;
            double loudest = 0;
            for (auto f = static_cast<uint64_t>(from); f < static_cast<uint64_t>(from) + kPacketFrames; ++f) {
                const double x = a[f * channels + c];
                const double d = b[f * channels + c] - x;
                signal += x * x;
                difference += d * d;
                peak = std::max(peak, std::fabs(d));
                loudest = std::max(loudest, std::fabs(x));
            }
            const double db = difference == 0 ? 999.0 : signal == 0 ? -999.0 : 10.0 * std::log10(signal / difference);
            if (db < jointDb || peak > peakShare * loudest) {
                problems << "joint before packet " << k << ", channel " << c << ": " << db << " dB, a sample off by "
                         << peak << " where the loudest is " << loudest << "; ";
            }
        }
    }
    return problems.str();
}

std::vector<testsupport::FrameSpan> Spans(const std::vector<moviekit::AfInterval>& intervals, uint64_t shift)
{
    std::vector<testsupport::FrameSpan> spans;
    for (const moviekit::AfInterval& interval : intervals) {
        spans.push_back({interval.startFrame + shift, interval.endFrame + shift});
    }
    return spans;
}

bool NearInterval(uint64_t frame, const std::vector<moviekit::AfInterval>& intervals, uint64_t margin)
{
    return std::ranges::any_of(intervals, [&](const moviekit::AfInterval& span) {
        return frame + margin >= span.startFrame && frame < span.endFrame + margin;
    });
}

template <typename Sample>
std::string CheckPcmChangedOnlyInside(const std::vector<Sample>& before, const std::vector<Sample>& after,
                                      unsigned channels, const std::vector<moviekit::AfInterval>& intervals,
                                      uint64_t ramp)
{
    if (before.empty() || after.size() != before.size()) {
        return "the sound is empty or changed its length";
    }
    uint64_t strays = 0;
    uint64_t firstStray = 0;
    std::vector<uint64_t> inside(intervals.size());
    std::vector<uint64_t> changedInside(intervals.size());
    for (uint64_t f = 0; f < before.size() / channels; ++f) {
        const auto at = static_cast<std::ptrdiff_t>(f * channels);
        // By their bits: a float's -0 is no 0.
        const bool changed = std::memcmp(before.data() + at, after.data() + at, channels * sizeof(Sample)) != 0;
        if (changed && !NearInterval(f, intervals, ramp)) {
            firstStray = strays++ == 0 ? f : firstStray;
        }
        for (size_t i = 0; i < intervals.size(); ++i) {
            if (f >= intervals[i].startFrame + ramp && f + ramp < intervals[i].endFrame) {
                ++inside[i];
                changedInside[i] += changed ? 1 : 0;
            }
        }
    }
    std::ostringstream problems;
    if (strays != 0) {
        problems << strays << " frames changed outside the intervals and their ramps, the first at " << firstStray
                 << "; ";
    }
    for (size_t i = 0; i < intervals.size(); ++i) {
        if (inside[i] == 0 || changedInside[i] * 2 <= inside[i]) {
            problems << "AF interval " << i << " left as it was: " << changedInside[i] << " of " << inside[i]
                     << " frames changed; ";
        }
    }
    return problems.str();
}

template std::string CheckPcmChangedOnlyInside(const std::vector<int16_t>&, const std::vector<int16_t>&, unsigned,
                                               const std::vector<moviekit::AfInterval>&, uint64_t);
template std::string CheckPcmChangedOnlyInside(const std::vector<double>&, const std::vector<double>&, unsigned,
                                               const std::vector<moviekit::AfInterval>&, uint64_t);

std::vector<uint8_t> ReadRange(const std::string& path, uint64_t offset, uint64_t size)
{
    std::vector<uint8_t> bytes;
    const int fd = open(path.c_str(), O_RDONLY);
    if (fd < 0) {
        return bytes;
    }
    bytes.resize(size);
    uint64_t got = 0;
    while (got < size) {
        const ssize_t n = pread(fd, bytes.data() + got, size - got, static_cast<off_t>(offset + got));
        if (n <= 0) {
            break;
        }
        got += static_cast<uint64_t>(n);
    }
    close(fd);
    bytes.resize(got);
    return bytes;
}

std::vector<TopAtom> TopLevelAtoms(const std::string& path)
{
    std::vector<TopAtom> atoms;
    struct stat info {};
    if (stat(path.c_str(), &info) != 0) {
        return atoms;
    }
    const auto fileSize = static_cast<uint64_t>(info.st_size);
    auto be = [](const std::vector<uint8_t>& b, size_t at, size_t width) {
        uint64_t value = 0;
        for (size_t k = 0; k < width; ++k) {
            value = value << 8 | b[at + k];
        }
        return value;
    };
    for (uint64_t offset = 0; offset + 8 <= fileSize;) {
        const std::vector<uint8_t> header = ReadRange(path, offset, 16);
        if (header.size() < 8) {
            break;
        }
        TopAtom atom;
        atom.type.assign(header.begin() + 4, header.begin() + 8);
        atom.offset = offset;
        atom.headerSize = 8;
        atom.size = be(header, 0, 4);
        if (atom.size == 1) {
            if (header.size() < 16) {
                break;
            }
            atom.headerSize = 16;
            atom.size = be(header, 8, 8);
        } else if (atom.size == 0) {
            atom.size = fileSize - offset;
        }
        if (atom.size < atom.headerSize || atom.size > fileSize - offset) {
            break;
        }
        atoms.push_back(atom);
        offset += atom.size;
    }
    return atoms;
}

bool Contains(const std::vector<uint8_t>& bytes, const std::string& text)
{
    return std::search(bytes.begin(), bytes.end(), text.begin(), text.end()) != bytes.end();
}

namespace {

class SparseFileSink : public moviekit::Sink {
public:
    SparseFileSink(const std::string& path, uint64_t holeBytes)
        : m_fd(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644)), m_holeBytes(holeBytes)
    {
    }
    ~SparseFileSink() override
    {
        if (m_fd >= 0) {
            close(m_fd);
        }
    }
    bool IsOpen() const { return m_fd >= 0; }
    bool Finish()
    {
        // A trailing hole only counts once the file is that long.
        return ftruncate(m_fd, static_cast<off_t>(Written())) == 0 && close(std::exchange(m_fd, -1)) == 0;
    }

private:
    bool Store(const uint8_t* data, size_t size) override
    {
        if (size >= m_holeBytes) {
            return lseek(m_fd, static_cast<off_t>(size), SEEK_CUR) >= 0;
        }
        for (size_t done = 0; done < size;) {
            const ssize_t n = write(m_fd, data + done, size - done);
            if (n <= 0) {
                return false;
            }
            done += static_cast<size_t>(n);
        }
        return true;
    }

    int m_fd;
    uint64_t m_holeBytes;
};

}  // namespace

bool WriteSparseMovie(const std::string& path, const moviekit::MovieRecipe& recipe, uint64_t holeBytes,
                      moviekit::MovieLayout* layout, std::string* error)
{
    SparseFileSink sink(path, holeBytes);
    if (!sink.IsOpen()) {
        *error = "cannot create " + path;
        return false;
    }
    if (!moviekit::WriteMovieTo(sink, recipe, layout, error)) {
        return false;
    }
    if (!sink.Finish()) {
        *error = "cannot finish " + path;
        return false;
    }
    return true;
}

void HostTest::SetUp()
{
    ASSERT_TRUE(testsupport::HaveCommand("ffprobe")) << "ffprobe is required";
    ASSERT_EQ(TqInitializeOVIX(), 0);
}

void HostTest::TearDown() { TqCloseOVIX(); }

std::string HostTest::Write(const moviekit::MovieRecipe& recipe, const std::string& name,
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
