#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <vector>

#include "Movie.h"
#include "audio/CTqovixAudioChunk.h"
#include "audio/CTqovixAudioDataControl.h"
#include "file/CTqovixFile.h"
#include "support/ChunkTables.h"
#include "support/TestSupport.h"

using moviekit::Bytes;

namespace {


Bytes SwappedWords(Bytes bytes)
{
    for (size_t i = 0; i + 1 < bytes.size(); i += 2) {
        std::swap(bytes[i], bytes[i + 1]);
    }
    return bytes;
}

class AudioFileTest : public ::testing::Test {
protected:
    void Open(const Bytes& bytes)
    {
        const std::string path = m_dir.File("source.mov");
        ASSERT_TRUE(testsupport::WriteFile(path, bytes));
        ASSERT_EQ(m_file.Open(path.c_str(), 1), eTqovixSuccess);
    }

    // Everything PopAudioData hands out, request by request, until a call delivers nothing.
    eTqovixErrorCode Drain(CTqovixAudioDataControl& control, unsigned long request, Bytes& out,
                           std::vector<unsigned long>* sizes = nullptr)
    {
        Bytes buffer(request);
        for (int guard = 0; guard < 1000000; ++guard) {
            unsigned long size = 0;
            const eTqovixErrorCode result = control.PopAudioData(buffer.data(), &size, request);
            if (TqovixFailed(result)) {
                return result;
            }
            if (sizes != nullptr) {
                sizes->push_back(size);
            }
            if (size == 0) {
                return eTqovixSuccess;
            }
            out.insert(out.end(), buffer.begin(), buffer.begin() + static_cast<std::ptrdiff_t>(size));
        }
        return eTqovixErrorInternal;
    }

    testsupport::TempDir m_dir;
    CTqovixFile m_file;
};

TEST(AudioChunkTest, QueuesAreFifosThatReportWhatTheyHold)
{
    CTqovixAudioChunk chunk;
    TqovixChunkInformation info;
    info.sampleSizes = {10, 20};
    CTqovixFile unopened;
    ASSERT_EQ(chunk.Initialize(unopened, info), eTqovixSuccess);
    EXPECT_EQ(chunk.GetSampleSize(-1), 0u);
    EXPECT_EQ(chunk.GetSampleSize(1), 20u);
    EXPECT_EQ(chunk.GetSampleSize(2), 0u);
    EXPECT_EQ(chunk.GetInputDataSize(), 0u);

    Bytes data(3000);
    for (size_t i = 0; i < data.size(); ++i) {
        data[i] = static_cast<uint8_t>(i * 13);
    }
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
    uint8_t small[4];
    ASSERT_EQ(chunk.PopProcessedData(small, &processed, sizeof small), eTqovixSuccess);
    EXPECT_EQ(processed, 4u);
    EXPECT_EQ(chunk.GetProcessedDataSize(), 3u);
    ASSERT_EQ(chunk.PushOutputData(data.data(), 5), eTqovixSuccess);
    ASSERT_EQ(chunk.PushOutputData(data.data() + 5, 5), eTqovixSuccess);
    EXPECT_EQ(Bytes(chunk.GetOutputData(), chunk.GetOutputData() + chunk.GetOutputDataSize()),
              Bytes(data.begin(), data.begin() + 10));

    unsigned long size = 0;
    EXPECT_EQ(chunk.PushDecodedData(nullptr, 4), eTqovixErrorInternal);
    EXPECT_EQ(chunk.PushOutputData(data.data(), 0), eTqovixErrorInternal);
    EXPECT_EQ(chunk.PopDecodedData(small, &size, 0), eTqovixErrorInternal);
    EXPECT_EQ(chunk.PopDecodedData(nullptr, &size, 4), eTqovixErrorInternal);
    unsigned int got = 0;
    EXPECT_EQ(chunk.PopInputData(small, &got, 4), eTqovixErrorInternal) << "the file is not open";
}

TEST_F(AudioFileTest, ChunkReadsWhatTheFileHoldsAndRemembersTheRest)
{
    Open(Bytes{0, 1, 2, 3, 4, 5, 6, 7, 8, 9});
    TqovixChunkInformation info;
    info.offset = 6;
    info.size = 8;  // four bytes lie past the end of the file
    CTqovixAudioChunk chunk;
    ASSERT_EQ(chunk.Initialize(m_file, info), eTqovixSuccess);
    uint8_t buffer[8] = {};
    unsigned int got = 0;
    ASSERT_EQ(chunk.PopInputData(buffer, &got, 8), eTqovixSuccess);
    EXPECT_EQ(got, 4u);
    EXPECT_EQ(Bytes(buffer, buffer + 4), (Bytes{6, 7, 8, 9}));
    EXPECT_EQ(chunk.GetInputDataSize(), 4u);
    ASSERT_EQ(chunk.PopInputData(buffer, &got, 4), eTqovixSuccess);
    EXPECT_EQ(got, 0u);

    chunk.Close();
    EXPECT_EQ(chunk.PopInputData(buffer, &got, 4), eTqovixErrorInternal);
}

TEST_F(AudioFileTest, PcmRequestsOfAnySizeDeliverTheTrackInOrder)
{
    for (const moviekit::SoundCodec codec : {moviekit::SoundCodec::Twos, moviekit::SoundCodec::Sowt}) {
        moviekit::MovieSpec recipe;
        recipe.video.frameCount = 45;
        recipe.sound.samplesPerChunk = 700;
        moviekit::MovieLayout layout;
        recipe.sound.codec = codec;
        const Bytes movie = moviekit::BuildMovie(recipe, &layout);
        CTqovixFile file;
        const std::string path = m_dir.File("pcm.mov");
        ASSERT_TRUE(testsupport::WriteFile(path, movie));
        ASSERT_EQ(file.Open(path.c_str(), 1), eTqovixSuccess);
        const bool bigEndian = codec == moviekit::SoundCodec::Twos;
        const Bytes expected = bigEndian ? SwappedWords(layout.soundBytes) : layout.soundBytes;

        for (const unsigned long request : {1UL, 4095UL, 4096UL, 2801UL, static_cast<unsigned long>(expected.size() + 9)}) {
            CTqovixAudioDataControl control;
            ASSERT_EQ(control.Initialize(file, testsupport::ChunkTableOf(layout.soundChunks, true), bigEndian), eTqovixSuccess);
            Bytes delivered;
            ASSERT_EQ(Drain(control, request, delivered), eTqovixSuccess) << request;
            EXPECT_EQ(delivered, expected) << "request of " << request;
            control.Close();
            EXPECT_FALSE(control.IsInitialized());
        }
    }
}

TEST_F(AudioFileTest, BigEndianWordsAreSwappedAndEmptyChunksSkipped)
{
    Open(Bytes{0x12, 0x34, 0x56, 0x78, 0xAB, 0xCD, 0xEF});
    std::vector<TqovixChunkInformation> table(3);
    table[0].offset = 0;
    table[0].size = 4;
    table[1].offset = 4;  // empty chunk in the middle
    table[2].offset = 4;
    table[2].size = 3;  // an odd trailing byte stays as it is
    for (const bool bigEndian : {true, false}) {
        CTqovixAudioDataControl control;
        ASSERT_EQ(control.Initialize(m_file, table, bigEndian), eTqovixSuccess);
        Bytes delivered;
        ASSERT_EQ(Drain(control, 64, delivered), eTqovixSuccess);
        EXPECT_EQ(delivered, bigEndian ? (Bytes{0x34, 0x12, 0x78, 0x56, 0xCD, 0xAB, 0xEF})
                                       : (Bytes{0x12, 0x34, 0x56, 0x78, 0xAB, 0xCD, 0xEF}));
    }

    CTqovixAudioDataControl empty;
    unsigned long size = 0;
    uint8_t buffer[4];
    EXPECT_EQ(empty.Initialize(m_file, {}, true), eTqovixErrorInternal);
    EXPECT_EQ(empty.PopAudioData(buffer, &size, 4), eTqovixErrorInternal);
    EXPECT_EQ(empty.PushAudioData(buffer, 4), eTqovixErrorInternal);
}

TEST_F(AudioFileTest, RequestsAreServedFromWholeChunksWithoutRereading)
{
    Bytes track(10000);
    for (size_t i = 0; i < track.size(); ++i) {
        track[i] = static_cast<uint8_t>(i);
    }
    Open(track);
    std::vector<TqovixChunkInformation> table(1);
    table[0].size = 10000;
    CTqovixAudioDataControl control;
    ASSERT_EQ(control.Initialize(m_file, table, false), eTqovixSuccess);
    Bytes delivered;
    std::vector<unsigned long> sizes;
    ASSERT_EQ(Drain(control, 4096, delivered, &sizes), eTqovixSuccess);
    EXPECT_EQ(sizes, (std::vector<unsigned long>{4096, 4096, 1808, 0}));
    EXPECT_EQ(delivered, track);
}

TEST_F(AudioFileTest, ChunksBeyondTheFileFailInsteadOfVanishing)
{
    Open(Bytes(100, 7));
    std::vector<TqovixChunkInformation> table(2);
    table[0].size = 60;
    table[1].offset = 80;
    table[1].size = 40;  // ends 20 bytes past the file
    CTqovixAudioDataControl control;
    ASSERT_EQ(control.Initialize(m_file, table, false), eTqovixSuccess);
    Bytes delivered;
    EXPECT_EQ(Drain(control, 20, delivered), eTqovixErrorInternal);
    EXPECT_EQ(delivered, Bytes(80, 7)) << "every byte that exists is served once, then the gap is reported";

    table[1].offset = 1000;
    CTqovixAudioDataControl past;
    ASSERT_EQ(past.Initialize(m_file, table, false), eTqovixSuccess);
    delivered.clear();
    EXPECT_EQ(Drain(past, 30, delivered), eTqovixErrorInternal);
    EXPECT_EQ(delivered.size(), 60u);
}

// Decodes a packet to 2048 bytes: its first byte repeated, so order is visible.
class FakeAacControl : public CTqovixAudioDataControl {
public:
    bool IsAACCodec() override { return true; }
    eTqovixErrorCode DecodeAAC2PCM(void* pcm, unsigned int* pcmSize, unsigned int* usedSize, const void* packet,
                                   unsigned int packetSize) override
    {
        ++decodeCalls;
        if (echo) {
            std::memcpy(pcm, packet, packetSize);
            *pcmSize = packetSize;
        } else {
            std::memset(pcm, *static_cast<const uint8_t*>(packet), 2048);
            *pcmSize = 2048;
        }
        *usedSize = packetSize;
        return eTqovixSuccess;
    }
    eTqovixErrorCode EncodePCM2AAC(void*, unsigned int pcmSize) override
    {
        encoded += pcmSize;
        if (encoded >= announceAfter) {
            SetOutputChunkIndex(chunkCount);
        }
        return eTqovixSuccess;
    }
    eTqovixErrorCode EncodeDone() override
    {
        ++flushes;
        return eTqovixSuccess;
    }

    bool echo = false;  // decode a packet to its own bytes
    int decodeCalls = 0;
    int flushes = 0;
    unsigned long encoded = 0;
    unsigned long announceAfter = ~0UL;
    unsigned long chunkCount = 0;
};

TEST_F(AudioFileTest, AacPacketsDecodeInOrderAndSilenceFollowsTheTrack)
{
    // Two chunks of packets 3+5 and 4 bytes; each packet's first byte names it.
    Open(Bytes{1, 0, 0, 2, 0, 0, 0, 0, 3, 0, 0, 0});
    std::vector<TqovixChunkInformation> table(2);
    table[0].size = 8;
    table[0].sampleSizes = {3, 5};
    table[1].offset = 8;
    table[1].size = 4;
    table[1].sampleSizes = {4};
    FakeAacControl control;
    ASSERT_EQ(control.Initialize(m_file, table, true), eTqovixSuccess);

    Bytes buffer(3000, 0xFF);
    unsigned long size = 0;
    ASSERT_EQ(control.PopAudioData(buffer.data(), &size, 3000), eTqovixSuccess);
    EXPECT_EQ(size, 3000u);
    EXPECT_EQ(control.decodeCalls, 2) << "one chunk decoded for the first request";
    EXPECT_EQ(buffer[0], 1);
    EXPECT_EQ(buffer[2047], 1);
    EXPECT_EQ(buffer[2048], 2);
    ASSERT_EQ(control.PopAudioData(buffer.data(), &size, 3000), eTqovixSuccess);
    EXPECT_EQ(buffer[0], 2);
    EXPECT_EQ(buffer[1096], 3);
    EXPECT_EQ(control.decodeCalls, 3);
    ASSERT_EQ(control.PopAudioData(buffer.data(), &size, 3000), eTqovixSuccess);
    EXPECT_EQ(size, 3000u);
    EXPECT_EQ(buffer[143], 3);
    EXPECT_EQ(buffer[144], 0) << "past the track the request is filled with silence";
    ASSERT_EQ(control.PopAudioData(buffer.data(), &size, 3000), eTqovixSuccess);
    EXPECT_EQ(size, 3000u);
    EXPECT_TRUE(std::all_of(buffer.begin(), buffer.end(), [](uint8_t b) { return b == 0; }));
}

TEST_F(AudioFileTest, AacChunksWhoseSizesDoNotAddUpAreRefused)
{
    Open(Bytes(64, 9));
    const std::vector<std::vector<uint32_t>> badSizes = {
        {},        // one common sample size: no packet sizes at all
        {3, 3},    // fewer bytes than the chunk
        {10, 10},  // runs past the chunk
        {0, 8},
    };
    for (const auto& sizes : badSizes) {
        std::vector<TqovixChunkInformation> table(1);
        table[0].size = 8;
        table[0].sampleSizes = sizes;
        FakeAacControl control;
        ASSERT_EQ(control.Initialize(m_file, table, false), eTqovixSuccess);
        uint8_t buffer[16];
        unsigned long size = 0;
        EXPECT_EQ(control.PopAudioData(buffer, &size, sizeof buffer), eTqovixErrorInternal);
    }
}

TEST_F(AudioFileTest, PushesEncodeAndFlushOnlyAfterTheWriterAnnouncesTheEnd)
{
    Open(Bytes(16, 1));
    std::vector<TqovixChunkInformation> table(2);
    table[0].size = 8;
    table[1].offset = 8;
    table[1].size = 8;
    FakeAacControl control;
    control.chunkCount = table.size();
    control.announceAfter = 3000;
    ASSERT_EQ(control.Initialize(m_file, table, false), eTqovixSuccess);
    Bytes pcm(1024, 5);
    EXPECT_EQ(control.PushAudioData(pcm.data(), pcm.size()), eTqovixSuccess);
    EXPECT_EQ(control.PushAudioData(pcm.data(), pcm.size()), eTqovixSuccess);
    EXPECT_EQ(control.flushes, 0);
    EXPECT_EQ(control.PushAudioData(pcm.data(), pcm.size()), eTqovixSuccess);
    EXPECT_EQ(control.flushes, 1);
    EXPECT_EQ(control.PushAudioData(pcm.data(), pcm.size()), eTqovixSuccess);
    EXPECT_EQ(control.flushes, 2);
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

TEST_F(AudioFileTest, ServingTwoThousandChunksHoldsOnlyAFewChunksOfMemory)
{
    constexpr uint32_t kChunks = 2000;
    constexpr uint32_t kChunkSize = 4000;
    Bytes track(static_cast<size_t>(kChunks) * kChunkSize);
    for (size_t i = 0; i < track.size(); ++i) {
        track[i] = static_cast<uint8_t>(i * 31 + i / 4000);
    }
    Open(track);
    std::vector<TqovixChunkInformation> table(kChunks);
    for (uint32_t i = 0; i < kChunks; ++i) {
        table[i].offset = static_cast<uint64_t>(i) * kChunkSize;
        table[i].size = kChunkSize;
    }
    CTqovixAudioDataControl control;
    ASSERT_EQ(control.Initialize(m_file, table, true), eTqovixSuccess);
    Bytes buffer(4096);
    Bytes delivered;
    uint64_t peak = 0;
    for (;;) {
        unsigned long size = 0;
        ASSERT_EQ(control.PopAudioData(buffer.data(), &size, buffer.size()), eTqovixSuccess);
        peak = std::max(peak, control.GetHeldByteCount());
        if (size == 0) {
            break;
        }
        delivered.insert(delivered.end(), buffer.begin(), buffer.begin() + static_cast<std::ptrdiff_t>(size));
    }
    EXPECT_EQ(delivered, SwappedWords(track));
    EXPECT_LE(peak, 4u * kChunkSize) << "memory must not grow with the track";
}

}  // namespace
