// The AAC codec classes over the converter layer: statuses, the decoder's delay, the encoder's
// block, drop and flush rules, and timing through decode → encode → decode.
#include <gtest/gtest.h>

#include <AudioToolbox/AudioToolbox.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstring>
#include <functional>
#include <random>
#include <string>
#include <tuple>
#include <vector>

#include "Movie.h"
#include "codec/AACDecoder.h"
#include "codec/AACEncoder.h"
#include "support/TestSupport.h"

namespace {

using Pcm = std::vector<int16_t>;
using Packet = std::vector<uint8_t>;
using Packets = std::vector<Packet>;

constexpr double kRate = 48000;
constexpr uint32_t kChannels = 2;
constexpr size_t kBlockSamples = 1024 * kChannels;
constexpr unsigned int kBlockBytes = 4096;
constexpr unsigned int kDropBytes = 4352;
constexpr unsigned int kFlush = 0;
constexpr long kPriming = 2112;
constexpr auto kAborted = static_cast<eConverterErrorCode>(eTqovixErrorAborted);
constexpr auto kAccessDenied = static_cast<eConverterErrorCode>(eTqovixErrorSourceAccessDenied);

ACFormat AacFormat(double rate = kRate, uint32_t channels = kChannels)
{
    return ACFormat{rate, ACFormatAAC, 0, 0, 1024, 0, channels, 0};
}

// What the codec adapter builds for a 16-bit track.
ACFormat PcmFormat(double rate = kRate, uint32_t channels = kChannels)
{
    return ACFormat{rate, ACFormatLinearPCM, 12, 2 * channels, 1, 2 * channels, channels, 16};
}

// A 1 kHz tone after `silentFrames`; the channels differ so that a swap would show.
Pcm Tone(size_t frames, size_t silentFrames = 0)
{
    Pcm pcm(frames * kChannels, 0);
    for (size_t i = silentFrames * kChannels; i < pcm.size(); ++i) {
        const double phase = 2 * M_PI * 1000.0 * static_cast<double>(i / kChannels) / kRate + (i % 2) * M_PI / 2;
        pcm[i] = static_cast<int16_t>(std::lround(12000 * std::sin(phase)));
    }
    return pcm;
}

// Silence with one short broadband click at frame `at`: it has exactly one best alignment.
Pcm Click(size_t frames, size_t at)
{
    constexpr std::array<int, 8> kShape = {6000, 18000, 24000, 12000, -12000, -24000, -18000, -6000};
    Pcm pcm(frames * kChannels, 0);
    for (size_t k = 0; k < kShape.size() * kChannels; ++k) {
        pcm[at * kChannels + k] = static_cast<int16_t>(kShape[k / kChannels]);
    }
    return pcm;
}

// The lag L within ±maxLag at which signal[i + L] best matches reference[i], first channel.
long BestLag(const Pcm& reference, const Pcm& signal, long from, long length, long maxLag)
{
    const long signalFrames = static_cast<long>(signal.size() / kChannels);
    long best = 0;
    double bestScore = -1e300;
    for (long lag = -maxLag; lag <= maxLag; ++lag) {
        double score = 0;
        for (long i = std::max(from, -lag); i < std::min(from + length, signalFrames - lag); ++i) {
            score += static_cast<double>(reference[i * kChannels]) * signal[(i + lag) * kChannels];
        }
        if (score > bestScore) {
            bestScore = score;
            best = lag;
        }
    }
    return best;
}

// An open encoder fed consecutive bytes of `pcm`, its stream lending a 4096-byte buffer as
// the codec adapter does, and able to refuse one packet.
struct EncoderRig {
    explicit EncoderRig(bool lend = true, unsigned int bitRate = 256000)
    {
        stream = {lend ? Request : nullptr, Result, buffer.data(), static_cast<unsigned int>(buffer.size()), this};
        EXPECT_EQ(encoder.Initialize(PcmFormat(), AacFormat(), bitRate, &stream), eConverterSuccess);
    }

    eConverterErrorCode Push(unsigned int bytes)
    {
        pushed += bytes;
        return bytes == kFlush ? encoder.EncodeDone()
                               : encoder.Encode(reinterpret_cast<unsigned char*>(pcm.data()) + pushed - bytes, bytes);
    }
    static EncoderRig& Of(void* s) { return *static_cast<EncoderRig*>(static_cast<ACEncoderStream*>(s)->userData); }
    static unsigned char* Request(void* s, unsigned int size)
    {
        Of(s).requested.push_back(size);
        return Of(s).stream.bufferSize > size ? Of(s).stream.buffer : nullptr;
    }
    static eTqovixErrorCode Result(void* s, unsigned char* data, unsigned int size)
    {
        Of(s).packets.emplace_back(data, data + size);
        Of(s).writtenAt.push_back(data);
        return Of(s).packets.size() - 1 == Of(s).refuseAt ? eTqovixErrorAborted : eTqovixSuccess;
    }

    std::array<unsigned char, 4096> buffer{};
    ACEncoderStream stream;
    AACEncoder encoder;
    Pcm pcm = Tone(16 * 1024);
    size_t pushed = 0;
    Packets packets;
    std::vector<unsigned int> requested;
    std::vector<const unsigned char*> writtenAt;
    size_t refuseAt = SIZE_MAX;
};

void OpenDecoder(AACDecoder& decoder, uint32_t channels = kChannels, unsigned int delay = 1)
{
    ASSERT_EQ(decoder.Initialize(AacFormat(kRate, channels), PcmFormat(kRate, channels)), eConverterSuccess);
    if (delay != 1) {  // 1 is the default, which opening must restore
        decoder.SetDecoderDelay(delay);
    }
}

// One Decode's status and PCM size, the PCM appended to `out`. Past the argument checks a
// success uses the whole packet, a failure nothing, and delivers nothing.
std::pair<eConverterErrorCode, unsigned int> Decode(AACDecoder& decoder, const Packet& packet, Pcm* out = nullptr)
{
    std::array<int16_t, AACDecoder::kMaxPcmSize / sizeof(int16_t)> pcm{};
    unsigned int pcmSize = 1;
    unsigned int used = 1;
    const auto status =
        decoder.Decode(pcm.data(), &pcmSize, &used, packet.data(), static_cast<unsigned int>(packet.size()));
    const bool ok = status == eConverterSuccess;
    EXPECT_TRUE(packet.empty() || (used == (ok ? packet.size() : 0U) && (ok || pcmSize == 0))) << status;
    if (out != nullptr) {
        out->insert(out->end(), pcm.begin(), pcm.begin() + pcmSize / sizeof(int16_t));
    }
    return {status, pcmSize};
}

unsigned int Decoded(AACDecoder& decoder, const Packet& packet, eConverterErrorCode expected = eConverterSuccess)
{
    const auto [status, pcmSize] = Decode(decoder, packet);
    EXPECT_EQ(status, expected);
    return pcmSize;
}

Pcm DecodeAll(const Packets& packets, unsigned int delay)
{
    AACDecoder decoder;
    OpenDecoder(decoder, kChannels, delay);
    Pcm pcm;
    for (const Packet& packet : packets) {
        EXPECT_EQ(Decode(decoder, packet, &pcm).first, eConverterSuccess);
    }
    return pcm;
}

// Every whole block of `pcm` through the one-block Encode of a fresh encoder.
Packets EncodeBlocks(const Pcm& pcm)
{
    EncoderRig rig;
    Packets packets;
    std::array<unsigned char, kBlockBytes> aac{};
    for (size_t at = 0; at + kBlockSamples <= pcm.size(); at += kBlockSamples) {
        unsigned int aacSize = 0;
        unsigned int used = 0;
        EXPECT_EQ(rig.encoder.Encode(aac.data(), &aacSize, &used, pcm.data() + at, kBlockBytes), eConverterSuccess);
        EXPECT_EQ(used, kBlockBytes);
        packets.emplace_back(aac.data(), aac.data() + aacSize);
    }
    return packets;
}

// `pcm` through the streaming Encode in pushes cycling through `sizes`, then the flush.
Packets EncodeStream(Pcm pcm, const std::vector<size_t>& sizes)
{
    EncoderRig rig;
    rig.pcm = std::move(pcm);
    const size_t total = rig.pcm.size() * sizeof(int16_t);
    for (size_t i = 0; rig.pushed < total; ++i) {
        EXPECT_EQ(rig.Push(static_cast<unsigned int>(std::min(sizes[i % sizes.size()], total - rig.pushed))),
                  eConverterSuccess);
    }
    EXPECT_EQ(rig.Push(kFlush), eConverterSuccess);
    return rig.packets;
}

Packets SilentPackets(size_t count)
{
    Packets packets;
    for (size_t i = 0; i < count; ++i) {
        packets.push_back(moviekit::MakeSilentAacPacket(kChannels, 40 + static_cast<uint32_t>(i), i));
    }
    return packets;
}

TEST(AacRoundTripTest, ClickKeepsItsPositionThroughDecodeEncodeDecode)
{
    // The source as the platform encoder would have made it: primed by 2112 frames.
    const long at = 6000;
    const Pcm click = Click(24 * 1024, at);
    const Packets source = EncodeBlocks(click);
    const Pcm sourceDecoded = DecodeAll(source, 0);
    ASSERT_EQ(BestLag(click, sourceDecoded, at - 256, 512, 4096), kPriming);

    // One packet dropped by the decoder, pushes of any size, 4352 bytes dropped, the flush.
    const Packets result = EncodeStream(DecodeAll(source, 1), {3000, 4096, 1234, 8192});
    EXPECT_EQ(BestLag(sourceDecoded, DecodeAll(result, 0), at + kPriming - 256, 512, 4096), 0);
}

TEST(AacDecoderTest, DelayDropsExactlyTheFirstPackets)
{
    const Packets silent = SilentPackets(5);
    AACDecoder decoder;
    for (unsigned int delay : {3U, 1U, 0U}) {
        // Reopened each time, so opening must reset the count of packets seen.
        ASSERT_NO_FATAL_FAILURE(OpenDecoder(decoder, kChannels, delay));
        Decoded(decoder, Packet(), eConverterInternal);  // refused arguments do not count
        for (unsigned int i = 0; i < silent.size(); ++i) {
            EXPECT_EQ(Decoded(decoder, silent[i]), i < delay ? 0U : 4096U) << "delay " << delay << ", packet " << i;
        }
    }
    // What is dropped is the first packet's output, not some other.
    const Packets packets = EncodeBlocks(Tone(8 * 1024));
    const Pcm whole = DecodeAll(packets, 0);
    const Pcm delayed = DecodeAll(packets, 1);
    ASSERT_EQ(whole.size(), 8 * kBlockSamples);
    ASSERT_EQ(delayed.size(), 7 * kBlockSamples);
    EXPECT_TRUE(std::equal(delayed.begin(), delayed.end(), whole.begin() + kBlockSamples));
}

TEST(AacDecoderTest, PrimingQueriedFromAMovieSetsTheDelay)
{
    const Packets packets = SilentPackets(6);
    moviekit::MovieRecipe recipe;
    recipe.sound.codec = moviekit::SoundCodec::Aac;
    recipe.sound.aacPackets = packets;
    moviekit::MovieLayout layout;
    const moviekit::Bytes camera = moviekit::BuildMovie(recipe, &layout);  // priming 1024
    recipe.sound.mediaTime = 2112;
    const moviekit::Bytes platform = moviekit::BuildMovie(recipe, nullptr);
    recipe.sound.present = false;
    const moviekit::Bytes silent = moviekit::BuildMovie(recipe, nullptr);

    using Bytes = moviekit::Bytes;
    using Change = std::function<void(Bytes&)>;
    // Writes `value` into every `type` atom, `offset` bytes from its type field.
    const auto patch = [](const char* type, ptrdiff_t offset, uint32_t value) {
        return Change([=](Bytes& b) {
            for (size_t at = 4, field = at + offset; std::max(at, field) + 4 <= b.size(); ++at, ++field) {
                if (std::memcmp(b.data() + at, type, 4) == 0) {
                    for (size_t i = 0; i < 4; ++i) {
                        b[field + i] = static_cast<uint8_t>(value >> (24 - 8 * i));
                    }
                }
            }
        });
    };
    // name, change to the camera movie, status, delay after a delay of 5 was set
    const std::vector<std::tuple<const char*, Change, eConverterErrorCode, unsigned int>> rows = {
        {"PlatformPrimingMeansOnePacket", [&](Bytes& b) { b = platform; }, eConverterSuccess, 1},
        {"OtherPrimingKeepsTheDelay", [](Bytes&) {}, eConverterSuccess, 5},
        {"NoSoundTrack", [&](Bytes& b) { b = silent; }, kAccessDenied, 5},
        {"Garbage", [](Bytes& b) { b.assign(100, 0xEE); }, kAccessDenied, 5},
        {"MovieAtomCutShort", [&](Bytes& b) { b.resize(layout.moovOffset + layout.moovSize / 2); }, kAccessDenied, 5},
        {"EditCountBeyondItsAtom", patch("elst", 8, ~0U), kAccessDenied, 5},
        {"TimeToSampleCountBeyondItsAtom", patch("stts", 8, 1U << 28), kAccessDenied, 5},
        {"MediaTimeScaleZero", patch("mdhd", 16, 0), kAccessDenied, 5},
        {"AtomSizeBelowItsHeader", patch("trak", -4, 3), kAccessDenied, 5},
    };
    testsupport::TempDir dir;
    AACDecoder decoder;
    for (const auto& [name, change, status, delay] : rows) {
        Bytes bytes = camera;
        change(bytes);
        const std::string path = dir.File(std::string(name) + ".mov");
        ASSERT_TRUE(testsupport::WriteFile(path, bytes));
        ASSERT_NO_FATAL_FAILURE(OpenDecoder(decoder, kChannels, 5));
        EXPECT_EQ(decoder.SetDecoderDelay(path.c_str()), status) << name;
        for (unsigned int i = 0; i <= delay; ++i) {
            EXPECT_EQ(Decoded(decoder, packets[i]), i < delay ? 0U : 4096U) << name << ", packet " << i;
        }
    }
    EXPECT_EQ(decoder.SetDecoderDelay(nullptr), eConverterInternal);
    EXPECT_EQ(decoder.SetDecoderDelay(""), eTqovixErrorSourceNotFound);
    EXPECT_EQ(decoder.SetDecoderDelay(dir.File("missing.mov").c_str()), eTqovixErrorSourceAccessDenied);
    EXPECT_EQ(decoder.SetDecoderDelay(dir.Path().c_str()), eTqovixErrorSourceAccessDenied);
}

TEST(AacEncoderTest, PushesOfAnySizeAreCutIntoBlocksAfterTheDropAndFlushedWithSilence)
{
    struct Step {
        unsigned int bytes;  // or kFlush
        size_t packetsBy;
        eConverterErrorCode status = eConverterSuccess;
    };
    const std::vector<std::tuple<const char*, bool, size_t, std::vector<Step>>> rows = {  // name, lend, refuseAt
        {"OneBlockPushes", true, SIZE_MAX, {{4096, 0}, {4096, 1}, {4096, 2}, {4096, 3}, {kFlush, 4}}},
        // 4352 dropped, a block, 1552 held; with the next push exactly one block; the flush
        // sends the 100 held bytes padded with silence, then silence; a second holds nothing.
        {"RemaindersWait", true, SIZE_MAX, {{10000, 1}, {2544, 2}, {100, 2}, {kFlush, 4}, {kFlush, 5}}},
        {"ShortFirstPushDroppedWhole", true, SIZE_MAX, {{4200, 0}, {4096, 1}, {kFlush, 2}}},
        {"OwnBufferWhenNoneIsLent", false, SIZE_MAX, {{kDropBytes + 2 * 4096, 2}}},
        {"RefusedPacketEndsThePushAndItsRest", true, 1, {{kDropBytes, 0}, {4 * 4096 + 10, 2, kAborted}, {kFlush, 3}}},
    };
    for (const auto& [name, lend, refuseAt, steps] : rows) {
        EncoderRig rig(lend);
        rig.refuseAt = refuseAt;
        for (const Step& step : steps) {
            EXPECT_EQ(rig.Push(step.bytes), step.status) << name;
            EXPECT_EQ(rig.packets.size(), step.packetsBy) << name << " after pushing " << step.bytes;
        }
        for (size_t i = 0; i < rig.packets.size(); ++i) {
            EXPECT_EQ(rig.writtenAt[i] == rig.buffer.data(), lend) << name;
        }
        // Asked for with the largest packet size, 6144 bits per channel.
        EXPECT_EQ(rig.requested, std::vector<unsigned int>(lend ? steps.size() : 0, 1536U)) << name;
    }

    // Blocks from pushes of any size are the blocks of the PCM after its first 4352 bytes;
    // the flush adds the remainder padded with silence, then silence.
    const Pcm tone = Tone(20 * 1024 + 300, 500);
    const Packets pushed = EncodeStream(tone, {3000, 777, 5000, 4096, 1});

    Pcm blocks(tone.begin() + kDropBytes / 2, tone.end());
    blocks.resize(blocks.size() - blocks.size() % kBlockSamples + 2 * kBlockSamples, 0);
    Packets expected = EncodeBlocks(blocks);
    expected.pop_back();  // the flush's last block holds only the remainder's length
    ASSERT_EQ(pushed.size(), expected.size() + 1);
    EXPECT_TRUE(std::equal(expected.begin(), expected.end(), pushed.begin()));
}

TEST(CodecFormatTest, OnlyAacLcAndPcm16AtOneRateAreAcceptedThenFormatsAndBitRateReadBack)
{
    const auto flags = [](ACFormat format, uint32_t formatFlags) { return format.formatFlags = formatFlags, format; };
    constexpr eConverterErrorCode kRefused = eConverterRefused;
    const std::vector<std::tuple<const char*, bool, ACFormat, ACFormat, eConverterErrorCode>> rows = {
        // name, encoding, AAC side, PCM side
        {"PcmToPcm", false, PcmFormat(), PcmFormat(), kRefused},
        {"FloatPcm", false, AacFormat(), flags(PcmFormat(), 1 | 8), kRefused},
        {"BigEndianPcm", true, AacFormat(), flags(PcmFormat(), 2 | 12), kRefused},
        {"NonInterleavedPcm", false, AacFormat(), flags(PcmFormat(), 32 | 12), kRefused},
        {"HighEfficiency", true, flags(AacFormat(), 5), PcmFormat(), kRefused},
        {"ChannelMismatch", true, AacFormat(kRate, 1), PcmFormat(), kRefused},
        {"SevenChannels", true, AacFormat(kRate, 7), PcmFormat(kRate, 7), kRefused},
        {"NoAacRate", false, AacFormat(44500), PcmFormat(44500), kRefused},
        {"WouldResample", true, AacFormat(), PcmFormat(44100), kRefused},
        // Whole-kilohertz labels stand for the AAC rates near them.
        {"Label44000", true, AacFormat(44100), PcmFormat(44000), eConverterSuccess},
        {"Label22000", false, AacFormat(22000), PcmFormat(22050), eConverterSuccess},
        {"Label11000", true, AacFormat(11025), PcmFormat(11000), eConverterSuccess},
        {"Label88000", false, AacFormat(88000), PcmFormat(88200), eConverterSuccess},
    };
    for (const auto& [name, encoding, aac, pcm, status] : rows) {
        AACEncoder encoder;
        AACDecoder decoder;
        AudioConverterBase& codec = encoding ? static_cast<AudioConverterBase&>(encoder) : decoder;
        EXPECT_EQ(encoding ? encoder.Initialize(pcm, aac) : decoder.Initialize(aac, pcm), status) << name;
        UInt32 value = 0;  // a refusal leaves no converter behind
        unsigned int size = sizeof value;
        EXPECT_EQ(codec.GetACProperty(kAudioConverterPropertyMaximumOutputPacketSize, &size, &value),
                  status == eConverterSuccess ? eConverterSuccess : eConverterInternal)
            << name;
    }

    // The formats are read back from what the converter settled on.
    ACFormat aac = AacFormat();
    aac.framesPerPacket = 0;
    AACDecoder decoder;
    ASSERT_EQ(decoder.Initialize(aac, PcmFormat()), eConverterSuccess);
    decoder.GetInputFormat(aac);
    EXPECT_EQ(std::tie(aac.formatID, aac.framesPerPacket, aac.channelsPerFrame), std::tuple(ACFormatAAC, 1024U, 2U));

    // 0 keeps the converter's own rate; a rate it refuses closes the converter.
    EncoderRig plain(true, 0);
    EncoderRig camera;
    UInt32 rate = 0;
    unsigned int size = sizeof rate;
    ASSERT_EQ(camera.encoder.GetACProperty(kAudioConverterEncodeBitRate, &size, &rate), eConverterSuccess);
    EXPECT_EQ(rate, 256000U);
    AACEncoder refused;
    EXPECT_EQ(refused.Initialize(PcmFormat(), AacFormat(), 1, &camera.stream), eConverterRefused);
    EXPECT_EQ(refused.GetACProperty(kAudioConverterEncodeBitRate, &size, &rate), eConverterInternal);
}

TEST(CodecBadInputTest, BadPacketsMissingConvertersAndNullArgumentsAreStatuses)
{
    const Packets silent = SilentPackets(2);
    AACDecoder decoder;
    ASSERT_NO_FATAL_FAILURE(OpenDecoder(decoder));
    EXPECT_EQ(Decoded(decoder, Packet(2000, 0x5A), eConverterRefused), 0U) << "oversized";
    EXPECT_EQ(Decoded(decoder, silent[0]), 4096U) << "the oversized packet used up the delay";

    std::mt19937 random(5);
    int failures = 0;
    for (int i = 0; i < 40; ++i) {
        Packet garbage(1 + random() % 700);
        std::generate(garbage.begin(), garbage.end(), [&] { return static_cast<uint8_t>(random()); });
        const eConverterErrorCode result = Decode(decoder, garbage).first;
        failures += result != eConverterSuccess;
        EXPECT_TRUE(result == eConverterSuccess || result == eConverterRefused || result == eConverterFailed) << result;
    }
    EXPECT_GT(failures, 0);
    EXPECT_EQ(Decoded(decoder, silent[1]), 4096U) << "the decoder recovers";

    AACDecoder mono;
    ASSERT_NO_FATAL_FAILURE(OpenDecoder(mono, 1, 0));
    EXPECT_EQ(Decoded(mono, silent[0], eConverterFailed) + Decoded(mono, silent[1], eConverterFailed), 0U);

    // Missing converters and null arguments are statuses.
    AACDecoder unopenedDecoder;
    EXPECT_EQ(Decoded(unopenedDecoder, silent[0], eConverterInternal), 0U) << "never opened";
    unsigned int size = 0;
    EXPECT_EQ(decoder.Decode(nullptr, &size, &size, silent[0].data(), 10), eConverterInternal);
    decoder.Close();
    EXPECT_EQ(Decoded(decoder, silent[0], eConverterInternal), 0U) << "closed";

    AACEncoder unopened;
    unsigned char bytes[kBlockBytes] = {};
    EXPECT_EQ(unopened.Encode(bytes, 16), eConverterInternal);
    EXPECT_EQ(unopened.EncodeDone(), eConverterInternal);
    EXPECT_EQ(unopened.Encode(bytes, &size, &size, bytes, 16), eConverterInternal);
    EncoderRig rig;
    EXPECT_EQ(rig.encoder.Encode(bytes, &size, &size, nullptr, 16), eConverterInternal);
    EXPECT_EQ(rig.encoder.Encode(nullptr, 16), eConverterInternal);
    AACEncoder wrongChannels;
    EXPECT_EQ(wrongChannels.Initialize(PcmFormat(), AacFormat(kRate, 1), 0, &rig.stream), eConverterRefused);
    EXPECT_EQ(wrongChannels.Encode(bytes, 16), eConverterInternal) << "the stream was not kept";
    ASSERT_EQ(rig.Push(kDropBytes), eConverterSuccess);
    rig.encoder.Close();
    EXPECT_EQ(rig.Push(4096), eConverterInternal) << "fed after close";
    EXPECT_EQ(rig.Push(kFlush), eConverterInternal);
    EXPECT_TRUE(rig.packets.empty());
}

}  // namespace
