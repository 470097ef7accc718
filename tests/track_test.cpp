#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "ByteWriter.h"
#include "Movie.h"
#include "atom/CTqovixAtomControl.h"
#include "file/CTqovixFile.h"
#include "support/ChunkTables.h"
#include "support/TestSupport.h"
#include "visitor/CTqovixAudioDataVisitor.h"
#include "visitor/CTqovixAudioInformationVisitor.h"
#include "visitor/CTqovixMovieDataVisitor.h"

using moviekit::Atom;
using moviekit::Bytes;
using moviekit::Container;
using moviekit::SoundCodec;
using Chunks = std::vector<TqovixChunkInformation>;
using Recipe = moviekit::MovieRecipe;

namespace {

Bytes U32s(const std::vector<uint32_t>& values)
{
    Bytes out;
    for (uint32_t value : values) {
        moviekit::PutU32(out, value);
    }
    return out;
}

// A movie whose only track holds the given handler subtype and sample tables.
Bytes TrackMovie(const char* subtype, const std::vector<Bytes>& tables, const std::vector<Bytes>& beforeMedia = {})
{
    const Bytes handler =
        moviekit::Concat({Bytes(4, 0), Bytes{'m', 'h', 'l', 'r'}, Bytes(subtype, subtype + 4), Bytes(12, 0)});
    std::vector<Bytes> track = beforeMedia;
    track.push_back(Container("mdia", {Atom("hdlr", handler), Container("minf", {Container("stbl", tables)})}));
    return moviekit::Concat({Atom("ftyp", Bytes{'q', 't', ' ', ' '}), Container("moov", {Container("trak", track)})});
}

Bytes Table(const char* type, uint32_t declaredCount, const Bytes& entries)
{
    return Atom(type, moviekit::Concat({U32s({0, declaredCount}), entries}));
}

Bytes Sizes(uint32_t common, std::vector<uint32_t> sizes)
{
    sizes.insert(sizes.begin(), static_cast<uint32_t>(sizes.size()));
    return Table("stsz", common, U32s(sizes));
}

eTqovixErrorCode UpdateChunks(const CTqovixAtomControl& tree, bool video, const Chunks& chunks)
{
    CTqovixAudioDataVisitor sound;
    CTqovixMovieDataVisitor picture;
    video ? picture.SetOffset(chunks) : sound.SetAudioChunkInformation(chunks);
    return video ? tree.Update(picture) : tree.Update(sound);
}

class TrackTest : public ::testing::Test {
protected:
    eTqovixErrorCode Load(const Bytes& movie)
    {
        m_tree.Close();
        m_file.Close();
        const std::string path = m_dir.File("movie" + std::to_string(m_files++) + ".mov");
        EXPECT_TRUE(testsupport::WriteFile(path, movie));
        EXPECT_EQ(m_file.Open(path.c_str(), 1), eTqovixSuccess);
        return m_tree.Initialize(m_file);
    }

    Bytes WriteTree()
    {
        TqovixAtomList atoms;
        m_tree.GetAtoms(atoms);
        CTqovixFile out;
        const std::string path = m_dir.File("written" + std::to_string(m_files++) + ".mov");
        EXPECT_EQ(out.Open(path.c_str(), 2), eTqovixSuccess);
        for (const auto& atom : atoms) {
            EXPECT_EQ(atom->Write(out), eTqovixSuccess);
        }
        out.Close();
        return testsupport::ReadFile(path);
    }

    testsupport::TempDir m_dir;
    CTqovixFile m_file;
    CTqovixAtomControl m_tree;
    int m_files = 0;
};

TEST_F(TrackTest, SoundDescriptionsAreReadOrRefused)
{
    const auto esds = [](const Bytes& descriptors) {
        return [descriptors](Recipe& s) { s.sound.esds.rawPayload = moviekit::Concat({U32s({0}), descriptors}); };
    };
    const eTqovixErrorCode ok = eTqovixSuccess, bad = eTqovixErrorInvalidMovie;
    const struct {
        const char* name;
        std::function<void(Recipe&)> change;
        eTqovixErrorCode expected;
    } cases[] = {
        {"sowt", [](Recipe& s) { s.sound.codec = SoundCodec::Sowt; }, ok},
        {"no edit list", [](Recipe& s) { s.sound.edts = false; }, ok},
        {"edits without a list", [](Recipe& s) { s.sound.elst = false; }, bad},
        {"description version 2", [](Recipe& s) { s.sound.descriptionVersion = 2; }, bad},
        {"long descriptor sizes", [](Recipe& s) { s.sound.esds.longSizes = true; }, ok},
        {"optional ES fields", [](Recipe& s) { s.sound.esds.esFlags = 0xE0; }, ok},
        {"profile after config", [](Recipe& s) { s.sound.esds.profileLevelAfterConfig = true; }, bad},
        {"zero average bit rate", [](Recipe& s) { s.sound.esds.averageBitRate = 0; }, bad},
        {"empty esds", esds({}), bad},
        {"decoder config deeper than its parent",
         esds({3, 20, 0, 1, 0, 4, 16, 0x40, 0x15, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1, 0, 5, 60, 0x11}), bad},
        {"two-byte size form", esds({3, 0x81, 0x10, 0, 1, 0, 4, 13, 0x40, 0x15, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1, 0}), bad},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        Recipe recipe;
        recipe.sound.codec = SoundCodec::Aac;
        recipe.sound.sampleRate = 44100;
        recipe.sound.channels = 1;
        recipe.sound.mediaTime = 2112;
        c.change(recipe);
        moviekit::MovieLayout layout;
        ASSERT_EQ(Load(moviekit::BuildMovie(recipe, &layout)), eTqovixSuccess);
        CTqovixAudioInformationVisitor v;
        EXPECT_EQ(m_tree.Analyze(v), c.expected);
        EXPECT_EQ(m_tree.Update(v), eTqovixErrorInternal) << "the format visitor only reads";
        if (c.expected != ok) {
            continue;
        }
        const SoundCodec codec = recipe.sound.codec;
        EXPECT_EQ(v.GetRate(), recipe.sound.sampleRate / 1000);
        EXPECT_EQ(v.GetChannel(), recipe.sound.channels);
        EXPECT_EQ(v.GetCount(), layout.soundSampleCount);
        EXPECT_EQ(v.IsBigEndianFormat(), codec == SoundCodec::Twos);
        EXPECT_EQ(v.GetPriming(), codec == SoundCodec::Sowt ? 0u : 1024u);
        EXPECT_EQ(v.GetMediaTime(), recipe.sound.edts ? 2112u : 0u);
        const Bytes config = codec == SoundCodec::Aac
                                 ? moviekit::MakeAudioSpecificConfig(recipe.sound.sampleRate, recipe.sound.channels)
                                 : Bytes{};
        ASSERT_EQ(v.GetAudioSpecificConfigSize(), config.size());
        EXPECT_EQ(Bytes(v.GetAudioSpecificConfigData(), v.GetAudioSpecificConfigData() + config.size()), config);
    }
}

TEST_F(TrackTest, SampleTotalComesFromWholeEntriesOnly)
{
    const Bytes stsd = Atom("stsd", moviekit::Concat({U32s({0, 1, 36}), Bytes{'t', 'w', 'o', 's'}, Bytes(8, 0),
                                                       U32s({0, 0, 0x00020010, 0, 48000u << 16})}));
    const Bytes stts = Table("stts", 1, U32s({10, 1}));
    const std::pair<const char*, Bytes> refused[] = {
        {"edit without its rate",
         TrackMovie("soun", {stsd, stts}, {Container("edts", {Atom("elst", U32s({0, 1, 900, 2112}))})})},
        {"total past 32 bits", TrackMovie("soun", {stsd, Table("stts", 2, U32s({0xFFFFFFF0, 1, 0x20, 1}))})},
        {"description too short", TrackMovie("soun", {Atom("stsd", Bytes(20, 0)), stts})},
        {"only a video track", TrackMovie("vide", {stsd, stts})},
    };
    for (const auto& [name, movie] : refused) {
        SCOPED_TRACE(name);
        ASSERT_EQ(Load(movie), eTqovixSuccess);
        CTqovixAudioInformationVisitor visitor;
        EXPECT_EQ(m_tree.Analyze(visitor), eTqovixErrorInvalidMovie);
    }
    // Without edits the second table finishes the walk; a count cut off from its duration is no run.
    ASSERT_EQ(Load(TrackMovie("soun", {stsd, Table("stts", 3, U32s({3, 1, 4, 1, 777}))})), eTqovixSuccess);
    CTqovixAudioInformationVisitor visitor;
    EXPECT_EQ(m_tree.Analyze(visitor), eTqovixSuccess);
    EXPECT_EQ(visitor.GetCount(), 7u);
}

TEST_F(TrackTest, SampleTablesBuildChunksOrRefuseContradictions)
{
    const Bytes six = Table("stco", 6, U32s({100, 200, 300, 400, 500, 600})), one = Table("stco", 1, U32s({8}));
    const Bytes two = Table("stco", 2, U32s({8, 16})), common = Sizes(1, {});
    const auto runs = [](std::initializer_list<uint32_t> entries) {
        return Table("stsc", static_cast<uint32_t>(entries.size() / 3), U32s(entries));
    };
    const struct {
        const char* name;
        std::vector<Bytes> tables;
        std::vector<uint32_t> sampleCounts;  // per chunk; none when refused
        unsigned int bytesPerFrame = 4;
    } cases[] = {
        {"two runs", {runs({1, 3, 1, 5, 2, 1}), common, six}, {3, 3, 3, 3, 2, 2}},
        {"count fields ignored", {Table("stsc", ~0u, U32s({1, 2, 1})), common, Table("stco", ~0u, U32s({8}))}, {2}},
        {"size count field ignored",
         {runs({1, 2, 1}), Table("stsz", 0, U32s({~0u, 4, 4})), Table("co64", 9, U32s({0, 8}))}, {2}},
        {"first chunk not one", {runs({2, 3, 1}), common, six}, {}},
        {"run repeats its first chunk", {runs({1, 3, 1, 1, 2, 1}), common, six}, {}},
        {"run past the chunks", {runs({1, 3, 1, 9, 2, 1}), common, six}, {}},
        {"no chunks", {runs({1, 3, 1}), common, Table("stco", 0, {})}, {}},
        {"missing table", {runs({1, 3, 1}), six}, {}},
        {"sizes run out", {runs({1, 2, 1}), Sizes(0, {4, 4, 4}), two}, {}},
        {"sizes left over", {runs({1, 1, 1}), Sizes(0, {4, 4, 4}), two}, {}},
        {"sizes past 4 GiB", {runs({1, 2, 1}), Sizes(0, {~0u, 1}), one}, {}},
        {"chunk of exactly 4 GiB", {runs({1, 0x40000000, 1}), common, one}, {}},
        // 2^31 samples of 2^31 bytes, 8 each: a product past 64 bits must not wrap to a small chunk.
        {"product past 64 bits", {runs({1, 0x80000000, 1}), Sizes(8, {}), one}, {}, 0x80000000},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        ASSERT_EQ(Load(TrackMovie("soun", c.tables)), eTqovixSuccess);
        CTqovixAudioDataVisitor visitor;
        Chunks chunks;
        eTqovixErrorCode built = m_tree.Analyze(visitor);
        built = built == eTqovixSuccess ? visitor.GetAudioChunkInformation(chunks, c.bytesPerFrame) : built;
        EXPECT_EQ(built, c.sampleCounts.empty() ? eTqovixErrorInvalidMovie : eTqovixSuccess);
        if (built != eTqovixSuccess) {
            continue;
        }
        std::vector<uint32_t> counts;
        for (const auto& chunk : chunks) {
            counts.push_back(chunk.sampleCount);
            EXPECT_EQ(chunk.size, chunk.sampleCount * c.bytesPerFrame);
        }
        EXPECT_EQ(counts, c.sampleCounts);
    }
}

TEST(ChunkBoundsTest, ChunksMayEndAtTheFileEndButNotBeyondOrWrapAround)
{
    Chunks chunks = {{100, 50, {}, 1, 0}, {150, 0, {}, 2, 0}};  // offset, size, sizes, number, samples
    EXPECT_EQ(TqovixCheckChunksInFile(chunks, 150), eTqovixSuccess);
    EXPECT_EQ(TqovixCheckChunksInFile(chunks, 149), eTqovixErrorInvalidMovie);
    chunks[0].size = 0;
    EXPECT_EQ(TqovixCheckChunksInFile(chunks, 149), eTqovixErrorInvalidMovie) << "an empty chunk past the end";
    chunks[1] = {~0ULL - 2, 8, {}, 2, 0};
    EXPECT_EQ(TqovixCheckChunksInFile(chunks, ~0ULL), eTqovixErrorInvalidMovie);
}

TEST_F(TrackTest, UpdatesThatCannotBeWrittenReplaceNoPayload)
{
    const struct {
        const char* name;
        SoundCodec codec;
        bool video;
        std::function<void(Chunks&)> change;
        eTqovixErrorCode expected = eTqovixErrorInternal;
    } cases[] = {
        {"sound offset past an stco", SoundCodec::Twos, false, [](Chunks& c) { c.back().offset = 1ULL << 32; }},
        {"fewer sound records", SoundCodec::Twos, false, [](Chunks& c) { c.pop_back(); }},
        {"more sample sizes", SoundCodec::Aac, false, [](Chunks& c) { c.front().sampleSizes.push_back(9); }},
        {"fewer video records", SoundCodec::Twos, true, [](Chunks& c) { c.pop_back(); }},
        // More video records than entries are ignored, so this one rewrites the same offsets.
        {"more video records", SoundCodec::Twos, true, [](Chunks& c) { c.push_back(c.back()); }, eTqovixSuccess},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        Recipe recipe;
        recipe.sound.codec = c.codec;
        moviekit::MovieLayout layout;
        const Bytes movie = moviekit::BuildMovie(recipe, &layout);
        ASSERT_EQ(Load(movie), eTqovixSuccess);
        Chunks chunks = testsupport::ChunkTableOf(c.video ? layout.videoChunks : layout.soundChunks,
                                                  !c.video && c.codec == SoundCodec::Aac);
        c.change(chunks);
        EXPECT_EQ(UpdateChunks(m_tree, c.video, chunks), c.expected);
        EXPECT_EQ(WriteTree(), movie);
    }

    // An empty offset table cannot be rewritten, and no list at all must not
    // write the visitor's blank record over a one-chunk table.
    for (const char* subtype : {"soun", "vide"}) {
        SCOPED_TRACE(subtype);
        const bool video = subtype[0] == 'v';
        const Bytes stsc = Table("stsc", 1, U32s({1, 1, 1})), common = Sizes(1, {});
        const Bytes empty = TrackMovie(subtype, {stsc, common, Atom("stco", {})});
        ASSERT_EQ(Load(empty), eTqovixSuccess);
        EXPECT_EQ(UpdateChunks(m_tree, video, Chunks(1)), eTqovixErrorOutOfMemory);
        EXPECT_EQ(WriteTree(), empty);
        const Bytes oneChunk = TrackMovie(subtype, {stsc, common, Table("stco", 1, U32s({4096}))});
        ASSERT_EQ(Load(oneChunk), eTqovixSuccess);
        EXPECT_EQ(UpdateChunks(m_tree, video, {}), eTqovixErrorInternal);
        EXPECT_EQ(WriteTree(), oneChunk);
    }
}

}  // namespace
