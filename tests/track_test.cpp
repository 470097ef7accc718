#include <gtest/gtest.h>

#include <functional>
#include <sstream>
#include <string>
#include <vector>

#include "ByteWriter.h"
#include "Movie.h"
#include "atom/CTqovixAtomControl.h"
#include "file/CTqovixFile.h"
#include "support/TestSupport.h"
#include "visitor/CTqovixAudioDataVisitor.h"
#include "visitor/CTqovixAudioInformationVisitor.h"
#include "visitor/CTqovixMovieDataVisitor.h"

using moviekit::Atom;
using moviekit::Bytes;
using moviekit::Container;

// Outside the anonymous namespace so that GoogleTest finds it beside the type.
void PrintTo(const TqovixChunkInformation& c, std::ostream* os)
{
    *os << "{offset " << c.offset << ", size " << c.size << ", samples " << c.sampleCount << ", chunk "
        << c.chunkNumber << ", sizes " << c.sampleSizes.size() << "}";
}

namespace {

Bytes U32s(std::initializer_list<uint32_t> values)
{
    Bytes out;
    for (uint32_t value : values) {
        moviekit::PutU32(out, value);
    }
    return out;
}

Bytes Handler(const char* subtype)
{
    Bytes payload = U32s({0});
    moviekit::PutString(payload, "mhlr");
    moviekit::PutString(payload, subtype);
    moviekit::PutBytes(payload, Bytes(12, 0));
    return Atom("hdlr", payload);
}

// A movie whose only track holds the given handler subtype and sample tables.
Bytes TrackMovie(const char* subtype, const std::vector<Bytes>& tables, const std::vector<Bytes>& beforeMedia = {})
{
    std::vector<Bytes> track = beforeMedia;
    track.push_back(Container("mdia", {Handler(subtype), Container("minf", {Container("stbl", tables)})}));
    return moviekit::Concat({Atom("ftyp", Bytes{'q', 't', ' ', ' '}), Container("moov", {Container("trak", track)})});
}

Bytes Table(const char* type, uint32_t declaredCount, const Bytes& entries)
{
    Bytes payload = U32s({0, declaredCount});
    moviekit::PutBytes(payload, entries);
    return Atom(type, payload);
}

Bytes Sizes(uint32_t common, const std::vector<uint32_t>& sizes)
{
    Bytes payload = U32s({0, common, static_cast<uint32_t>(sizes.size())});
    for (uint32_t size : sizes) {
        moviekit::PutU32(payload, size);
    }
    return Atom("stsz", payload);
}

class TrackTest : public ::testing::Test {
protected:
    eTqovixErrorCode Load(const Bytes& movie)
    {
        m_tree.Close();
        if (m_file.IsOpened()) {
            m_file.Close();
        }
        const std::string path = m_dir.File("movie" + std::to_string(m_loads++) + ".mov");
        EXPECT_TRUE(testsupport::WriteFile(path, movie));
        EXPECT_EQ(m_file.Open(path.c_str(), 1), eTqovixSuccess);
        return m_tree.Initialize(m_file);
    }

    // Writes the tree's top-level atoms, with `inserted` bytes after the first `before` atoms.
    Bytes WriteTree(size_t before = 0, const Bytes& inserted = {})
    {
        TqovixAtomList atoms;
        m_tree.GetAtoms(atoms);
        CTqovixFile out;
        const std::string path = m_dir.File("written" + std::to_string(m_loads++) + ".mov");
        EXPECT_EQ(out.Open(path.c_str(), 2), eTqovixSuccess);
        for (size_t i = 0; i < atoms.size(); ++i) {
            if (i == before && !inserted.empty()) {
                EXPECT_EQ(out.Write(inserted.data(), static_cast<unsigned int>(inserted.size())), eTqovixSuccess);
            }
            EXPECT_EQ(atoms[i]->Write(out), eTqovixSuccess);
        }
        out.Close();
        m_lastWritten = path;
        return testsupport::ReadFile(path);
    }

    testsupport::TempDir m_dir;
    CTqovixFile m_file;
    CTqovixAtomControl m_tree;
    std::string m_lastWritten;
    int m_loads = 0;
};

TEST_F(TrackTest, SoundFormatOfCameraMovies)
{
    struct Case {
        moviekit::SoundCodec codec;
        uint32_t rate;
        uint16_t channels;
        uint32_t rateKHz;
        bool bigEndian;
        uint32_t priming;
    };
    const Case cases[] = {
        {moviekit::SoundCodec::Twos, 48000, 2, 48, true, 1024},
        {moviekit::SoundCodec::Sowt, 44100, 1, 44, false, 0},
        {moviekit::SoundCodec::Aac, 32000, 2, 32, false, 1024},
        {moviekit::SoundCodec::Aac, 44100, 1, 44, false, 1024},
    };
    for (const Case& c : cases) {
        moviekit::MovieSpec spec;
        spec.sound.codec = c.codec;
        spec.sound.sampleRate = c.rate;
        spec.sound.channels = c.channels;
        spec.sound.mediaTime = 2112;
        spec.soundTrackFirst = c.rate == 44100;
        moviekit::MovieLayout layout;
        ASSERT_EQ(Load(moviekit::BuildMovie(spec, &layout)), eTqovixSuccess);
        CTqovixAudioInformationVisitor visitor;
        ASSERT_EQ(m_tree.Analyze(visitor), eTqovixSuccess);
        EXPECT_EQ(visitor.GetRate(), c.rateKHz);
        EXPECT_EQ(visitor.GetChannel(), c.channels);
        EXPECT_EQ(visitor.GetSize(), 16);
        EXPECT_EQ(visitor.GetCount(), layout.soundSampleCount);
        EXPECT_EQ(visitor.IsBigEndianFormat(), c.bigEndian);
        EXPECT_EQ(visitor.GetPriming(), c.priming);
        EXPECT_EQ(visitor.GetMediaTime(), 2112u);
        if (c.codec == moviekit::SoundCodec::Aac) {
            const Bytes config = moviekit::MakeAudioSpecificConfig(c.rate, c.channels);
            ASSERT_EQ(visitor.GetAudioSpecificConfigSize(), config.size());
            EXPECT_EQ(Bytes(visitor.GetAudioSpecificConfigData(), visitor.GetAudioSpecificConfigData() + config.size()),
                      config);
            EXPECT_GT(visitor.GetAverageBitRate(), 0u);
        } else {
            EXPECT_EQ(visitor.GetAudioSpecificConfigSize(), 0u);
        }
        EXPECT_EQ(m_tree.Update(visitor), eTqovixErrorInternal) << "the format visitor only reads";
    }
}

struct FormatCase {
    const char* name;
    std::function<void(moviekit::MovieSpec&)> change;
    eTqovixErrorCode expected;
};

void PrintTo(const FormatCase& c, std::ostream* os) { *os << c.name; }

class SoundFormatTest : public TrackTest, public ::testing::WithParamInterface<FormatCase> {};

TEST_P(SoundFormatTest, AcceptsOrRefusesTheDescription)
{
    moviekit::MovieSpec spec;
    spec.sound.codec = moviekit::SoundCodec::Aac;
    GetParam().change(spec);
    ASSERT_EQ(Load(moviekit::BuildMovie(spec)), eTqovixSuccess);
    CTqovixAudioInformationVisitor visitor;
    EXPECT_EQ(m_tree.Analyze(visitor), GetParam().expected);
    if (GetParam().expected == eTqovixSuccess) {
        EXPECT_EQ(visitor.GetAudioSpecificConfigSize(), 2u);
    }
}

Bytes EsdsWith(const Bytes& descriptors)
{
    Bytes payload = U32s({0});
    moviekit::PutBytes(payload, descriptors);
    return payload;
}

const FormatCase kFormatCases[] = {
    {"PlainAac", [](moviekit::MovieSpec&) {}, eTqovixSuccess},
    {"NoEditList", [](moviekit::MovieSpec& s) { s.sound.edts = false; }, eTqovixSuccess},
    {"EditsWithoutList", [](moviekit::MovieSpec& s) { s.sound.elst = false; }, eTqovixErrorInvalidMovie},
    {"DescriptionVersionTwo", [](moviekit::MovieSpec& s) { s.sound.descriptionVersion = 2; }, eTqovixErrorInvalidMovie},
    {"LongDescriptorSizes", [](moviekit::MovieSpec& s) { s.sound.esds.longSizes = true; }, eTqovixSuccess},
    {"PriorityBitsOnly", [](moviekit::MovieSpec& s) { s.sound.esds.esFlags = 0x1F; }, eTqovixSuccess},
    {"OptionalEsFields", [](moviekit::MovieSpec& s) { s.sound.esds.esFlags = 0xE0; }, eTqovixSuccess},
    {"ProfileAfterConfig", [](moviekit::MovieSpec& s) { s.sound.esds.profileLevelAfterConfig = true; },
     eTqovixErrorInvalidMovie},
    {"ZeroAverageBitRate", [](moviekit::MovieSpec& s) { s.sound.esds.averageBitRate = 0; }, eTqovixErrorInvalidMovie},
    {"EmptyEsds", [](moviekit::MovieSpec& s) { s.sound.esds.rawPayload = U32s({0}); }, eTqovixErrorInvalidMovie},
    // An ES descriptor claiming 100 bytes in a 10-byte atom.
    {"DescriptorPastTheAtom",
     [](moviekit::MovieSpec& s) { s.sound.esds.rawPayload = EsdsWith({3, 100, 0, 1, 0, 4, 2, 0x40, 0x15}); },
     eTqovixErrorInvalidMovie},
    // A decoder configuration whose specific info claims more than its parent holds.
    {"ConfigDeeperThanItsParent",
     [](moviekit::MovieSpec& s) {
         s.sound.esds.rawPayload =
             EsdsWith({3, 20, 0, 1, 0, 4, 16, 0x40, 0x15, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1, 0, 5, 60, 0x11});
     },
     eTqovixErrorInvalidMovie},
    {"TwoByteSizeForm",
     [](moviekit::MovieSpec& s) {
         s.sound.esds.rawPayload = EsdsWith({3, 0x81, 0x10, 0, 1, 0, 4, 13, 0x40, 0x15, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1, 0});
     },
     eTqovixErrorInvalidMovie},
};

INSTANTIATE_TEST_SUITE_P(Descriptions, SoundFormatTest, ::testing::ValuesIn(kFormatCases),
                         [](const ::testing::TestParamInfo<FormatCase>& info) { return std::string(info.param.name); });

TEST_F(TrackTest, TimeToSampleEntriesAddUpAndOverflowIsRefused)
{
    Bytes pcm = U32s({0, 1, 36});
    moviekit::PutString(pcm, "twos");
    moviekit::PutBytes(pcm, Bytes(8, 0));
    moviekit::PutBytes(pcm, U32s({0, 0, 0x00020010, 0, 0xBB800000}));
    const Bytes stsd = Atom("stsd", pcm);
    ASSERT_EQ(Load(TrackMovie("soun", {stsd, Table("stts", 3, U32s({100, 1, 200, 1, 3000, 1}))})), eTqovixSuccess);
    CTqovixAudioInformationVisitor visitor;
    EXPECT_EQ(m_tree.Analyze(visitor), eTqovixSuccess);
    EXPECT_EQ(visitor.GetCount(), 3300u);
    EXPECT_EQ(visitor.GetRate(), 48u);

    ASSERT_EQ(Load(TrackMovie("soun", {stsd, Table("stts", 2, U32s({0xFFFFFFF0, 1, 0x20, 1}))})), eTqovixSuccess);
    CTqovixAudioInformationVisitor overflowing;
    EXPECT_EQ(m_tree.Analyze(overflowing), eTqovixErrorInvalidMovie);

    // A sound description too short to hold the fields read.
    ASSERT_EQ(Load(TrackMovie("soun", {Atom("stsd", Bytes(20, 0)), Table("stts", 1, U32s({1, 1}))})), eTqovixSuccess);
    CTqovixAudioInformationVisitor truncated;
    EXPECT_EQ(m_tree.Analyze(truncated), eTqovixErrorInvalidMovie);

    // Only the video track's tables: the sound visitor finds nothing.
    ASSERT_EQ(Load(TrackMovie("vide", {stsd, Table("stts", 1, U32s({1, 1}))})), eTqovixSuccess);
    CTqovixAudioInformationVisitor noSound;
    EXPECT_EQ(m_tree.Analyze(noSound), eTqovixErrorInvalidMovie);
}

std::vector<TqovixChunkInformation> ExpectedChunks(const std::vector<moviekit::ChunkLayout>& chunks, bool withSizes)
{
    std::vector<TqovixChunkInformation> table;
    uint32_t number = 1;
    for (const moviekit::ChunkLayout& chunk : chunks) {
        TqovixChunkInformation info;
        info.offset = chunk.offset;
        info.size = static_cast<uint32_t>(chunk.size);
        if (withSizes) {
            info.sampleSizes = chunk.sampleSizes;
        }
        info.chunkNumber = number++;
        info.sampleCount = chunk.sampleCount;
        table.push_back(info);
    }
    return table;
}

TEST_F(TrackTest, ChunkListsOfCameraMoviesMatchTheirLayout)
{
    moviekit::MovieSpec pcm;
    pcm.sound.samplesPerChunk = 1000;  // a short last chunk makes a second run
    moviekit::MovieSpec wide;
    wide.sound.codec = moviekit::SoundCodec::Sowt;
    wide.co64 = true;
    wide.video.perSampleSizes = true;
    wide.soundTrackFirst = true;
    moviekit::MovieSpec aac;
    aac.sound.codec = moviekit::SoundCodec::Aac;
    aac.sound.chunkSampleCounts = {5, 5, 3, 7};
    aac.video.framesPerChunk = 4;
    for (const moviekit::MovieSpec& spec : {pcm, wide, aac}) {
        moviekit::MovieLayout layout;
        ASSERT_EQ(Load(moviekit::BuildMovie(spec, &layout)), eTqovixSuccess);
        const bool isAac = spec.sound.codec == moviekit::SoundCodec::Aac;

        CTqovixAudioDataVisitor sound;
        ASSERT_EQ(m_tree.Analyze(sound), eTqovixSuccess);
        std::vector<TqovixChunkInformation> soundChunks;
        ASSERT_EQ(sound.GetAudioChunkInformation(soundChunks, 4), eTqovixSuccess);
        EXPECT_EQ(soundChunks, ExpectedChunks(layout.soundChunks, isAac));

        CTqovixMovieDataVisitor video;
        ASSERT_EQ(m_tree.Analyze(video), eTqovixSuccess);
        std::vector<TqovixChunkInformation> videoChunks;
        ASSERT_EQ(video.GetOffset(videoChunks), eTqovixSuccess);
        EXPECT_EQ(videoChunks, ExpectedChunks(layout.videoChunks, spec.video.perSampleSizes));

        // The last chunk ends exactly where the file would have to, or one byte beyond.
        uint64_t end = 0;
        for (const auto& chunk : soundChunks) {
            end = std::max<uint64_t>(end, chunk.offset + chunk.size);
        }
        for (const auto& chunk : videoChunks) {
            end = std::max<uint64_t>(end, chunk.offset + chunk.size);
        }
        EXPECT_EQ(TqovixCheckChunksInFile(soundChunks, end), eTqovixSuccess);
        EXPECT_EQ(TqovixCheckChunksInFile(videoChunks, end), eTqovixSuccess);
        EXPECT_EQ(std::max(TqovixCheckChunksInFile(soundChunks, end - 1), TqovixCheckChunksInFile(videoChunks, end - 1)),
                  eTqovixErrorInvalidMovie);
    }
    std::vector<TqovixChunkInformation> wrapping(1);
    wrapping[0].offset = ~0ULL - 2;
    wrapping[0].size = 8;
    EXPECT_EQ(TqovixCheckChunksInFile(wrapping, ~0ULL), eTqovixErrorInvalidMovie) << "no wrap-around";
}

struct TableCase {
    const char* name;
    std::vector<Bytes> tables;
    eTqovixErrorCode expected;
    std::vector<uint32_t> sampleCounts;  // per chunk, when accepted
};

void PrintTo(const TableCase& c, std::ostream* os) { *os << c.name; }

class SampleTableTest : public TrackTest, public ::testing::WithParamInterface<TableCase> {};

TEST_P(SampleTableTest, BuildsChunksOrRefusesContradictions)
{
    ASSERT_EQ(Load(TrackMovie("soun", GetParam().tables)), eTqovixSuccess);
    CTqovixAudioDataVisitor visitor;
    const eTqovixErrorCode walk = m_tree.Analyze(visitor);
    std::vector<TqovixChunkInformation> chunks;
    const eTqovixErrorCode built = walk == eTqovixSuccess ? visitor.GetAudioChunkInformation(chunks, 4) : walk;
    EXPECT_EQ(built, GetParam().expected);
    if (GetParam().expected == eTqovixSuccess) {
        std::vector<uint32_t> counts;
        for (const auto& chunk : chunks) {
            counts.push_back(chunk.sampleCount);
            EXPECT_EQ(chunk.size, chunk.sampleCount * 4);
        }
        EXPECT_EQ(counts, GetParam().sampleCounts);
    }
}

const Bytes kSixOffsets = Table("stco", 6, U32s({100, 200, 300, 400, 500, 600}));

const TableCase kTableCases[] = {
    {"TwoRuns", {Table("stsc", 2, U32s({1, 3, 1, 5, 2, 1})), Sizes(1, {}), kSixOffsets}, eTqovixSuccess,
     {3, 3, 3, 3, 2, 2}},
    {"OneRunToTheEnd", {Table("stsc", 1, U32s({1, 9, 1})), Sizes(1, {}), kSixOffsets}, eTqovixSuccess,
     {9, 9, 9, 9, 9, 9}},
    {"CountFieldIgnored", {Table("stsc", 0xFFFFFFFF, U32s({1, 2, 1})), Sizes(1, {}), Table("stco", 0xFFFFFFFF, U32s({8}))},
     eTqovixSuccess, {2}},
    {"FirstChunkZero", {Table("stsc", 1, U32s({0, 3, 1})), Sizes(1, {}), kSixOffsets}, eTqovixErrorInvalidMovie, {}},
    {"RunsOutOfOrder", {Table("stsc", 2, U32s({1, 3, 1, 5, 2, 1, 3, 4, 1})), Sizes(1, {}), kSixOffsets},
     eTqovixErrorInvalidMovie, {}},
    {"RunPastTheChunks", {Table("stsc", 2, U32s({1, 3, 1, 9, 2, 1})), Sizes(1, {}), kSixOffsets},
     eTqovixErrorInvalidMovie, {}},
    {"NoRuns", {Table("stsc", 0, {}), Sizes(1, {}), kSixOffsets}, eTqovixErrorInvalidMovie, {}},
    {"NoChunks", {Table("stsc", 1, U32s({1, 3, 1})), Sizes(1, {}), Table("stco", 0, {})}, eTqovixErrorInvalidMovie, {}},
    {"SizesRunOut", {Table("stsc", 1, U32s({1, 2, 1})), Sizes(0, {4, 4, 4}), Table("stco", 2, U32s({8, 16}))},
     eTqovixErrorInvalidMovie, {}},
    {"SizesLeftOver", {Table("stsc", 1, U32s({1, 1, 1})), Sizes(0, {4, 4, 4}), Table("stco", 2, U32s({8, 16}))},
     eTqovixErrorInvalidMovie, {}},
    {"ChunkBeyondFourGiB", {Table("stsc", 1, U32s({1, 0x40000000, 1})), Sizes(1, {}), Table("stco", 1, U32s({8}))},
     eTqovixErrorInvalidMovie, {}},
    {"MissingTable", {Table("stsc", 1, U32s({1, 3, 1})), kSixOffsets}, eTqovixErrorInvalidMovie, {}},
};

INSTANTIATE_TEST_SUITE_P(Tables, SampleTableTest, ::testing::ValuesIn(kTableCases),
                         [](const ::testing::TestParamInfo<TableCase>& info) { return std::string(info.param.name); });

TEST_F(TrackTest, UpdatedTablesWriteBackAndReadAsSet)
{
    moviekit::MovieSpec spec;
    spec.sound.codec = moviekit::SoundCodec::Aac;
    spec.co64 = true;
    spec.video.perSampleSizes = true;
    moviekit::MovieLayout layout;
    ASSERT_EQ(Load(moviekit::BuildMovie(spec, &layout)), eTqovixSuccess);
    TqovixAtomList atoms;
    m_tree.GetAtoms(atoms);
    const Bytes before = WriteTree();

    std::vector<TqovixChunkInformation> sound = ExpectedChunks(layout.soundChunks, true);
    for (auto& chunk : sound) {
        chunk.offset += 5ULL << 32;  // beyond what 32 bits can say
        for (auto& size : chunk.sampleSizes) {
            size += 3;
        }
    }
    CTqovixAudioDataVisitor soundWriter;
    soundWriter.SetAudioChunkInformation(sound);
    ASSERT_EQ(m_tree.Update(soundWriter), eTqovixSuccess);
    std::vector<TqovixChunkInformation> video = ExpectedChunks(layout.videoChunks, false);
    for (auto& chunk : video) {
        chunk.offset = chunk.offset * 3 + 1;
    }
    CTqovixMovieDataVisitor videoWriter;
    videoWriter.SetOffset(video);
    ASSERT_EQ(m_tree.Update(videoWriter), eTqovixSuccess);

    const Bytes after = WriteTree();
    ASSERT_EQ(after.size(), before.size()) << "tables keep their kind and length";
    ASSERT_EQ(Load(after), eTqovixSuccess);
    CTqovixAudioDataVisitor soundReader;
    ASSERT_EQ(m_tree.Analyze(soundReader), eTqovixSuccess);
    std::vector<TqovixChunkInformation> soundRead;
    soundReader.GetAudioChunkInformation(soundRead, 4);
    for (size_t i = 0; i < sound.size(); ++i) {
        sound[i].size = 0;
        for (uint32_t size : sound[i].sampleSizes) {
            sound[i].size += size;
        }
    }
    EXPECT_EQ(soundRead, sound);
    CTqovixMovieDataVisitor videoReader;
    ASSERT_EQ(m_tree.Analyze(videoReader), eTqovixSuccess);
    std::vector<TqovixChunkInformation> videoRead;
    videoReader.GetOffset(videoRead);
    ASSERT_EQ(videoRead.size(), video.size());
    for (size_t i = 0; i < video.size(); ++i) {
        EXPECT_EQ(videoRead[i].offset, video[i].offset);
        EXPECT_EQ(videoRead[i].sampleSizes, layout.videoChunks[i].sampleSizes) << "video sizes stay as they were";
    }
}

TEST_F(TrackTest, UpdatesThatCannotBeWrittenLeaveTheTablesAlone)
{
    moviekit::MovieSpec spec;  // PCM with "stco" tables
    moviekit::MovieLayout layout;
    const Bytes movie = moviekit::BuildMovie(spec, &layout);
    ASSERT_EQ(Load(movie), eTqovixSuccess);

    std::vector<TqovixChunkInformation> far = ExpectedChunks(layout.soundChunks, false);
    far.back().offset = 1ULL << 32;
    CTqovixAudioDataVisitor tooFar;
    tooFar.SetAudioChunkInformation(far);
    EXPECT_EQ(m_tree.Update(tooFar), eTqovixErrorInternal) << "an stco cannot say 4 GiB";

    std::vector<TqovixChunkInformation> fewer = ExpectedChunks(layout.soundChunks, false);
    fewer.pop_back();
    CTqovixAudioDataVisitor missing;
    missing.SetAudioChunkInformation(fewer);
    EXPECT_EQ(m_tree.Update(missing), eTqovixErrorInternal);

    CTqovixMovieDataVisitor shortVideo;
    std::vector<TqovixChunkInformation> oneVideo(1);
    oneVideo[0].offset = 77;
    shortVideo.SetOffset(oneVideo);
    EXPECT_EQ(m_tree.Update(shortVideo), eTqovixErrorInternal);

    EXPECT_EQ(WriteTree(), movie) << "failed updates replace no payload";
}

TEST_F(TrackTest, RewrittenOffsetsAreWhereAnIndependentReaderFindsThePackets)
{
    if (!testsupport::HaveCommand("ffprobe")) {
        FAIL() << "ffprobe is needed as the independent reader";
    }
    for (const moviekit::SoundCodec codec : {moviekit::SoundCodec::Twos, moviekit::SoundCodec::Aac}) {
        moviekit::MovieSpec spec;
        spec.sound.codec = codec;
        spec.wide = false;
        moviekit::MovieLayout layout;
        ASSERT_EQ(Load(moviekit::BuildMovie(spec, &layout)), eTqovixSuccess);

        // Move the media data 1000 bytes down by putting a "free" atom in front of it.
        const Bytes padding = Atom("free", Bytes(992, 0));
        std::vector<TqovixChunkInformation> sound = ExpectedChunks(layout.soundChunks, codec == moviekit::SoundCodec::Aac);
        for (auto& chunk : sound) {
            chunk.offset += padding.size();
        }
        std::vector<TqovixChunkInformation> video = ExpectedChunks(layout.videoChunks, false);
        for (auto& chunk : video) {
            chunk.offset += padding.size();
        }
        CTqovixAudioDataVisitor soundWriter;
        soundWriter.SetAudioChunkInformation(sound);
        ASSERT_EQ(m_tree.Update(soundWriter), eTqovixSuccess);
        CTqovixMovieDataVisitor videoWriter;
        videoWriter.SetOffset(video);
        ASSERT_EQ(m_tree.Update(videoWriter), eTqovixSuccess);
        WriteTree(1, padding);

        std::string output;
        ASSERT_EQ(testsupport::RunCommand("ffprobe -v error -show_entries packet=stream_index,pos -of csv=p=0 " +
                                              testsupport::ShellQuote(m_lastWritten),
                                          &output),
                  0);
        std::istringstream lines(output);
        std::string line;
        std::vector<uint64_t> videoPositions;
        std::vector<uint64_t> soundPositions;
        while (std::getline(lines, line)) {
            if (line.empty()) {
                continue;
            }
            const auto comma = line.find(',');
            ASSERT_NE(comma, std::string::npos) << "[" << line << "] in " << output;
            const uint64_t pos = std::stoull(line.substr(comma + 1));
            (line.substr(0, comma) == "0" ? videoPositions : soundPositions).push_back(pos);
        }
        ASSERT_FALSE(soundPositions.empty());
        EXPECT_EQ(soundPositions.front(), sound.front().offset);
        EXPECT_EQ(videoPositions.front(), video.front().offset);
        EXPECT_EQ(videoPositions.back(), video.back().offset + layout.videoFrameSize * (layout.videoChunks.back().sampleCount - 1));
        if (codec == moviekit::SoundCodec::Aac) {
            EXPECT_EQ(soundPositions.back(), sound.back().offset + sound.back().size - sound.back().sampleSizes.back());
        }
    }
}

}  // namespace
