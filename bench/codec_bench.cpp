// Encodes and decodes 60 s of 48 kHz stereo through AACEncoder and AACDecoder over the
// converter layer, then has ffmpeg do the same with its own AAC encoder and decoder on the
// same PCM, and prints both times and their ratios. The library doing the coding is the
// same on both sides, so a ratio above 1 is overhead of ours.
//
// Usage: codec_bench [WORK_DIR] [ROUNDS]   (defaults: a fresh temporary directory, 3;
// an empty WORK_DIR also means the default)
#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "codec/AACDecoder.h"
#include "codec/AACEncoder.h"

namespace {

constexpr double kRate = 48000;
constexpr uint32_t kChannels = 2;
constexpr size_t kSeconds = 60;
constexpr unsigned int kBitRate = 256000;
// The processing library hands processed sound back in pieces of this size.
constexpr size_t kPushBytes = 16384;

using Clock = std::chrono::steady_clock;

double Seconds(Clock::time_point start)
{
    return std::chrono::duration<double>(Clock::now() - start).count();
}

// Something with the spectral spread of real sound: a few partials that drift, and noise.
std::vector<int16_t> MakeSound()
{
    const size_t frames = static_cast<size_t>(kRate) * kSeconds;
    std::vector<int16_t> pcm(frames * kChannels);
    uint32_t noise = 12345;
    for (size_t i = 0; i < frames; ++i) {
        const double t = static_cast<double>(i) / kRate;
        for (uint32_t c = 0; c < kChannels; ++c) {
            double value = 0;
            for (int partial = 1; partial <= 5; ++partial) {
                const double hz = 220.0 * partial * (1 + 0.01 * std::sin(0.3 * t + c));
                value += 3000.0 / partial * std::sin(2 * M_PI * hz * t + partial * c);
            }
            noise = noise * 1664525U + 1013904223U;
            value += static_cast<double>(static_cast<int32_t>(noise) >> 20);
            pcm[i * kChannels + c] = static_cast<int16_t>(std::clamp(value, -32768.0, 32767.0));
        }
    }
    return pcm;
}

ACFormat AacFormat()
{
    return ACFormat{kRate, ACFormatAAC, 0, 0, 1024, 0, kChannels, 0};
}

ACFormat PcmFormat()
{
    return ACFormat{kRate, ACFormatLinearPCM, 12, 2 * kChannels, 1, 2 * kChannels, kChannels, 16};
}

struct Collected {
    std::vector<std::vector<unsigned char>> packets;
};

eTqovixErrorCode Keep(void* stream, unsigned char* data, unsigned int size)
{
    static_cast<Collected*>(static_cast<ACEncoderStream*>(stream)->userData)->packets.emplace_back(data, data + size);
    return eTqovixSuccess;
}

unsigned char* Lend(void* stream, unsigned int size)
{
    auto* owner = static_cast<ACEncoderStream*>(stream);
    return owner->bufferSize > size ? owner->buffer : nullptr;
}

bool EncodeOurs(const std::vector<int16_t>& pcm, Collected& collected, double* seconds)
{
    std::vector<unsigned char> buffer(4096);
    ACEncoderStream stream;
    stream.requestProc = Lend;
    stream.resultProc = Keep;
    stream.buffer = buffer.data();
    stream.bufferSize = static_cast<unsigned int>(buffer.size());
    stream.userData = &collected;

    const Clock::time_point start = Clock::now();
    AACEncoder encoder;
    if (encoder.Initialize(PcmFormat(), AacFormat(), kBitRate, &stream) != eConverterSuccess) {
        return false;
    }
    auto* bytes = reinterpret_cast<unsigned char*>(const_cast<int16_t*>(pcm.data()));
    const size_t total = pcm.size() * sizeof(int16_t);
    for (size_t at = 0; at < total; at += kPushBytes) {
        if (encoder.Encode(bytes + at, static_cast<unsigned int>(std::min(kPushBytes, total - at))) !=
            eConverterSuccess) {
            return false;
        }
    }
    const bool done = encoder.EncodeDone() == eConverterSuccess;
    *seconds = Seconds(start);
    return done;
}

bool DecodeOurs(const Collected& collected, size_t* frames, double* seconds)
{
    std::vector<unsigned char> pcm(AACDecoder::kMaxPcmSize);
    const Clock::time_point start = Clock::now();
    AACDecoder decoder;
    if (decoder.Initialize(AacFormat(), PcmFormat()) != eConverterSuccess) {
        return false;
    }
    size_t bytes = 0;
    for (const auto& packet : collected.packets) {
        unsigned int pcmSize = 0;
        unsigned int used = 0;
        if (decoder.Decode(pcm.data(), &pcmSize, &used, packet.data(), static_cast<unsigned int>(packet.size())) !=
            eConverterSuccess) {
            return false;
        }
        bytes += pcmSize;
    }
    *seconds = Seconds(start);
    *frames = bytes / (2 * kChannels);
    return true;
}

// Runs an ffmpeg command with -benchmark; `wall` is the whole process, `loop` the time
// ffmpeg itself reports for its coding loop, without starting up and probing.
bool RunFfmpeg(const std::string& command, double* wall, double* loop)
{
    const Clock::time_point start = Clock::now();
    FILE* pipe = popen((command + " 2>&1").c_str(), "r");
    if (pipe == nullptr) {
        return false;
    }
    std::string output;
    char buffer[512];
    while (std::fgets(buffer, sizeof buffer, pipe) != nullptr) {
        output += buffer;
    }
    const int status = pclose(pipe);
    *wall = Seconds(start);
    const size_t at = output.find("rtime=");
    if (status != 0 || at == std::string::npos) {
        std::fprintf(stderr, "%s", output.c_str());
        return false;
    }
    *loop = std::atof(output.c_str() + at + 6);
    return true;
}

std::string Quote(const std::filesystem::path& path)
{
    // Appended rather than "'" + s: GCC 12 at -O3 warns falsely (-Wrestrict) on the latter.
    std::string quoted = "'";
    quoted += path.string();
    quoted += '\'';
    return quoted;
}

}  // namespace

int main(int argc, char** argv)
{
    std::filesystem::path work;
    const bool ownWork = argc < 2 || argv[1][0] == '\0';
    if (!ownWork) {
        work = argv[1];
    } else {
        std::string pattern = (std::filesystem::temp_directory_path() / "codec-bench-XXXXXX").string();
        if (mkdtemp(pattern.data()) == nullptr) {
            std::perror("mkdtemp");
            return 1;
        }
        work = pattern;
    }
    const int rounds = argc > 2 ? std::max(1, std::atoi(argv[2])) : 3;
    std::filesystem::create_directories(work);

    const std::vector<int16_t> sound = MakeSound();
    // Our encoder drops the first 1088 frames and the layer puts as much silence in their
    // place; ffmpeg gets exactly the samples that libavcodec then sees from us. (Leading
    // silence steers the encoder's rate control, which alone moves its time by several %.)
    std::vector<int16_t> ffmpegSound = sound;
    std::fill_n(ffmpegSound.begin(), AACEncoder::kDroppedFrames * 2, 0);  // stereo
    const std::filesystem::path pcmPath = work / "sound.pcm";
    std::ofstream(pcmPath, std::ios::binary)
        .write(reinterpret_cast<const char*>(ffmpegSound.data()),
               static_cast<std::streamsize>(ffmpegSound.size() * sizeof(int16_t)));

    const std::string ffmpeg = "ffmpeg -hide_banner -nostats -v info -benchmark -nostdin -y ";
    const std::string encodeCommand =
        ffmpeg + "-f s16le -ar 48000 -ac 2 -i " + Quote(pcmPath) + " -c:a aac -b:a 256k " + Quote(work / "ffmpeg.m4a");
    const std::string decodeCommand =
        ffmpeg + "-i " + Quote(work / "ffmpeg.m4a") + " -f s16le -c:a pcm_s16le /dev/null";

    // Best of several rounds on each side, so that a busy moment on a shared machine
    // does not decide the ratio.
    double oursEncode = 1e9;
    double oursDecode = 1e9;
    double ffmpegEncode = 1e9;
    double ffmpegDecode = 1e9;
    double ffmpegEncodeLoop = 1e9;
    double ffmpegDecodeLoop = 1e9;
    size_t packets = 0;
    size_t aacBytes = 0;
    size_t decodedFrames = 0;
    for (int round = 0; round < rounds; ++round) {
        Collected collected;
        double seconds = 0;
        double loop = 0;
        if (!EncodeOurs(sound, collected, &seconds)) {
            std::fprintf(stderr, "codec_bench: our encoder failed\n");
            return 1;
        }
        oursEncode = std::min(oursEncode, seconds);
        if (!DecodeOurs(collected, &decodedFrames, &seconds)) {
            std::fprintf(stderr, "codec_bench: our decoder failed\n");
            return 1;
        }
        oursDecode = std::min(oursDecode, seconds);
        packets = collected.packets.size();
        aacBytes = 0;
        for (const auto& packet : collected.packets) {
            aacBytes += packet.size();
        }

        if (!RunFfmpeg(encodeCommand, &seconds, &loop)) {
            std::fprintf(stderr, "codec_bench: ffmpeg failed to encode (is it installed?)\n");
            return 1;
        }
        ffmpegEncode = std::min(ffmpegEncode, seconds);
        ffmpegEncodeLoop = std::min(ffmpegEncodeLoop, loop);
        if (!RunFfmpeg(decodeCommand, &seconds, &loop)) {
            std::fprintf(stderr, "codec_bench: ffmpeg failed to decode\n");
            return 1;
        }
        ffmpegDecode = std::min(ffmpegDecode, seconds);
        ffmpegDecodeLoop = std::min(ffmpegDecodeLoop, loop);
    }

    std::printf("60 s of 48 kHz stereo, AAC-LC at %u bit/s, best of %d rounds\n", kBitRate, rounds);
    std::printf("ours: %zu packets, %.1f kbit/s, %zu frames decoded\n", packets,
                static_cast<double>(aacBytes) * 8 / kSeconds / 1000, decodedFrames);
    std::printf("ffmpeg process: the whole command; ffmpeg loop: its own -benchmark time\n");
    std::printf("%-8s %9s %15s %12s %16s %13s\n", "", "ours (s)", "ffmpeg process", "ffmpeg loop",
                "ours/process", "ours/loop");
    std::printf("%-8s %9.3f %15.3f %12.3f %16.3f %13.3f\n", "encode", oursEncode, ffmpegEncode, ffmpegEncodeLoop,
                oursEncode / ffmpegEncode, oursEncode / ffmpegEncodeLoop);
    std::printf("%-8s %9.3f %15.3f %12.3f %16.3f %13.3f\n", "decode", oursDecode, ffmpegDecode, ffmpegDecodeLoop,
                oursDecode / ffmpegDecode, oursDecode / ffmpegDecodeLoop);
    if (ownWork) {
        std::filesystem::remove_all(work);
    }
    return 0;
}
