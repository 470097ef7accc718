// The AAC codec classes and the audio converter layer beneath them: format mapping and
// statuses, the decoder's delay, the encoder's block, drop and flush rules, the timing of
// decode → encode → decode, and ffmpeg as an independent decoder of what we encode.
#include <gtest/gtest.h>

#include <AudioToolbox/AudioToolbox.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstring>
#include <filesystem>
#include <functional>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "AacConfig.h"
#include "Movie.h"
#include "codec/AACDecoder.h"
#include "codec/AACEncoder.h"
#include "codec/AudioConverterBase.h"
#include "support/TestSupport.h"

namespace {

using Pcm = std::vector<int16_t>;
using Packet = std::vector<uint8_t>;
using Packets = std::vector<Packet>;

constexpr double kRate = 48000;
constexpr uint32_t kChannels = 2;
constexpr size_t kPacketFrames = 1024;
constexpr unsigned int kBlockBytes = 4096;
constexpr unsigned int kDropBytes = 4352;
constexpr long kPlatformPriming = 2112;
constexpr unsigned int kCameraBitRate = 256000;

ACFormat AacFormat(double rate = kRate, uint32_t channels = kChannels)
{
    return ACFormat{rate, ACFormatAAC, 0, 0, 1024, 0, channels, 0};
}

// What the codec adapter builds for a 16-bit track.
ACFormat PcmFormat(double rate = kRate, uint32_t channels = kChannels)
{
    return ACFormat{rate, ACFormatLinearPCM, 12, 2 * channels, 1, 2 * channels, channels, 16};
}

// A 1 kHz tone over frames [from, to), a quarter period apart between the channels.
void AddTone(Pcm& pcm, uint32_t channels, size_t from, size_t to)
{
    for (size_t i = from; i < to; ++i) {
        for (uint32_t c = 0; c < channels; ++c) {
            const double phase = 2 * M_PI * 1000.0 * static_cast<double>(i) / kRate + c * M_PI / 2;
            pcm[i * channels + c] = static_cast<int16_t>(std::lround(12000 * std::sin(phase)));
        }
    }
}

Pcm Tone(size_t frames, uint32_t channels, size_t silentFrames = 0)
{
    Pcm pcm(frames * channels, 0);
    AddTone(pcm, channels, silentFrames, frames);
    return pcm;
}

// Silence with one short broadband click starting at frame `at`.
Pcm Click(size_t frames, size_t at)
{
    constexpr std::array<int, 8> kShape = {6000, 18000, 24000, 12000, -12000, -24000, -18000, -6000};
    Pcm pcm(frames * kChannels, 0);
    for (size_t k = 0; k < kShape.size(); ++k) {
        for (uint32_t c = 0; c < kChannels; ++c) {
            pcm[(at + k) * kChannels + c] = static_cast<int16_t>(kShape[k]);
        }
    }
    return pcm;
}

// The lag L within ±maxLag at which signal[i + L] best matches reference[i] over frames
// [from, from + length) of the first channel.
long BestLag(const Pcm& reference, const Pcm& signal, size_t from, size_t length, long maxLag)
{
    const long referenceFrames = static_cast<long>(reference.size() / kChannels);
    const long signalFrames = static_cast<long>(signal.size() / kChannels);
    long best = 0;
    double bestScore = -1e300;
    for (long lag = -maxLag; lag <= maxLag; ++lag) {
        double score = 0;
        for (long i = static_cast<long>(from); i < static_cast<long>(from + length); ++i) {
            if (i < 0 || i >= referenceFrames || i + lag < 0 || i + lag >= signalFrames) {
                continue;
            }
            score += static_cast<double>(reference[i * kChannels]) * signal[(i + lag) * kChannels];
        }
        if (score > bestScore) {
            bestScore = score;
            best = lag;
        }
    }
    return best;
}

double SnrDb(const Pcm& reference, const Pcm& signal, long lag, size_t from, size_t length)
{
    double power = 0;
    double noise = 0;
    for (size_t i = from; i < from + length; ++i) {
        for (uint32_t c = 0; c < kChannels; ++c) {
            const double wanted = reference[i * kChannels + c];
            const double got = signal[(static_cast<long>(i) + lag) * kChannels + c];
            power += wanted * wanted;
            noise += (wanted - got) * (wanted - got);
        }
    }
    return 10 * std::log10(power / std::max(noise, 1e-9));
}

// Collects what an encoder's stream hands out, lending a 4096-byte buffer as the codec
// adapter does; it can be told to refuse one packet.
class PacketSink {
public:
    explicit PacketSink(bool lendBuffer = true)
    {
        m_stream.requestProc = lendBuffer ? Request : nullptr;
        m_stream.resultProc = Result;
        m_stream.buffer = m_buffer.data();
        m_stream.bufferSize = static_cast<unsigned int>(m_buffer.size());
        m_stream.userData = this;
    }
    PacketSink(const PacketSink&) = delete;
    PacketSink& operator=(const PacketSink&) = delete;

    const ACEncoderStream* Stream() const { return &m_stream; }
    const unsigned char* LentBuffer() const { return m_buffer.data(); }

    Packets packets;
    std::vector<unsigned int> requested;
    std::vector<const unsigned char*> writtenAt;
    size_t refuseAt = SIZE_MAX;  // index of the packet to answer with a failure

private:
    static PacketSink& Of(void* stream)
    {
        return *static_cast<PacketSink*>(static_cast<ACEncoderStream*>(stream)->userData);
    }

    static unsigned char* Request(void* stream, unsigned int size)
    {
        PacketSink& sink = Of(stream);
        sink.requested.push_back(size);
        return sink.m_stream.bufferSize > size ? sink.m_stream.buffer : nullptr;
    }

    static eTqovixErrorCode Result(void* stream, unsigned char* data, unsigned int size)
    {
        PacketSink& sink = Of(stream);
        sink.packets.emplace_back(data, data + size);
        sink.writtenAt.push_back(data);
        return sink.packets.size() - 1 == sink.refuseAt ? eTqovixErrorAborted : eTqovixSuccess;
    }

    std::array<unsigned char, 4096> m_buffer{};
    ACEncoderStream m_stream;
};

void OpenEncoder(AACEncoder& encoder, const PacketSink& sink, unsigned int bitRate = kCameraBitRate)
{
    ASSERT_EQ(encoder.Initialize(PcmFormat(), AacFormat(), bitRate, sink.Stream()), eConverterSuccess);
}

void OpenDecoder(AACDecoder& decoder, uint32_t channels = kChannels)
{
    ASSERT_EQ(decoder.Initialize(AacFormat(kRate, channels), PcmFormat(kRate, channels)), eConverterSuccess);
}

// Every whole 1024-frame block of `pcm` through the one-block Encode of a fresh encoder.
Packets EncodeBlocks(const Pcm& pcm)
{
    PacketSink sink;
    AACEncoder encoder;
    OpenEncoder(encoder, sink);
    Packets packets;
    std::array<unsigned char, kBlockBytes> aac{};
    for (size_t at = 0; at + kPacketFrames * kChannels <= pcm.size(); at += kPacketFrames * kChannels) {
        unsigned int aacSize = 0;
        unsigned int used = 0;
        EXPECT_EQ(encoder.Encode(aac.data(), &aacSize, &used, pcm.data() + at, kBlockBytes), eConverterSuccess);
        EXPECT_EQ(used, kBlockBytes);
        packets.emplace_back(aac.data(), aac.data() + aacSize);
    }
    return packets;
}

// Pushes `pcm` through the streaming Encode in pushes cycling through `sizes`, then flushes.
Packets EncodeStream(const Pcm& pcm, const std::vector<size_t>& sizes)
{
    PacketSink sink;
    AACEncoder encoder;
    OpenEncoder(encoder, sink);
    const auto* bytes = reinterpret_cast<const unsigned char*>(pcm.data());
    const size_t total = pcm.size() * sizeof(int16_t);
    for (size_t at = 0, i = 0; at < total; ++i) {
        const size_t size = std::min(sizes[i % sizes.size()], total - at);
        EXPECT_EQ(encoder.Encode(const_cast<unsigned char*>(bytes + at), static_cast<unsigned int>(size)),
                  eConverterSuccess);
        at += size;
    }
    EXPECT_EQ(encoder.EncodeDone(), eConverterSuccess);
    return sink.packets;
}

// Every packet through a fresh decoder with the given delay; the PCM it delivers, in order.
Pcm DecodeAll(const Packets& packets, unsigned int delay)
{
    AACDecoder decoder;
    OpenDecoder(decoder);
    decoder.SetDecoderDelay(delay);
    Pcm pcm;
    std::array<int16_t, AACDecoder::kMaxPcmSize / sizeof(int16_t)> out{};
    for (const Packet& packet : packets) {
        unsigned int pcmSize = 0;
        unsigned int used = 0;
        EXPECT_EQ(decoder.Decode(out.data(), &pcmSize, &used, packet.data(), static_cast<unsigned int>(packet.size())),
                  eConverterSuccess);
        pcm.insert(pcm.end(), out.begin(), out.begin() + pcmSize / sizeof(int16_t));
    }
    return pcm;
}

std::string WriteAacMovie(const testsupport::TempDir& dir, const Packets& packets, uint32_t mediaTime)
{
    moviekit::MovieSpec recipe;
    recipe.sound.codec = moviekit::SoundCodec::Aac;
    recipe.sound.mediaTime = mediaTime;
    recipe.sound.aacPackets = packets;
    const std::string path = dir.File("movie-" + std::to_string(mediaTime) + ".mov");
    std::string error;
    EXPECT_TRUE(moviekit::WriteMovie(path, recipe, nullptr, &error)) << error;
    return path;
}

Packets SilentPackets(size_t count, uint16_t channels = kChannels)
{
    Packets packets;
    for (size_t i = 0; i < count; ++i) {
        packets.push_back(moviekit::MakeSilentAacPacket(channels, 40 + static_cast<uint32_t>(i), i));
    }
    return packets;
}

// ---------------------------------------------------------------------------------------
// Formats, properties and statuses of the wrapper

TEST(ConverterWrapperTest, FormatFieldsMapBothWaysKeepingOnlyMeaningfulFlags)
{
    AudioConverterBase base;
    ACFormat format = PcmFormat();
    format.formatFlags = 0x8C;
    AudioStreamBasicDescription description{};
    base.ACFormat2BasicDescription(format, description);
    EXPECT_EQ(description.mFormatID, static_cast<UInt32>(kAudioFormatLinearPCM));
    EXPECT_EQ(description.mFormatFlags, 0x0CU);
    EXPECT_EQ(description.mBytesPerFrame, 4U);
    EXPECT_EQ(description.mChannelsPerFrame, 2U);
    EXPECT_EQ(description.mBitsPerChannel, 16U);

    // An unknown format ID leaves the other side's ID as it was, both ways.
    description.mFormatID = kAudioFormatMPEG4AAC;
    format.formatID = static_cast<eACFormatID>(3);
    base.ACFormat2BasicDescription(format, description);
    EXPECT_EQ(description.mFormatID, static_cast<UInt32>(kAudioFormatMPEG4AAC));
    description.mFormatID = 0x61626364;
    base.BasicDescription2ACFormat(description, format);
    EXPECT_EQ(format.formatID, static_cast<eACFormatID>(3));
}

TEST(ConverterWrapperTest, PlatformStatusesMapToConverterCodes)
{
    EXPECT_EQ(ConvertACError(noErr), eConverterSuccess);
    for (int status : {kAudioConverterErr_FormatNotSupported, kAudioConverterErr_OperationNotSupported,
                       kAudioConverterErr_PropertyNotSupported, kAudioConverterErr_InvalidInputSize,
                       kAudioConverterErr_InvalidOutputSize, kAudioConverterErr_BadPropertySizeError,
                       kAudioConverterErr_RequiresPacketDescriptionsError,
                       kAudioConverterErr_InputSampleRateOutOfRange, kAudioConverterErr_OutputSampleRateOutOfRange}) {
        EXPECT_EQ(ConvertACError(status), eConverterRefused) << std::hex << status;
    }
    EXPECT_EQ(ConvertACError(kAudioConverterErr_UnspecifiedError), eConverterFailed);
    EXPECT_EQ(ConvertACError(-50), eConverterInternal);
}

TEST(ConverterWrapperTest, PropertiesNeedAConverter)
{
    AudioConverterBase base;
    UInt32 value = 0;
    unsigned int size = sizeof value;
    EXPECT_EQ(base.GetACProperty(kAudioConverterPropertyMaximumOutputPacketSize, &size, &value), eConverterInternal);
    EXPECT_EQ(base.SetACProperty(kAudioConverterEncodeBitRate, sizeof value, &value), eConverterInternal);
}

TEST(ConverterWrapperTest, InitializeReadsBackWhatTheConverterSettledOn)
{
    AACDecoder decoder;
    ACFormat aac = AacFormat();
    aac.framesPerPacket = 0;  // left to the converter
    ASSERT_EQ(decoder.Initialize(aac, PcmFormat()), eConverterSuccess);
    ACFormat input;
    ACFormat output;
    decoder.GetInputFormat(input);
    decoder.GetOutputFormat(output);
    EXPECT_EQ(input.formatID, ACFormatAAC);
    EXPECT_EQ(input.framesPerPacket, 1024U);
    EXPECT_EQ(input.channelsPerFrame, 2U);
    EXPECT_EQ(output.formatID, ACFormatLinearPCM);
    EXPECT_EQ(output.formatFlags, 12U);
    EXPECT_EQ(output.bytesPerFrame, 4U);
    EXPECT_EQ(output.sampleRate, 48000.0);

    UInt32 maximum = 0;
    unsigned int size = sizeof maximum;
    AACEncoder encoder;
    PacketSink sink;
    ASSERT_NO_FATAL_FAILURE(OpenEncoder(encoder, sink));
    ASSERT_EQ(encoder.GetACProperty(kAudioConverterPropertyMaximumOutputPacketSize, &size, &maximum),
              eConverterSuccess);
    EXPECT_EQ(maximum, 1536U);  // 6144 bits per channel
}

struct FormatCase {
    const char* name;
    bool encoding;
    std::function<void(ACFormat& aac, ACFormat& pcm)> change;
};

class RefusedFormatTest : public testing::TestWithParam<FormatCase> {};

TEST_P(RefusedFormatTest, InitializeRefusesAndLeavesNoConverter)
{
    ACFormat aac = AacFormat();
    ACFormat pcm = PcmFormat();
    GetParam().change(aac, pcm);
    std::unique_ptr<AudioConverterBase> codec;
    if (GetParam().encoding) {
        codec = std::make_unique<AACEncoder>();
        EXPECT_EQ(codec->Initialize(pcm, aac), eConverterRefused);
    } else {
        codec = std::make_unique<AACDecoder>();
        EXPECT_EQ(codec->Initialize(aac, pcm), eConverterRefused);
    }
    UInt32 value = 0;
    unsigned int size = sizeof value;
    EXPECT_EQ(codec->GetACProperty(kAudioConverterPropertyMaximumOutputPacketSize, &size, &value),
              eConverterInternal);
}

INSTANTIATE_TEST_SUITE_P(
    Formats, RefusedFormatTest,
    testing::Values(
        FormatCase{"DecoderPcmToPcm", false, [](ACFormat& aac, ACFormat& pcm) { aac = pcm; }},
        FormatCase{"EncoderAacToAac", true, [](ACFormat& aac, ACFormat& pcm) { pcm = aac; }},
        FormatCase{"FloatPcm", false, [](ACFormat&, ACFormat& pcm) { pcm.formatFlags = 1 | 8; }},
        FormatCase{"BigEndianPcm", true, [](ACFormat&, ACFormat& pcm) { pcm.formatFlags |= 2; }},
        FormatCase{"UnsignedPcm", true, [](ACFormat&, ACFormat& pcm) { pcm.formatFlags = 8; }},
        FormatCase{"NonInterleavedPcm", false, [](ACFormat&, ACFormat& pcm) { pcm.formatFlags |= 32; }},
        FormatCase{"TwentyFourBitPcm", false,
                   [](ACFormat&, ACFormat& pcm) {
                       pcm.bitsPerChannel = 24;
                       pcm.bytesPerFrame = pcm.bytesPerPacket = 6;
                   }},
        FormatCase{"DecoderChannelMismatch", false, [](ACFormat&, ACFormat& pcm) { pcm = PcmFormat(kRate, 1); }},
        FormatCase{"EncoderChannelMismatch", true, [](ACFormat& aac, ACFormat&) { aac = AacFormat(kRate, 1); }},
        FormatCase{"SevenChannels", true,
                   [](ACFormat& aac, ACFormat& pcm) {
                       aac = AacFormat(kRate, 7);
                       pcm = PcmFormat(kRate, 7);
                   }},
        FormatCase{"NoChannels", false,
                   [](ACFormat& aac, ACFormat& pcm) {
                       aac = AacFormat(kRate, 0);
                       pcm = PcmFormat(kRate, 0);
                   }},
        FormatCase{"RateNoAacRateLabels", false,
                   [](ACFormat& aac, ACFormat& pcm) {
                       aac = AacFormat(44500);
                       pcm = PcmFormat(44500);
                   }},
        FormatCase{"EncoderWouldResample", true, [](ACFormat&, ACFormat& pcm) { pcm = PcmFormat(44100); }},
        FormatCase{"HighEfficiencyObjectType", true, [](ACFormat& aac, ACFormat&) { aac.formatFlags = 5; }}),
    [](const testing::TestParamInfo<FormatCase>& info) { return std::string(info.param.name); });

// ---------------------------------------------------------------------------------------
// The converter layer through its C interface

struct BlockSource {
    const int16_t* pcm = nullptr;
    UInt32 frames = 0;
    int calls = 0;
    bool ended = false;
};

OSStatus OfferBlock(AudioConverterRef, UInt32* packets, AudioBufferList* data, AudioStreamPacketDescription** described,
                    void* userData)
{
    auto* source = static_cast<BlockSource*>(userData);
    ++source->calls;
    if (described != nullptr) {
        *described = nullptr;
    }
    if (source->ended) {
        *packets = 0;
        return noErr;
    }
    data->mBuffers[0].mData = const_cast<int16_t*>(source->pcm);
    data->mBuffers[0].mDataByteSize = source->frames * 4;
    return noErr;  // the count is left as asked, as the encoder's own procedure does
}

AudioStreamBasicDescription Description(const ACFormat& format)
{
    AudioConverterBase base;
    AudioStreamBasicDescription description{};
    base.ACFormat2BasicDescription(format, description);
    return description;
}

class ConverterLayerTest : public testing::Test {
protected:
    void SetUp() override
    {
        m_encoder = NewConverter(PcmFormat(), AacFormat());
        m_decoder = NewConverter(AacFormat(), PcmFormat());
        ASSERT_NE(m_encoder, nullptr);
        ASSERT_NE(m_decoder, nullptr);
    }
    void TearDown() override
    {
        for (AudioConverterRef converter : m_converters) {
            EXPECT_EQ(AudioConverterDispose(converter), noErr);
        }
    }

    AudioConverterRef NewConverter(const ACFormat& from, const ACFormat& to)
    {
        const AudioStreamBasicDescription source = Description(from);
        const AudioStreamBasicDescription destination = Description(to);
        AudioConverterRef converter = nullptr;
        EXPECT_EQ(AudioConverterNew(&source, &destination, &converter), noErr);
        if (converter != nullptr) {
            m_converters.push_back(converter);
        }
        return converter;
    }

    // One Fill of `encoder` asking for one packet; the packet's bytes, empty when none came.
    static OSStatus FillOne(AudioConverterRef encoder, BlockSource& source, Packet* packet, UInt32 room = 1536)
    {
        packet->assign(room, 0);
        AudioBufferList output{};
        output.mNumberBuffers = 1;
        output.mBuffers[0] = AudioBuffer{2, room, packet->data()};
        AudioStreamPacketDescription description{};
        UInt32 packets = 1;
        const OSStatus status =
            AudioConverterFillComplexBuffer(encoder, OfferBlock, &source, &packets, &output, &description);
        packet->resize(packets == 1 ? output.mBuffers[0].mDataByteSize : 0);
        if (packets == 1) {
            EXPECT_EQ(description.mDataByteSize, packet->size());
        }
        return status;
    }
    OSStatus FillOne(BlockSource& source, Packet* packet, UInt32 room = 1536)
    {
        return FillOne(m_encoder, source, packet, room);
    }

    AudioConverterRef m_encoder = nullptr;
    AudioConverterRef m_decoder = nullptr;
    std::vector<AudioConverterRef> m_converters;
};

TEST_F(ConverterLayerTest, EncoderGivesOnePacketPerCallAndTakesInputOnlyAsNeeded)
{
    const Pcm tone = Tone(1024, kChannels);
    BlockSource whole{tone.data(), 1024};
    Packet packet;
    for (int call = 1; call <= 5; ++call) {
        ASSERT_EQ(FillOne(whole, &packet), noErr);
        EXPECT_FALSE(packet.empty()) << "call " << call;
        EXPECT_EQ(whole.calls, call);
    }

    // Quarter blocks: the 64 frames held since priming plus four of them make each packet.
    AudioConverterRef encoder = NewConverter(PcmFormat(), AacFormat());
    ASSERT_NE(encoder, nullptr);
    BlockSource quarter{tone.data(), 256};
    for (int call = 1; call <= 3; ++call) {
        ASSERT_EQ(FillOne(encoder, quarter, &packet), noErr);
        EXPECT_FALSE(packet.empty());
        EXPECT_EQ(quarter.calls, 4 * call);
    }
}

TEST_F(ConverterLayerTest, EncoderDrainsEverythingAtTheEndOfInput)
{
    const Pcm tone = Tone(1024, kChannels);
    BlockSource source{tone.data(), 1024};
    Packets packets;
    Packet packet;
    for (int i = 0; i < 10; ++i) {
        ASSERT_EQ(FillOne(source, &packet), noErr);
        packets.push_back(packet);
    }
    source.ended = true;
    for (int i = 0; i < 10; ++i) {
        ASSERT_EQ(FillOne(source, &packet), noErr);
        if (packet.empty()) {
            break;
        }
        packets.push_back(packet);
    }
    ASSERT_TRUE(packet.empty()) << "the drain never ended";
    ASSERT_EQ(FillOne(source, &packet), noErr);
    EXPECT_TRUE(packet.empty());
    // Priming, every frame offered, and the encoder's tail are all in the stream.
    EXPECT_GE(DecodeAll(packets, 0).size() / kChannels, size_t{kPlatformPriming} + 10 * 1024);
}

TEST_F(ConverterLayerTest, PacketTooLargeForTheBufferWaitsForMoreRoom)
{
    const Pcm tone = Tone(1024, kChannels);
    BlockSource source{tone.data(), 1024};
    Packet packet;
    EXPECT_EQ(FillOne(source, &packet, 1), kAudioConverterErr_InvalidOutputSize);
    EXPECT_TRUE(packet.empty());
    ASSERT_EQ(FillOne(source, &packet), noErr);
    EXPECT_GT(packet.size(), 1U);
    EXPECT_EQ(source.calls, 1);  // the kept packet needed no new input
}

TEST_F(ConverterLayerTest, PropertiesAnswerWithPlatformStatuses)
{
    AudioStreamBasicDescription description{};
    UInt32 size = sizeof description;
    ASSERT_EQ(AudioConverterGetProperty(m_encoder, kAudioConverterCurrentOutputStreamDescription, &size, &description),
              noErr);
    EXPECT_EQ(size, 40U);
    EXPECT_EQ(description.mFormatID, static_cast<UInt32>(kAudioFormatMPEG4AAC));
    size = 39;
    EXPECT_EQ(AudioConverterGetProperty(m_encoder, kAudioConverterCurrentInputStreamDescription, &size, &description),
              kAudioConverterErr_BadPropertySizeError);
    size = sizeof description;
    EXPECT_EQ(AudioConverterGetProperty(m_encoder, 0x61626364, &size, &description),
              kAudioConverterErr_PropertyNotSupported);

    UInt32 bitRate = 1;
    EXPECT_EQ(AudioConverterSetProperty(m_encoder, kAudioConverterEncodeBitRate, sizeof bitRate, &bitRate),
              kAudioConverterErr_PropertyNotSupported);
    bitRate = 192000;
    ASSERT_EQ(AudioConverterSetProperty(m_encoder, kAudioConverterEncodeBitRate, sizeof bitRate, &bitRate), noErr);
    bitRate = 0;
    size = sizeof bitRate;
    ASSERT_EQ(AudioConverterGetProperty(m_encoder, kAudioConverterEncodeBitRate, &size, &bitRate), noErr);
    EXPECT_EQ(bitRate, 192000U);
    EXPECT_EQ(AudioConverterSetProperty(m_decoder, kAudioConverterEncodeBitRate, sizeof bitRate, &bitRate),
              kAudioConverterErr_PropertyNotSupported);

    // Once packets exist, the rate they were made with stays.
    const Pcm tone = Tone(1024, kChannels);
    BlockSource source{tone.data(), 1024};
    Packet packet;
    ASSERT_EQ(FillOne(source, &packet), noErr);
    EXPECT_EQ(AudioConverterSetProperty(m_encoder, kAudioConverterEncodeBitRate, sizeof bitRate, &bitRate),
              kAudioConverterErr_OperationNotSupported);
}

TEST_F(ConverterLayerTest, DecoderTakesItsConfigurationFromACookie)
{
    const moviekit::Bytes config = moviekit::MakeAudioSpecificConfig(48000, 2);
    const moviekit::Bytes esds = moviekit::MakeEsdsPayload(moviekit::EsdsSpec{}, config, 0, 0);
    Packet cookie(64, 0);
    UInt32 size = static_cast<UInt32>(cookie.size());
    ASSERT_EQ(AudioConverterGetProperty(m_decoder, kAudioConverterDecompressionMagicCookie, &size, cookie.data()),
              noErr);
    EXPECT_EQ(Packet(cookie.begin(), cookie.begin() + size), config) << "built from the description";

    // The "esds" payload, the ES descriptor inside it, and a bare configuration all do.
    for (const Packet& offered : {esds, Packet(esds.begin() + 4, esds.end()), config}) {
        EXPECT_EQ(AudioConverterSetProperty(m_decoder, kAudioConverterDecompressionMagicCookie,
                                            static_cast<UInt32>(offered.size()), offered.data()),
                  noErr);
    }
    const moviekit::Bytes mono = moviekit::MakeAudioSpecificConfig(48000, 1);
    const Packet objectTypeZero = {0x00, 0x10};
    for (const Packet& offered : {mono, objectTypeZero, Packet(esds.begin(), esds.begin() + 12)}) {
        EXPECT_EQ(AudioConverterSetProperty(m_decoder, kAudioConverterDecompressionMagicCookie,
                                            static_cast<UInt32>(offered.size()), offered.data()),
                  kAudioConverterErr_FormatNotSupported);
    }
}

struct PacketSource {
    Packet bytes;
    UInt32 count = 1;
};

OSStatus OfferPackets(AudioConverterRef, UInt32* packets, AudioBufferList* data,
                      AudioStreamPacketDescription** described, void* userData)
{
    auto* source = static_cast<PacketSource*>(userData);
    *packets = source->count;
    *described = nullptr;
    data->mBuffers[0].mData = source->bytes.data();
    data->mBuffers[0].mDataByteSize = static_cast<UInt32>(source->bytes.size());
    return noErr;
}

TEST_F(ConverterLayerTest, DecoderRefusesEmptyAndUndescribedPacketsAndEndsOnNone)
{
    std::array<int16_t, 2048> pcm{};
    const auto fill = [&](PacketSource source, UInt32* frames) {
        AudioBufferList output{};
        output.mNumberBuffers = 1;
        output.mBuffers[0] = AudioBuffer{2, sizeof pcm, pcm.data()};
        *frames = 1024;
        return AudioConverterFillComplexBuffer(m_decoder, OfferPackets, &source, frames, &output, nullptr);
    };
    UInt32 frames = 0;
    EXPECT_EQ(fill(PacketSource{Packet(), 1}, &frames), kAudioConverterErr_InvalidInputSize);
    EXPECT_EQ(frames, 0U);
    const Packet silent = SilentPackets(1)[0];
    Packet two = silent;
    two.insert(two.end(), silent.begin(), silent.end());
    EXPECT_EQ(fill(PacketSource{two, 2}, &frames), kAudioConverterErr_RequiresPacketDescriptionsError);
    ASSERT_EQ(fill(PacketSource{silent, 1}, &frames), noErr);
    EXPECT_EQ(frames, 1024U) << "one packet in, 1024 frames out";
    ASSERT_EQ(fill(PacketSource{silent, 0}, &frames), noErr);
    EXPECT_EQ(frames, 0U) << "no packets: the end of the stream";
}

TEST(ConverterRateTest, WholeKilohertzLabelsStandForAacRates)
{
    for (const auto& [label, rate] : std::vector<std::pair<double, uint32_t>>{
             {44000, 44100}, {22000, 22050}, {11000, 11025}, {88000, 88200}, {48000, 48000}}) {
        AACDecoder decoder;
        ASSERT_EQ(decoder.Initialize(AacFormat(label), PcmFormat(label)), eConverterSuccess) << label;
        Packet cookie(16, 0);
        unsigned int size = static_cast<unsigned int>(cookie.size());
        ASSERT_EQ(decoder.GetACProperty(kAudioConverterDecompressionMagicCookie, &size, cookie.data()),
                  eConverterSuccess);
        EXPECT_EQ(Packet(cookie.begin(), cookie.begin() + size), moviekit::MakeAudioSpecificConfig(rate, 2)) << label;
        ACFormat reported;
        decoder.GetOutputFormat(reported);
        EXPECT_EQ(reported.sampleRate, label) << "the label is the caller's";

        AACEncoder encoder;
        EXPECT_EQ(encoder.Initialize(PcmFormat(label), AacFormat(rate)), eConverterSuccess) << label;
    }
}

TEST(ConverterArgumentTest, NullArgumentsAreParameterErrors)
{
    const AudioStreamBasicDescription pcm = Description(PcmFormat());
    AudioConverterRef converter = nullptr;
    EXPECT_EQ(AudioConverterNew(nullptr, &pcm, &converter), kAudio_ParamError);
    EXPECT_EQ(AudioConverterNew(&pcm, &pcm, &converter), kAudioConverterErr_FormatNotSupported);
    EXPECT_EQ(converter, nullptr);
    EXPECT_EQ(AudioConverterDispose(nullptr), kAudio_ParamError);
    UInt32 packets = 1;
    AudioBufferList output{};
    EXPECT_EQ(AudioConverterFillComplexBuffer(nullptr, OfferBlock, nullptr, &packets, &output, nullptr),
              kAudio_ParamError);
}

// ---------------------------------------------------------------------------------------
// AAC decoder

class AacDecoderTest : public testing::Test {
protected:
    void SetUp() override { ASSERT_NO_FATAL_FAILURE(OpenDecoder(m_decoder)); }

    eConverterErrorCode Decode(const Packet& packet)
    {
        return m_decoder.Decode(m_pcm.data(), &m_pcmSize, &m_usedSize, packet.data(),
                                static_cast<unsigned int>(packet.size()));
    }

    AACDecoder m_decoder;
    std::array<int16_t, 2048> m_pcm{};
    unsigned int m_pcmSize = 0;
    unsigned int m_usedSize = 0;
    Packets m_silent = SilentPackets(6);
};

TEST_F(AacDecoderTest, FirstPacketIsDroppedAndWholePacketsCountAsUsed)
{
    ASSERT_EQ(Decode(m_silent[0]), eConverterSuccess);
    EXPECT_EQ(m_pcmSize, 0U);
    EXPECT_EQ(m_usedSize, m_silent[0].size());
    m_pcm.fill(1);
    ASSERT_EQ(Decode(m_silent[1]), eConverterSuccess);
    EXPECT_EQ(m_pcmSize, 4096U);
    EXPECT_EQ(m_usedSize, m_silent[1].size());
    EXPECT_TRUE(std::all_of(m_pcm.begin(), m_pcm.end(), [](int16_t s) { return s == 0; }));
}

TEST_F(AacDecoderTest, DelayCountsPacketsWithValidArguments)
{
    for (unsigned int delay : {0U, 3U}) {
        ASSERT_NO_FATAL_FAILURE(OpenDecoder(m_decoder));
        m_decoder.SetDecoderDelay(delay);
        // Invalid arguments do not count.
        EXPECT_EQ(Decode(Packet()), eConverterInternal);
        EXPECT_EQ(m_decoder.Decode(nullptr, &m_pcmSize, &m_usedSize, m_silent[0].data(), 10), eConverterInternal);
        for (unsigned int i = 0; i < 5; ++i) {
            ASSERT_EQ(Decode(m_silent[i]), eConverterSuccess);
            EXPECT_EQ(m_pcmSize, i < delay ? 0U : 4096U) << "delay " << delay << ", packet " << i;
        }
    }
}

TEST_F(AacDecoderTest, DroppedPcmIsExactlyTheFirstPacketsOutput)
{
    const Packets packets = EncodeBlocks(Tone(8 * 1024, kChannels));
    const Pcm whole = DecodeAll(packets, 0);
    const Pcm delayed = DecodeAll(packets, 1);
    ASSERT_EQ(whole.size(), 8 * 1024 * kChannels);
    ASSERT_EQ(delayed.size(), 7 * 1024 * kChannels);
    EXPECT_TRUE(std::equal(delayed.begin(), delayed.end(), whole.begin() + 1024 * kChannels));
}

TEST_F(AacDecoderTest, BadPacketsGiveStatusesAndCountTowardTheDelay)
{
    const Packet oversized(2000, 0x5A);
    EXPECT_EQ(Decode(oversized), eConverterRefused);
    EXPECT_EQ(m_pcmSize, 0U);
    EXPECT_EQ(m_usedSize, 0U);
    ASSERT_EQ(Decode(m_silent[0]), eConverterSuccess);
    EXPECT_EQ(m_pcmSize, 4096U) << "the refused packet used up the delay";

    std::mt19937 random(5);
    int failures = 0;
    for (int i = 0; i < 40; ++i) {
        Packet garbage(1 + random() % 700);
        std::generate(garbage.begin(), garbage.end(), [&] { return static_cast<uint8_t>(random()); });
        const eConverterErrorCode result = Decode(garbage);
        if (result == eConverterSuccess) {
            EXPECT_EQ(m_usedSize, garbage.size());
        } else {
            ++failures;
            EXPECT_TRUE(result == eConverterRefused || result == eConverterFailed) << result;
            EXPECT_EQ(m_pcmSize, 0U);
            EXPECT_EQ(m_usedSize, 0U);
        }
    }
    EXPECT_GT(failures, 0);
    ASSERT_EQ(Decode(m_silent[1]), eConverterSuccess);
    EXPECT_EQ(m_pcmSize, 4096U) << "the decoder recovers";
}

TEST_F(AacDecoderTest, StereoPacketsIntoAMonoDecoderFail)
{
    AACDecoder mono;
    ASSERT_NO_FATAL_FAILURE(OpenDecoder(mono, 1));
    for (const Packet& packet : m_silent) {
        const eConverterErrorCode result =
            mono.Decode(m_pcm.data(), &m_pcmSize, &m_usedSize, packet.data(), static_cast<unsigned int>(packet.size()));
        EXPECT_NE(result, eConverterSuccess);
        EXPECT_EQ(m_pcmSize, 0U);
    }
}

TEST_F(AacDecoderTest, DecodeWithoutConverterIsAnInternalError)
{
    AACDecoder unopened;
    EXPECT_EQ(unopened.Decode(m_pcm.data(), &m_pcmSize, &m_usedSize, m_silent[0].data(),
                              static_cast<unsigned int>(m_silent[0].size())),
              eConverterInternal);
    m_decoder.Close();
    EXPECT_EQ(Decode(m_silent[0]), eConverterInternal);
}

TEST_F(AacDecoderTest, MovieRecordingPlatformPrimingSetsADelayOfOnePacket)
{
    testsupport::TempDir dir;
    const Packets packets = SilentPackets(40);
    const std::string platform = WriteAacMovie(dir, packets, 2112);
    const std::string camera = WriteAacMovie(dir, packets, 1024);

    m_decoder.SetDecoderDelay(5U);
    ASSERT_EQ(m_decoder.SetDecoderDelay(platform.c_str()), eConverterSuccess);
    ASSERT_EQ(Decode(m_silent[0]), eConverterSuccess);
    ASSERT_EQ(Decode(m_silent[1]), eConverterSuccess);
    EXPECT_EQ(m_pcmSize, 4096U) << "delay 1";

    ASSERT_NO_FATAL_FAILURE(OpenDecoder(m_decoder));
    m_decoder.SetDecoderDelay(5U);
    ASSERT_EQ(m_decoder.SetDecoderDelay(camera.c_str()), eConverterSuccess);
    for (int i = 0; i < 5; ++i) {
        ASSERT_EQ(Decode(m_silent[i]), eConverterSuccess);
        EXPECT_EQ(m_pcmSize, 0U) << "delay 5 kept, packet " << i;
    }

    EXPECT_EQ(m_decoder.SetDecoderDelay(nullptr), eConverterInternal);
    EXPECT_EQ(m_decoder.SetDecoderDelay(""), eTqovixErrorSourceNotFound);
    EXPECT_EQ(m_decoder.SetDecoderDelay(dir.File("missing.mov").c_str()), eTqovixErrorSourceAccessDenied);
    EXPECT_EQ(m_decoder.SetDecoderDelay(dir.Path().c_str()), eTqovixErrorSourceAccessDenied);
    ASSERT_TRUE(testsupport::WriteFile(dir.File("garbage.mov"), Packet(100, 0xEE)));
    EXPECT_EQ(m_decoder.SetDecoderDelay(dir.File("garbage.mov").c_str()), eTqovixErrorSourceAccessDenied);
}

CFURLRef UrlOf(const std::string& path)
{
    return CFURLCreateFromFileSystemRepresentation(kCFAllocatorDefault, reinterpret_cast<const UInt8*>(path.c_str()),
                                                   static_cast<CFIndex>(path.size()), false);
}

TEST(AudioFileTest, PacketTableComesFromTheSoundTracksEditList)
{
    testsupport::TempDir dir;
    const std::string path = WriteAacMovie(dir, SilentPackets(40), 2112);
    // A relative path is resolved when the URL is made.
    const std::filesystem::path previous = std::filesystem::current_path();
    std::filesystem::current_path(dir.Path());
    CFURLRef url = UrlOf(std::filesystem::path(path).filename().string());
    std::filesystem::current_path(previous);
    ASSERT_NE(url, nullptr);

    AudioFileID file = nullptr;
    EXPECT_EQ(AudioFileOpenURL(url, kAudioFileReadWritePermission, 0, &file), kAudioFileOperationNotSupportedError);
    ASSERT_EQ(AudioFileOpenURL(url, kAudioFileReadPermission, 0, &file), noErr);
    CFRelease(url);
    AudioFilePacketTableInfo table{};
    UInt32 size = sizeof table - 1;
    EXPECT_EQ(AudioFileGetProperty(file, kAudioFilePropertyPacketTableInfo, &size, &table),
              kAudioFileBadPropertySizeError);
    size = sizeof table;
    ASSERT_EQ(AudioFileGetProperty(file, kAudioFilePropertyPacketTableInfo, &size, &table), noErr);
    EXPECT_EQ(table.mPrimingFrames, 2112);
    EXPECT_EQ(table.mNumberValidFrames + table.mPrimingFrames + table.mRemainderFrames, 40 * 1024);
    EXPECT_EQ(AudioFileClose(file), noErr);

    moviekit::MovieSpec videoOnly;
    videoOnly.sound.present = false;
    std::string error;
    ASSERT_TRUE(moviekit::WriteMovie(dir.File("video.mov"), videoOnly, nullptr, &error)) << error;
    url = UrlOf(dir.File("video.mov"));
    EXPECT_EQ(AudioFileOpenURL(url, kAudioFileReadPermission, 0, &file), kAudioFileUnsupportedDataFormatError);
    CFRelease(url);
    EXPECT_EQ(UrlOf(""), nullptr);
}

// Every atom of `type` in `bytes` gets `value` written `offset` bytes from its type field.
void PatchAtoms(moviekit::Bytes& bytes, const char* type, ptrdiff_t offset, uint32_t value)
{
    for (size_t at = 4; at + 4 <= bytes.size(); ++at) {
        const ptrdiff_t field = static_cast<ptrdiff_t>(at) + offset;
        if (std::memcmp(bytes.data() + at, type, 4) == 0 && field >= 0 &&
            static_cast<size_t>(field) + 4 <= bytes.size()) {
            for (int i = 0; i < 4; ++i) {
                bytes[static_cast<size_t>(field) + i] = static_cast<uint8_t>(value >> (24 - 8 * i));
            }
        }
    }
}

TEST(AudioFileTest, MalformedMoviesAreRefused)
{
    moviekit::MovieSpec recipe;
    recipe.sound.codec = moviekit::SoundCodec::Aac;
    moviekit::MovieLayout layout;
    const moviekit::Bytes movie = moviekit::BuildMovie(recipe, &layout);
    ASSERT_FALSE(movie.empty());
    struct Case {
        const char* name;
        std::function<void(moviekit::Bytes&)> change;
    };
    const std::vector<Case> cases = {
        {"MovieAtomCutShort", [&](moviekit::Bytes& b) { b.resize(layout.moovOffset + layout.moovSize / 2); }},
        {"EditCountBeyondItsAtom", [](moviekit::Bytes& b) { PatchAtoms(b, "elst", 8, 0xFFFFFFFF); }},
        {"TimeToSampleCountBeyondItsAtom", [](moviekit::Bytes& b) { PatchAtoms(b, "stts", 8, 0x10000000); }},
        {"MediaTimeScaleZero", [](moviekit::Bytes& b) { PatchAtoms(b, "mdhd", 16, 0); }},
        {"AtomSizeBelowItsHeader", [](moviekit::Bytes& b) { PatchAtoms(b, "trak", -4, 3); }},
    };
    testsupport::TempDir dir;
    for (const Case& c : cases) {
        moviekit::Bytes bytes = movie;
        c.change(bytes);
        const std::string path = dir.File(std::string(c.name) + ".mov");
        ASSERT_TRUE(testsupport::WriteFile(path, bytes));
        CFURLRef url = UrlOf(path);
        AudioFileID file = nullptr;
        EXPECT_EQ(AudioFileOpenURL(url, kAudioFileReadPermission, 0, &file), kAudioFileInvalidFileError) << c.name;
        EXPECT_EQ(file, nullptr);
        CFRelease(url);
    }
}

// ---------------------------------------------------------------------------------------
// AAC encoder: blocks, the dropped first block, the flush

class AacEncoderTest : public testing::Test {
protected:
    void SetUp() override { ASSERT_NO_FATAL_FAILURE(OpenEncoder(m_encoder, m_sink)); }

    eConverterErrorCode Push(size_t bytes)
    {
        if (m_pcm.size() * sizeof(int16_t) < m_pushed + bytes) {
            m_pcm = Tone((m_pushed + bytes) / 4 + 1, kChannels);
        }
        auto* at = reinterpret_cast<unsigned char*>(m_pcm.data()) + m_pushed;
        m_pushed += bytes;
        return m_encoder.Encode(at, static_cast<unsigned int>(bytes));
    }

    PacketSink m_sink;
    AACEncoder m_encoder;
    Pcm m_pcm;
    size_t m_pushed = 0;
};

TEST_F(AacEncoderTest, PushesOfOneBlockGiveOnePacketAfterTheDroppedFirst)
{
    ASSERT_EQ(Push(4096), eConverterSuccess);
    EXPECT_EQ(m_sink.packets.size(), 0U);
    for (size_t i = 1; i <= 5; ++i) {
        ASSERT_EQ(Push(4096), eConverterSuccess);
        EXPECT_EQ(m_sink.packets.size(), i);
    }
    ASSERT_EQ(m_encoder.EncodeDone(), eConverterSuccess);
    EXPECT_EQ(m_sink.packets.size(), 6U) << "nothing was held: one block of silence";
    // Every packet went into the lent buffer, asked for with the largest packet size.
    EXPECT_TRUE(std::all_of(m_sink.writtenAt.begin(), m_sink.writtenAt.end(),
                            [&](const unsigned char* p) { return p == m_sink.LentBuffer(); }));
    EXPECT_TRUE(std::all_of(m_sink.requested.begin(), m_sink.requested.end(),
                            [](unsigned int size) { return size == 1536; }));
}

TEST_F(AacEncoderTest, RemaindersWaitForTheNextPushAndTheFlush)
{
    ASSERT_EQ(Push(10000), eConverterSuccess);
    EXPECT_EQ(m_sink.packets.size(), 1U);  // 4352 dropped, 4096 encoded, 1552 held
    ASSERT_EQ(Push(2544), eConverterSuccess);
    EXPECT_EQ(m_sink.packets.size(), 2U);  // 1552 + 2544: one block, nothing held
    ASSERT_EQ(Push(100), eConverterSuccess);
    EXPECT_EQ(m_sink.packets.size(), 2U);
    ASSERT_EQ(m_encoder.EncodeDone(), eConverterSuccess);
    EXPECT_EQ(m_sink.packets.size(), 4U) << "100 held bytes and silence, then 100 bytes of silence";
    ASSERT_EQ(m_encoder.EncodeDone(), eConverterSuccess);
    EXPECT_EQ(m_sink.packets.size(), 5U) << "a second flush holds nothing";
}

TEST_F(AacEncoderTest, ShortFirstPushIsDroppedWhole)
{
    ASSERT_EQ(Push(4200), eConverterSuccess);
    ASSERT_EQ(Push(4096), eConverterSuccess);
    EXPECT_EQ(m_sink.packets.size(), 1U) << "only one block is ever dropped";
    ASSERT_EQ(m_encoder.EncodeDone(), eConverterSuccess);
    EXPECT_EQ(m_sink.packets.size(), 2U) << "nothing was held";
}

TEST_F(AacEncoderTest, PacketsDoNotDependOnHowThePcmWasPushed)
{
    // Blocks cut from pushes of any size are the blocks of the PCM after its first 4352
    // bytes, and the flush adds the remainder padded with silence, then silence.
    const Pcm tone = Tone(20 * 1024 + 300, kChannels, 500);
    const Packets pushed = EncodeStream(tone, {3000, 777, 5000, 4096, 1});

    Pcm blocks(tone.begin() + kDropBytes / 2, tone.end());
    const size_t held = blocks.size() % (kPacketFrames * kChannels);
    blocks.resize(blocks.size() - held + 2 * kPacketFrames * kChannels, 0);
    Packets expected = EncodeBlocks(blocks);
    expected.pop_back();  // the flush's last block holds only the remainder's length
    ASSERT_EQ(pushed.size(), expected.size() + 1);
    EXPECT_TRUE(std::equal(expected.begin(), expected.end(), pushed.begin()));
}

TEST_F(AacEncoderTest, ResultProcedureFailureStopsThePush)
{
    m_sink.refuseAt = 1;
    ASSERT_EQ(Push(4352), eConverterSuccess);
    EXPECT_EQ(Push(4 * 4096 + 10), static_cast<eConverterErrorCode>(eTqovixErrorAborted));
    EXPECT_EQ(m_sink.packets.size(), 2U);
    m_sink.refuseAt = SIZE_MAX;
    ASSERT_EQ(m_encoder.EncodeDone(), eConverterSuccess);
    EXPECT_EQ(m_sink.packets.size(), 3U) << "the rest of the stopped push was not kept";
}

TEST_F(AacEncoderTest, WithoutALentBufferTheEncoderUsesItsOwn)
{
    PacketSink sink(false);
    AACEncoder encoder;
    ASSERT_NO_FATAL_FAILURE(OpenEncoder(encoder, sink));
    const Pcm tone = Tone(4 * 1024, kChannels);
    ASSERT_EQ(encoder.Encode(const_cast<int16_t*>(tone.data()), static_cast<unsigned int>(tone.size() * 2)),
              eConverterSuccess);
    ASSERT_EQ(sink.packets.size(), 2U);
    EXPECT_NE(sink.writtenAt[0], sink.LentBuffer());
    EXPECT_FALSE(sink.packets[0].empty());
}

TEST_F(AacEncoderTest, BitRateZeroKeepsTheConvertersOwn)
{
    AACEncoder plain;
    ASSERT_NO_FATAL_FAILURE(OpenEncoder(plain, m_sink, 0));
    UInt32 own = 0;
    UInt32 camera = 0;
    unsigned int size = sizeof own;
    ASSERT_EQ(plain.GetACProperty(kAudioConverterEncodeBitRate, &size, &own), eConverterSuccess);
    ASSERT_EQ(m_encoder.GetACProperty(kAudioConverterEncodeBitRate, &size, &camera), eConverterSuccess);
    EXPECT_EQ(camera, kCameraBitRate);
    EXPECT_NE(own, kCameraBitRate);
    EXPECT_GT(own, 0U);

    AACEncoder refused;
    EXPECT_EQ(refused.Initialize(PcmFormat(), AacFormat(), 1, m_sink.Stream()), eConverterRefused);
    EXPECT_EQ(refused.GetACProperty(kAudioConverterEncodeBitRate, &size, &own), eConverterInternal)
        << "a refused bit rate closes the converter";
}

TEST_F(AacEncoderTest, EncoderWithoutStreamOrConverterAnswersWithStatuses)
{
    AACEncoder unopened;
    unsigned char pcm[16] = {};
    EXPECT_EQ(unopened.Encode(pcm, sizeof pcm), eConverterInternal);
    EXPECT_EQ(unopened.EncodeDone(), eConverterInternal);
    unsigned int aacSize = 0;
    unsigned int used = 0;
    unsigned char aac[kBlockBytes];
    EXPECT_EQ(unopened.Encode(aac, &aacSize, &used, pcm, 0), eConverterInternal);

    AACEncoder wrongChannels;
    EXPECT_EQ(wrongChannels.Initialize(PcmFormat(kRate, 2), AacFormat(kRate, 1), 0, m_sink.Stream()),
              eConverterRefused);
    EXPECT_EQ(wrongChannels.Encode(pcm, sizeof pcm), eConverterInternal) << "the stream was not kept";

    // Fed after its converter was disposed of.
    ASSERT_EQ(Push(kDropBytes), eConverterSuccess);
    m_encoder.Close();
    EXPECT_EQ(Push(4096), eConverterInternal);
    EXPECT_EQ(m_encoder.EncodeDone(), eConverterInternal);
    EXPECT_TRUE(m_sink.packets.empty());
}

// ---------------------------------------------------------------------------------------
// Quality and timing of whole streams

TEST(AacRoundTripTest, ToneComesBackCleanWithOnePacketPerBlock)
{
    // A short burst, far enough from the steady tone that only its own image can match
    // it, fixes the delay; a tone alone would match at every period.
    Pcm tone(94 * 1024 * kChannels, 0);
    AddTone(tone, kChannels, 4096, 6144);
    AddTone(tone, kChannels, 16384, 94 * 1024);
    const Packets packets = EncodeBlocks(tone);
    ASSERT_EQ(packets.size(), 94U);
    EXPECT_TRUE(std::none_of(packets.begin(), packets.end(), [](const Packet& p) { return p.empty(); }))
        << "one packet per block from the very first";

    const Pcm decoded = DecodeAll(packets, 0);
    ASSERT_EQ(decoded.size(), tone.size());
    const long delay = BestLag(tone, decoded, 3072, 4096, 4096);
    ASSERT_GE(delay, 0);
    EXPECT_GT(SnrDb(tone, decoded, delay, 20000, 65536), 30.0) << "delay " << delay;
}

TEST(AacRoundTripTest, LayerPrimesTwoThousandOneHundredTwelveFrames)
{
    const size_t at = 3000;
    const Pcm click = Click(12 * 1024, at);
    const Pcm decoded = DecodeAll(EncodeBlocks(click), 0);
    EXPECT_EQ(BestLag(click, decoded, at - 256, 512, 4096), kPlatformPriming);
}

TEST(AacRoundTripTest, ClickKeepsItsPositionThroughDecodeEncodeDecode)
{
    // The source stream, as the platform encoder would have made it.
    const size_t at = 6000;
    const Packets source = EncodeBlocks(Click(24 * 1024, at));
    const Pcm sourceDecoded = DecodeAll(source, 0);

    // The pipeline: the decoder drops one packet, the processed PCM is pushed in pieces of
    // any size, the encoder drops 4352 bytes and flushes at the end.
    const Pcm processed = DecodeAll(source, 1);
    const Packets result = EncodeStream(processed, {3000, 4096, 1234, 8192});
    const Pcm resultDecoded = DecodeAll(result, 0);

    const size_t clickThere = at + kPlatformPriming;
    ASSERT_EQ(BestLag(Click(24 * 1024, at), sourceDecoded, at - 256, 512, 4096), kPlatformPriming);
    EXPECT_EQ(BestLag(sourceDecoded, resultDecoded, clickThere - 256, 512, 4096), 0);
}

TEST(AacRoundTripTest, FfmpegPlaysOurPacketsWithTheClickInPlace)
{
    ASSERT_TRUE(testsupport::HaveCommand("ffmpeg")) << "ffmpeg is required";
    const size_t at = 5000;
    const Pcm click = Click(30 * 1024, at);
    const Packets packets = EncodeBlocks(click);
    testsupport::TempDir dir;
    // The edit list skips the priming, as a camera movie written with this encoder would.
    const std::string movie = WriteAacMovie(dir, packets, kPlatformPriming);
    const std::string pcmPath = dir.File("decoded.pcm");
    ASSERT_EQ(testsupport::RunCommand("ffmpeg -v error -i " + testsupport::ShellQuote(movie) +
                                          " -map 0:a:0 -f s16le -acodec pcm_s16le " +
                                          testsupport::ShellQuote(pcmPath),
                                      nullptr),
              0);
    const Packet bytes = testsupport::ReadFile(pcmPath);
    Pcm played(bytes.size() / 2);
    std::memcpy(played.data(), bytes.data(), played.size() * 2);
    ASSERT_GT(played.size(), (at + 1024) * kChannels);
    EXPECT_EQ(BestLag(click, played, at - 256, 512, 4096), 0);
}

}  // namespace
