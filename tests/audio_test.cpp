#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <ostream>
#include <string>
#include <tuple>
#include <vector>

#include "Movie.h"
#include "audio/CTqovixAudioChunk.h"
#include "audio/CTqovixAudioDataControl.h"
#include "file/CTqovixFile.h"
#include "support/TestSupport.h"

using moviekit::Bytes;
using Table = std::vector<TqovixChunkInformation>;

namespace {

// Everything PopAudioData hands out until a call delivers nothing, each call's size, and the
// most storage held meanwhile.
struct Drained {
    eTqovixErrorCode result = eTqovixErrorInternal;
    Bytes data;
    std::vector<unsigned long> sizes;
    uint64_t peak = 0;
};

Drained Drain(CTqovixAudioDataControl& control, unsigned long request)
{
    Drained out;
    Bytes buffer(request);
    for (unsigned long size = 1; size != 0 && out.sizes.size() < 1000000;) {
        if (TqovixFailed(out.result = control.PopAudioData(buffer.data(), &size, request))) {
            break;
        }
        out.peak = std::max(out.peak, control.GetHeldByteCount());
        out.sizes.push_back(size);
        out.data.insert(out.data.end(), buffer.begin(), buffer.begin() + static_cast<std::ptrdiff_t>(size));
    }
    return out;
}

class AudioFileTest : public ::testing::Test {
protected:
    void Open(const Bytes& bytes)
    {
        m_file.Close();
        const std::string path = m_dir.File("source.mov");
        ASSERT_TRUE(testsupport::WriteFile(path, bytes));
        ASSERT_EQ(m_file.Open(path.c_str(), 1), eTqovixSuccess);
    }

    testsupport::TempDir m_dir;
    CTqovixFile m_file;
};

TEST_F(AudioFileTest, ChunkRefusesBadArgumentsAndAFileNotOpen)
{
    CTqovixAudioChunk chunk;
    ASSERT_EQ(chunk.Initialize(m_file, {0, 8, {}}), eTqovixSuccess);
    uint8_t small[8] = {};
    unsigned int got = 0;
    EXPECT_EQ(chunk.PushDecodedData(nullptr, 4), eTqovixErrorInternal);
    EXPECT_EQ(chunk.PushDecodedData(small, 0), eTqovixErrorInternal);
    EXPECT_EQ(chunk.PopInputData(small, &got, 4), eTqovixErrorInternal);
}

// Decodes a packet to 2048 bytes of its first byte, so that order is visible.
class FakeAacControl : public CTqovixAudioDataControl {
public:
    bool IsAACCodec() override { return aac; }
    eTqovixErrorCode DecodeAAC2PCM(void* pcm, unsigned int* pcmSize, unsigned int* usedSize, const void* packet,
                                   unsigned int packetSize) override
    {
        ++decodeCalls;
        std::memset(pcm, *static_cast<const uint8_t*>(packet), *pcmSize = 2048);
        *usedSize = packetSize;
        return eTqovixSuccess;
    }
    eTqovixErrorCode EncodePCM2AAC(void*, unsigned int pcmSize) override
    {
        if ((encoded += pcmSize) >= announceAfter) {
            SetOutputChunkIndex(chunkCount);
        }
        return eTqovixSuccess;
    }
    eTqovixErrorCode EncodeDone() override { return ++flushes, eTqovixSuccess; }

    bool aac = true;
    int decodeCalls = 0, flushes = 0;
    unsigned long encoded = 0, announceAfter = ~0UL, chunkCount = 0;
};

struct DrainRow {
    const char* name;
    Bytes file;
    Table table;
    bool aac;
    unsigned long request;
    eTqovixErrorCode result;
    Bytes delivered;
    unsigned sampleBytes = 2;
};
void PrintTo(const DrainRow& row, std::ostream* os) { *os << row.name; }

// Bytes that differ everywhere, and the same with each `width`-byte sample reversed.
Bytes Pattern(size_t size)
{
    Bytes bytes(size);
    for (size_t k = 0; k < size; ++k) {
        bytes[k] = static_cast<uint8_t>(k * 7 % 251);
    }
    return bytes;
}
Bytes Reversed(Bytes bytes, size_t width)
{
    for (size_t k = 0; k + width <= bytes.size(); k += width) {
        std::reverse(bytes.begin() + static_cast<std::ptrdiff_t>(k), bytes.begin() + static_cast<std::ptrdiff_t>(k + width));
    }
    return bytes;
}
// Just over the 1 MiB a read takes, which no 3-byte sample divides.
constexpr uint32_t kPastAPiece = 3 * 349530;

class AudioDrainTest : public AudioFileTest, public ::testing::WithParamInterface<DrainRow> {};

// Chunk tables that disagree with the file or with themselves fail rather than lose bytes silently.
TEST_P(AudioDrainTest, DeliversInTheTrackByteOrderOrFails)
{
    const DrainRow& row = GetParam();
    Open(row.file);
    FakeAacControl control;
    control.aac = row.aac;
    ASSERT_EQ(control.Initialize(m_file, row.table, true, row.sampleBytes), eTqovixSuccess);
    const Drained drained = Drain(control, row.request);
    EXPECT_EQ(drained.result, row.result);
    EXPECT_EQ(drained.data, row.delivered);
}

constexpr eTqovixErrorCode kFail = eTqovixErrorInternal;
INSTANTIATE_TEST_SUITE_P(
    Chunks, AudioDrainTest,
    ::testing::Values(
        // An empty chunk in the middle, an odd byte last.
        DrainRow{"BigEndian", {0x12, 0x34, 0x56, 0x78, 0xAB, 0xCD, 0xEF}, {{0, 4, {}}, {4, 0, {}}, {4, 3, {}}}, false,
                 64, eTqovixSuccess, {0x34, 0x12, 0x78, 0x56, 0xCD, 0xAB, 0xEF}},
        // Every width a sample may have, across the pieces the file is read in.
        DrainRow{"BigEndian24BitPastAPiece", Pattern(kPastAPiece), {{0, kPastAPiece - 6, {}}, {kPastAPiece - 6, 6, {}}},
                 false, 1 << 16, eTqovixSuccess, Reversed(Pattern(kPastAPiece), 3), 3},
        DrainRow{"BigEndian32Bit", Pattern(40), {{0, 16, {}}, {16, 24, {}}}, false, 12, eTqovixSuccess,
                 Reversed(Pattern(40), 4), 4},
        DrainRow{"BigEndian64Bit", Pattern(48), {{0, 48, {}}}, false, 20, eTqovixSuccess, Reversed(Pattern(48), 8), 8},
        DrainRow{"ChunkEndsPastTheFile", Bytes(100, 7), {{0, 60, {}}, {80, 40, {}}}, false, 20, kFail, Bytes(80, 7)},
        DrainRow{"AacPacketsShortOfTheChunk", Bytes(64, 9), {{0, 8, {3, 3}}}, true, 16, kFail, {}},
        DrainRow{"AacPacketsPastTheChunk", Bytes(64, 9), {{0, 8, {10, 10}}}, true, 16, kFail, {}}),
    [](const ::testing::TestParamInfo<DrainRow>& info) { return std::string(info.param.name); });

TEST_F(AudioFileTest, ControlsWithoutChunksOrForPcmTakeNoSound)
{
    Open(Bytes(8, 0));
    CTqovixAudioDataControl empty;
    unsigned long size = 0;
    uint8_t buffer[4];
    EXPECT_EQ(empty.Initialize(m_file, {}, true), eTqovixErrorInternal);
    EXPECT_EQ(empty.PopAudioData(buffer, &size, 4), eTqovixErrorInternal);
    EXPECT_EQ(empty.PushAudioData(buffer, 4), eTqovixErrorInternal);
    // PCM goes from the writer straight to the file: a PCM control takes no processed sound.
    CTqovixAudioDataControl pcm;
    ASSERT_EQ(pcm.Initialize(m_file, {{0, 8, {}}}, true), eTqovixSuccess);
    EXPECT_EQ(pcm.PushAudioData(buffer, 4), eTqovixErrorInternal);
}

// A chunk is decoded only when a request reaches it; past the track comes silence.
TEST_F(AudioFileTest, AacPacketsDecodeInOrderAndSilenceFollowsTheTrack)
{
    // Two chunks of packets 3+5 and 4 bytes; each packet's first byte names it.
    Open(Bytes{1, 0, 0, 2, 0, 0, 0, 0, 3, 0, 0, 0});
    FakeAacControl control;
    ASSERT_EQ(control.Initialize(m_file, {{0, 8, {3, 5}}, {8, 4, {4}}}, true), eTqovixSuccess);
    // packets decoded by then; the first byte, where the next packet starts, its byte (0: silence)
    const std::tuple<int, uint8_t, size_t, uint8_t> pops[] = {{2, 1, 2048, 2}, {3, 2, 1096, 3}, {3, 3, 144, 0}};
    for (const auto& [decoded, first, at, next] : pops) {
        Bytes buffer(3000, 0xFF);
        unsigned long size = 0;
        EXPECT_EQ(control.PopAudioData(buffer.data(), &size, 3000), eTqovixSuccess);
        EXPECT_EQ(std::tuple(size, control.decodeCalls, buffer[0], buffer[at - 1], buffer[at], buffer.back()),
                  std::tuple(3000UL, decoded, first, first, next, next)) << at;
    }
}

TEST_F(AudioFileTest, PushesEncodeAndFlushOnlyAfterTheWriterAnnouncesTheEnd)
{
    Open(Bytes(16, 1));
    const Table table = {{0, 8, {}}, {8, 8, {}}};
    FakeAacControl control;
    control.chunkCount = table.size();
    control.announceAfter = 3000;
    ASSERT_EQ(control.Initialize(m_file, table, false), eTqovixSuccess);
    Bytes pcm(1024, 5);
    for (int flushes : {0, 0, 1, 2}) {
        EXPECT_EQ(control.PushAudioData(pcm.data(), pcm.size()), eTqovixSuccess);
        EXPECT_EQ(control.flushes, flushes);
    }
    EXPECT_EQ(control.encoded, 4096u);
}

// Every request but the last is filled whole across chunk boundaries, and memory does not grow
// with the track.
TEST_F(AudioFileTest, ServingTwoThousandChunksHoldsOnlyAFewChunksOfMemory)
{
    constexpr uint32_t kChunks = 2000, kChunkSize = 4000;
    Bytes track(size_t{kChunks} * kChunkSize);  // different in every chunk
    for (size_t i = 0; i < track.size(); ++i) {
        track[i] = static_cast<uint8_t>(i * 31 + i / 4000);
    }
    Open(track);
    Table table(kChunks);
    for (uint32_t i = 0; i < kChunks; ++i) {
        table[i] = {uint64_t{i} * kChunkSize, kChunkSize, {}};
    }
    CTqovixAudioDataControl control;
    ASSERT_EQ(control.Initialize(m_file, table, false), eTqovixSuccess);
    const Drained drained = Drain(control, 4096);
    ASSERT_EQ(drained.result, eTqovixSuccess);
    EXPECT_EQ(drained.data, track);
    std::vector<unsigned long> sizes(track.size() / 4096, 4096);
    sizes.insert(sizes.end(), {track.size() % 4096, 0});
    EXPECT_EQ(drained.sizes, sizes);
    EXPECT_LE(drained.peak, 4u * kChunkSize);
}


struct LargeChunkRow {
    const char* name;
    bool aac;
};
void PrintTo(const LargeChunkRow& row, std::ostream* os) { *os << row.name; }

class AudioLargeChunkTest : public AudioFileTest, public ::testing::WithParamInterface<LargeChunkRow> {};

// A chunk's size is the file's to choose: one chunk of 8 MiB is read a piece at a time, and what
// is held stays near one piece whatever the chunk.
TEST_P(AudioLargeChunkTest, OneLargeChunkIsReadInPieces)
{
    constexpr uint32_t kPacket = 1024;
    constexpr uint32_t kChunkSize = 8 << 20;
    Bytes track(kChunkSize);
    for (size_t i = 0; i < track.size(); ++i) {
        track[i] = static_cast<uint8_t>(i / kPacket * 7 + i % 5);
    }
    Open(track);
    TqovixChunkInformation chunk{0, kChunkSize, {}};
    if (GetParam().aac) {
        chunk.sampleSizes.assign(kChunkSize / kPacket, kPacket);
    }
    FakeAacControl control;
    control.aac = GetParam().aac;
    ASSERT_EQ(control.Initialize(m_file, {chunk}, true), eTqovixSuccess);
    Bytes expected;
    if (GetParam().aac) {
        for (size_t at = 0; at < track.size(); at += kPacket) {
            expected.insert(expected.end(), 2048, track[at]);
        }
    } else {
        expected = track;
        for (size_t i = 0; i + 1 < expected.size(); i += 2) {
            std::swap(expected[i], expected[i + 1]);
        }
    }
    // AAC is padded with silence past the track: take what the track holds.
    Bytes delivered;
    uint64_t peak = 0;
    Bytes buffer(4096);
    for (unsigned long size = 1; size != 0 && delivered.size() < expected.size();) {
        ASSERT_EQ(control.PopAudioData(buffer.data(), &size, buffer.size()), eTqovixSuccess);
        peak = std::max(peak, control.GetHeldByteCount());
        delivered.insert(delivered.end(), buffer.begin(), buffer.begin() + static_cast<std::ptrdiff_t>(size));
    }
    EXPECT_EQ(delivered.size(), expected.size());
    EXPECT_TRUE(delivered == expected);
    EXPECT_LE(peak, uint64_t{2} << 20) << "a piece or two, not the chunk";
}

INSTANTIATE_TEST_SUITE_P(Codecs, AudioLargeChunkTest,
                         ::testing::Values(LargeChunkRow{"Pcm", false}, LargeChunkRow{"Aac", true}),
                         [](const ::testing::TestParamInfo<LargeChunkRow>& info) { return std::string(info.param.name); });

}  // namespace
