// Runs the suppressor alone over raw interleaved 16-bit little-endian sound, for tuning it on
// many clips quickly: ovix_probe RATE CHANNELS IN OUT START:END[:STRENGTH]...
// Writes the processed sound to OUT and prints, per span, the motor share it was judged by.
#include "NoiseSuppressor.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

int main(int argc, char** argv)
{
    if (argc < 5) {
        std::fprintf(stderr, "usage: ovix_probe RATE CHANNELS IN OUT START:END[:STRENGTH]...\n");
        return 2;
    }
    const uint64_t rate = std::strtoull(argv[1], nullptr, 10);
    const auto channels = static_cast<unsigned>(std::strtoul(argv[2], nullptr, 10));
    std::ifstream in(argv[3], std::ios::binary);
    const std::vector<char> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    const uint64_t frames = bytes.size() / (2 * channels);
    std::vector<int16_t> sound(frames * channels);
    std::copy_n(bytes.data(), sound.size() * 2, reinterpret_cast<char*>(sound.data()));
    std::vector<ovix::DriveSpan> spans;
    for (int i = 5; i < argc; ++i) {
        unsigned long long start = 0;
        unsigned long long end = 0;
        unsigned strength = 1000;
        if (std::sscanf(argv[i], "%llu:%llu:%u", &start, &end, &strength) < 2) {
            return 2;
        }
        spans.push_back({start, end, static_cast<float>(strength) / 1000.0f});
    }
    ovix::NoiseSuppressor suppressor(rate, channels, frames);
    suppressor.SetSpans(spans);
    std::vector<int16_t> out(sound.size());
    uint64_t appended = 0;
    uint64_t read = 0;
    const auto drain = [&] {
        const uint64_t ready = suppressor.Ready();
        suppressor.Read(read, ready - read, out.data() + read * channels);
        read = ready;
        suppressor.Release(read);
    };
    while (appended < frames) {
        const uint64_t n = std::min<uint64_t>({ovix::NoiseSuppressor::kBlockFrames, frames - appended, suppressor.Room()});
        suppressor.Append(sound.data() + appended * channels, n);
        appended += n;
        drain();
    }
    suppressor.Finish();
    drain();
    std::ofstream(argv[4], std::ios::binary).write(reinterpret_cast<const char*>(out.data()),
                                                  static_cast<std::streamsize>(out.size() * 2));
    for (const double share : suppressor.SpanShares()) {
        std::printf("%.4f\n", share);
    }
    return read == frames ? 0 : 1;
}
