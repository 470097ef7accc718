#include "SoundComparison.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <utility>

namespace {

constexpr uint64_t kBlockFrames = 4096;
constexpr int64_t kMaxOffset = 2048;       // more than any codec's delay
constexpr uint64_t kWindowFrames = 8192;  // the stretch the offset is measured on
constexpr double kSilenceDb = -120.0;

double Decibels(double sumOfSquares, uint64_t count)
{
    if (count == 0 || sumOfSquares <= 0) {
        return kSilenceDb;
    }
    return std::max(kSilenceDb, 10.0 * std::log10(sumOfSquares / static_cast<double>(count) / (32768.0 * 32768.0)));
}

bool Outside(uint64_t frame, const std::vector<SoundInterval>& intervals, uint64_t margin)
{
    for (const SoundInterval& span : intervals) {
        if (frame + margin >= span.start && frame < span.end + margin) {
            return false;
        }
    }
    return true;
}

// Mono mixes of the first stretch of both sounds, for the offset.
std::string MeasureOffset(const std::string& sourcePath, const std::string& destinationPath,
                          const std::vector<SoundInterval>& intervals, uint64_t margin, SoundComparison& result)
{
    SoundStream a;
    SoundStream b;
    if (!a.Open(sourcePath).empty() || !b.Open(destinationPath).empty()) {
        return "cannot be read twice";
    }
    const uint64_t length = std::min<uint64_t>(a.Frames(), kWindowFrames + 3 * kMaxOffset);
    const auto mono = [length](SoundStream& stream, uint64_t& frames) {
        std::vector<uint8_t> raw(length * stream.FrameBytes());
        frames = stream.Read(raw.data(), length);
        std::vector<double> levels(frames * stream.Channels());
        stream.Levels(raw.data(), frames, levels.data());
        std::vector<double> m(frames);
        for (uint64_t f = 0; f < frames; ++f) {
            for (uint32_t c = 0; c < stream.Channels(); ++c) {
                m[f] += levels[f * stream.Channels() + c];
            }
        }
        return m;
    };
    uint64_t na = 0;
    uint64_t nb = 0;
    const std::vector<double> ma = mono(a, na);
    const std::vector<double> mb = mono(b, nb);
    // The encoder's lead-in is no part of the comparison: start a packet in.
    const auto from = static_cast<int64_t>(std::min<uint64_t>(na, kMaxOffset));
    const auto to = static_cast<int64_t>(na);
    double best = -2;
    // Nearest lags first, so that a periodic sound (a tone) matches at the smallest lag that fits.
    for (int64_t step = 0; step <= 2 * kMaxOffset; ++step) {
        const int64_t lag = step % 2 == 0 ? step / 2 : -(step + 1) / 2;
        double ab = 0;
        double aa = 0;
        double bb = 0;
        for (int64_t f = std::max<int64_t>(from, -lag); f < to && f + lag < static_cast<int64_t>(nb); ++f) {
            if (Outside(static_cast<uint64_t>(f), intervals, margin)) {
                ab += ma[f] * mb[f + lag];
                aa += ma[f] * ma[f];
                bb += mb[f + lag] * mb[f + lag];
            }
        }
        const double c = aa > 0 && bb > 0 ? ab / std::sqrt(aa * bb) : (aa == 0 && bb == 0 && lag == 0 ? 1.0 : 0.0);
        if (c > best + 1e-9) {
            best = c;
            result.offset = lag;
        }
    }
    result.correlation = best;
    return "";
}

// As many frames as asked, unless the sound ends: blocks of both sounds then cover the same
// frames, however the stream happens to hand them out.
uint64_t ReadBlock(SoundStream& stream, uint8_t* samples, uint64_t frames)
{
    uint64_t done = 0;
    while (done < frames) {
        const uint64_t got = stream.Read(samples + done * stream.FrameBytes(), frames - done);
        if (got == 0) {
            break;
        }
        done += got;
    }
    return done;
}

std::string Seconds(uint64_t frames, uint32_t rate)
{
    char text[32];
    std::snprintf(text, sizeof text, "%.3f s", static_cast<double>(frames) / rate);
    return text;
}

}  // namespace

std::string CompareSounds(const std::string& sourcePath, const std::string& destinationPath, SoundComparison& result,
                          const SoundBlockSink& sink)
{
    SoundStream source;
    SoundStream destination;
    result.reason = "unreadable";
    for (const auto& [stream, path] : {std::pair{&source, &sourcePath}, std::pair{&destination, &destinationPath}}) {
        if (const std::string why = stream->Open(*path); !why.empty()) {
            result.reason = stream->HasInconsistentTables() ? "tables-inconsistent" : "unreadable";
            return *path + ": " + why;
        }
    }
    const std::string different = destinationPath + ": not the processed form of " + sourcePath + " (";
    if (source.Rate() != destination.Rate()) {
        result.reason = "rate-differs";
        return different + "its sound differs in rate: " + std::to_string(destination.Rate()) + " Hz against " +
               std::to_string(source.Rate()) + " Hz)";
    }
    if (source.Channels() != destination.Channels()) {
        result.reason = "channels-differ";
        return different + "its sound differs in channels: " + std::to_string(destination.Channels()) +
               " against " + std::to_string(source.Channels()) + ")";
    }
    if (source.Describe() != destination.Describe()) {
        result.reason = "format-differs";
        return different + "its sound is " + destination.Describe() + " against " + source.Describe() + ")";
    }
    if (source.Frames() != destination.Frames()) {
        result.reason = "length-differs";
        return different + "its sound differs in length: " + std::to_string(destination.Frames()) + " frames (" +
               Seconds(destination.Frames(), destination.Rate()) + ") against " + std::to_string(source.Frames()) +
               " (" + Seconds(source.Frames(), source.Rate()) + "))";
    }
    result.reason.clear();
    result.rate = source.Rate();
    result.channels = source.Channels();
    result.frames = source.Frames();
    result.aac = source.IsAac();
    result.format = source.Describe();
    result.bits = result.aac ? 0 : source.Bits();
    result.floatingPoint = source.IsFloatingPoint();
    const uint64_t ramp = result.rate / 100;  // the processing library's ramps
    const std::vector<SoundInterval>& intervals = source.Intervals();
    std::vector<double> before(intervals.size());
    std::vector<double> after(intervals.size());
    std::vector<uint64_t> counted(intervals.size());
    const uint64_t frameBytes = source.FrameBytes();
    std::vector<uint8_t> rawA(kBlockFrames * frameBytes);
    std::vector<uint8_t> rawB(kBlockFrames * frameBytes);
    std::vector<double> a(kBlockFrames * result.channels);
    std::vector<double> b(kBlockFrames * result.channels);
    double largest = 0;
    uint64_t first = 0;
    while (first < result.frames) {
        const uint64_t na = ReadBlock(source, rawA.data(), kBlockFrames);
        const uint64_t nb = ReadBlock(destination, rawB.data(), kBlockFrames);
        const uint64_t n = std::min(na, nb);
        if (n == 0) {
            break;
        }
        source.Levels(rawA.data(), n, a.data());
        destination.Levels(rawB.data(), n, b.data());
        for (uint64_t f = 0; f < n; ++f) {
            const uint64_t frame = first + f;
            const double* x = a.data() + f * result.channels;
            const double* y = b.data() + f * result.channels;
            for (size_t i = 0; i < intervals.size(); ++i) {
                if (frame >= intervals[i].start && frame < intervals[i].end) {
                    for (uint32_t c = 0; c < result.channels; ++c) {
                        before[i] += x[c] * x[c];
                        after[i] += y[c] * y[c];
                    }
                    counted[i] += result.channels;
                }
            }
            // Bytes decide whether a frame changed, as they do for the job, whatever floats make of them.
            if (Outside(frame, intervals, ramp) &&
                std::memcmp(rawA.data() + f * frameBytes, rawB.data() + f * frameBytes, frameBytes) != 0) {
                ++result.differingFrames;
                for (uint32_t c = 0; c < result.channels; ++c) {
                    const double difference = std::abs(x[c] - y[c]);
                    largest = difference > largest ? difference : largest;
                }
                largest = std::max(largest, 1e-300);  // a changed frame is never a difference of 0
            }
        }
        if (sink) {
            sink(a.data(), b.data(), first, n);
        }
        first += n;
        if (na != nb) {
            break;  // one of them stopped short
        }
    }
    // Each side must deliver all the sound its tables promise: one that stops early is no
    // match, however well the frames before agree. The side that stopped first is named.
    const bool destinationShort =
        destination.Position() < result.frames && destination.Position() <= source.Position();
    if (destinationShort || source.Position() < result.frames) {
        const SoundStream& stopped = destinationShort ? destination : source;
        result.reason = "sound-stops-early";
        return (destinationShort ? destinationPath : sourcePath) + ": its sound stops at " +
               Seconds(stopped.Position(), result.rate) + " of the " + Seconds(result.frames, result.rate) +
               " its tables promise";
    }
    result.largestDifference = static_cast<int>(std::min(std::ceil(largest), 1e9));
    for (size_t i = 0; i < intervals.size(); ++i) {
        result.intervals.push_back({intervals[i], Decibels(before[i], counted[i]), Decibels(after[i], counted[i])});
    }
    if (const std::string why = MeasureOffset(sourcePath, destinationPath, intervals, ramp, result); !why.empty()) {
        result.reason = "unreadable";
        return why;
    }
    if (result.correlation < 0.5) {
        result.reason = "sound-differs";
        return destinationPath + ": not the processed form of " + sourcePath + " (its sound does not match)";
    }
    return "";
}
