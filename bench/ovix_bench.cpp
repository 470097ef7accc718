// Processing speed of libOVIX at 48 kHz stereo: the whole track inside one AF interval (nothing
// around it to learn from: analysed, left as it is), a lens hunting (drives over 80% of the
// track, the worst that is processed) and a usual take (drives over a tenth of the track). First the suppressor
// alone, on 16-bit and on 24-bit samples and on one channel (what is judged per frame costs a
// mono track as much as a stereo one), then a whole session through the exported functions with
// in-memory callbacks. Prints frames per second and the multiple of real time.
#include "NoiseSuppressor.h"
#include "ovix/Ovix.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <random>
#include <thread>
#include <vector>

namespace {

constexpr uint64_t kRate = 48000;
constexpr unsigned kChannels = 2;
constexpr uint64_t kSeconds = 600;
constexpr uint64_t kFrames = kRate * kSeconds;
constexpr int kRounds = 3;

using Clock = std::chrono::steady_clock;

// Ten seconds replayed in a loop: room noise, and a lens motor (a whine sweeping from 300 to
// 1500 Hz with its harmonics, over hiss) wherever `Spans(share)` puts the drives, so that the
// suppressor does its whole work there rather than leaving the intervals untouched.
std::vector<int16_t> Source(double share)
{
    std::mt19937 random(7);
    std::normal_distribution<double> noise(0.0, 1.0);
    const uint64_t frames = kRate * 10;
    const uint64_t drive = kRate / 2;
    const uint64_t period = share >= 1.0 ? drive : static_cast<uint64_t>(static_cast<double>(drive) / share);
    const uint64_t first = share >= 1.0 ? 0 : period / 2;
    std::vector<int16_t> source(frames * kChannels);
    double phase = 0.0;
    for (uint64_t f = 0; f < frames; ++f) {
        const bool driving = f >= first && (f - first) % period < drive;
        const double into = static_cast<double>((f - first) % period) / static_cast<double>(drive);
        phase += 2.0 * 3.141592653589793 * (300.0 + 1200.0 * into) / kRate;
        double motor = 0.0;
        for (int h = 1; h <= 5 && driving; ++h) {
            motor += 1500.0 / h * std::sin(h * phase);
        }
        for (unsigned c = 0; c < kChannels; ++c) {
            const double hiss = driving ? 800.0 * noise(random) : 0.0;
            source[f * kChannels + c] = static_cast<int16_t>(std::clamp(motor + hiss + 200.0 * noise(random), -32768.0, 32767.0));
        }
    }
    return source;
}

void Report(const char* what, double seconds)
{
    const double framesPerSecond = static_cast<double>(kFrames) / seconds;
    std::printf("%-34s %8.1f Mframes/s  %7.0fx real time\n", what, framesPerSecond / 1e6,
                framesPerSecond / static_cast<double>(kRate));
}

// Spans covering `share` of the track: a drive of 0.5 s every 0.5/share seconds, or all of it.
std::vector<ovix::DriveSpan> Spans(double share)
{
    if (share >= 1.0) {
        return {{0, kFrames, 1.0f}};
    }
    std::vector<ovix::DriveSpan> spans;
    const uint64_t drive = kRate / 2;
    const auto period = static_cast<uint64_t>(static_cast<double>(drive) / share);
    for (uint64_t at = period / 2; at + drive <= kFrames; at += period) {
        spans.push_back({at, at + drive, 1.0f});
    }
    return spans;
}

// The same sound as 24-bit samples, each 16-bit one with a low byte of its own.
std::vector<uint8_t> Widened(const std::vector<int16_t>& source)
{
    std::vector<uint8_t> wide(source.size() * 3);
    for (size_t k = 0; k < source.size(); ++k) {
        const auto value = static_cast<uint32_t>(static_cast<int32_t>(source[k]) * 256 + static_cast<int32_t>(k % 251));
        wide[3 * k] = static_cast<uint8_t>(value);
        wide[3 * k + 1] = static_cast<uint8_t>(value >> 8);
        wide[3 * k + 2] = static_cast<uint8_t>(value >> 16);
    }
    return wide;
}

// The left channel alone.
std::vector<int16_t> Mono(const std::vector<int16_t>& source)
{
    std::vector<int16_t> mono(source.size() / kChannels);
    for (size_t f = 0; f < mono.size(); ++f) {
        mono[f] = source[f * kChannels];
    }
    return mono;
}

// Appends blocks as the session pulls them and reads back what is final.
double TimeSuppressor(const void* samples, size_t sampleCount, ovix::SampleFormat format, double share,
                      double& motorShare, unsigned channels = kChannels)
{
    constexpr size_t kBlock = ovix::NoiseSuppressor::kBlockFrames;
    ovix::NoiseSuppressor suppressor(kRate, channels, kFrames, format);
    suppressor.SetSpans(Spans(share));
    const size_t frameBytes = size_t{channels} * format.Bytes();
    const auto* source = static_cast<const uint8_t*>(samples);
    std::vector<uint8_t> block(kBlock * frameBytes);
    const uint64_t sourceFrames = sampleCount / channels;
    uint64_t read = 0;
    const auto drain = [&] {
        for (const uint64_t ready = suppressor.Ready(); read < ready;) {
            const uint64_t n = std::min<uint64_t>(kBlock, ready - read);
            suppressor.Read(read, n, block.data());
            read += n;
            suppressor.Release(read);
        }
    };
    const auto start = Clock::now();
    for (uint64_t done = 0; done < kFrames;) {
        const uint64_t n = std::min<uint64_t>({kBlock, kFrames - done, sourceFrames - done % sourceFrames});
        if (suppressor.Room() < n) {
            return -1.0;
        }
        std::memcpy(block.data(), source + (done % sourceFrames) * frameBytes, n * frameBytes);
        suppressor.Append(block.data(), n);
        done += n;
        drain();
    }
    suppressor.Finish();
    drain();
    const double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    motorShare = suppressor.LastMotorShare();
    return read == kFrames ? seconds : -1.0;
}

// The session's side of the system: AF information with the intervals asked for, no audio
// level, audio served from memory, output dropped.
struct Feed {
    std::vector<uint8_t> af;
    const std::vector<int16_t>* source = nullptr;
    uint64_t position = 0;  // frames
};
Feed g_feed;

std::vector<uint8_t> AfBlock(const std::vector<ovix::DriveSpan>& spans)
{
    std::vector<uint8_t> block(8 + 16 + 20 * spans.size(), 0);
    auto put = [&](size_t at, uint64_t value, int bytes) {
        for (int i = 0; i < bytes; ++i) {
            block[at + i] = static_cast<uint8_t>(value >> (8 * (bytes - 1 - i)));
        }
    };
    put(0, block.size(), 4);
    std::memcpy(block.data() + 4, "OP01AFR1", 8);
    put(12, 1, 2);
    put(16, kRate, 4);
    put(20, spans.size(), 4);
    for (size_t i = 0; i < spans.size(); ++i) {
        put(24 + 20 * i, spans[i].start, 8);
        put(32 + 20 * i, spans[i].end, 8);
        put(40 + 20 * i, 1000, 2);
    }
    return block;
}

unsigned long InputAf(void* buffer, unsigned long* delivered, unsigned long size, unsigned long)
{
    if (buffer == nullptr) {
        *delivered = g_feed.af.size();
        return 0;
    }
    *delivered = std::min<unsigned long>(size, g_feed.af.size());
    std::memcpy(buffer, g_feed.af.data(), *delivered);
    return 0;
}

unsigned long InputLevel(void*, unsigned long* delivered, unsigned long, unsigned long)
{
    *delivered = 0;
    return ovix::kNoAudioLevel;
}

unsigned long InputAudio(void* buffer, unsigned long* delivered, unsigned long size, unsigned long)
{
    const uint64_t sourceFrames = g_feed.source->size() / kChannels;
    const uint64_t frames = std::min<uint64_t>(size / (kChannels * 2), sourceFrames - g_feed.position % sourceFrames);
    std::memcpy(buffer, g_feed.source->data() + (g_feed.position % sourceFrames) * kChannels, frames * kChannels * 2);
    g_feed.position += frames;
    *delivered = frames * kChannels * 2;
    return 0;
}

unsigned long OutputAudio(void*, unsigned long) { return 0; }
void NotifyProgress(unsigned long, unsigned long) {}

double TimeSession(const std::vector<int16_t>& source, double share)
{
    g_feed = {AfBlock(Spans(share)), &source, 0};
    TqovixLibraryInitialize();
    TqovixSetCallbackInputAFInformation(InputAf);
    TqovixSetCallbackInputAudioLevelInformation(InputLevel);
    TqovixSetCallbackInputAudio(InputAudio);
    TqovixSetCallbackOutputAudio(OutputAudio);
    TqovixSetCallbackNotifyProgress(NotifyProgress);
    const TqovixAudioInformation audio{sizeof(TqovixAudioInformation), kRate / 1000, kChannels, 16, kFrames, 0, 0, 0, 0};
    const TqovixTrimInformation trim{sizeof(TqovixTrimInformation), 30000, 1001, 0, 0};
    const auto start = Clock::now();
    double seconds = -1.0;
    if (TqovixOpenSession(audio, trim) == ovix::kSuccess) {
        while (TqovixIsSessionFinished() == 0) {
            std::this_thread::sleep_for(std::chrono::microseconds(200));
        }
        seconds = std::chrono::duration<double>(Clock::now() - start).count();
        if (TqovixIsSessionFinished() != ovix::kSessionFinished) {
            seconds = -1.0;
        }
        TqovixCloseSession(0);
    }
    TqovixLibraryClose();
    return seconds;
}

}  // namespace

int main()
{
    std::printf("%llu s of 48 kHz stereo, best of %d\n", static_cast<unsigned long long>(kSeconds), kRounds);
    for (const double share : {1.0, 0.8, 0.1}) {
        const std::vector<int16_t> source = Source(share);
        const std::vector<uint8_t> wide = Widened(source);
        const std::vector<int16_t> mono = Mono(source);
        double suppressor = 1e30;
        double deeper = 1e30;
        double single = 1e30;
        double session = 1e30;
        double motorShare = 0.0;
        for (int round = 0; round < kRounds; ++round) {
            const double alone = TimeSuppressor(source.data(), source.size(), ovix::SampleFormat::Int16(), share, motorShare);
            double wideShare = 0.0;
            const double alone24 =
                TimeSuppressor(wide.data(), source.size(), *ovix::SampleFormat::Of(24, false), share, wideShare);
            double monoShare = 0.0;
            const double alone1 =
                TimeSuppressor(mono.data(), mono.size(), ovix::SampleFormat::Int16(), share, monoShare, 1);
            const double whole = TimeSession(source, share);
            if (alone < 0.0 || alone24 < 0.0 || alone1 < 0.0 || whole < 0.0) {
                std::fprintf(stderr, "the suppressor or the session did not finish\n");
                return 1;
            }
            suppressor = std::min(suppressor, alone);
            deeper = std::min(deeper, alone24);
            single = std::min(single, alone1);
            session = std::min(session, whole);
        }
        std::printf("intervals over %3.0f%% of the track (motor share of the last segment %.2f):\n", share * 100.0,
                    motorShare);
        Report("  suppressor alone", suppressor);
        Report("  suppressor alone, 24-bit samples", deeper);
        Report("  suppressor alone, mono", single);
        Report("  session through the interface", session);
    }
    return 0;
}
