// The AAC codec classes over the converter layer: statuses, the decoder's delay and the
// encoder's block, drop and flush rules.
#include <gtest/gtest.h>

#include <AudioToolbox/AudioToolbox.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <ostream>
#include <string>
#include <vector>

#include "Movie.h"
#include "codec/AACDecoder.h"
#include "bridge/TqovixInterfaceConvert.h"
#include "codec/AACEncoder.h"
#include "codec/CTqovixAacSplicer.h"
#include "codec/CTqovixAudioDataControlMac.h"
#include "codec/TqovixAacSyntax.h"
#include "support/SpliceCollector.h"
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
constexpr auto kAborted = static_cast<eConverterErrorCode>(eTqovixErrorAborted);

ACFormat AacFormat(double rate = kRate, uint32_t channels = kChannels)
{
    return ACFormat{rate, ACFormatAAC, 0, 0, 1024, 0, channels, 0};
}
// What the codec adapter builds for a 16-bit track.
ACFormat PcmFormat(double rate = kRate, uint32_t channels = kChannels)
{
    return ACFormat{rate, ACFormatLinearPCM, 12, 2 * channels, 1, 2 * channels, channels, 16};
}

// A 1 kHz tone; the channels differ so that a swap would show.
Pcm Tone(size_t frames)
{
    Pcm pcm(frames * kChannels);
    for (size_t i = 0; i < pcm.size(); ++i) {
        const double phase = 2 * M_PI * 1000.0 * static_cast<double>(i / kChannels) / kRate + (i % 2) * M_PI / 2;
        pcm[i] = static_cast<int16_t>(std::lround(12000 * std::sin(phase)));
    }
    return pcm;
}

// An open encoder fed consecutive bytes of `pcm`, lent a buffer as the codec adapter does,
// and able to refuse one packet.
struct EncoderRig {
    explicit EncoderRig(bool lend = true, uint32_t channels = kChannels)
    {
        stream = {lend ? Request : nullptr, Result, buffer.data(), static_cast<unsigned int>(buffer.size()), this};
        EXPECT_EQ(encoder.Initialize(PcmFormat(kRate, channels), AacFormat(kRate, channels), 128000 * channels,
                                     &stream),
                  eConverterSuccess);
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

// One Decode's PCM size. Past the argument checks a success uses the whole packet, a failure
// nothing, and delivers nothing.
unsigned int Decoded(AACDecoder& decoder, const Packet& packet, eConverterErrorCode expected = eConverterSuccess)
{
    std::array<int16_t, AACDecoder::kMaxPcmSize / sizeof(int16_t)> pcm{};
    unsigned int pcmSize = 1, used = 1;
    const auto status =
        decoder.Decode(pcm.data(), &pcmSize, &used, packet.data(), static_cast<unsigned int>(packet.size()));
    EXPECT_EQ(status, expected);
    const bool ok = status == eConverterSuccess;
    EXPECT_TRUE(packet.empty() || (used == (ok ? packet.size() : 0U) && (ok || pcmSize == 0))) << status;
    return pcmSize;
}

// Every whole block of `pcm` through the one-block Encode of a fresh encoder.
Packets EncodeBlocks(const Pcm& pcm)
{
    EncoderRig rig;
    Packets packets;
    std::array<unsigned char, kBlockBytes> aac{};
    for (size_t at = 0; at + kBlockSamples <= pcm.size(); at += kBlockSamples) {
        unsigned int aacSize = 0, used = 0;
        EXPECT_EQ(rig.encoder.Encode(aac.data(), &aacSize, &used, pcm.data() + at, kBlockBytes), eConverterSuccess);
        EXPECT_EQ(used, kBlockBytes);
        packets.emplace_back(aac.data(), aac.data() + aacSize);
    }
    return packets;
}

Packets SilentPackets(size_t count)
{
    Packets packets(count);
    for (size_t i = 0; i < count; ++i) {
        packets[i] = moviekit::MakeSilentAacPacket(kChannels, 40 + static_cast<uint32_t>(i), i);
    }
    return packets;
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
}

struct PrimingRow {
    const char* name;
    void (*edit)(moviekit::MovieRecipe&);  // of a camera's AAC movie, priming 1024
    eConverterErrorCode status;
    unsigned int delay;  // after a delay of 5 was set
};
void PrintTo(const PrimingRow& row, std::ostream* os) { *os << row.name; }

class PrimingTest : public testing::TestWithParam<PrimingRow> {};

TEST_P(PrimingTest, QueriedFromAMovieSetsTheDelay)
{
    const Packets packets = SilentPackets(6);
    moviekit::MovieRecipe recipe;
    recipe.sound.codec = moviekit::SoundCodec::Aac;
    recipe.sound.aacPackets = packets;
    GetParam().edit(recipe);
    testsupport::TempDir dir;
    const std::string path = dir.File("movie.mov");
    ASSERT_TRUE(testsupport::WriteFile(path, moviekit::BuildMovie(recipe, nullptr)));
    AACDecoder decoder;
    ASSERT_NO_FATAL_FAILURE(OpenDecoder(decoder, kChannels, 5));
    EXPECT_EQ(decoder.SetDecoderDelay(path.c_str()), GetParam().status);
    for (unsigned int i = 0; i <= GetParam().delay; ++i) {
        EXPECT_EQ(Decoded(decoder, packets[i]), i < GetParam().delay ? 0U : 4096U) << "packet " << i;
    }
}

INSTANTIATE_TEST_SUITE_P(
    AacDecoder, PrimingTest,
    testing::Values(
        PrimingRow{"PlatformPrimingMeansOnePacket", [](moviekit::MovieRecipe& r) { r.sound.mediaTime = 2112; },
                   eConverterSuccess, 1},
        PrimingRow{"OtherPrimingKeepsTheDelay", [](moviekit::MovieRecipe&) {}, eConverterSuccess, 5},
        PrimingRow{"NoSoundTrack", [](moviekit::MovieRecipe& r) { r.sound.present = false; },
                   static_cast<eConverterErrorCode>(eTqovixErrorInvalidMovie), 5}),
    [](const testing::TestParamInfo<PrimingRow>& info) { return std::string(info.param.name); });

TEST(AacDecoderTest, PrimingQueryWithoutAMovieIsRefused)
{
    testsupport::TempDir dir;
    AACDecoder decoder;
    ASSERT_NO_FATAL_FAILURE(OpenDecoder(decoder, kChannels, 5));
    EXPECT_EQ(decoder.SetDecoderDelay(nullptr), eConverterInternal);
    EXPECT_EQ(decoder.SetDecoderDelay(""), eTqovixErrorSourceNotFound);
    EXPECT_EQ(decoder.SetDecoderDelay(dir.File("missing.mov").c_str()), eTqovixErrorSourceNotFound);
}

struct Step {  // bytes pushed or kFlush, packets by then, status
    unsigned int bytes, packetsBy;
    eConverterErrorCode status = eConverterSuccess;
};
struct PushRow {
    const char* name;
    bool lend;
    size_t refuseAt;
    uint32_t channels;
    std::vector<Step> steps;
};
void PrintTo(const PushRow& row, std::ostream* os) { *os << row.name; }

class EncoderPushTest : public testing::TestWithParam<PushRow> {};

TEST_P(EncoderPushTest, PushesAreCutIntoBlocksAfterTheDrop)
{
    const auto& [name, lend, refuseAt, channels, steps] = GetParam();
    EncoderRig rig(lend, channels);
    rig.refuseAt = refuseAt;
    for (const Step& step : steps) {
        EXPECT_EQ(rig.Push(step.bytes), step.status);
        EXPECT_EQ(rig.packets.size(), size_t{step.packetsBy}) << "after pushing " << step.bytes;
    }
    EXPECT_EQ(static_cast<size_t>(std::ranges::count(rig.writtenAt, rig.buffer.data())),
              lend ? rig.packets.size() : 0);
    // Asked for with the largest packet size, 6144 bits per channel.
    EXPECT_EQ(rig.requested, std::vector<unsigned int>(lend ? steps.size() : 0, 768U * channels));
}

INSTANTIATE_TEST_SUITE_P(
    AacEncoder, EncoderPushTest,
    testing::Values(
        // 4352 dropped, a block, 1552 held; with the next push exactly one block; the flush
        // sends the 100 held bytes padded with silence, then silence; a second holds nothing.
        PushRow{"RemaindersWait", true, SIZE_MAX, 2, {{10000, 1}, {2544, 2}, {100, 2}, {kFlush, 4}, {kFlush, 5}}},
        // The drop is 1088 frames however the pushes fall: 4200 bytes, then 152 of the next.
        PushRow{"DropSpansPushes", true, SIZE_MAX, 2, {{4200, 0}, {4096, 0}, {4248, 2}, {kFlush, 3}}},
        // Mono: 2176 bytes dropped, blocks of 2048 bytes, silence of 2048.
        PushRow{"MonoBlocksFollowTheFrame", true, SIZE_MAX, 1, {{2176 + 2048, 1}, {2047, 1}, {1, 2}, {kFlush, 3}}},
        PushRow{"OwnBufferWhenNoneIsLent", false, SIZE_MAX, 2, {{kDropBytes + 2 * 4096, 2}}},
        PushRow{"RefusedPacketEndsThePushAndItsRest", true, 1, 2,
                {{kDropBytes, 0}, {4 * 4096 + 10, 2, kAborted}, {kFlush, 3}}}),
    [](const testing::TestParamInfo<PushRow>& info) { return std::string(info.param.name); });

TEST(AacEncoderTest, BlocksAreThePcmAfterTheDropAndTheFlushPadsWithSilence)
{
    // Byte for byte, the blocks of the PCM after its first 4352 bytes; the flush adds the
    // remainder padded with silence, then silence.
    EncoderRig rig;
    rig.pcm = Tone(20 * 1024 + 300);
    const size_t total = rig.pcm.size() * sizeof(int16_t);
    const std::array<size_t, 5> sizes = {3000, 777, 5000, 4096, 1};
    for (size_t i = 0; rig.pushed < total; ++i) {
        ASSERT_EQ(rig.Push(static_cast<unsigned int>(std::min(sizes[i % sizes.size()], total - rig.pushed))),
                  eConverterSuccess);
    }
    ASSERT_EQ(rig.Push(kFlush), eConverterSuccess);
    Pcm blocks(rig.pcm.begin() + kDropBytes / 2, rig.pcm.end());
    blocks.resize(blocks.size() - blocks.size() % kBlockSamples + 2 * kBlockSamples, 0);
    Packets expected = EncodeBlocks(blocks);
    expected.pop_back();  // the flush's last block holds only the remainder's length
    ASSERT_EQ(rig.packets.size(), expected.size() + 1);
    EXPECT_TRUE(std::equal(expected.begin(), expected.end(), rig.packets.begin()));
}

// The comparison above holds the encoder to its own one-block path, which settles how pushes
// are cut but not what the packets sound like. ffmpeg's decoder, over the packets framed as ADTS,
// judges that: pushed frame f (the first 1088 dropped) must come out at f + 1024 (the 2112 frames
// of priming less the drop; a movie's edit list skips the 1024), within coding noise, channel by channel.
TEST(AacEncoderTest, FfmpegHearsThePushedSoundOnePacketLate)
{
    if (!testsupport::HaveCommand("ffmpeg")) {
        GTEST_SKIP() << "ffmpeg is the judge";
    }
    EncoderRig rig;
    rig.pcm.assign(48 * 1024 * kChannels, 0);
    // A sweep, each channel its own: no lag but the right one matches.
    for (size_t i = 0; i < rig.pcm.size(); ++i) {
        const double t = static_cast<double>(i / kChannels) / kRate;
        const double start = i % kChannels == 0 ? 200.0 : 300.0;
        rig.pcm[i] = static_cast<int16_t>(std::lround(9000 * std::sin(2 * M_PI * (start * t + 900 * t * t))));
    }
    ASSERT_EQ(rig.Push(static_cast<unsigned int>(rig.pcm.size() * sizeof(int16_t))), eConverterSuccess);
    ASSERT_EQ(rig.Push(kFlush), eConverterSuccess);
    ASSERT_FALSE(rig.packets.empty());
    std::vector<uint8_t> adts;
    for (const Packet& packet : rig.packets) {
        const size_t length = packet.size() + 7;
        // AAC LC, 48 kHz (index 3), two channels, no CRC, one raw block.
        const uint8_t header[7] = {0xFF, 0xF1, (1 << 6) | (3 << 2), static_cast<uint8_t>((2 << 6) | (length >> 11)),
                                   static_cast<uint8_t>(length >> 3), static_cast<uint8_t>((length & 7) << 5 | 0x1F),
                                   0xFC};
        adts.insert(adts.end(), header, header + 7);
        adts.insert(adts.end(), packet.begin(), packet.end());
    }
    testsupport::TempDir dir;
    ASSERT_TRUE(testsupport::WriteFile(dir.File("sound.aac"), adts));
    std::string output;
    ASSERT_EQ(testsupport::RunCommand("ffmpeg -v error -nostdin -f aac -i " + testsupport::ShellQuote(dir.File("sound.aac")) +
                                          " -f s16le -acodec pcm_s16le " + testsupport::ShellQuote(dir.File("sound.raw")) +
                                          " 2>&1",
                                      &output),
              0)
        << output;
    const std::vector<uint8_t> raw = testsupport::ReadFile(dir.File("sound.raw"));
    constexpr size_t kLate = 1024;
    // Judged past the drop and the first packet, short of the last packet heard.
    const size_t from = kDropBytes / 4 + 1024;
    const size_t to = std::min(rig.pcm.size() / kChannels, raw.size() / 4 - kLate) - 1024;
    ASSERT_GT(to, from + 40000) << "ffmpeg heard " << raw.size() / 4 << " frames";
    for (uint32_t c = 0; c < kChannels; ++c) {
        double signal = 0, difference = 0;
        for (size_t f = from; f < to; ++f) {
            const size_t k = (kLate + f) * kChannels + c;
            const double heard = static_cast<int16_t>(raw[2 * k] | (raw[2 * k + 1] << 8));
            const double pushed = rig.pcm[f * kChannels + c];
            signal += pushed * pushed;
            difference += (heard - pushed) * (heard - pushed);
        }
        EXPECT_GT(10 * std::log10(signal / std::max(difference, 1.0)), 30.0) << "channel " << c;
    }
}

ACFormat WithFlags(ACFormat format, uint32_t formatFlags) { return format.formatFlags = formatFlags, format; }

struct FormatRow {
    const char* name;
    bool encoding;
    ACFormat aac, pcm;
    eConverterErrorCode status;
};
void PrintTo(const FormatRow& row, std::ostream* os) { *os << row.name; }

class CodecFormatTest : public testing::TestWithParam<FormatRow> {};

TEST_P(CodecFormatTest, OnlyAacLcAndPcm16AtOneRateAreAccepted)
{
    const auto& [name, encoding, aac, pcm, status] = GetParam();
    AACEncoder encoder;
    AACDecoder decoder;
    AudioConverterBase& codec = encoding ? static_cast<AudioConverterBase&>(encoder) : decoder;
    EXPECT_EQ(encoding ? encoder.Initialize(pcm, aac) : decoder.Initialize(aac, pcm), status);
    UInt32 value = 0;  // a refusal leaves no converter behind
    unsigned int size = sizeof value;
    EXPECT_EQ(codec.GetACProperty(kAudioConverterPropertyMaximumOutputPacketSize, &size, &value),
              status == eConverterSuccess ? eConverterSuccess : eConverterInternal);
}

constexpr eConverterErrorCode kRefused = eConverterRefused;
INSTANTIATE_TEST_SUITE_P(
    Formats, CodecFormatTest,
    testing::Values(FormatRow{"PcmToPcm", false, PcmFormat(), PcmFormat(), kRefused},
                    FormatRow{"FloatPcm", false, AacFormat(), WithFlags(PcmFormat(), 1 | 8), kRefused},
                    FormatRow{"BigEndianPcm", true, AacFormat(), WithFlags(PcmFormat(), 2 | 12), kRefused},
                    FormatRow{"NonInterleavedPcm", false, AacFormat(), WithFlags(PcmFormat(), 32 | 12), kRefused},
                    FormatRow{"HighEfficiency", true, WithFlags(AacFormat(), 5), PcmFormat(), kRefused},
                    FormatRow{"ChannelMismatch", true, AacFormat(kRate, 1), PcmFormat(), kRefused},
                    FormatRow{"SevenChannels", true, AacFormat(kRate, 7), PcmFormat(kRate, 7), kRefused},
                    FormatRow{"NoAacRate", false, AacFormat(44500), PcmFormat(44500), kRefused},
                    FormatRow{"WouldResample", true, AacFormat(), PcmFormat(44100), kRefused},
                    // Whole-kilohertz labels, on either side, stand for the AAC rates near them.
                    FormatRow{"LabelOnPcm", true, AacFormat(44100), PcmFormat(44000), eConverterSuccess},
                    FormatRow{"LabelOnAac", false, AacFormat(22000), PcmFormat(22050), eConverterSuccess}),
    [](const testing::TestParamInfo<FormatRow>& info) { return std::string(info.param.name); });

TEST(CodecBadInputTest, BadPacketsMissingConvertersAndNullArgumentsAreStatuses)
{
    const Packets silent = SilentPackets(2);
    AACDecoder decoder;
    ASSERT_NO_FATAL_FAILURE(OpenDecoder(decoder));
    // Writers overshoot the format's 768 bytes per channel now and then; four times that is refused.
    EXPECT_EQ(Decoded(decoder, Packet(4 * 768 * kChannels + 1, 0x5A), eConverterRefused), 0U) << "oversized";
    EXPECT_EQ(Decoded(decoder, Packet(2000, 0x5A), eConverterFailed), 0U) << "over 768 per channel: decoded, not refused";
    EXPECT_EQ(Decoded(decoder, silent[0]), 4096U) << "the oversized packet used up the delay";

    AACDecoder mono;
    ASSERT_NO_FATAL_FAILURE(OpenDecoder(mono, 1, 0));
    EXPECT_EQ(Decoded(mono, silent[0], eConverterFailed), 0U) << "stereo packet, mono decoder";

    unsigned int size = 0;
    EXPECT_EQ(decoder.Decode(nullptr, &size, &size, silent[0].data(), 10), eConverterInternal);
    decoder.Close();
    EXPECT_EQ(Decoded(decoder, silent[0], eConverterInternal), 0U) << "closed";
    unsigned char bytes[kBlockBytes] = {};
    EncoderRig rig;
    EXPECT_EQ(rig.encoder.Encode(bytes, &size, &size, nullptr, 16), eConverterInternal);
    EXPECT_EQ(rig.encoder.Encode(nullptr, 16), eConverterInternal);
    AACEncoder lowRate;
    EXPECT_EQ(lowRate.Initialize(PcmFormat(), AacFormat(), 1, &rig.stream), eConverterRefused) << "bit rate 1";
    EXPECT_EQ(lowRate.Encode(bytes, 16), eConverterInternal) << "neither converter nor stream was kept";
    ASSERT_EQ(rig.Push(kDropBytes), eConverterSuccess);
    rig.encoder.Close();
    EXPECT_EQ(rig.Push(4096), eConverterInternal) << "fed after close";
    EXPECT_EQ(rig.Push(kFlush), eConverterInternal);
    EXPECT_TRUE(rig.packets.empty());
}

}  // namespace

namespace {

// A codec that cannot open ends the job's start with the converter's reason, for the decoder
// as for the encoder; one that opens serves.
TEST(CodecAdapterTest, CodecsThatCannotOpenFailTheStart)
{
    const moviekit::Bytes config = moviekit::MakeAudioSpecificConfig(48000, 2);
    const auto open = [&](uint64_t rate, uint64_t channels) {
        CTqovixAudioDataControlMac control;
        TqovixInterfaceConvert::TqovixAudioInformation record;
        record.sampleRate = rate;
        record.channels = channels;
        record.bitsPerSample = 16;
        return control.SetAACInformation(nullptr, config.data(), static_cast<unsigned int>(config.size()), record,
                                         128000);
    };
    EXPECT_EQ(open(48000, 2), eTqovixSuccess);
    EXPECT_TRUE(TqovixFailed(open(48000, 0))) << "no channels";
    EXPECT_TRUE(TqovixFailed(open(0, 2))) << "no rate";
}

}  // namespace

namespace {

// Bytes from a string of bits (spaces for reading), zero-padded to the byte.
Packet Bits(const std::string& text)
{
    Packet bytes;
    int count = 0;
    for (const char c : text) {
        if (c != '0' && c != '1') {
            continue;
        }
        if (count % 8 == 0) {
            bytes.push_back(0);
        }
        bytes.back() |= static_cast<uint8_t>((c - '0') << (7 - count % 8));
        ++count;
    }
    return bytes;
}

struct ConfigRow {
    const char* name;
    Packet bytes;
    bool read;
    uint32_t objectType = 0, rate = 0, channels = 0;
    bool extension = false;
};
void PrintTo(const ConfigRow& row, std::ostream* os) { *os << row.name; }

class AacConfigTest : public testing::TestWithParam<ConfigRow> {};

TEST_P(AacConfigTest, ProfileRateChannelsAndWhatElseItAsksFor)
{
    const ConfigRow& row = GetParam();
    const auto config = TqovixAacSyntax::ReadDecoderConfig(row.bytes.data(), row.bytes.size());
    ASSERT_EQ(config.has_value(), row.read);
    if (config) {
        EXPECT_EQ(config->objectType, row.objectType);
        EXPECT_EQ(config->sampleRate, row.rate);
        EXPECT_EQ(config->channelConfiguration, row.channels);
        EXPECT_EQ(config->shortFrames || config->dependsOnCoreCoder || config->extension, row.extension);
    }
}

INSTANTIATE_TEST_SUITE_P(
    Configs, AacConfigTest,
    testing::Values(ConfigRow{"LowComplexity48kStereo", {0x11, 0x90}, true, 2, 48000, 2},
                    // ffmpeg's: no spectral band replication, said outright.
                    ConfigRow{"SaysNoReplication", {0x12, 0x08, 0x56, 0xE5, 0x00}, true, 2, 44100, 1},
                    ConfigRow{"ReplicationPresent", {0x12, 0x08, 0x56, 0xE5, 0x80}, true, 2, 44100, 1, true},
                    ConfigRow{"ShortFrames", {0x11, 0x94}, true, 2, 48000, 2, true},
                    ConfigRow{"ProgramConfiguration", {0x11, 0x80}, true, 2, 48000, 0, true},
                    ConfigRow{"ExplicitRate", Bits("00010 1111 000000001011101110000000 0001 000"), true, 2, 48000, 1},
                    ConfigRow{"HighEfficiency", {0x2B, 0x92, 0x08, 0x00}, true, 5, 22050, 2},
                    ConfigRow{"CutShort", {0x11}, false},
                    ConfigRow{"Empty", {}, false}),
    [](const testing::TestParamInfo<ConfigRow>& info) { return std::string(info.param.name); });

struct FrameRow {
    const char* name;
    Packet bytes;
    bool read;
    uint8_t element = 0, sequence = 0, shape = 0;
};
void PrintTo(const FrameRow& row, std::ostream* os) { *os << row.name; }

class AacFrameTest : public testing::TestWithParam<FrameRow> {};

TEST_P(AacFrameTest, TheFirstChannelsWindowIsFound)
{
    const FrameRow& row = GetParam();
    const auto header = TqovixAacSyntax::ReadFrameHeader(row.bytes.data(), row.bytes.size());
    ASSERT_EQ(header.has_value(), row.read);
    if (header) {
        EXPECT_EQ(header->element, row.element);
        EXPECT_EQ(header->windowSequence, row.sequence);
        EXPECT_EQ(header->windowShape, row.shape);
    }
}

INSTANTIATE_TEST_SUITE_P(
    Frames, AacFrameTest,
    testing::Values(
        // element, tag, [common window], [global gain], reserved, sequence, shape
        FrameRow{"OneChannel", Bits("000 0000 10010110 0 00 1 000000"), true, 0, 0, 1},
        FrameRow{"PairSharingItsWindow", Bits("001 0000 1 0 10 0 0000"), true, 1, 2, 0},
        FrameRow{"PairEachItsOwn", Bits("001 0000 0 01100100 0 11 1 0000"), true, 1, 3, 1},
        FrameRow{"AfterFill", Bits("110 0010 00000000 10100101 001 0000 1 0 01 1 0000"), true, 1, 1, 1},
        // A fill of nothing, then data aligned to the packet's bytes (one bit skipped), then the channel.
        FrameRow{"AfterByteAlignedData", Bits("110 0000 100 0000 1 00000001 0 11111111 000 0000 10010110 0 00 1"), true,
                 0, 0, 1},
        FrameRow{"ProgramConfigurationFirst", Bits("101 0000 0000000000000000"), false},
        FrameRow{"CutShort", Bits("001 0000 1"), false},
        FrameRow{"FillPastTheEnd", Bits("110 1111 11111111 00000000"), false}),
    [](const testing::TestParamInfo<FrameRow>& info) { return std::string(info.param.name); });

// Decoding a packet sequence from its start, as a job serves it.
Pcm DecodeAll(const Packets& packets, uint32_t channels = kChannels)
{
    AACDecoder decoder;
    EXPECT_EQ(decoder.Initialize(AacFormat(kRate, channels), PcmFormat(kRate, channels)), eConverterSuccess);
    Pcm sound;
    for (const Packet& packet : packets) {
        std::array<int16_t, AACDecoder::kMaxPcmSize / sizeof(int16_t)> block{};
        unsigned int size = 0, used = 0;
        EXPECT_EQ(decoder.Decode(block.data(), &size, &used, packet.data(), static_cast<unsigned int>(packet.size())),
                  eConverterSuccess);
        sound.insert(sound.end(), block.begin(), block.begin() + size / sizeof(int16_t));
    }
    sound.resize(packets.size() * kBlockSamples, 0);
    return sound;
}

// Fill elements make a packet any longer size and leave its sound as it was; and our encoder's
// long windows have the shape the splicing counts on.
TEST(AacPaddingTest, FilledOutPacketsSoundTheSame)
{
    const Packets packets = EncodeBlocks(Tone(24 * 1024));
    ASSERT_EQ(packets.size(), 24U);
    for (const Packet& packet : packets) {
        const auto header = TqovixAacSyntax::ReadFrameHeader(packet.data(), packet.size());
        ASSERT_TRUE(header.has_value());
        if (header->windowSequence == TqovixAacSyntax::kOnlyLong) {
            EXPECT_EQ(header->windowShape, AACEncoder::kLongWindowShape);
        }
    }
    Packets padded = packets;
    const size_t grows[] = {0, 1, 2, 7, 8, 14, 15, 16, 17, 120, 134, 135, 300, 2000};
    for (size_t k = 0; k < std::size(grows); ++k) {
        Packet& packet = padded[k + 4];
        Packet out;
        ASSERT_TRUE(TqovixAacSyntax::PadToSize(packet.data(), packet.size(), packet.size() + grows[k], out)) << grows[k];
        EXPECT_EQ(out.size(), packet.size() + grows[k]);
        packet = out;
    }
    EXPECT_TRUE(DecodeAll(padded) == DecodeAll(packets)) << "fill changed the sound";
    Packet out;
    EXPECT_FALSE(TqovixAacSyntax::PadToSize(packets[3].data(), packets[3].size(), packets[3].size() - 1, out));
    Packet unended = packets[3];
    unended.push_back(0x80);  // a set bit after the end element: not how an encoder closes a block
    EXPECT_FALSE(TqovixAacSyntax::PadToSize(unended.data(), unended.size(), unended.size() + 10, out));
}

struct SpliceRun {
    Packets written;
    std::vector<bool> carried;
    CTqovixAacSplicer::Statistics statistics;
    eTqovixErrorCode result = eTqovixSuccess;
};

// 64 packets of a tone; its decode served, and pushed back halved over regions [from, to)
// (whole packets' worth), all of it or the first `pushedRegions`.
SpliceRun Splice(const Packets& source, uint64_t from, uint64_t to, bool whole = false, uint64_t pushedRegions = UINT64_MAX)
{
    const Pcm served = DecodeAll(source);
    Pcm processed = served;
    for (uint64_t k = from * kBlockSamples; k < std::min(to * kBlockSamples, processed.size()); ++k) {
        processed[k] = static_cast<int16_t>(processed[k] / 2);
    }
    testsupport::SpliceCollector collector(source);
    CTqovixAacSplicer splicer;
    SpliceRun run;
    run.result = splicer.Open(PcmFormat(), AacFormat(), 128000 * kChannels, &collector);
    splicer.Plan(source.size(), whole);
    for (uint64_t region = 0; region < source.size() && region < pushedRegions && !TqovixFailed(run.result); ++region) {
        splicer.KeepServed(served.data() + region * kBlockSamples, kBlockBytes);
        run.result = splicer.Push(processed.data() + region * kBlockSamples, kBlockBytes);
    }
    if (!TqovixFailed(run.result)) {
        run.result = splicer.Finish();
    }
    run.written = collector.written;
    run.carried = collector.carried;
    run.statistics = splicer.GetStatistics();
    return run;
}

// The decoder's output for packet k (served region k - 1) against the sound wanted, in dB.
double RegionDb(const Pcm& heard, const Pcm& wanted, uint64_t region)
{
    double signal = 0, difference = 0;
    for (uint64_t k = region * kBlockSamples; k < (region + 1) * kBlockSamples; ++k) {
        const double want = wanted[k];
        const double error = heard[k] - want;
        signal += want * want;
        difference += error * error;
    }
    return difference == 0 ? 999 : 10 * std::log10(signal / difference);
}

TEST(AacSplicerTest, CarriesWhatCameBackAndReencodesAroundChanges)
{
    const Packets source = EncodeBlocks(Tone(64 * 1024));
    ASSERT_EQ(source.size(), 64U);
    // Nothing changed: every packet the source's own.
    const SpliceRun same = Splice(source, 0, 0);
    ASSERT_EQ(same.result, eTqovixSuccess);
    EXPECT_TRUE(same.written == source);
    EXPECT_EQ(same.statistics.spans, 0U);
    // A stream we cannot splice into: every packet re-encoded, none carried.
    const SpliceRun whole = Splice(source, 0, 0, true);
    ASSERT_EQ(whole.result, eTqovixSuccess);
    ASSERT_EQ(whole.written.size(), source.size());
    EXPECT_EQ(std::count(whole.carried.begin(), whole.carried.end(), true), 0);
    // Halved over served regions 30 to 35: packets from a margin before to a margin after re-encoded.
    const SpliceRun middle = Splice(source, 30, 36);
    ASSERT_EQ(middle.result, eTqovixSuccess);
    ASSERT_EQ(middle.written.size(), source.size());
    EXPECT_EQ(middle.statistics.spans, 1U);
    EXPECT_EQ(middle.statistics.joints, 2U);
    EXPECT_EQ(middle.statistics.unheardJoints, 0U);
    for (size_t k = 0; k < source.size(); ++k) {
        // Changed served regions 30 to 35 are stream regions 31 to 36, under packets 30 to 36.
        const bool near = k + 1 + CTqovixAacSplicer::Tuning{}.margin >= 31 && k <= 36 + CTqovixAacSplicer::Tuning{}.margin;
        if (near) {
            EXPECT_FALSE(middle.carried[k]) << "packet " << k << " overlaps the change or its margin";
        } else if (k + 16 < 31 || k > 36 + 16) {
            EXPECT_TRUE(middle.carried[k] && middle.written[k] == source[k]) << "packet " << k << " is far from it";
        }
    }
    Pcm wanted = DecodeAll(source);
    for (uint64_t k = 30 * kBlockSamples; k < 36 * kBlockSamples; ++k) {
        wanted[k] = static_cast<int16_t>(wanted[k] / 2);
    }
    const Pcm heard = DecodeAll(middle.written);
    for (uint64_t region = 1; region + 1 < source.size(); ++region) {
        EXPECT_GT(RegionDb(heard, wanted, region), 25.0) << "served region " << region;
    }
}

// A joint whose windows do not cancel is heard and moved. Made here by marking source packets'
// windows as they were not encoded (so that the sound served has the fault, and a re-encoded
// neighbour does not): the first packet tried for the span's start as stopping a short window,
// the last one re-encoded before the first end tried as starting one.
TEST(AacSplicerTest, JointsThatDoNotCancelAreMoved)
{
    Packets source = EncodeBlocks(Tone(64 * 1024));
    ASSERT_EQ(source.size(), 64U);
    const uint64_t margin = CTqovixAacSplicer::Tuning{}.margin;
    // Changed served regions 30 to 34 are stream regions 31 to 35, under packets 30 to 35.
    const uint64_t start = 30 - margin;
    const uint64_t end = 35 + 1 + margin;
    const auto setSequence = [&](uint64_t packet, unsigned sequence) {
        ASSERT_EQ(source[packet][0] >> 5, 1) << "a channel pair";
        ASSERT_EQ(source[packet][0] & 1, 1) << "sharing its window";
        source[packet][1] = static_cast<uint8_t>((source[packet][1] & ~0x60) | sequence << 5);  // bits 9 and 10
    };
    setSequence(start, TqovixAacSyntax::kLongStop);
    setSequence(end - 1, TqovixAacSyntax::kLongStart);
    const SpliceRun run = Splice(source, 30, 35);
    ASSERT_EQ(run.result, eTqovixSuccess);
    EXPECT_EQ(run.statistics.joints, 2U);
    EXPECT_EQ(run.statistics.unheardJoints, 0U);
    EXPECT_EQ(run.statistics.startsMoved, 1U);
    EXPECT_EQ(run.statistics.endsMoved, 1U);
    EXPECT_FALSE(run.carried[start - 1]) << "the span starts where its first place was heard to differ";
    EXPECT_FALSE(run.carried[end]) << "the span ends where its first end was heard to differ";
    EXPECT_TRUE(run.carried[end + 1] && run.carried[start - 1 - CTqovixAacSplicer::Tuning{}.startCandidates]);
}

// A library that stops early leaves the rest of the track as it came; one that stops inside a
// span leaves no packets to end it with, which fails rather than writing a joint unheard.
TEST(AacSplicerTest, SoundNeverPushedBackGoesOutAsItCame)
{
    const Packets source = EncodeBlocks(Tone(64 * 1024));
    const SpliceRun early = Splice(source, 10, 14, false, 40);
    ASSERT_EQ(early.result, eTqovixSuccess);
    ASSERT_EQ(early.written.size(), source.size());
    for (size_t k = 30; k < source.size(); ++k) {
        EXPECT_TRUE(early.carried[k] && early.written[k] == source[k]) << "packet " << k;
    }
    const SpliceRun inside = Splice(source, 30, 50, false, 40);
    EXPECT_TRUE(TqovixFailed(inside.result));
}

}  // namespace
