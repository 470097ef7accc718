#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <functional>
#include <map>
#include <set>
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
using moviekit::SoundCodec;
using Chunks = std::vector<TqovixChunkInformation>;
using Recipe = moviekit::MovieRecipe;
using Keys = std::set<std::string>;

// Outside the anonymous namespace so that GoogleTest finds it beside the type.
void PrintTo(const TqovixChunkInformation& c, std::ostream* os)
{
    *os << "{offset " << c.offset << ", size " << c.size << ", samples " << c.sampleCount << ", chunk "
        << c.chunkNumber << ", sizes " << c.sampleSizes.size() << "}";
}

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
    Bytes handler = U32s({0});
    moviekit::PutString(handler, "mhlr");
    moviekit::PutString(handler, subtype);
    moviekit::PutBytes(handler, Bytes(12, 0));
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

// Each track's leaves behind its media handler, header included, keyed "subtype/type".
std::map<std::string, Bytes> TrackLeaves(const Bytes& file, size_t at = 0, size_t end = SIZE_MAX,
                                         const std::string& parent = "", std::string subtype = "")
{
    std::map<std::string, Bytes> leaves;
    end = std::min(end, file.size());
    for (size_t size = 0; at + 8 <= end; at += size) {
        size = TqovixReadBE32(file.data() + at);
        const std::string type(file.begin() + at + 4, file.begin() + at + 8);
        if (size < 8 || size > end - at) {
            break;
        } else if (type == "hdlr" && parent == "mdia" && size >= 20) {
            subtype.assign(file.begin() + at + 16, file.begin() + at + 20);
        } else if (type == "moov" || type == "trak" || type == "mdia" || type == "minf" || type == "stbl") {
            leaves.merge(TrackLeaves(file, at + 8, at + size, type, type == "trak" ? "" : subtype));
        } else if (!subtype.empty()) {
            leaves[subtype + "/" + type] = Bytes(file.begin() + at, file.begin() + at + size);
        }
    }
    return leaves;
}

// The track leaves that differ between two files.
Keys Changed(const Bytes& before, const Bytes& after)
{
    auto a = TrackLeaves(before), b = TrackLeaves(after);
    EXPECT_EQ(a.size(), b.size());
    Keys changed;
    for (const auto& [key, bytes] : a) {
        if (b[key] != bytes) {
            changed.insert(key);
        }
    }
    return changed;
}

// One track's chunk list: the walk's failure, or what building the list gave.
eTqovixErrorCode ReadChunks(const CTqovixAtomControl& tree, bool video, Chunks& out, unsigned int bytesPerFrame = 4)
{
    CTqovixAudioDataVisitor sound;
    CTqovixMovieDataVisitor picture;
    const eTqovixErrorCode walk = video ? tree.Analyze(picture) : tree.Analyze(sound);
    if (walk != eTqovixSuccess) {
        return walk;
    }
    return video ? picture.GetOffset(out) : sound.GetAudioChunkInformation(out, bytesPerFrame);
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

    eTqovixErrorCode LoadRecipe(const Recipe& recipe, moviekit::MovieLayout* layout = nullptr)
    {
        m_movie = moviekit::BuildMovie(recipe, layout);
        return Load(m_movie);
    }

    // The tree's top-level atoms as written to a file.
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
    Bytes m_movie;
    int m_files = 0;
};

TEST_F(TrackTest, SoundDescriptionsAreReadOrRefused)
{
    const auto camera = [](SoundCodec codec, uint32_t rate, uint16_t channels) {
        return [=](Recipe& s) {
            s.sound.codec = codec;
            s.sound.sampleRate = rate;
            s.sound.channels = channels;
            s.sound.mediaTime = 2112;
            s.soundTrackFirst = rate == 44100;
        };
    };
    const auto esds = [](const Bytes& descriptors) {
        return [descriptors](Recipe& s) { s.sound.esds.rawPayload = moviekit::Concat({U32s({0}), descriptors}); };
    };
    const eTqovixErrorCode ok = eTqovixSuccess, bad = eTqovixErrorInvalidMovie;
    const struct {
        const char* name;
        std::function<void(Recipe&)> change;
        eTqovixErrorCode expected;
    } cases[] = {
        {"twos, 48 kHz stereo", camera(SoundCodec::Twos, 48000, 2), ok},
        {"sowt, 44.1 kHz mono, sound first", camera(SoundCodec::Sowt, 44100, 1), ok},
        {"AAC, 32 kHz stereo", camera(SoundCodec::Aac, 32000, 2), ok},
        {"AAC, 44.1 kHz mono, sound first", camera(SoundCodec::Aac, 44100, 1), ok},
        {"no edit list", [](Recipe& s) { s.sound.edts = false; }, ok},
        {"edits without a list", [](Recipe& s) { s.sound.elst = false; }, bad},
        {"description version 2", [](Recipe& s) { s.sound.descriptionVersion = 2; }, bad},
        {"long descriptor sizes", [](Recipe& s) { s.sound.esds.longSizes = true; }, ok},
        {"priority bits only", [](Recipe& s) { s.sound.esds.esFlags = 0x1F; }, ok},
        {"optional ES fields", [](Recipe& s) { s.sound.esds.esFlags = 0xE0; }, ok},
        {"profile after config", [](Recipe& s) { s.sound.esds.profileLevelAfterConfig = true; }, bad},
        {"zero average bit rate", [](Recipe& s) { s.sound.esds.averageBitRate = 0; }, bad},
        {"empty esds", esds({}), bad},
        {"ES descriptor of 100 bytes in 10", esds({3, 100, 0, 1, 0, 4, 2, 0x40, 0x15}), bad},
        {"specific info deeper than its parent",
         esds({3, 20, 0, 1, 0, 4, 16, 0x40, 0x15, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1, 0, 5, 60, 0x11}), bad},
        {"two-byte size form", esds({3, 0x81, 0x10, 0, 1, 0, 4, 13, 0x40, 0x15, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1, 0}), bad},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        Recipe recipe;
        recipe.sound.codec = SoundCodec::Aac;
        c.change(recipe);
        moviekit::MovieLayout layout;
        ASSERT_EQ(LoadRecipe(recipe, &layout), eTqovixSuccess);
        CTqovixAudioInformationVisitor v;
        EXPECT_EQ(m_tree.Analyze(v), c.expected);
        EXPECT_EQ(m_tree.Update(v), eTqovixErrorInternal) << "the format visitor only reads";
        if (c.expected != ok) {
            continue;
        }
        const SoundCodec codec = recipe.sound.codec;
        EXPECT_EQ(v.GetRate(), recipe.sound.sampleRate / 1000);
        EXPECT_EQ(v.GetChannel(), recipe.sound.channels);
        EXPECT_EQ(v.GetSize(), 16);
        EXPECT_EQ(v.GetCount(), layout.soundSampleCount);
        EXPECT_EQ(v.IsBigEndianFormat(), codec == SoundCodec::Twos);
        EXPECT_EQ(v.GetPriming(), codec == SoundCodec::Sowt ? 0u : 1024u);
        EXPECT_EQ(v.GetMediaTime(), recipe.sound.edts ? recipe.sound.mediaTime.value_or(1024) : 0u);
        const Bytes config = codec == SoundCodec::Aac
                                 ? moviekit::MakeAudioSpecificConfig(recipe.sound.sampleRate, recipe.sound.channels)
                                 : Bytes{};
        ASSERT_EQ(v.GetAudioSpecificConfigSize(), config.size());
        EXPECT_EQ(Bytes(v.GetAudioSpecificConfigData(), v.GetAudioSpecificConfigData() + config.size()), config);
        EXPECT_TRUE(config.empty() || v.GetAverageBitRate() > 0);
    }
}

TEST_F(TrackTest, SampleTotalAndMediaTimeComeFromWholeEntriesOnly)
{
    const Bytes stsd = Atom("stsd", moviekit::Concat({U32s({0, 1, 36}), Bytes{'t', 'w', 'o', 's'}, Bytes(8, 0),
                                                       U32s({0, 0, 0x00020010, 0, 48000u << 16})}));
    // Many runs, then a count cut off from its duration, which is not a run.
    Bytes runs;
    uint32_t total = 0;
    for (uint32_t i = 1; i <= 5000; ++i) {
        moviekit::PutBytes(runs, U32s({i, 1}));
        total += i;
    }
    moviekit::PutU32(runs, 777);
    const Bytes stts = Table("stts", 1, U32s({10, 1}));
    const eTqovixErrorCode ok = eTqovixSuccess, bad = eTqovixErrorInvalidMovie;
    const auto edit = [](const Bytes& entry) { return Container("edts", {Atom("elst", entry)}); };
    const struct {
        const char* name;
        Bytes movie;
        eTqovixErrorCode expected;
        uint32_t count = 0, mediaTime = 0;
    } cases[] = {
        // Without edits the second table finishes the walk.
        {"runs", TrackMovie("soun", {stsd, Table("stts", 5000, runs)}), ok, total, 0},
        {"whole edit", TrackMovie("soun", {stsd, stts}, {edit(U32s({0, 1, 900, 2112, 0x10000}))}), ok, 10, 2112},
        {"edit without its rate", TrackMovie("soun", {stsd, stts}, {edit(U32s({0, 1, 900, 2112}))}), bad},
        {"total past 32 bits", TrackMovie("soun", {stsd, Table("stts", 2, U32s({0xFFFFFFF0, 1, 0x20, 1}))}), bad},
        {"description too short", TrackMovie("soun", {Atom("stsd", Bytes(20, 0)), stts}), bad},
        {"only a video track", TrackMovie("vide", {stsd, stts}), bad},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        ASSERT_EQ(Load(c.movie), eTqovixSuccess);
        CTqovixAudioInformationVisitor visitor;
        EXPECT_EQ(m_tree.Analyze(visitor), c.expected);
        if (c.expected == ok) {
            EXPECT_EQ(visitor.GetCount(), c.count);
            EXPECT_EQ(visitor.GetMediaTime(), c.mediaTime);
            EXPECT_EQ(visitor.GetRate(), 48u);
        }
    }
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
        {"one run to the end", {runs({1, 9, 1}), common, six}, {9, 9, 9, 9, 9, 9}},
        {"count fields ignored", {Table("stsc", ~0u, U32s({1, 2, 1})), common, Table("stco", ~0u, U32s({8}))}, {2}},
        {"size count field ignored",
         {runs({1, 2, 1}), Table("stsz", 0, U32s({~0u, 4, 4})), Table("co64", 9, U32s({0, 8}))}, {2}},
        {"first chunk zero", {runs({0, 3, 1}), common, six}, {}},
        {"first chunk not one", {runs({2, 3, 1}), common, six}, {}},
        {"runs out of order", {Table("stsc", 2, U32s({1, 3, 1, 5, 2, 1, 3, 4, 1})), common, six}, {}},
        {"run repeats its first chunk", {runs({1, 3, 1, 1, 2, 1}), common, six}, {}},
        {"run past the chunks", {runs({1, 3, 1, 9, 2, 1}), common, six}, {}},
        {"no runs", {runs({}), common, six}, {}},
        {"no chunks", {runs({1, 3, 1}), common, Table("stco", 0, {})}, {}},
        {"missing table", {runs({1, 3, 1}), six}, {}},
        {"sizes run out", {runs({1, 2, 1}), Sizes(0, {4, 4, 4}), two}, {}},
        {"sizes left over", {runs({1, 1, 1}), Sizes(0, {4, 4, 4}), two}, {}},
        {"sizes past 4 GiB", {runs({1, 2, 1}), Sizes(0, {~0u, 1}), one}, {}},
        {"chunk beyond 4 GiB", {runs({1, 0x40000000, 1}), common, one}, {}},
        // 2^31 samples of 2^31 bytes, 8 each: a product past 64 bits must not wrap to a small chunk.
        {"product past 64 bits", {runs({1, 0x80000000, 1}), Sizes(8, {}), one}, {}, 0x80000000},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        ASSERT_EQ(Load(TrackMovie("soun", c.tables)), eTqovixSuccess);
        Chunks chunks;
        const eTqovixErrorCode built = ReadChunks(m_tree, false, chunks, c.bytesPerFrame);
        if (c.sampleCounts.empty()) {
            EXPECT_EQ(built, eTqovixErrorInvalidMovie);
            continue;
        }
        EXPECT_EQ(built, eTqovixSuccess);
        std::vector<uint32_t> counts;
        for (const auto& chunk : chunks) {
            counts.push_back(chunk.sampleCount);
            EXPECT_EQ(chunk.size, chunk.sampleCount * c.bytesPerFrame);
        }
        EXPECT_EQ(counts, c.sampleCounts);
    }
}

TEST_F(TrackTest, CameraChunkListsMatchTheirLayoutAndUpdatesRewriteOnlyTheirTables)
{
    Recipe pcm, wide, aac;
    pcm.sound.samplesPerChunk = 1000;  // a short last chunk makes a second run
    wide.sound.codec = SoundCodec::Sowt;
    wide.co64 = wide.video.perSampleSizes = wide.soundTrackFirst = true;
    aac.sound.codec = SoundCodec::Aac;
    aac.sound.chunkSampleCounts = {5, 5, 3, 7};
    aac.video.framesPerChunk = 4;
    aac.co64 = true;
    for (const Recipe& recipe : {pcm, wide, aac}) {
        moviekit::MovieLayout layout;
        ASSERT_EQ(LoadRecipe(recipe, &layout), eTqovixSuccess);
        const bool isAac = recipe.sound.codec == SoundCodec::Aac;
        Chunks sound, video, soundRead, videoRead;
        ASSERT_EQ(ReadChunks(m_tree, false, sound), eTqovixSuccess);
        EXPECT_EQ(sound, testsupport::ChunkTableOf(layout.soundChunks, isAac));
        ASSERT_EQ(ReadChunks(m_tree, true, video), eTqovixSuccess);
        EXPECT_EQ(video, testsupport::ChunkTableOf(layout.videoChunks, recipe.video.perSampleSizes));

        // The last chunk ends exactly where the file would have to, or one byte beyond.
        uint64_t end = 0;
        for (const Chunks* chunks : {&sound, &video}) {
            for (const auto& chunk : *chunks) {
                end = std::max<uint64_t>(end, chunk.offset + chunk.size);
            }
        }
        EXPECT_EQ(TqovixCheckChunksInFile(sound, end), eTqovixSuccess);
        EXPECT_EQ(TqovixCheckChunksInFile(video, end), eTqovixSuccess);
        EXPECT_EQ(std::max(TqovixCheckChunksInFile(sound, end - 1), TqovixCheckChunksInFile(video, end - 1)),
                  eTqovixErrorInvalidMovie);

        const std::string offsets = recipe.co64 ? "co64" : "stco";
        const Bytes before = WriteTree();
        for (auto& chunk : sound) {
            chunk.offset += recipe.co64 ? 5ULL << 32 : 1000;
            for (auto& size : chunk.sampleSizes) {
                size += 3;
                chunk.size += 3;
            }
        }
        ASSERT_EQ(UpdateChunks(m_tree, false, sound), eTqovixSuccess);
        const Bytes afterSound = WriteTree();
        // A common sample size is left as it is; a size table keeps its header, common size and count.
        const Keys rewritten = isAac ? Keys{"soun/" + offsets, "soun/stsz"} : Keys{"soun/" + offsets};
        EXPECT_EQ(Changed(before, afterSound), rewritten);
        const Bytes stszBefore = TrackLeaves(before)["soun/stsz"], stszAfter = TrackLeaves(afterSound)["soun/stsz"];
        ASSERT_GE(stszAfter.size(), 20u);
        EXPECT_TRUE(std::equal(stszAfter.begin(), stszAfter.begin() + 20, stszBefore.begin()));

        for (auto& chunk : video) {
            chunk.offset = chunk.offset * 3 + 1;
        }
        ASSERT_EQ(UpdateChunks(m_tree, true, video), eTqovixSuccess);
        const Bytes after = WriteTree();
        EXPECT_EQ(Changed(afterSound, after), Keys{"vide/" + offsets});
        ASSERT_EQ(after.size(), before.size()) << "tables keep their kind and length";
        ASSERT_EQ(Load(after), eTqovixSuccess);
        EXPECT_EQ(ReadChunks(m_tree, false, soundRead), eTqovixSuccess);
        EXPECT_EQ(soundRead, sound);
        EXPECT_EQ(ReadChunks(m_tree, true, videoRead), eTqovixSuccess);
        EXPECT_EQ(videoRead, video);
    }
    Chunks wrapping(1);
    wrapping[0].offset = ~0ULL - 2;
    wrapping[0].size = 8;
    EXPECT_EQ(TqovixCheckChunksInFile(wrapping, ~0ULL), eTqovixErrorInvalidMovie) << "no wrap-around";
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
        {"more sound records", SoundCodec::Twos, false, [](Chunks& c) { c.push_back(c.back()); }},
        {"fewer sample sizes", SoundCodec::Aac, false, [](Chunks& c) { c.back().sampleSizes.pop_back(); }},
        {"more sample sizes", SoundCodec::Aac, false, [](Chunks& c) { c.front().sampleSizes.push_back(9); }},
        {"video offset past an stco", SoundCodec::Twos, true, [](Chunks& c) { c.back().offset = 1ULL << 32; }},
        {"fewer video records", SoundCodec::Twos, true, [](Chunks& c) { c.pop_back(); }},
        // More video records than entries are ignored, so this one rewrites the same offsets.
        {"more video records", SoundCodec::Twos, true, [](Chunks& c) { c.push_back(c.back()); }, eTqovixSuccess},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        Recipe recipe;
        recipe.sound.codec = c.codec;
        moviekit::MovieLayout layout;
        ASSERT_EQ(LoadRecipe(recipe, &layout), eTqovixSuccess);
        Chunks chunks = testsupport::ChunkTableOf(c.video ? layout.videoChunks : layout.soundChunks,
                                                  !c.video && c.codec == SoundCodec::Aac);
        c.change(chunks);
        EXPECT_EQ(UpdateChunks(m_tree, c.video, chunks), c.expected);
        EXPECT_EQ(WriteTree(), m_movie);
    }

    // An empty offset table cannot be rewritten, and no list at all must not
    // write the visitor's blank record over a one-chunk table.
    for (const char* subtype : {"soun", "vide"}) {
        SCOPED_TRACE(subtype);
        const bool video = subtype[0] == 'v';
        const Bytes empty = TrackMovie(subtype, {Table("stsc", 1, U32s({1, 1, 1})), Sizes(1, {}), Atom("stco", {})});
        ASSERT_EQ(Load(empty), eTqovixSuccess);
        EXPECT_EQ(UpdateChunks(m_tree, video, Chunks(1)), eTqovixErrorOutOfMemory);
        EXPECT_EQ(WriteTree(), empty);
        const Bytes oneChunk =
            TrackMovie(subtype, {Table("stsc", 1, U32s({1, 1, 1})), Sizes(1, {}), Table("stco", 1, U32s({4096}))});
        ASSERT_EQ(Load(oneChunk), eTqovixSuccess);
        EXPECT_EQ(UpdateChunks(m_tree, video, {}), eTqovixErrorInternal);
        EXPECT_EQ(WriteTree(), oneChunk);
    }
}

}  // namespace
