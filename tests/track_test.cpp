// The track layer: typed readers of the track atoms, chunk lists built from a track's
// tables, per-track decisions of the visitors, and table rewrites for the destination.
#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <cstring>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <vector>

#include "ByteWriter.h"
#include "Movie.h"
#include "atom/CTqovixAtomControl.h"
#include "atom/TqovixSoundEntry.h"
#include "atom/TqovixTrackAtoms.h"
#include "file/CTqovixFile.h"
#include "support/TestSupport.h"
#include "support/TreeTest.h"
#include "visitor/CTqovixAudioDataVisitor.h"
#include "visitor/CTqovixAudioInformationVisitor.h"
#include "visitor/CTqovixMovieDataVisitor.h"

using moviekit::Atom;
using moviekit::Bytes;
using moviekit::Container;
using moviekit::SoundCodec;
using Chunks = std::vector<TqovixChunkInformation>;
using Recipe = moviekit::MovieRecipe;
namespace ta = TqovixTrackAtoms;
namespace se = TqovixSoundEntry;

namespace {

using testsupport::PrintTo;

Bytes U32s(const std::vector<uint32_t>& values)
{
    Bytes out;
    for (uint32_t value : values) {
        moviekit::PutU32(out, value);
    }
    return out;
}

Bytes Text(const char* text) { return Bytes(text, text + 4); }

Bytes Handler(const char* type, const char* subtype)
{
    return moviekit::Concat({Bytes(4, 0), type ? Text(type) : Bytes(4, 0), Text(subtype), Bytes(12, 0)});
}

// A track whose media handler names `subtype`, with the given sample tables.
Bytes Track(const char* subtype, const std::vector<Bytes>& tables, const std::vector<Bytes>& beforeMedia = {})
{
    std::vector<Bytes> track = beforeMedia;
    track.push_back(Container("mdia", {Atom("hdlr", Handler("mhlr", subtype)), Container("minf", {Container("stbl", tables)})}));
    return Container("trak", track);
}

Bytes MovieOf(const std::vector<Bytes>& tracks)
{
    return moviekit::Concat({Atom("ftyp", Text("qt  ")), Container("moov", tracks)});
}

Bytes Table(const char* type, uint32_t count, const Bytes& entries)
{
    return Atom(type, moviekit::Concat({U32s({0, count}), entries}));
}

Bytes Described(const Bytes& entry)
{
    return Table("stsd", 1, moviekit::Concat({U32s({static_cast<uint32_t>(entry.size() + 4)}), entry}));
}

// A PCM sound description of the given version (1 adds the per-packet fields) whose sample size
// field says 16, as QuickTime keeps it, with extension atoms after the fields.
Bytes PcmDescription(const char* format, uint16_t channels, uint16_t version = 0, uint32_t bytesPerFrame = 0,
                     const Bytes& extensions = {})
{
    Bytes entry = moviekit::Concat({Text(format), Bytes(6, 0), Bytes{0, 1}});
    moviekit::PutU16(entry, version);
    entry.insert(entry.end(), 6, 0);
    moviekit::PutU16(entry, channels);
    moviekit::PutU16(entry, 16);
    entry.insert(entry.end(), 4, 0);
    moviekit::PutU32(entry, 48000u << 16);
    if (version == 1) {
        entry = moviekit::Concat({entry, U32s({1, bytesPerFrame / channels, bytesPerFrame, 2})});
    }
    return Described(moviekit::Concat({entry, extensions}));
}

// QuickTime's byte-order atom inside the "wave" that older sound descriptions carry.
Bytes WaveEnda(const char* format, uint16_t little)
{
    return Container("wave", {Atom("frma", Text(format)), Atom("enda", Bytes{static_cast<uint8_t>(little >> 8), static_cast<uint8_t>(little)}),
                              Bytes(8, 0)});
}

// A version-2 description: the rate as a double, the linear PCM flags and the bytes a packet of one frame takes.
Bytes Version2Description(const char* format, uint32_t channels, uint32_t bits, uint32_t flags, double rate,
                          uint32_t bytesPerPacket)
{
    Bytes entry = moviekit::Concat({Text(format), Bytes(6, 0), Bytes{0, 1}, Bytes{0, 2}, Bytes(6, 0), Bytes{0, 3, 0, 16, 0xFF, 0xFE, 0, 0},
                                    U32s({0x10000, 72})});
    uint64_t rateBits = 0;
    std::memcpy(&rateBits, &rate, sizeof rateBits);
    moviekit::PutU32(entry, static_cast<uint32_t>(rateBits >> 32));
    moviekit::PutU32(entry, static_cast<uint32_t>(rateBits));
    return Described(moviekit::Concat({entry, U32s({channels, 0x7F000000, bits, flags, bytesPerPacket, 1})}));
}

// ---- Typed readers: each row reads a payload and shows what it understood ----

struct ReaderRow {
    const char* name;
    std::function<std::string()> read;
    std::string expected;  // "refused" when the reader gives nothing
};

template <typename T, typename Show>
std::string Shown(const std::optional<T>& value, Show show)
{
    return value ? show(*value) : "refused";
}

std::string Edits(const Bytes& payload)
{
    return Shown(ta::ParseEditList(payload), [](const std::vector<ta::Edit>& edits) {
        std::ostringstream out;
        for (const ta::Edit& edit : edits) {
            out << edit.duration << "@" << edit.mediaTime << " ";
        }
        out << "first " << ta::FirstMediaTime(edits);
        return out.str();
    });
}

std::string Offsets(const Bytes& payload, bool wide)
{
    return Shown(ta::ParseChunkOffsets(payload, wide), [](const std::vector<uint64_t>& offsets) {
        std::ostringstream out;
        for (uint64_t offset : offsets) {
            out << offset << " ";
        }
        return out.str();
    });
}

// The entry as read, then how its samples are stored ("s24le", "f32be") or why they are not processed.
std::string Entry(const Bytes& stsdAtom)
{
    const Bytes payload(stsdAtom.begin() + 8, stsdAtom.end());
    return Shown(se::Parse(payload), [](const se::Entry& e) {
        std::string why;
        const std::optional<se::PcmLayout> layout = se::ReadPcmLayout(e, why);
        std::ostringstream out;
        out << TqovixAtomTypeName(e.format) << " v" << e.version << " " << e.channels << "ch " << e.bitsPerChannel
            << "bit " << e.sampleRateHz << "Hz frame " << se::FrameBytes(e) << " ";
        if (layout) {
            out << (layout->floating ? "f" : "s") << layout->bits << (layout->littleEndian ? "le" : "be");
        } else {
            out << why;
        }
        return out.str();
    });
}

std::string Esds(const Bytes& children)
{
    const auto payload = se::FindEsds(children);
    if (!payload) {
        return "none";
    }
    return Shown(se::ParseEsds(*payload), [](const se::DecoderConfig& c) {
        return "rate " + std::to_string(c.averageBitRate) + " config " + std::to_string(c.audioSpecificConfig.size());
    });
}

// version/flags, ES_Descriptor(ES_ID, flags, DecoderConfig(type, stream, buffer, max, avg, DSI(2 bytes))).
const Bytes kEsdsPayload = {0, 0, 0, 0, 3, 22, 0, 1, 0, 4, 17, 0x40, 0x15, 0, 0, 0, 0, 0, 0, 1,
                            0, 0, 0, 2, 5, 2, 0x11, 0x90};

// A descriptor whose size takes `width` bytes, seven bits each, the high bit saying "more".
Bytes Descriptor(uint8_t tag, const Bytes& body, int width)
{
    Bytes out = {tag};
    for (int k = width - 1; k >= 0; --k) {
        out.push_back(static_cast<uint8_t>(((body.size() >> (7 * k)) & 0x7F) | (k > 0 ? 0x80 : 0)));
    }
    return moviekit::Concat({out, body});
}

// The esds payload above with every size `width` bytes long and `info` as the decoder's information.
Bytes EsdsSized(int width, const Bytes& info = {0x11, 0x90})
{
    const Bytes config = moviekit::Concat({Bytes{0x40, 0x15, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 2}, Descriptor(5, info, width)});
    return moviekit::Concat({Bytes(4, 0), Descriptor(3, moviekit::Concat({Bytes{0, 1, 0}, Descriptor(4, config, width)}), width)});
}

class TypedReaderTest : public ::testing::TestWithParam<ReaderRow> {};

TEST_P(TypedReaderTest, ReadsWhatThePayloadHoldsOrRefuses)
{
    EXPECT_EQ(GetParam().read(), GetParam().expected);
}

INSTANTIATE_TEST_SUITE_P(
    Readers, TypedReaderTest,
    ::testing::Values(
        ReaderRow{"HandlerQuickTime", [] { return ta::IsMediaHandler(*ta::ParseHandler(Handler("mhlr", "soun")), "soun") ? "yes" : "no"; }, "yes"},
        ReaderRow{"HandlerIso", [] { return ta::IsMediaHandler(*ta::ParseHandler(Handler(nullptr, "soun")), "soun") ? "yes" : "no"; }, "yes"},
        ReaderRow{"HandlerOfData", [] { return ta::IsMediaHandler(*ta::ParseHandler(Handler("dhlr", "soun")), "soun") ? "yes" : "no"; }, "no"},
        ReaderRow{"HandlerTooShort", [] { return ta::ParseHandler(Bytes(11, 0)) ? "read" : "refused"; }, "refused"},
        ReaderRow{"EditListVersion0", [] { return Edits(U32s({0, 2, 500, 0xFFFFFFFF, 0x10000, 900, 2112, 0x10000})); }, "500@-1 900@2112 first 2112"},
        ReaderRow{"EditListVersion1", [] { return Edits(U32s({0x01000000, 1, 0, 900, 0, 1024, 0x10000})); }, "900@1024 first 1024"},
        ReaderRow{"EditListCountPastPayload", [] { return Edits(U32s({0, 2, 900, 1024, 0x10000})); }, "refused"},
        ReaderRow{"EditListOnlyEmpty", [] { return Edits(U32s({0, 1, 500, 0xFFFFFFFF, 0x10000})); }, "500@-1 first 0"},
        ReaderRow{"OffsetsNarrow", [] { return Offsets(U32s({0, 2, 8, 16}), false); }, "8 16 "},
        ReaderRow{"OffsetsWide", [] { return Offsets(U32s({0, 1, 1, 0}), true); }, "4294967296 "},
        ReaderRow{"OffsetsCountPastPayload", [] { return Offsets(U32s({0, 3, 8, 16}), false); }, "refused"},
        ReaderRow{"OffsetsAbsurdCount", [] { return Offsets(U32s({0, 0xFFFFFFFF}), false); }, "refused"},
        ReaderRow{"SizesCommon", [] { return Shown(ta::ParseSampleSizes(U32s({0, 4, 1000})), [](const ta::SampleSizes& s) { return std::to_string(s.common) + "x" + std::to_string(s.count); }); }, "4x1000"},
        ReaderRow{"SizesListPastPayload", [] { return Shown(ta::ParseSampleSizes(U32s({0, 0, 3, 5, 6})), [](const ta::SampleSizes&) { return std::string("read"); }); }, "refused"},
        ReaderRow{"RunsCountPastPayload", [] { return ta::ParseSampleToChunk(U32s({0, 2, 1, 5, 1})) ? "read" : "refused"; }, "refused"},
        ReaderRow{"TimeToSampleTotal", [] { return Shown(ta::ParseSampleTotal(U32s({0, 2, 3, 1, 4, 1})), [](uint64_t t) { return std::to_string(t); }); }, "7"},
        ReaderRow{"TimeToSampleHalfEntry", [] { return ta::ParseSampleTotal(U32s({0, 3, 3, 1, 4, 1, 777})) ? "read" : "refused"; }, "refused"},
        ReaderRow{"DataInFile", [] { return Shown(ta::ParseDataInFile(moviekit::Concat({U32s({0, 1, 12}), Text("url "), U32s({1})})), [](bool in) { return in ? "here" : "elsewhere"; }); }, "here"},
        ReaderRow{"DataElsewhere", [] { return Shown(ta::ParseDataInFile(moviekit::Concat({U32s({0, 1, 16}), Text("alis"), U32s({0, 7})})), [](bool in) { return in ? "here" : "elsewhere"; }); }, "elsewhere"},
        ReaderRow{"SoundEntryVersion0", [] { return Entry(PcmDescription("twos", 2)); }, "twos v0 2ch 16bit 48000Hz frame 4 s16be"},
        ReaderRow{"SoundEntryVersion1FrameField", [] { return Entry(PcmDescription("sowt", 6, 1, 12)); }, "sowt v1 6ch 16bit 48000Hz frame 12 s16le"},
        // The format says the width, "enda" (in "wave" or among the extensions) the byte order.
        ReaderRow{"SoundEntryIn24Version0", [] { return Entry(PcmDescription("in24", 2)); }, "in24 v0 2ch 24bit 48000Hz frame 6 s24be"},
        ReaderRow{"SoundEntryIn24EndaLittle", [] { return Entry(PcmDescription("in24", 2, 1, 6, WaveEnda("in24", 1))); }, "in24 v1 2ch 24bit 48000Hz frame 6 s24le"},
        ReaderRow{"SoundEntryIn32EndaBig", [] { return Entry(PcmDescription("in32", 4, 1, 16, WaveEnda("in32", 0))); }, "in32 v1 4ch 32bit 48000Hz frame 16 s32be"},
        ReaderRow{"SoundEntryFl32EndaLittle", [] { return Entry(PcmDescription("fl32", 2, 1, 8, WaveEnda("fl32", 1))); }, "fl32 v1 2ch 32bit 48000Hz frame 8 f32le"},
        ReaderRow{"SoundEntryFl64EndaOutsideWave", [] { return Entry(PcmDescription("fl64", 1, 1, 8, Atom("enda", Bytes{0, 1}))); }, "fl64 v1 1ch 64bit 48000Hz frame 8 f64le"},
        ReaderRow{"SoundEntryTwosKeepsItsByteOrder", [] { return Entry(PcmDescription("twos", 2, 1, 4, WaveEnda("twos", 1))); }, "twos v1 2ch 16bit 48000Hz frame 4 s16be"},
        ReaderRow{"SoundEntryTwos8Bit", [] { return Entry(PcmDescription("twos", 2, 1, 2)); },
                  "twos v1 2ch 8bit 48000Hz frame 2 sound 'twos' is 8-bit PCM; 16, 24 and 32-bit integer and 32 and 64-bit float PCM are processed"},
        ReaderRow{"SoundEntryFrameSizeDisagrees", [] { return Entry(PcmDescription("in24", 2, 1, 8)); },
                  "in24 v1 2ch 24bit 48000Hz frame 8 the sound description's frame of 8 bytes does not hold 2 samples of 24 bits"},
        // Version 2: a rate past the 16.16 field, the flags for kind and byte order.
        ReaderRow{"SoundEntryLpcm24Bit96k", [] { return Entry(Version2Description("lpcm", 2, 24, 0xC, 96000.0, 6)); }, "lpcm v2 2ch 24bit 96000Hz frame 6 s24le"},
        ReaderRow{"SoundEntryLpcmFloatBigEndian192k", [] { return Entry(Version2Description("lpcm", 4, 32, 0xB, 192000.0, 16)); }, "lpcm v2 4ch 32bit 192000Hz frame 16 f32be"},
        ReaderRow{"SoundEntryLpcmRateRounded", [] { return Entry(Version2Description("lpcm", 2, 16, 0xE, 44099.99999, 4)); }, "lpcm v2 2ch 16bit 44100Hz frame 4 s16be"},
        ReaderRow{"SoundEntryLpcmHighAlignedIn4Bytes", [] { return Entry(Version2Description("lpcm", 2, 24, 0x14, 48000.0, 8)); },
                  "lpcm v2 2ch 24bit 48000Hz frame 8 the sound description's frame of 8 bytes does not hold 2 samples of 24 bits"},
        ReaderRow{"SoundEntryLpcmNonInterleaved", [] { return Entry(Version2Description("lpcm", 2, 32, 0x29, 48000.0, 4)); },
                  "lpcm v2 2ch 32bit 48000Hz frame 4 sound 'lpcm' keeps each channel apart (non-interleaved PCM); only interleaved PCM is processed"},
        ReaderRow{"SoundEntryLpcmFloatAndInteger", [] { return Entry(Version2Description("lpcm", 2, 32, 0xF, 48000.0, 8)); },
                  "lpcm v2 2ch 32bit 48000Hz frame 8 sound 'lpcm' has flags 0xF, both float and integer; 16, 24 and 32-bit integer and 32 and 64-bit float PCM are processed"},
        ReaderRow{"SoundEntryLpcmUnsigned", [] { return Entry(Version2Description("lpcm", 1, 8, 0x8, 48000.0, 1)); },
                  "lpcm v2 1ch 8bit 48000Hz frame 1 sound 'lpcm' has flags 0x8, unsigned integers; 16, 24 and 32-bit integer and 32 and 64-bit float PCM are processed"},
        ReaderRow{"SoundEntryLpcmHalfFloat", [] { return Entry(Version2Description("lpcm", 2, 16, 0x9, 48000.0, 4)); },
                  "lpcm v2 2ch 16bit 48000Hz frame 4 sound 'lpcm' is 16-bit float PCM; 16, 24 and 32-bit integer and 32 and 64-bit float PCM are processed"},
        ReaderRow{"SoundEntryVersion2RateNotANumber", [] { return Entry(Version2Description("lpcm", 2, 16, 0xC, std::nan(""), 4)); }, "lpcm v2 2ch 16bit 0Hz frame 4 s16le"},
        ReaderRow{"SoundEntryVersion1Cut", [] { Bytes d = PcmDescription("sowt", 2, 1, 4); d.resize(d.size() > 8 ? d.size() - 8 : 0); return Entry(d); }, "refused"},
        ReaderRow{"SoundEntryVersion3", [] { return Entry(PcmDescription("twos", 2, 3)); }, "refused"},
        ReaderRow{"EsdsDirect", [] { return Esds(Atom("esds", kEsdsPayload)); }, "rate 2 config 2"},
        ReaderRow{"EsdsInsideWave", [] { return Esds(Container("wave", {Atom("frma", Text("mp4a")), Atom("esds", kEsdsPayload), Bytes(8, 0)})); }, "rate 2 config 2"},
        // Bytes that spell "esds" inside another child are no decoder configuration.
        ReaderRow{"EsdsSpelledInsideAnotherAtom", [] { return Esds(Atom("btrt", moviekit::Concat({Bytes{0, 0, 0, 20}, Text("esds"), kEsdsPayload}))); }, "none"},
        // A size may take one to four bytes; the short forms are as legal as the long one.
        ReaderRow{"EsdsSizeOneByte", [] { return Esds(Atom("esds", EsdsSized(1))); }, "rate 2 config 2"},
        ReaderRow{"EsdsSizeTwoBytes", [] { return Esds(Atom("esds", EsdsSized(2))); }, "rate 2 config 2"},
        ReaderRow{"EsdsSizeThreeBytes", [] { return Esds(Atom("esds", EsdsSized(3))); }, "rate 2 config 2"},
        ReaderRow{"EsdsSizeFourBytes", [] { return Esds(Atom("esds", EsdsSized(4))); }, "rate 2 config 2"},
        ReaderRow{"EsdsSizeFiveBytes", [] { return Esds(Atom("esds", EsdsSized(5))); }, "refused"},
        // Sizes above 127 need the high bits: 200 bytes of information in two-byte sizes.
        ReaderRow{"EsdsSizeValueInTwoBytes", [] { return Esds(Atom("esds", EsdsSized(2, Bytes(200, 0x11)))); }, "rate 2 config 200"},
        ReaderRow{"EsdsSizeValueInThreeBytes", [] { return Esds(Atom("esds", EsdsSized(3, Bytes(20000, 0x11)))); }, "rate 2 config 20000"},
        // A continuation bit on the last byte the payload holds: the size never ends.
        ReaderRow{"EsdsSizeCutShort", [] { return Esds(Atom("esds", Bytes{0, 0, 0, 0, 3, 0x80, 0x80})); }, "refused"},
        ReaderRow{"EsdsSizePastThePayload", [] { Bytes p = kEsdsPayload; p[5] = 0x81; return Esds(Atom("esds", p)); }, "refused"},
        ReaderRow{"EsdsProfileAfterConfig", [] { Bytes p = kEsdsPayload; p[5] += 2; p[10] += 2; p.insert(p.end(), {6, 0}); return Esds(Atom("esds", p)); }, "refused"},
        ReaderRow{"EsdsDescriptorPastItsParent", [] { Bytes p = kEsdsPayload; p[10] += 1; return Esds(Atom("esds", p)); }, "refused"}),
    testsupport::ByName);

// ---- Chunk lists from a track's tables ----

struct ChunkRow {
    const char* name;
    std::vector<ta::ChunkRun> runs;
    ta::SampleSizes sizes;
    uint32_t chunks;
    uint32_t frameBytes;
    std::vector<uint32_t> expectedBytes;  // per chunk; empty when refused
};

class ChunkListTest : public ::testing::TestWithParam<ChunkRow> {};

TEST_P(ChunkListTest, TablesGiveChunksOrARefusal)
{
    const ChunkRow& row = GetParam();
    TqovixTrackTables tables;
    tables.runs = row.runs;
    tables.sizes = row.sizes;
    tables.offsets = std::vector<uint64_t>(row.chunks);
    for (uint32_t k = 0; k < row.chunks; ++k) {
        (*tables.offsets)[k] = 1000 * (k + 1);
    }
    Chunks chunks;
    const eTqovixErrorCode built = TqovixBuildChunkList(tables, row.frameBytes, chunks);
    ASSERT_EQ(built, row.expectedBytes.empty() && row.chunks != 0 ? eTqovixErrorInvalidMovie : eTqovixSuccess);
    std::vector<uint32_t> bytes;
    for (size_t k = 0; k < chunks.size(); ++k) {
        bytes.push_back(chunks[k].size);
        EXPECT_EQ(chunks[k].offset, 1000 * (k + 1));
        EXPECT_EQ(chunks[k].chunkNumber, k + 1);
    }
    EXPECT_EQ(bytes, row.expectedBytes);
}

const ta::SampleSizes kOne{1, 0, {}};
const ta::SampleSizes kFrame{4, 0, {}};

INSTANTIATE_TEST_SUITE_P(
    Tables, ChunkListTest,
    ::testing::Values(
        ChunkRow{"TwoRuns", {{1, 3}, {5, 2}}, kOne, 6, 4, {12, 12, 12, 12, 8, 8}},
        ChunkRow{"CameraCommonSizeOne", {{1, 1024}}, kOne, 2, 2, {2048, 2048}},
        ChunkRow{"WritersCommonSizeOfAFrame", {{1, 1024}}, kFrame, 2, 4, {4096, 4096}},
        ChunkRow{"CommonSizeNeitherOneNorAFrame", {{1, 1024}}, ta::SampleSizes{2, 0, {}}, 2, 4, {}},
        ChunkRow{"CompressedCommonSize", {{1, 3}}, ta::SampleSizes{7, 0, {}}, 1, 0, {21}},
        ChunkRow{"SampleSizeList", {{1, 2}}, ta::SampleSizes{0, 4, {5, 6, 7, 8}}, 2, 0, {11, 15}},
        // An empty chunk keeps its place, so rewritten offsets still line up with the table.
        ChunkRow{"ChunkWithoutSamples", {{1, 3}, {2, 0}, {3, 2}}, kOne, 4, 4, {12, 0, 8, 8}},
        ChunkRow{"FirstChunkNotOne", {{2, 3}}, kOne, 6, 4, {}},
        ChunkRow{"RunRepeatsItsFirstChunk", {{1, 3}, {1, 2}}, kOne, 6, 4, {}},
        ChunkRow{"RunPastTheChunks", {{1, 3}, {9, 2}}, kOne, 6, 4, {}},
        ChunkRow{"NoRunsForChunks", {}, kOne, 2, 4, {}},
        ChunkRow{"SizesRunOut", {{1, 2}}, ta::SampleSizes{0, 3, {4, 4, 4}}, 2, 0, {}},
        ChunkRow{"SizesLeftOver", {{1, 1}}, ta::SampleSizes{0, 3, {4, 4, 4}}, 2, 0, {}},
        ChunkRow{"SizesPast4GiB", {{1, 2}}, ta::SampleSizes{0, 2, {~0u, 1}}, 1, 0, {}},
        ChunkRow{"ChunkOfExactly4GiB", {{1, 0x40000000}}, kOne, 1, 4, {}},
        ChunkRow{"EmptyTrack", {}, kOne, 0, 0, {}}), testsupport::ByName);

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

// ---- Visitors over whole trees ----

using TrackTest = testsupport::TreeTest;

struct DescriptionRow {
    const char* name;
    std::function<void(Recipe&)> change;
    eTqovixErrorCode expected;
};

class SoundDescriptionTest : public TrackTest, public ::testing::WithParamInterface<DescriptionRow> {};

TEST_P(SoundDescriptionTest, FirstSoundTrackIsReadOrRefused)
{
    Recipe recipe;
    recipe.sound.codec = SoundCodec::Aac;
    recipe.sound.sampleRate = 44100;
    recipe.sound.channels = 1;
    recipe.sound.mediaTime = 2112;
    GetParam().change(recipe);
    moviekit::MovieLayout layout;
    ASSERT_EQ(Load(moviekit::BuildMovie(recipe, &layout)), eTqovixSuccess);
    CTqovixAudioInformationVisitor v;
    ASSERT_EQ(m_tree.Analyze(v), GetParam().expected);
    EXPECT_EQ(m_tree.Update(v), eTqovixErrorInternal) << "the format visitor only reads";
    if (GetParam().expected != eTqovixSuccess) {
        return;
    }
    const SoundCodec codec = recipe.sound.codec;
    EXPECT_EQ(v.GetRate(), recipe.sound.sampleRate / 1000);
    EXPECT_EQ(v.GetChannel(), recipe.sound.channels);
    EXPECT_EQ(v.GetCount(), layout.soundSampleCount);
    EXPECT_EQ(v.IsBigEndianFormat(), codec == SoundCodec::Twos);
    // Priming belongs to AAC alone: PCM in either byte order starts at its first frame.
    EXPECT_EQ(v.GetPriming(), codec == SoundCodec::Aac ? 1024u : 0u);
    EXPECT_EQ(v.GetMediaTime(), recipe.sound.edts ? 2112u : 0u);
    EXPECT_EQ(v.GetFrameBytes(), codec == SoundCodec::Aac ? 0u : 2u * recipe.sound.channels);
    const Bytes config = codec == SoundCodec::Aac
                             ? moviekit::MakeAudioSpecificConfig(recipe.sound.sampleRate, recipe.sound.channels)
                             : Bytes{};
    ASSERT_EQ(v.GetAudioSpecificConfigSize(), config.size());
    EXPECT_EQ(Bytes(v.GetAudioSpecificConfigData(), v.GetAudioSpecificConfigData() + config.size()), config);
}

INSTANTIATE_TEST_SUITE_P(
    Descriptions, SoundDescriptionTest,
    ::testing::Values(
        DescriptionRow{"Aac", [](Recipe&) {}, eTqovixSuccess},
        DescriptionRow{"Sowt", [](Recipe& s) { s.sound.codec = SoundCodec::Sowt; }, eTqovixSuccess},
        DescriptionRow{"Twos", [](Recipe& s) { s.sound.codec = SoundCodec::Twos; s.sound.channels = 2; }, eTqovixSuccess},
        DescriptionRow{"NoEditList", [](Recipe& s) { s.sound.edts = false; }, eTqovixSuccess},
        DescriptionRow{"EditsWithoutAList", [](Recipe& s) { s.sound.elst = false; }, eTqovixErrorInvalidMovie},
        DescriptionRow{"Version2InAVersion0Layout", [](Recipe& s) { s.sound.descriptionVersion = 2; }, eTqovixErrorInvalidMovie},
        DescriptionRow{"LongDescriptorSizes", [](Recipe& s) { s.sound.esds.longSizes = true; }, eTqovixSuccess},
        DescriptionRow{"OptionalEsFields", [](Recipe& s) { s.sound.esds.esFlags = 0xE0; }, eTqovixSuccess},
        DescriptionRow{"ZeroAverageBitRate", [](Recipe& s) { s.sound.esds.averageBitRate = 0; }, eTqovixErrorInvalidMovie},
        // The visitor refuses whatever the esds reader refuses (the reader's rows above).
        DescriptionRow{"EmptyEsds", [](Recipe& s) { s.sound.esds.rawPayload = U32s({0}); }, eTqovixErrorInvalidMovie}),
    testsupport::ByName);

TEST_F(TrackTest, EachTrackIsDecidedWhenItEnds)
{
    const Bytes stsc = Table("stsc", 1, U32s({1, 2, 1}));
    const Bytes pcmSizes = Atom("stsz", U32s({0, 1, 4}));
    const Bytes stts = Table("stts", 1, U32s({4, 1}));
    const Bytes video = Track("vide", {Atom("stsd", Bytes(16, 0)), stsc, Atom("stsz", U32s({0, 7, 4})), Table("stco", 2, U32s({8, 22}))});
    const Bytes first = Track("soun", {PcmDescription("sowt", 1), stts, stsc, pcmSizes, Table("stco", 2, U32s({36, 40}))});
    const Bytes second = Track("soun", {PcmDescription("twos", 2), Table("stts", 1, U32s({9, 1})), stsc, pcmSizes,
                                        Table("co64", 2, U32s({0, 44, 0, 52}))});
    ASSERT_EQ(Load(MovieOf({video, first, second})), eTqovixSuccess);

    // The first sound track is the one read, with its own tables, not the second's.
    CTqovixAudioInformationVisitor information;
    ASSERT_EQ(m_tree.Analyze(information), eTqovixSuccess);
    EXPECT_EQ(information.GetTrackIndex(), 1u);
    EXPECT_EQ(information.GetChannel(), 1u);
    EXPECT_EQ(information.GetCount(), 4u);
    CTqovixAudioDataVisitor sound;
    Chunks chunks;
    ASSERT_EQ(m_tree.Analyze(sound), eTqovixSuccess);
    ASSERT_EQ(sound.GetAudioChunkInformation(chunks, 2), eTqovixSuccess);
    ASSERT_EQ(chunks.size(), 2u);
    EXPECT_EQ(chunks[1].offset, 40u);
    EXPECT_EQ(chunks[1].size, 4u);

    // Every track, with its index, handler and table form.
    CTqovixTrackListVisitor all;
    ASSERT_EQ(m_tree.Analyze(all), eTqovixSuccess);
    ASSERT_EQ(all.GetTracks().size(), 3u);
    EXPECT_TRUE(all.GetTracks()[0].IsHandler("vide"));
    EXPECT_TRUE(all.GetTracks()[2].wideOffsets);
    ASSERT_EQ(TqovixBuildChunkList(all.GetTracks()[2], 4, chunks), eTqovixSuccess);
    EXPECT_EQ(chunks[1].offset, 52u);
    EXPECT_EQ(chunks[1].size, 8u);

    // A sound track that cannot be read refuses the movie even when a later one could be.
    ASSERT_EQ(Load(MovieOf({Track("soun", {PcmDescription("twos", 2), Table("stts", 3, U32s({1, 1}))}), second})),
              eTqovixSuccess);
    CTqovixAudioInformationVisitor broken;
    EXPECT_EQ(m_tree.Analyze(broken), eTqovixErrorInvalidMovie);
    // No sound track at all: the walk runs out.
    ASSERT_EQ(Load(MovieOf({video})), eTqovixSuccess);
    CTqovixAudioInformationVisitor none;
    EXPECT_EQ(m_tree.Analyze(none), eTqovixErrorInvalidMovie);
}

struct MismatchRow {
    const char* name;
    void (*change)(Chunks& sound, Chunks& video);
};

// A camera's AAC movie and the chunk records of its sound and video.
struct MovieTables {
    Bytes movie;
    Chunks sound, video;
};
MovieTables AacMovie()
{
    Recipe recipe;
    recipe.sound.codec = SoundCodec::Aac;
    moviekit::MovieLayout layout;
    MovieTables tables{moviekit::BuildMovie(recipe, &layout), {}, {}};
    for (const bool sound : {true, false}) {
        uint32_t number = 1;
        for (const moviekit::ChunkLayout& chunk : sound ? layout.soundChunks : layout.videoChunks) {
            (sound ? tables.sound : tables.video)
                .push_back({chunk.offset, static_cast<uint32_t>(chunk.size), sound ? chunk.sampleSizes : std::vector<uint32_t>{},
                            number++, chunk.sampleCount});
        }
    }
    return tables;
}

class RecordMismatchTest : public TrackTest, public ::testing::WithParamInterface<MismatchRow> {};

// Records that do not match the table's entries change nothing.
TEST_P(RecordMismatchTest, ChangesNothing)
{
    const auto [movie, sound, video] = AacMovie();
    ASSERT_EQ(Load(movie), eTqovixSuccess);
    Chunks s = sound;
    Chunks v = video;
    GetParam().change(s, v);
    CTqovixAudioDataVisitor soundUpdate;
    soundUpdate.SetAudioChunkInformation(s);
    CTqovixMovieDataVisitor videoUpdate;
    videoUpdate.SetOffset(v);
    const bool soundChanged = s != sound;
    EXPECT_EQ(soundChanged ? m_tree.Update(soundUpdate) : m_tree.Update(videoUpdate), eTqovixErrorInternal);
    EXPECT_EQ(WriteTree(), movie);
}

INSTANTIATE_TEST_SUITE_P(
    Records, RecordMismatchTest,
    ::testing::Values(MismatchRow{"FewerSoundRecords", [](Chunks& s, Chunks&) { s.pop_back(); }},
                      MismatchRow{"MoreSampleSizes", [](Chunks& s, Chunks&) { s.front().sampleSizes.push_back(9); }},
                      MismatchRow{"FewerVideoRecords", [](Chunks&, Chunks& v) { v.pop_back(); }},
                      MismatchRow{"MoreVideoRecords", [](Chunks&, Chunks& v) { v.push_back(v.back()); }}),
    testsupport::ByName);

TEST_F(TrackTest, RewritesKeepEachTableOrGrowItIntoCo64)
{
    const auto [movie, sound, video] = AacMovie();

    // An offset past 4 GiB turns the sound track's "stco" into a "co64"; the video keeps its "stco".
    ASSERT_EQ(Load(movie), eTqovixSuccess);
    Chunks far = sound;
    far.back().offset = (uint64_t{1} << 32) + 12;
    CTqovixAudioDataVisitor update;
    update.SetAudioChunkInformation(far);
    EXPECT_EQ(m_tree.Update(update), eTqovixVisitSkip) << "the rewrite walks the whole tree";
    const Bytes written = WriteTree();
    ASSERT_EQ(Load(written), eTqovixSuccess);
    CTqovixTrackListVisitor tracks;
    ASSERT_EQ(m_tree.Analyze(tracks), eTqovixSuccess);
    ASSERT_EQ(tracks.GetTracks().size(), 2u);
    EXPECT_FALSE(tracks.GetTracks()[0].wideOffsets);
    EXPECT_TRUE(tracks.GetTracks()[1].wideOffsets);
    Chunks read;
    ASSERT_EQ(TqovixBuildChunkList(tracks.GetTracks()[1], 0, read), eTqovixSuccess);
    EXPECT_EQ(read, far);

    // ffprobe, which shares nothing with our reader, finds every packet where the records put it:
    // the rewritten movie with the last sound chunk moved past 4 GiB into a sparse file.
    testsupport::TempDir dir;
    const std::string path = dir.File("co64.mov");
    ASSERT_TRUE(testsupport::WriteFile(path, written));
    const std::vector<uint8_t> lastChunk(movie.begin() + static_cast<std::ptrdiff_t>(sound.back().offset),
                                         movie.begin() + static_cast<std::ptrdiff_t>(sound.back().offset +
                                                                                     sound.back().size));
    {
        std::fstream file(path, std::ios::in | std::ios::out | std::ios::binary);
        file.seekp(static_cast<std::streamoff>(far.back().offset));
        file.write(reinterpret_cast<const char*>(lastChunk.data()), static_cast<std::streamsize>(lastChunk.size()));
        ASSERT_TRUE(file.good());
    }
    const auto packets = [&](const char* stream) {
        std::string output;
        EXPECT_EQ(testsupport::RunCommand("ffprobe -v error -select_streams " + std::string(stream) +
                                              " -show_entries packet=pos,size -of csv=p=0 " +
                                              testsupport::ShellQuote(path),
                                          &output),
                  0);
        // "size,pos" per packet; a packet with side data adds a field and a line of its own.
        std::istringstream lines(output);
        std::string line;
        std::string sizes;
        while (std::getline(lines, line)) {
            std::istringstream fields(line);
            std::string size;
            std::string position;
            if (std::getline(fields, size, ',') && std::getline(fields, position, ',') && !size.empty()) {
                sizes += size + "," + position + "\n";
            }
        }
        return sizes;
    };
    const auto expected = [](const Chunks& chunks, uint64_t commonSize) {
        std::ostringstream out;
        for (const TqovixChunkInformation& chunk : chunks) {
            uint64_t at = chunk.offset;
            for (uint32_t k = 0; k < chunk.sampleCount; ++k) {
                const uint64_t size = chunk.sampleSizes.empty() ? commonSize : chunk.sampleSizes[k];
                out << size << "," << at << "\n";
                at += size;
            }
        }
        return out.str();
    };
    EXPECT_EQ(packets("a:0"), expected(far, 0));
    EXPECT_EQ(packets("v:0"), expected(video, video.front().size / video.front().sampleCount));
}

}  // namespace
