#include <gtest/gtest.h>

#include <functional>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "ByteWriter.h"
#include "Movie.h"
#include "atom/CTqovixAtomControl.h"
#include "atom/TqovixEndian.h"
#include "file/CTqovixFile.h"
#include "support/ChunkTables.h"
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

Bytes U64s(std::initializer_list<uint64_t> values)
{
    Bytes out;
    for (uint64_t value : values) {
        moviekit::PutU64(out, value);
    }
    return out;
}

Bytes Track(const char* subtype, const std::vector<Bytes>& tables, const std::vector<Bytes>& beforeMedia = {})
{
    std::vector<Bytes> track = beforeMedia;
    track.push_back(Container("mdia", {Handler(subtype), Container("minf", {Container("stbl", tables)})}));
    return Container("trak", track);
}

Bytes MovieOf(const std::vector<Bytes>& tracks)
{
    return moviekit::Concat({Atom("ftyp", Bytes{'q', 't', ' ', ' '}), Container("moov", tracks)});
}

// A movie whose only track holds the given handler subtype and sample tables.
Bytes TrackMovie(const char* subtype, const std::vector<Bytes>& tables, const std::vector<Bytes>& beforeMedia = {})
{
    return MovieOf({Track(subtype, tables, beforeMedia)});
}

Bytes PcmDescription(const char* format, uint32_t rate)
{
    Bytes payload = U32s({0, 1, 36});
    moviekit::PutString(payload, format);
    moviekit::PutBytes(payload, Bytes(8, 0));
    moviekit::PutBytes(payload, U32s({0, 0, 0x00020010, 0, rate << 16}));
    return Atom("stsd", payload);
}

// Payload range of one atom inside a file's bytes.
struct Span {
    size_t begin = 0;
    size_t end = 0;
};

std::vector<std::pair<std::string, Span>> Children(const Bytes& file, Span parent)
{
    std::vector<std::pair<std::string, Span>> out;
    size_t at = parent.begin;
    while (at + 8 <= parent.end) {
        const size_t size = TqovixReadBE32(file.data() + at);
        if (size < 8 || size > parent.end - at) {
            break;
        }
        out.emplace_back(std::string(file.begin() + at + 4, file.begin() + at + 8), Span{at + 8, at + size});
        at += size;
    }
    return out;
}

Span Child(const Bytes& file, Span parent, const std::string& type)
{
    for (const auto& [childType, span] : Children(file, parent)) {
        if (childType == type) {
            return span;
        }
    }
    return {};
}

// The sample-table atoms, header included, of the track whose handler names `subtype`.
std::map<std::string, Bytes> TrackTables(const Bytes& file, const std::string& subtype)
{
    std::map<std::string, Bytes> tables;
    for (const auto& [type, trak] : Children(file, Child(file, {0, file.size()}, "moov"))) {
        const Span mdia = Child(file, trak, "mdia");
        const Span handler = Child(file, mdia, "hdlr");
        if (type != "trak" || handler.end - handler.begin < 12 ||
            std::string(file.begin() + handler.begin + 8, file.begin() + handler.begin + 12) != subtype) {
            continue;
        }
        for (const auto& [tableType, table] : Children(file, Child(file, Child(file, mdia, "minf"), "stbl"))) {
            tables[tableType] = Bytes(file.begin() + table.begin - 8, file.begin() + table.end);
        }
        break;
    }
    return tables;
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
        moviekit::MovieSpec recipe;
        recipe.sound.codec = c.codec;
        recipe.sound.sampleRate = c.rate;
        recipe.sound.channels = c.channels;
        recipe.sound.mediaTime = 2112;
        recipe.soundTrackFirst = c.rate == 44100;
        moviekit::MovieLayout layout;
        ASSERT_EQ(Load(moviekit::BuildMovie(recipe, &layout)), eTqovixSuccess);
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
    moviekit::MovieSpec recipe;
    recipe.sound.codec = moviekit::SoundCodec::Aac;
    GetParam().change(recipe);
    ASSERT_EQ(Load(moviekit::BuildMovie(recipe)), eTqovixSuccess);
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

TEST_F(TrackTest, SampleTotalAndMediaTimeComeFromWholeEntriesOnly)
{
    const Bytes stsd = PcmDescription("twos", 48000);
    // Many runs, then a count cut off from its duration, which is not a run.
    Bytes runs;
    uint32_t total = 0;
    for (uint32_t i = 1; i <= 5000; ++i) {
        moviekit::PutBytes(runs, U32s({i, 1}));
        total += i;
    }
    moviekit::PutU32(runs, 777);
    ASSERT_EQ(Load(TrackMovie("soun", {stsd, Table("stts", 5000, runs)})), eTqovixSuccess);
    CTqovixAudioInformationVisitor visitor;
    EXPECT_EQ(m_tree.Analyze(visitor), eTqovixSuccess) << "without edits the second table finishes the walk";
    EXPECT_EQ(visitor.GetCount(), total);
    EXPECT_EQ(visitor.GetRate(), 48u);
    EXPECT_EQ(visitor.GetMediaTime(), 0u);

    const Bytes stts = Table("stts", 1, U32s({10, 1}));
    const Bytes wholeEdit = Container("edts", {Atom("elst", U32s({0, 1, 900, 2112, 0x10000}))});
    ASSERT_EQ(Load(TrackMovie("soun", {stsd, stts}, {wholeEdit})), eTqovixSuccess);
    CTqovixAudioInformationVisitor edited;
    EXPECT_EQ(m_tree.Analyze(edited), eTqovixSuccess);
    EXPECT_EQ(edited.GetMediaTime(), 2112u);
    EXPECT_EQ(edited.GetCount(), 10u);

    const Bytes cutEdit = Container("edts", {Atom("elst", U32s({0, 1, 900, 2112}))});
    ASSERT_EQ(Load(TrackMovie("soun", {stsd, stts}, {cutEdit})), eTqovixSuccess);
    CTqovixAudioInformationVisitor cut;
    EXPECT_EQ(m_tree.Analyze(cut), eTqovixErrorInvalidMovie) << "an edit entry without its rate is not whole";

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
    for (const moviekit::MovieSpec& recipe : {pcm, wide, aac}) {
        moviekit::MovieLayout layout;
        ASSERT_EQ(Load(moviekit::BuildMovie(recipe, &layout)), eTqovixSuccess);
        const bool isAac = recipe.sound.codec == moviekit::SoundCodec::Aac;

        CTqovixAudioDataVisitor sound;
        ASSERT_EQ(m_tree.Analyze(sound), eTqovixSuccess);
        std::vector<TqovixChunkInformation> soundChunks;
        ASSERT_EQ(sound.GetAudioChunkInformation(soundChunks, 4), eTqovixSuccess);
        EXPECT_EQ(soundChunks, testsupport::ChunkTableOf(layout.soundChunks, isAac));

        CTqovixMovieDataVisitor video;
        ASSERT_EQ(m_tree.Analyze(video), eTqovixSuccess);
        std::vector<TqovixChunkInformation> videoChunks;
        ASSERT_EQ(video.GetOffset(videoChunks), eTqovixSuccess);
        EXPECT_EQ(videoChunks, testsupport::ChunkTableOf(layout.videoChunks, recipe.video.perSampleSizes));

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
    unsigned int bytesPerFrame = 4;
};

void PrintTo(const TableCase& c, std::ostream* os) { *os << c.name; }

class SampleTableTest : public TrackTest, public ::testing::WithParamInterface<TableCase> {};

TEST_P(SampleTableTest, BuildsChunksOrRefusesContradictions)
{
    ASSERT_EQ(Load(TrackMovie("soun", GetParam().tables)), eTqovixSuccess);
    CTqovixAudioDataVisitor visitor;
    const eTqovixErrorCode walk = m_tree.Analyze(visitor);
    std::vector<TqovixChunkInformation> chunks;
    const unsigned int frame = GetParam().bytesPerFrame;
    const eTqovixErrorCode built = walk == eTqovixSuccess ? visitor.GetAudioChunkInformation(chunks, frame) : walk;
    EXPECT_EQ(built, GetParam().expected);
    if (GetParam().expected == eTqovixSuccess) {
        std::vector<uint32_t> counts;
        for (const auto& chunk : chunks) {
            counts.push_back(chunk.sampleCount);
            EXPECT_EQ(chunk.size, chunk.sampleCount * frame);
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
    {"SizeCountFieldIgnored",
     {Table("stsc", 1, U32s({1, 2, 1})), Table("stsz", 0, U32s({0xFFFFFFFF, 4, 4})), Table("co64", 9, U64s({8}))},
     eTqovixSuccess, {2}},
    {"FirstChunkNotOne", {Table("stsc", 1, U32s({2, 3, 1})), Sizes(1, {}), kSixOffsets}, eTqovixErrorInvalidMovie, {}},
    {"RunRepeatsItsFirstChunk", {Table("stsc", 2, U32s({1, 3, 1, 1, 2, 1})), Sizes(1, {}), kSixOffsets},
     eTqovixErrorInvalidMovie, {}},
    {"SizesPastFourGiB", {Table("stsc", 1, U32s({1, 2, 1})), Sizes(0, {0xFFFFFFFF, 1}), Table("stco", 1, U32s({8}))},
     eTqovixErrorInvalidMovie, {}},
    // 2^31 samples of 2^31 bytes, 8 each: a product past 64 bits must not wrap to a small chunk.
    {"ProductPastSixtyFourBits", {Table("stsc", 1, U32s({1, 0x80000000, 1})), Sizes(8, {}), Table("stco", 1, U32s({8}))},
     eTqovixErrorInvalidMovie, {}, 0x80000000},
};

INSTANTIATE_TEST_SUITE_P(Tables, SampleTableTest, ::testing::ValuesIn(kTableCases),
                         [](const ::testing::TestParamInfo<TableCase>& info) { return std::string(info.param.name); });

// Chunks of stsc {1, 3}, {5, 2} over six offsets; with `sizes`, each takes the next sizes in order.
TEST_F(TrackTest, UpdateWalksRewriteOnlyTheirTablesAndReadBackAsSet)
{
    struct Case {
        const char* name;
        moviekit::SoundCodec codec;
        bool co64;
        uint64_t shift;
    };
    const Case cases[] = {{"aac with co64", moviekit::SoundCodec::Aac, true, 5ULL << 32},
                          {"pcm with stco", moviekit::SoundCodec::Twos, false, 1000}};
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        moviekit::MovieSpec recipe;
        recipe.sound.codec = c.codec;
        recipe.co64 = c.co64;
        recipe.video.perSampleSizes = true;
        moviekit::MovieLayout layout;
        ASSERT_EQ(Load(moviekit::BuildMovie(recipe, &layout)), eTqovixSuccess);
        const bool aac = c.codec == moviekit::SoundCodec::Aac;
        const std::string offsets = c.co64 ? "co64" : "stco";
        const Bytes before = WriteTree();

        std::vector<TqovixChunkInformation> sound = testsupport::ChunkTableOf(layout.soundChunks, aac);
        for (auto& chunk : sound) {
            chunk.offset += c.shift;
            for (auto& size : chunk.sampleSizes) {
                size += 3;
                chunk.size += 3;
            }
        }
        CTqovixAudioDataVisitor soundWriter;
        soundWriter.SetAudioChunkInformation(sound);
        ASSERT_EQ(m_tree.Update(soundWriter), eTqovixSuccess);
        const Bytes afterSound = WriteTree();
        auto soundBefore = TrackTables(before, "soun");
        auto soundAfter = TrackTables(afterSound, "soun");
        EXPECT_EQ(TrackTables(afterSound, "vide"), TrackTables(before, "vide")) << "the video track is not touched";
        EXPECT_EQ(soundAfter["stsc"], soundBefore["stsc"]);
        EXPECT_NE(soundAfter[offsets], soundBefore[offsets]);
        if (aac) {
            ASSERT_EQ(soundAfter["stsz"].size(), soundBefore["stsz"].size());
            EXPECT_TRUE(std::equal(soundBefore["stsz"].begin(), soundBefore["stsz"].begin() + 20, soundAfter["stsz"].begin()))
                << "header, common size and count stay";
        } else {
            EXPECT_EQ(soundAfter["stsz"], soundBefore["stsz"]) << "a common sample size is left as it is";
        }

        std::vector<TqovixChunkInformation> video = testsupport::ChunkTableOf(layout.videoChunks, false);
        for (auto& chunk : video) {
            chunk.offset = chunk.offset * 3 + 1;
        }
        CTqovixMovieDataVisitor videoWriter;
        videoWriter.SetOffset(video);
        ASSERT_EQ(m_tree.Update(videoWriter), eTqovixSuccess);
        const Bytes after = WriteTree();
        auto videoBefore = TrackTables(before, "vide");
        auto videoAfter = TrackTables(after, "vide");
        EXPECT_EQ(TrackTables(after, "soun"), soundAfter) << "the sound track is not touched";
        EXPECT_EQ(videoAfter["stsc"], videoBefore["stsc"]);
        EXPECT_EQ(videoAfter["stsz"], videoBefore["stsz"]);
        EXPECT_NE(videoAfter[offsets], videoBefore[offsets]);
        ASSERT_EQ(after.size(), before.size()) << "tables keep their kind and length";

        ASSERT_EQ(Load(after), eTqovixSuccess);
        CTqovixAudioDataVisitor soundReader;
        ASSERT_EQ(m_tree.Analyze(soundReader), eTqovixSuccess);
        std::vector<TqovixChunkInformation> soundRead;
        EXPECT_EQ(soundReader.GetAudioChunkInformation(soundRead, 4), eTqovixSuccess);
        EXPECT_EQ(soundRead, sound);
        CTqovixMovieDataVisitor videoReader;
        ASSERT_EQ(m_tree.Analyze(videoReader), eTqovixSuccess);
        std::vector<TqovixChunkInformation> videoRead;
        EXPECT_EQ(videoReader.GetOffset(videoRead), eTqovixSuccess);
        ASSERT_EQ(videoRead.size(), video.size());
        for (size_t i = 0; i < video.size(); ++i) {
            EXPECT_EQ(videoRead[i].offset, video[i].offset);
            EXPECT_EQ(videoRead[i].sampleSizes, layout.videoChunks[i].sampleSizes);
        }
    }
}

eTqovixErrorCode UpdateSound(const CTqovixAtomControl& tree, const std::vector<TqovixChunkInformation>& chunks)
{
    CTqovixAudioDataVisitor visitor;
    visitor.SetAudioChunkInformation(chunks);
    return tree.Update(visitor);
}

eTqovixErrorCode UpdateVideo(const CTqovixAtomControl& tree, const std::vector<TqovixChunkInformation>& chunks)
{
    CTqovixMovieDataVisitor visitor;
    visitor.SetOffset(chunks);
    return tree.Update(visitor);
}

TEST_F(TrackTest, UpdatesThatCannotBeWrittenReplaceNoPayload)
{
    using Chunks = std::vector<TqovixChunkInformation>;
    struct Refused {
        const char* name;
        moviekit::SoundCodec codec;
        bool video;
        std::function<void(Chunks&)> change;
    };
    const Refused cases[] = {
        {"sound offset past an stco", moviekit::SoundCodec::Twos, false, [](Chunks& c) { c.back().offset = 1ULL << 32; }},
        {"fewer sound records", moviekit::SoundCodec::Twos, false, [](Chunks& c) { c.pop_back(); }},
        {"more sound records", moviekit::SoundCodec::Twos, false, [](Chunks& c) { c.push_back(c.back()); }},
        {"no sound records", moviekit::SoundCodec::Twos, false, [](Chunks& c) { c.clear(); }},
        {"fewer sample sizes", moviekit::SoundCodec::Aac, false, [](Chunks& c) { c.back().sampleSizes.pop_back(); }},
        {"more sample sizes", moviekit::SoundCodec::Aac, false, [](Chunks& c) { c.front().sampleSizes.push_back(9); }},
        {"video offset past an stco", moviekit::SoundCodec::Twos, true, [](Chunks& c) { c.back().offset = 1ULL << 32; }},
        {"fewer video records", moviekit::SoundCodec::Twos, true, [](Chunks& c) { c.pop_back(); }},
        {"no video records", moviekit::SoundCodec::Twos, true, [](Chunks& c) { c.clear(); }},
    };
    for (const Refused& c : cases) {
        SCOPED_TRACE(c.name);
        moviekit::MovieSpec recipe;
        recipe.sound.codec = c.codec;
        moviekit::MovieLayout layout;
        const Bytes movie = moviekit::BuildMovie(recipe, &layout);
        ASSERT_EQ(Load(movie), eTqovixSuccess);
        Chunks chunks = c.video ? testsupport::ChunkTableOf(layout.videoChunks, false)
                                : testsupport::ChunkTableOf(layout.soundChunks, c.codec == moviekit::SoundCodec::Aac);
        c.change(chunks);
        EXPECT_EQ(c.video ? UpdateVideo(m_tree, chunks) : UpdateSound(m_tree, chunks), eTqovixErrorInternal);
        EXPECT_EQ(WriteTree(), movie);
    }

    // More video records than entries are ignored.
    moviekit::MovieLayout layout;
    ASSERT_EQ(Load(moviekit::BuildMovie(moviekit::MovieSpec{}, &layout)), eTqovixSuccess);
    Chunks extra = testsupport::ChunkTableOf(layout.videoChunks, false);
    extra.push_back(extra.back());
    EXPECT_EQ(UpdateVideo(m_tree, extra), eTqovixSuccess);

    // An empty offset table cannot be rewritten, and no list at all must not
    // write the visitor's blank record over a one-chunk table.
    const Chunks one(1);
    for (const char* subtype : {"soun", "vide"}) {
        SCOPED_TRACE(subtype);
        const bool sound = subtype[0] == 's';
        const Bytes empty = TrackMovie(subtype, {Table("stsc", 1, U32s({1, 1, 1})), Sizes(1, {}), Atom("stco", {})});
        ASSERT_EQ(Load(empty), eTqovixSuccess);
        EXPECT_EQ(sound ? UpdateSound(m_tree, one) : UpdateVideo(m_tree, one), eTqovixErrorOutOfMemory);
        EXPECT_EQ(WriteTree(), empty);

        const Bytes oneChunk =
            TrackMovie(subtype, {Table("stsc", 1, U32s({1, 1, 1})), Sizes(1, {}), Table("stco", 1, U32s({4096}))});
        ASSERT_EQ(Load(oneChunk), eTqovixSuccess);
        EXPECT_EQ(sound ? UpdateSound(m_tree, {}) : UpdateVideo(m_tree, {}), eTqovixErrorInternal);
        EXPECT_EQ(WriteTree(), oneChunk);
    }
}

}  // namespace
