#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <tuple>
#include <vector>

#include "Movie.h"
#include "audio/CTqovixAudioChunk.h"
#include "audio/CTqovixAudioDataControl.h"
#include "file/CTqovixFile.h"
#include "support/ChunkTables.h"
#include "support/TestSupport.h"

using moviekit::Bytes;
using Table = std::vector<TqovixChunkInformation>;

namespace {

Bytes SwappedWords(Bytes bytes)
{
    for (size_t i = 0; i + 1 < bytes.size(); i += 2) {
        std::swap(bytes[i], bytes[i + 1]);
    }
    return bytes;
}

Bytes Counting(size_t size, size_t step)
{
    Bytes bytes(size);
    for (size_t i = 0; i < size; ++i) {
        bytes[i] = static_cast<uint8_t>(i * step + i / 4000);
    }
    return bytes;
}

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
        out.result = control.PopAudioData(buffer.data(), &size, request);
        if (TqovixFailed(out.result)) {
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

TEST_F(AudioFileTest, ChunkReadsWhatTheFileHoldsAndQueuesAreFifos)
{
    Open(Bytes{0, 1, 2, 3, 4, 5, 6, 7, 8, 9});
    CTqovixAudioChunk chunk;
    ASSERT_EQ(chunk.Initialize(m_file, {6, 8, {10, 20}}), eTqovixSuccess);  // 4 bytes lie past the file
    EXPECT_EQ(std::tuple(chunk.GetSampleSize(-1), chunk.GetSampleSize(1), chunk.GetSampleSize(2)),
              std::tuple(0u, 20u, 0u));
    uint8_t small[8] = {};
    unsigned int got = 0;
    ASSERT_EQ(chunk.PopInputData(small, &got, 8), eTqovixSuccess);
    EXPECT_EQ(Bytes(small, small + got), (Bytes{6, 7, 8, 9}));
    EXPECT_EQ(chunk.GetInputDataSize(), 4u);
    ASSERT_EQ(chunk.PopInputData(small, &got, 4), eTqovixSuccess);
    EXPECT_EQ(got, 0u);

    const Bytes data = Counting(3000, 13);
    ASSERT_EQ(chunk.PushDecodedData(data.data(), data.size()), eTqovixSuccess);
    Bytes out;
    for (unsigned long expected : {1024UL, 1024UL, 952UL, 0UL}) {
        uint8_t buffer[1024];
        unsigned long size = 99;
        ASSERT_EQ(chunk.PopDecodedData(buffer, &size, sizeof buffer), eTqovixSuccess);
        EXPECT_EQ(size, expected);
        out.insert(out.end(), buffer, buffer + size);
    }
    EXPECT_EQ(out, data);
    EXPECT_EQ(chunk.GetHeldByteCount(), 0u) << "a drained queue keeps no storage";

    ASSERT_EQ(chunk.PushProcessedData(data.data(), 7), eTqovixSuccess);
    unsigned long long processed = 0;
    ASSERT_EQ(chunk.PopProcessedData(small, &processed, 4), eTqovixSuccess);
    EXPECT_EQ(std::pair(processed, chunk.GetProcessedDataSize()), std::pair(4ULL, uint64_t{3}));
    ASSERT_EQ(chunk.PushOutputData(data.data(), 5), eTqovixSuccess);
    ASSERT_EQ(chunk.PushOutputData(data.data() + 5, 5), eTqovixSuccess);
    EXPECT_EQ(Bytes(chunk.GetOutputData(), chunk.GetOutputData() + chunk.GetOutputDataSize()),
              Bytes(data.begin(), data.begin() + 10));

    unsigned long size = 0;
    EXPECT_EQ(chunk.PushDecodedData(nullptr, 4), eTqovixErrorInternal);
    EXPECT_EQ(chunk.PushOutputData(data.data(), 0), eTqovixErrorInternal);
    EXPECT_EQ(chunk.PopDecodedData(small, &size, 0), eTqovixErrorInternal);
    EXPECT_EQ(chunk.PopDecodedData(nullptr, &size, 4), eTqovixErrorInternal);
    chunk.Close();
    EXPECT_EQ(chunk.PopInputData(small, &got, 4), eTqovixErrorInternal);
    CTqovixFile unopened;
    ASSERT_EQ(chunk.Initialize(unopened, {0, 8, {}}), eTqovixSuccess);
    EXPECT_EQ(chunk.PopInputData(small, &got, 4), eTqovixErrorInternal) << "the file is not open";
}

TEST_F(AudioFileTest, PcmRequestsOfAnySizeDeliverTheTrackInOrder)
{
    for (const moviekit::SoundCodec codec : {moviekit::SoundCodec::Twos, moviekit::SoundCodec::Sowt}) {
        moviekit::MovieRecipe recipe;
        recipe.video.frameCount = 45;
        recipe.sound.samplesPerChunk = 700;
        recipe.sound.codec = codec;
        moviekit::MovieLayout layout;
        Open(moviekit::BuildMovie(recipe, &layout));
        const bool bigEndian = codec == moviekit::SoundCodec::Twos;
        const Bytes expected = bigEndian ? SwappedWords(layout.soundBytes) : layout.soundBytes;
        for (const unsigned long request : {1UL, 4095UL, 4096UL, 2801UL, expected.size() + 9}) {
            CTqovixAudioDataControl control;
            const Table table = testsupport::ChunkTableOf(layout.soundChunks, true);
            ASSERT_EQ(control.Initialize(m_file, table, bigEndian), eTqovixSuccess);
            const Drained drained = Drain(control, request);
            EXPECT_EQ(drained.result, eTqovixSuccess) << request;
            EXPECT_EQ(drained.data, expected) << "request of " << request;
            control.Close();
            EXPECT_FALSE(control.IsInitialized());
        }
    }
}

// Decodes a packet to 2048 bytes of its first byte, so that order is visible.
class FakeAacControl : public CTqovixAudioDataControl {
public:
    bool IsAACCodec() override { return true; }
    eTqovixErrorCode DecodeAAC2PCM(void* pcm, unsigned int* pcmSize, unsigned int* usedSize, const void* packet,
                                   unsigned int packetSize) override
    {
        ++decodeCalls;
        std::memset(pcm, *static_cast<const uint8_t*>(packet), 2048);
        *pcmSize = 2048;
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

    int decodeCalls = 0;
    int flushes = 0;
    unsigned long encoded = 0;
    unsigned long announceAfter = ~0UL;
    unsigned long chunkCount = 0;
};

// Chunk tables that disagree with the file or with themselves fail rather than lose bytes silently.
TEST_F(AudioFileTest, SmallTablesByteOrderAndBadChunks)
{
    const Bytes words = {0x12, 0x34, 0x56, 0x78, 0xAB, 0xCD, 0xEF};
    const Bytes sevens(100, 7);
    const Bytes nines(64, 9);
    const Table oddWords = {{0, 4, {}}, {4, 0, {}}, {4, 3, {}}};  // an empty chunk in the middle, an odd byte last
    constexpr eTqovixErrorCode kFail = eTqovixErrorInternal;
    // name, file, table, big-endian, AAC, request, result, delivered
    const std::tuple<const char*, Bytes, Table, bool, bool, unsigned long, eTqovixErrorCode, Bytes> rows[] = {
        {"BigEndian", words, oddWords, true, false, 64, eTqovixSuccess, {0x34, 0x12, 0x78, 0x56, 0xCD, 0xAB, 0xEF}},
        {"LittleEndian", words, oddWords, false, false, 64, eTqovixSuccess, words},
        {"ChunkEndsPastTheFile", sevens, {{0, 60, {}}, {80, 40, {}}}, false, false, 20, kFail, Bytes(80, 7)},
        {"ChunkStartsPastTheFile", sevens, {{0, 60, {}}, {1000, 40, {}}}, false, false, 30, kFail, Bytes(60, 7)},
        {"AacWithoutPacketSizes", nines, {{0, 8, {}}}, false, true, 16, kFail, {}},
        {"AacPacketsShortOfTheChunk", nines, {{0, 8, {3, 3}}}, false, true, 16, kFail, {}},
        {"AacPacketsPastTheChunk", nines, {{0, 8, {10, 10}}}, false, true, 16, kFail, {}},
        {"AacEmptyPacket", nines, {{0, 8, {0, 8}}}, false, true, 16, kFail, {}},
    };
    for (const auto& [name, file, table, bigEndian, aac, request, result, delivered] : rows) {
        SCOPED_TRACE(name);
        Open(file);
        FakeAacControl fake;
        CTqovixAudioDataControl plain;
        CTqovixAudioDataControl& control = aac ? fake : plain;
        ASSERT_EQ(control.Initialize(m_file, table, bigEndian), eTqovixSuccess);
        const Drained drained = Drain(control, request);
        EXPECT_EQ(drained.result, result);
        EXPECT_EQ(drained.data, delivered);
    }

    CTqovixAudioDataControl empty;
    unsigned long size = 0;
    uint8_t buffer[4];
    EXPECT_EQ(empty.Initialize(m_file, {}, true), eTqovixErrorInternal);
    EXPECT_EQ(empty.PopAudioData(buffer, &size, 4), eTqovixErrorInternal);
    EXPECT_EQ(empty.PushAudioData(buffer, 4), eTqovixErrorInternal);
}

TEST_F(AudioFileTest, AacPacketsDecodeInOrderAndSilenceFollowsTheTrack)
{
    // Two chunks of packets 3+5 and 4 bytes; each packet's first byte names it.
    Open(Bytes{1, 0, 0, 2, 0, 0, 0, 0, 3, 0, 0, 0});
    FakeAacControl control;
    ASSERT_EQ(control.Initialize(m_file, {{0, 8, {3, 5}}, {8, 4, {4}}}, true), eTqovixSuccess);
    Bytes buffer(3000, 0xFF);
    const auto pop = [&] {
        unsigned long size = 0;
        EXPECT_EQ(control.PopAudioData(buffer.data(), &size, 3000), eTqovixSuccess);
        EXPECT_EQ(size, 3000u);
    };
    pop();
    EXPECT_EQ(control.decodeCalls, 2) << "one chunk decoded for the first request";
    EXPECT_EQ(std::tuple(buffer[0], buffer[2047], buffer[2048]), std::tuple(1, 1, 2));
    pop();
    EXPECT_EQ(std::tuple(buffer[0], buffer[1096], control.decodeCalls), std::tuple(2, 3, 3));
    pop();
    EXPECT_EQ(std::tuple(buffer[143], buffer[144]), std::tuple(3, 0)) << "past the track, silence";
    pop();
    EXPECT_TRUE(std::all_of(buffer.begin(), buffer.end(), [](uint8_t b) { return b == 0; }));
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

    // Without a codec, processed PCM goes to the output of the chunk being read.
    CTqovixAudioDataControl pcmControl;
    ASSERT_EQ(pcmControl.Initialize(m_file, table, false), eTqovixSuccess);
    uint8_t buffer[8];
    unsigned long size = 0;
    ASSERT_EQ(pcmControl.PopAudioData(buffer, &size, 8), eTqovixSuccess);
    ASSERT_EQ(pcmControl.PushAudioData(pcm.data(), 6), eTqovixSuccess);
    std::shared_ptr<CTqovixAudioChunk> finished;
    ASSERT_EQ(pcmControl.PopFinishedAudioChunk(finished), eTqovixSuccess);
    ASSERT_NE(finished, nullptr);
    EXPECT_EQ(finished->GetOutputDataSize(), 6u);
    pcmControl.SetOutputChunkIndex(2);
    EXPECT_EQ(pcmControl.PopFinishedAudioChunk(finished), eTqovixErrorInternal);
}

// Every request but the last is filled whole across chunk boundaries, and memory does not grow
// with the track.
TEST_F(AudioFileTest, ServingTwoThousandChunksHoldsOnlyAFewChunksOfMemory)
{
    constexpr uint32_t kChunks = 2000;
    constexpr uint32_t kChunkSize = 4000;
    const Bytes track = Counting(size_t{kChunks} * kChunkSize, 31);
    Open(track);
    Table table(kChunks);
    for (uint32_t i = 0; i < kChunks; ++i) {
        table[i] = {uint64_t{i} * kChunkSize, kChunkSize, {}};
    }
    CTqovixAudioDataControl control;
    ASSERT_EQ(control.Initialize(m_file, table, true), eTqovixSuccess);
    const Drained drained = Drain(control, 4096);
    ASSERT_EQ(drained.result, eTqovixSuccess);
    EXPECT_EQ(drained.data, SwappedWords(track));
    std::vector<unsigned long> sizes(track.size() / 4096, 4096);
    sizes.insert(sizes.end(), {track.size() % 4096, 0});
    EXPECT_EQ(drained.sizes, sizes);
    EXPECT_LE(drained.peak, 4u * kChunkSize);
}

}  // namespace
