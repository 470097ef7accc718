// Measures the AAC splicer on a raw AAC stream (ADTS, as `ffmpeg -f adts` writes it): the
// stream is decoded as a job serves it, changed inside the given intervals as processing
// would change it, spliced, and the packets written are decoded again and set against the
// sound wanted. Prints the share of packets carried, the encoder's time, and the error at
// every joint beside the coding noise of the re-encoded packets around it.
//
// Usage: splice_bench ADTS|motor RATE CHANNELS BITRATE START:END[,START:END...] [PREROLL MARGIN CANDIDATES] [gain|filter]
//        (interval bounds in seconds of the decoded sound). "motor" makes the stream itself: a chord
//        over ambience, a lens motor (whine, ticks, hiss) inside the intervals, 60 s encoded by ffmpeg
//        at BITRATE; processing then takes the motor away again, as the suppressor would.
#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <sstream>
#include <string>
#include <vector>

#include "codec/AACDecoder.h"
#include "codec/CTqovixAacSplicer.h"
#include "support/MotorSound.h"
#include "support/SpliceCollector.h"

namespace {

using Packet = std::vector<uint8_t>;
constexpr size_t kFrames = 1024;

struct Interval {
    size_t start;
    size_t end;
};

std::vector<Packet> ReadAdts(const char* path)
{
    std::ifstream in(path, std::ios::binary);
    const std::vector<uint8_t> stream((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    std::vector<Packet> packets;
    for (size_t at = 0; at + 7 <= stream.size();) {
        const uint8_t* h = stream.data() + at;
        if (h[0] != 0xFF || (h[1] & 0xF0) != 0xF0) {
            break;
        }
        const size_t header = (h[1] & 0x01) != 0 ? 7 : 9;
        const size_t length = (size_t{h[3] & 0x03u} << 11) | (size_t{h[4]} << 3) | (h[5] >> 5);
        if (length <= header || at + length > stream.size()) {
            break;
        }
        packets.emplace_back(stream.begin() + static_cast<std::ptrdiff_t>(at + header),
                             stream.begin() + static_cast<std::ptrdiff_t>(at + length));
        at += length;
    }
    return packets;
}

// Decodes a packet stream as a job serves it: the first packet's sound dropped, one packet late.
std::vector<int16_t> Decode(const std::vector<Packet>& packets, const ACFormat& aac, const ACFormat& pcm)
{
    AACDecoder decoder;
    decoder.Initialize(aac, pcm);
    std::vector<int16_t> sound;
    for (const Packet& packet : packets) {
        int16_t block[AACDecoder::kMaxPcmSize / 2];
        unsigned int size = 0;
        unsigned int used = 0;
        decoder.Decode(block, &size, &used, packet.data(), static_cast<unsigned int>(packet.size()));
        sound.insert(sound.end(), block, block + size / 2);
    }
    sound.resize(packets.size() * kFrames * pcm.channelsPerFrame, 0);
    return sound;
}

double Db(double signal, double noise) { return noise == 0 ? 999 : signal == 0 ? -999 : 10 * std::log10(signal / noise); }

}  // namespace

int main(int argc, char** argv)
{
    if (argc < 6) {
        std::fprintf(stderr, "usage: splice_bench ADTS RATE CHANNELS BITRATE START:END[,...] [PREROLL MARGIN CANDIDATES] [gain|filter]\n");
        return 2;
    }
    const double rate = std::atof(argv[2]);
    const auto channels = static_cast<uint32_t>(std::atoi(argv[3]));
    const auto bitRate = static_cast<unsigned int>(std::atoi(argv[4]));
    std::vector<Interval> intervals;
    std::istringstream list(argv[5]);
    for (std::string item; std::getline(list, item, ',');) {
        const size_t colon = item.find(':');
        intervals.push_back({static_cast<size_t>(std::atof(item.substr(0, colon).c_str()) * rate),
                             static_cast<size_t>(std::atof(item.substr(colon + 1).c_str()) * rate)});
    }
    CTqovixAacSplicer::Tuning tuning;
    if (argc >= 9) {
        tuning.preRoll = std::strtoull(argv[6], nullptr, 10);
        tuning.margin = std::strtoull(argv[7], nullptr, 10);
        tuning.startCandidates = std::strtoull(argv[8], nullptr, 10);
    }
    const bool filter = argc >= 10 && std::strcmp(argv[9], "filter") == 0;

    const ACFormat aac{rate, ACFormatAAC, 0, 0, 1024, 0, channels, 0};
    const ACFormat pcm{rate, ACFormatLinearPCM, 12, 2 * channels, 1, 2 * channels, channels, 16};
    const bool motor = std::strcmp(argv[1], "motor") == 0;
    std::vector<double> motorSound;
    std::string adts = argv[1];
    if (motor) {
        const uint64_t frames = static_cast<uint64_t>(60 * rate);
        std::vector<testsupport::MotorSpan> spans;
        for (const Interval& interval : intervals) {
            spans.push_back({interval.start, interval.end});
        }
        motorSound = testsupport::MotorNoise(frames, channels, static_cast<uint32_t>(rate), spans, 2500.0);
        const std::vector<int16_t> mixed = testsupport::ToPcm(testsupport::Sum(
            testsupport::Sum(testsupport::Chord(frames, channels, static_cast<uint32_t>(rate), 1200.0),
                             testsupport::Ambience(frames, channels, 300.0)),
            motorSound));
        const std::string raw = "splice_bench.raw";
        adts = "splice_bench.aac";
        std::ofstream(raw, std::ios::binary).write(reinterpret_cast<const char*>(mixed.data()),
                                                    static_cast<std::streamsize>(mixed.size() * 2));
        const std::string command = "ffmpeg -v error -nostdin -y -f s16le -ar " + std::to_string(static_cast<int>(rate)) +
                                    " -ac " + std::to_string(channels) + " -i " + raw + " -c:a aac -b:a " +
                                    std::to_string(bitRate) + " -f adts " + adts;
        if (std::system(command.c_str()) != 0) {
            std::fprintf(stderr, "splice_bench: ffmpeg failed\n");
            return 1;
        }
    }
    const std::vector<Packet> source = ReadAdts(adts.c_str());
    if (source.empty()) {
        std::fprintf(stderr, "splice_bench: no packets in %s\n", argv[1]);
        return 1;
    }
    const std::vector<int16_t> served = Decode(source, aac, pcm);
    // Processing: inside each interval a change that reaches every sample, under 10 ms ramps.
    std::vector<int16_t> processed = served;
    const size_t ramp = static_cast<size_t>(rate / 100);
    for (const Interval& interval : intervals) {
        std::vector<double> low(channels, 0);
        for (size_t f = interval.start > ramp ? interval.start - ramp : 0;
             f < std::min(interval.end + ramp, served.size() / channels); ++f) {
            double weight = 1;
            if (f < interval.start) {
                weight = 0.5 - 0.5 * std::cos(M_PI * static_cast<double>(f + ramp - interval.start) / ramp);
            } else if (f >= interval.end) {
                weight = 0.5 + 0.5 * std::cos(M_PI * static_cast<double>(f - interval.end) / ramp);
            }
            for (uint32_t c = 0; c < channels; ++c) {
                const double x = served[f * channels + c];
                low[c] += 0.2 * (x - low[c]);
                // The served sound starts where the motor's frames do: the decoder drops the priming packet.
                const size_t m = f * channels + c;
                const double changed = motor ? x - (m < motorSound.size() ? motorSound[m] : 0.0)
                                       : filter ? low[c]
                                                : 0.4 * x;
                processed[f * channels + c] =
                    static_cast<int16_t>(std::lround(std::clamp(x + weight * (changed - x), -32768.0, 32767.0)));
            }
        }
    }

    testsupport::SpliceCollector collector(source);
    CTqovixAacSplicer splicer;
    splicer.SetTuning(tuning);
    if (TqovixFailed(splicer.Open(pcm, aac, bitRate, &collector))) {
        std::fprintf(stderr, "splice_bench: the codecs did not open\n");
        return 1;
    }
    splicer.Plan(source.size(), false);
    const auto start = std::chrono::steady_clock::now();
    const size_t block = kFrames * channels;
    for (size_t at = 0; at < served.size(); at += block) {
        const size_t n = std::min(block, served.size() - at);
        splicer.KeepServed(served.data() + at, n * 2);
        if (TqovixFailed(splicer.Push(processed.data() + at, n * 2))) {
            std::fprintf(stderr, "splice_bench: the splicer failed\n");
            return 1;
        }
    }
    const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    if (!splicer.IsFinished() || collector.written.size() != source.size()) {
        std::fprintf(stderr, "splice_bench: %zu of %zu packets written\n", collector.written.size(), source.size());
        return 1;
    }

    // The written stream decoded, region by region (served region r is the packets r and r + 1's).
    const std::vector<int16_t> heard = Decode(collector.written, aac, pcm);
    const size_t regions = source.size() - 1;
    std::vector<double> signal(regions), noise(regions), peak(regions);
    for (size_t r = 0; r < regions; ++r) {
        for (size_t k = r * block; k < (r + 1) * block; ++k) {
            const double want = processed[k];
            const double d = heard[k] - want;
            signal[r] += want * want;
            noise[r] += d * d;
            peak[r] = std::max(peak[r], std::fabs(d));
        }
    }
    const CTqovixAacSplicer::Statistics& s = splicer.GetStatistics();
    size_t carried = 0;
    for (bool c : collector.carried) {
        carried += c ? 1 : 0;
    }
    std::printf("packets %zu, carried %zu (%.1f %%), re-encoded %llu, spans %llu, joints %llu, unheard %llu, "
                "starts moved %llu, ends moved %llu, worst joint %.2f x noise, peak %.0f; splicer %.3f s\n",
                source.size(), carried, 100.0 * static_cast<double>(carried) / static_cast<double>(source.size()),
                static_cast<unsigned long long>(s.encoded), static_cast<unsigned long long>(s.spans),
                static_cast<unsigned long long>(s.joints), static_cast<unsigned long long>(s.unheardJoints),
                static_cast<unsigned long long>(s.startsMoved), static_cast<unsigned long long>(s.endsMoved),
                s.worstJointRatio, s.worstJointPeak, seconds);
    // Each joint: the region both sides sound in, beside the re-encoded regions next to it.
    double worstJointDb = 999;
    double worstJointPeak = 0;
    double worstBesideDb = 999;
    for (size_t p = 1; p < collector.carried.size(); ++p) {
        if (collector.carried[p] == collector.carried[p - 1]) {
            continue;
        }
        const size_t joint = p - 1;  // served region where packets p - 1 and p meet
        const bool startOfSpan = !collector.carried[p];
        const size_t inside = startOfSpan ? std::min(joint + 1, regions - 1) : (joint > 0 ? joint - 1 : 0);
        worstJointDb = std::min(worstJointDb, Db(signal[joint], noise[joint]));
        worstJointPeak = std::max(worstJointPeak, peak[joint]);
        worstBesideDb = std::min(worstBesideDb, Db(signal[inside], noise[inside]));
        std::printf("  %s at packet %zu: joint %.1f dB SNR, peak %.0f; re-encoded beside it %.1f dB, peak %.0f\n",
                    startOfSpan ? "span starts" : "span ends", p, Db(signal[joint], noise[joint]), peak[joint],
                    Db(signal[inside], noise[inside]), peak[inside]);
    }
    std::printf("joints: worst %.1f dB SNR, largest sample difference %.0f (16-bit steps); the re-encoded region "
                "beside a joint at worst %.1f dB\n",
                worstJointDb, worstJointPeak, worstBesideDb);
    // Over every span's first packets: their sound and their size against the source's.
    double firstNoise = 0, firstSignal = 0, firstBytes = 0, firstSourceBytes = 0, allBytes = 0, allSourceBytes = 0;
    for (size_t p = 1; p + 4 < collector.carried.size(); ++p) {
        if (!collector.carried[p]) {
            allBytes += static_cast<double>(collector.written[p].size());
            allSourceBytes += static_cast<double>(source[p].size());
        }
        if (collector.carried[p - 1] && !collector.carried[p]) {
            for (size_t k = p; k < p + 3; ++k) {
                firstSignal += signal[k];
                firstNoise += noise[k];
                firstBytes += static_cast<double>(collector.written[k].size());
                firstSourceBytes += static_cast<double>(source[k].size());
            }
        }
    }
    std::printf("spans' first three packets: %.1f dB SNR, %.2f x the source's bytes; all re-encoded: %.2f x\n",
                Db(firstSignal, firstNoise), firstBytes / firstSourceBytes, allBytes / allSourceBytes);
    double outsideNoise = 0, outsideSignal = 0;
    for (size_t r = 0; r < regions; ++r) {
        if (collector.carried[r] && collector.carried[r + 1]) {
            outsideSignal += signal[r];
            outsideNoise += noise[r];
        }
    }
    std::printf("carried regions: %.1f dB SNR against the sound served\n", Db(outsideSignal, outsideNoise));
    return 0;
}
