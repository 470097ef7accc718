// moviekit: the maker payloads byte for byte, the structure of the movies it writes, and
// ffprobe as an independent reader of those movies.
#include "Movie.h"
#include "support/TestSupport.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <map>
#include <optional>
#include <set>
#include <sstream>

namespace {

using moviekit::Bytes;
using moviekit::MovieLayout;
using moviekit::MovieSpec;
using moviekit::SoundCodec;
using namespace std::string_literals;

uint32_t U16(const Bytes& b, size_t at) { return uint32_t{b.at(at)} << 8 | b.at(at + 1); }
uint32_t U32(const Bytes& b, size_t at) { return U16(b, at) << 16 | U16(b, at + 2); }
uint64_t U64(const Bytes& b, size_t at) { return uint64_t{U32(b, at)} << 32 | U32(b, at + 4); }
std::string Type(const Bytes& b, size_t at) { return std::string(b.begin() + at, b.begin() + at + 4); }
Bytes Slice(const Bytes& b, uint64_t at, uint64_t size) { return Bytes(b.begin() + at, b.begin() + at + size); }
Bytes Text(const std::string& text) { return Bytes(text.begin(), text.end()); }

// A deliberately small reader of our own, independent of the library's atom parser.
struct AtomView {
    std::string type;
    uint64_t offset = 0;  // of the header
    uint64_t size = 0;
    uint64_t header = 8;
    uint64_t PayloadOffset() const { return offset + header; }
    uint64_t PayloadSize() const { return size - header; }
};

std::vector<AtomView> Children(const Bytes& file, uint64_t begin, uint64_t end)
{
    std::vector<AtomView> atoms;
    for (uint64_t at = begin; at + 8 <= end;) {
        AtomView atom{Type(file, at + 4), at, U32(file, at), 8};
        if (atom.size == 1) {
            atom.size = U64(file, at + 8);
            atom.header = 16;
        }
        if (atom.size < atom.header || at + atom.size > end) {
            ADD_FAILURE() << "atom " << atom.type << " at " << at << " overruns its parent";
            break;
        }
        atoms.push_back(atom);
        at += atom.size;
    }
    return atoms;
}

std::vector<AtomView> TopLevel(const Bytes& file) { return Children(file, 0, file.size()); }

std::optional<AtomView> Child(const Bytes& file, const AtomView& parent, const std::string& type)
{
    for (const AtomView& atom : Children(file, parent.PayloadOffset(), parent.offset + parent.size)) {
        if (atom.type == type) {
            return atom;
        }
    }
    return std::nullopt;
}

std::optional<AtomView> Path(const Bytes& file, AtomView from, const std::vector<std::string>& path)
{
    for (const std::string& type : path) {
        std::optional<AtomView> next = Child(file, from, type);
        if (!next) {
            return std::nullopt;
        }
        from = *next;
    }
    return from;
}

AtomView Moov(const Bytes& file)
{
    for (const AtomView& atom : TopLevel(file)) {
        if (atom.type == "moov") {
            return atom;
        }
    }
    ADD_FAILURE() << "no moov";
    return {};
}

std::vector<std::string> TrackKinds(const Bytes& file)
{
    std::vector<std::string> kinds;
    const AtomView moov = Moov(file);
    for (const AtomView& trak : Children(file, moov.PayloadOffset(), moov.offset + moov.size)) {
        if (trak.type == "trak") {
            const std::optional<AtomView> hdlr = Path(file, trak, {"mdia", "hdlr"});
            kinds.push_back(hdlr ? Type(file, hdlr->PayloadOffset() + 4) + "/" + Type(file, hdlr->PayloadOffset() + 8)
                                 : "?");
        }
    }
    return kinds;
}

// An atom below the "trak" whose media handler names `subtype`.
std::optional<AtomView> TrackPath(const Bytes& file, const std::string& subtype, const std::vector<std::string>& path)
{
    const AtomView moov = Moov(file);
    for (const AtomView& trak : Children(file, moov.PayloadOffset(), moov.offset + moov.size)) {
        if (trak.type != "trak") {
            continue;
        }
        const std::optional<AtomView> hdlr = Path(file, trak, {"mdia", "hdlr"});
        if (hdlr && Type(file, hdlr->PayloadOffset() + 8) == subtype) {
            return Path(file, trak, path);
        }
    }
    return std::nullopt;
}

Bytes TrackAtom(const Bytes& file, const std::string& subtype, const std::vector<std::string>& path)
{
    const std::optional<AtomView> atom = TrackPath(file, subtype, path);
    return atom ? Slice(file, atom->PayloadOffset(), atom->PayloadSize()) : Bytes{};
}

Bytes StblAtom(const Bytes& file, const std::string& subtype, const std::string& table)
{
    return TrackAtom(file, subtype, {"mdia", "minf", "stbl", table});
}

std::optional<Bytes> MakerAtom(const Bytes& file, const std::vector<std::string>& path)
{
    const std::optional<AtomView> atom = Path(file, Moov(file), path);
    if (!atom) {
        return std::nullopt;
    }
    return Slice(file, atom->PayloadOffset(), atom->PayloadSize());
}

// (first chunk, samples per chunk) of every "stsc" entry.
std::vector<std::pair<uint32_t, uint32_t>> StscRuns(const Bytes& stsc)
{
    std::vector<std::pair<uint32_t, uint32_t>> runs;
    for (uint32_t i = 0; i < U32(stsc, 4); ++i) {
        runs.emplace_back(U32(stsc, 8 + 12 * i), U32(stsc, 12 + 12 * i));
    }
    return runs;
}

Bytes BuildOk(const MovieSpec& recipe, MovieLayout* layout = nullptr)
{
    std::string error;
    Bytes file = moviekit::BuildMovie(recipe, layout, &error);
    EXPECT_FALSE(file.empty()) << error;
    return file;
}

// ---------------------------------------------------------------------------------------
// Maker payloads against the documented layouts, written out by hand.

TEST(MakerPayloadTest, AfInformationLayout)
{
    const Bytes expected = {'A', 'F', 'R', '1', 0x00, 0x01, 0x00, 0x00,  // magic, version 1, flags
                            0x00, 0x00, 0xBB, 0x80, 0x00, 0x00, 0x00, 0x02,  // 48000 Hz, two intervals
                            0, 0, 0, 0, 0, 0, 0x03, 0xE8, 0, 0, 0, 0, 0, 0, 0x07, 0xD0, 0x02, 0xEE, 0, 0,
                            0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 2, 0x03, 0xE8, 0, 0};
    EXPECT_EQ(moviekit::MakeAfInformation(48000, {{1000, 2000, 750}, {0x100000000ULL, 0x100000002ULL, 1000}}, false),
              expected);

    const Bytes processed = moviekit::MakeAfInformation(44100, {}, true);
    EXPECT_EQ(processed, (Bytes{'A', 'F', 'R', '1', 0, 1, 0, 1, 0, 0, 0xAC, 0x44, 0, 0, 0, 0}));
}

TEST(MakerPayloadTest, AudioLevelLayout)
{
    EXPECT_EQ(moviekit::MakeAudioLevel(-1200), (Bytes{'A', 'L', 'V', '1', 0, 1, 0, 0, 0xFF, 0xFF, 0xFB, 0x50}));
    EXPECT_EQ(moviekit::MakeAudioLevel(350), (Bytes{'A', 'L', 'V', '1', 0, 1, 0, 0, 0, 0, 0x01, 0x5E}));
}

TEST(MakerPayloadTest, TagLayouts)
{
    EXPECT_EQ(moviekit::SerializeTag(moviekit::MakeRationalTag(0, 22, 30000, 1001)),
              (Bytes{0, 0, 0, 22, 0, 5, 0, 1, 0, 0, 0x75, 0x30, 0, 0, 0x03, 0xE9}));

    const Bytes ascii = moviekit::SerializeTag(moviekit::MakeAsciiTag(0, 3, "Camera Firmware 1X"));
    ASSERT_EQ(ascii.size(), 27U);
    EXPECT_EQ(Slice(ascii, 0, 8), (Bytes{0, 0, 0, 3, 0, 2, 0, 0x13}));
    EXPECT_EQ(Slice(ascii, 8, 18), Text("Camera Firmware 1X"));
    EXPECT_EQ(ascii[26], 0);

    // Trim tags: forward and backward counts as two LONGs, then the frame rate, in that order.
    const Bytes trim = moviekit::SerializeTags(moviekit::MakeTrimTags(12, 7, 30000, 1001));
    const Bytes expected = {0, 0, 0, 20, 0, 4, 0, 2, 0, 0, 0, 12, 0, 0, 0, 0,
                            0, 0, 0, 21, 0, 4, 0, 2, 0, 0, 0, 7,  0, 0, 0, 0,
                            0, 0, 0, 22, 0, 5, 0, 1, 0, 0, 0x75, 0x30, 0, 0, 0x03, 0xE9};
    EXPECT_EQ(trim, expected);

    // The count is written as given, so tests can make tags that lie about their length.
    moviekit::Tag liar{1, 20, moviekit::kTagLong, 2, {0, 0, 0, 9}};
    EXPECT_EQ(moviekit::SerializeTag(liar), (Bytes{0, 1, 0, 20, 0, 4, 0, 2, 0, 0, 0, 9}));
}

TEST(AacConfigTest, AudioSpecificConfig)
{
    EXPECT_EQ(moviekit::MakeAudioSpecificConfig(48000, 2), (Bytes{0x11, 0x90}));
    EXPECT_EQ(moviekit::MakeAudioSpecificConfig(44100, 1), (Bytes{0x12, 0x08}));
    EXPECT_EQ(moviekit::MakeAudioSpecificConfig(32000, 2), (Bytes{0x12, 0x90}));
    // A rate outside the table is spelled out after the escape index 15.
    EXPECT_EQ(moviekit::MakeAudioSpecificConfig(50000, 2), (Bytes{0x17, 0x80, 0x61, 0xA8, 0x10}));
}

TEST(AacConfigTest, EsdsDescriptorChain)
{
    moviekit::EsdsSpec recipe;
    const Bytes expected = {0, 0, 0, 0,                                 // version, flags
                            0x03, 25, 0x00, 0x01, 0x00,                 // ES_Descriptor, ES_ID 1, flags
                            0x04, 17, 0x40, 0x15, 0x00, 0x18, 0x00,     // DecoderConfig, buffer 6144
                            0x00, 0x03, 0xE8, 0x00, 0x00, 0x01, 0xF4, 0x00,  // max 256000, avg 128000
                            0x05, 2, 0x11, 0x90,                        // DecoderSpecificInfo
                            0x06, 1, 0x02};                             // SLConfig
    EXPECT_EQ(moviekit::MakeEsdsPayload(recipe, {0x11, 0x90}, 256000, 128000), expected);

    recipe.longSizes = true;
    const Bytes longForm = moviekit::MakeEsdsPayload(recipe, {0x11, 0x90}, 256000, 128000);
    ASSERT_EQ(longForm.size(), 43U);
    EXPECT_EQ(Slice(longForm, 4, 5), (Bytes{0x03, 0x80, 0x80, 0x80, 34}));
    EXPECT_EQ(Slice(longForm, 4 + 8, 5), (Bytes{0x04, 0x80, 0x80, 0x80, 20}));
    EXPECT_EQ(Slice(longForm, 4 + 8 + 5 + 13, 7), (Bytes{0x05, 0x80, 0x80, 0x80, 2, 0x11, 0x90}));

    // Optional ES fields follow their flags; an extra descriptor goes after the config.
    moviekit::EsdsSpec odd;
    odd.esFlags = 0xE0;
    odd.profileLevelAfterConfig = true;
    const Bytes withFields = moviekit::MakeEsdsPayload(odd, {0x11, 0x90}, 1, 1);
    EXPECT_EQ(Slice(withFields, 4, 11), (Bytes{0x03, 33, 0x00, 0x01, 0xE0, 0, 0, 0, 0, 0, 0x04}));
    EXPECT_EQ(withFields[15], 20);  // config body grew by the 3-byte descriptor 0x14
    EXPECT_EQ(Slice(withFields, 16 + 13 + 4, 3), (Bytes{0x14, 1, 0x01}));
}

TEST(AacConfigTest, SilentPacketSizesFollowTheFill)
{
    for (uint16_t channels : {1, 2}) {
        std::set<size_t> sizes;
        for (uint32_t fill = 0; fill <= moviekit::kMaxAacFillBytes; ++fill) {
            const Bytes packet = moviekit::MakeSilentAacPacket(channels, fill, fill);
            ASSERT_EQ(packet.size(), moviekit::SilentAacPacketSize(channels, fill)) << channels << " " << fill;
            sizes.insert(packet.size());
        }
        EXPECT_GT(sizes.size(), 250U);
    }
    // First three bits: the element id (SCE 0, CPE 1).
    EXPECT_EQ(moviekit::MakeSilentAacPacket(1, 0, 0)[0] >> 5, 0);
    EXPECT_EQ(moviekit::MakeSilentAacPacket(2, 0, 0)[0] >> 5, 1);
}

// ---------------------------------------------------------------------------------------
// Movie structure, read back with the small reader above.

TEST(MovieStructureTest, DefaultMovieHasCameraLayout)
{
    MovieLayout layout;
    const Bytes file = BuildOk(MovieSpec{}, &layout);
    ASSERT_EQ(file.size(), layout.fileSize);

    std::vector<std::string> order;
    uint64_t sum = 0;
    for (const AtomView& atom : TopLevel(file)) {
        order.push_back(atom.type);
        sum += atom.size;
    }
    EXPECT_EQ(order, (std::vector<std::string>{"ftyp", "wide", "mdat", "moov"}));
    EXPECT_EQ(sum, file.size());
    EXPECT_EQ(Slice(file, 8, 12), Text("qt  \0\0\2\0qt  "s));
    ASSERT_EQ(layout.mdatOffsets.size(), 1U);
    EXPECT_EQ(Type(file, layout.mdatOffsets[0] + 4), "mdat");
    EXPECT_EQ(Type(file, layout.moovOffset + 4), "moov");
    EXPECT_EQ(U32(file, layout.moovOffset), layout.moovSize);
    EXPECT_EQ(TrackKinds(file), (std::vector<std::string>{"mhlr/vide", "mhlr/soun"}));

    // Two seconds' worth of chunk periods: 30 frames of 1001/30000 s in chunks of 15 frames,
    // 48048 stereo frames in chunks of 24024.
    ASSERT_EQ(layout.videoChunks.size(), 2U);
    ASSERT_EQ(layout.soundChunks.size(), 2U);
    EXPECT_EQ(layout.soundSampleCount, 48048U);
    EXPECT_EQ(layout.soundChunks[1].sampleCount, 24024U);
    EXPECT_EQ(layout.soundChunks[1].size, 24024U * 4);
    EXPECT_EQ(layout.videoChunks[0].size, 15U * 64 * 36 * 3);
    EXPECT_EQ(layout.soundBytes.size(), 48048U * 4);
    EXPECT_FALSE(layout.co64);

    // Sound: twos, 16-bit stereo 48 kHz, one frame per sample, 1024 frames of priming edited out.
    const Bytes stsd = StblAtom(file, "soun", "stsd");
    EXPECT_EQ(Type(stsd, 12), "twos");
    EXPECT_EQ(U16(stsd, 24), 0U);
    EXPECT_EQ(U16(stsd, 32), 2U);
    EXPECT_EQ(U16(stsd, 34), 16U);
    EXPECT_EQ(U32(stsd, 40), 48000U << 16);
    EXPECT_EQ(Slice(StblAtom(file, "soun", "stsz"), 4, 8), (Bytes{0, 0, 0, 1, 0, 0, 0xBB, 0xB0}));
    EXPECT_EQ(Slice(StblAtom(file, "soun", "stts"), 4, 12), (Bytes{0, 0, 0, 1, 0, 0, 0xBB, 0xB0, 0, 0, 0, 1}));
    EXPECT_EQ(U32(TrackAtom(file, "soun", {"edts", "elst"}), 12), 1024U);
    const Bytes stco = StblAtom(file, "soun", "stco");
    ASSERT_EQ(U32(stco, 4), 2U);
    EXPECT_EQ(U32(stco, 8), layout.soundChunks[0].offset);
    EXPECT_EQ(U32(stco, 12), layout.soundChunks[1].offset);
    const Bytes video = StblAtom(file, "vide", "stsd");
    EXPECT_EQ(Type(video, 12), "raw ");
    EXPECT_EQ(U16(video, 8 + 32), 64U);
    EXPECT_EQ(U16(video, 8 + 34), 36U);
    EXPECT_EQ(U32(StblAtom(file, "vide", "stsz"), 4), 6912U);

    // Maker data: AF information for the sound's rate, the level, and the four default tags.
    const std::optional<Bytes> af = MakerAtom(file, {"udta", "TCDT", "TCDB", "OP01"});
    ASSERT_TRUE(af);
    EXPECT_EQ(Slice(*af, 0, 4), Text("AFR1"));
    EXPECT_EQ(U32(*af, 8), 48000U);
    ASSERT_EQ(U32(*af, 12), 2U);
    EXPECT_EQ(af->size(), 16U + 40);
    EXPECT_LT(U64(*af, 16 + 20 + 8), 48048U);  // the second interval ends inside the sound
    EXPECT_EQ(MakerAtom(file, {"udta", "TCDT", "TCDB", "OP02"}), moviekit::MakeAudioLevel(-1200));
    const std::optional<Bytes> tags = MakerAtom(file, {"udta", "TCDT", "TCTG"});
    ASSERT_TRUE(tags);
    std::vector<uint32_t> numbers;
    for (size_t at = 0; at + 8 <= tags->size();) {
        numbers.push_back(U16(*tags, at + 2));
        const uint32_t type = U16(*tags, at + 4);
        const uint32_t width = type == 4 ? 4 : type == 5 ? 8 : 1;
        if (U16(*tags, at + 2) == 22) {
            EXPECT_EQ(U32(*tags, at + 8), 30000U);
            EXPECT_EQ(U32(*tags, at + 12), 1001U);
        }
        at += 8 + width * U16(*tags, at + 6);
    }
    EXPECT_EQ(numbers, (std::vector<uint32_t>{3, 20, 21, 22}));
}

TEST(MovieStructureTest, TopLevelOrderOptions)
{
    struct Row {
        const char* name;
        void (*apply)(MovieSpec&);
        std::vector<std::string> order;
    };
    const std::vector<Row> rows = {
        {"moov first", [](MovieSpec& s) { s.moovBeforeMdat = true; }, {"ftyp", "moov", "wide", "mdat"}},
        {"ftyp after moov", [](MovieSpec& s) { s.ftypAfterMoov = true; s.wide = false; }, {"mdat", "moov", "ftyp"}},
        {"free and three mdat", [](MovieSpec& s) { s.freeSize = 5; s.mdatCount = 3; },
         {"ftyp", "free", "wide", "mdat", "mdat", "mdat", "moov"}},
        {"large mdat header", [](MovieSpec& s) { s.largeMdatHeader = true; }, {"ftyp", "wide", "mdat", "moov"}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        MovieSpec recipe;
        row.apply(recipe);
        MovieLayout layout;
        const Bytes file = BuildOk(recipe, &layout);
        std::vector<std::string> order;
        std::vector<AtomView> mdats;
        for (const AtomView& atom : TopLevel(file)) {
            order.push_back(atom.type);
            if (atom.type == "mdat") {
                mdats.push_back(atom);
            }
        }
        EXPECT_EQ(order, row.order);
        ASSERT_EQ(layout.mdatPayloadOffsets.size(), mdats.size());
        // Every chunk lies inside an mdat payload, and the mdats hold nothing else.
        uint64_t chunkBytes = 0;
        for (const auto* chunks : {&layout.soundChunks, &layout.videoChunks}) {
            for (const moviekit::ChunkLayout& chunk : *chunks) {
                chunkBytes += chunk.size;
                bool inside = false;
                for (const AtomView& mdat : mdats) {
                    const uint64_t end = mdat.offset + mdat.size;
                    inside = inside || (chunk.offset >= mdat.PayloadOffset() && chunk.offset + chunk.size <= end);
                }
                EXPECT_TRUE(inside) << chunk.offset;
            }
        }
        uint64_t payloads = 0;
        for (size_t i = 0; i < mdats.size(); ++i) {
            EXPECT_EQ(mdats[i].PayloadOffset(), layout.mdatPayloadOffsets[i]);
            payloads += mdats[i].PayloadSize();
        }
        EXPECT_EQ(payloads, chunkBytes);
        EXPECT_EQ(mdats[0].header, recipe.largeMdatHeader ? 16U : 8U);
        EXPECT_EQ(U32(StblAtom(file, "soun", "stco"), 8), layout.soundChunks[0].offset);
    }
}

TEST(MovieStructureTest, PcmBytesAreStoredInTheTrackByteOrder)
{
    for (SoundCodec codec : {SoundCodec::Twos, SoundCodec::Sowt}) {
        MovieSpec recipe;
        recipe.sound.codec = codec;
        recipe.sound.channels = 1;
        recipe.sound.pcm = {0x1234, -2, 0x7F00, 5, 6};
        recipe.sound.chunkSampleCounts = {2, 3};
        MovieLayout layout;
        const Bytes file = BuildOk(recipe, &layout);
        const Bytes expected = codec == SoundCodec::Twos ? Bytes{0x12, 0x34, 0xFF, 0xFE, 0x7F, 0, 0, 5, 0, 6}
                                                         : Bytes{0x34, 0x12, 0xFE, 0xFF, 0, 0x7F, 5, 0, 6, 0};
        EXPECT_EQ(layout.soundBytes, expected);
        ASSERT_EQ(layout.soundChunks.size(), 2U);
        EXPECT_EQ(Slice(file, layout.soundChunks[0].offset, 4), Slice(expected, 0, 4));
        EXPECT_EQ(Slice(file, layout.soundChunks[1].offset, 6), Slice(expected, 4, 6));
        EXPECT_EQ(Type(StblAtom(file, "soun", "stsd"), 12), codec == SoundCodec::Twos ? "twos" : "sowt");
        // A camera's "sowt" track carries no priming in its edit.
        EXPECT_EQ(U32(TrackAtom(file, "soun", {"edts", "elst"}), 12), codec == SoundCodec::Twos ? 1024U : 0U);
    }
}

TEST(MovieStructureTest, GeneratedMediaIsDeterministicAndDistinctPerFrame)
{
    MovieLayout first;
    MovieLayout second;
    const Bytes a = BuildOk(MovieSpec{}, &first);
    const Bytes b = BuildOk(MovieSpec{}, &second);
    EXPECT_EQ(a, b);
    const Bytes frame0 = Slice(a, first.videoChunks[0].offset, first.videoFrameSize);
    const Bytes frame1 = Slice(a, first.videoChunks[0].offset + first.videoFrameSize, first.videoFrameSize);
    const Bytes frame15 = Slice(a, first.videoChunks[1].offset, first.videoFrameSize);
    EXPECT_NE(frame0, frame1);
    EXPECT_NE(frame0, frame15);
    // The tone differs between channels and is not silence.
    EXPECT_NE(Slice(first.soundBytes, 4, 2), Slice(first.soundBytes, 6, 2));
    EXPECT_NE(Slice(first.soundBytes, 4, 4), (Bytes{0, 0, 0, 0}));

    testsupport::TempDir dir;
    std::string error;
    MovieLayout written;
    ASSERT_TRUE(moviekit::WriteMovie(dir.File("m.mov"), MovieSpec{}, &written, &error)) << error;
    EXPECT_EQ(testsupport::ReadFile(dir.File("m.mov")), a);
    EXPECT_EQ(written.soundBytes, first.soundBytes);
}

TEST(MovieStructureTest, SampleToChunkRuns)
{
    MovieSpec recipe;
    recipe.sound.sampleCount = 1000;
    recipe.sound.samplesPerChunk = 300;  // 300, 300, 300, 100
    recipe.video.frameCount = 31;        // 15, 15, 1
    MovieLayout layout;
    Bytes file = BuildOk(recipe, &layout);
    using Runs = std::vector<std::pair<uint32_t, uint32_t>>;
    EXPECT_EQ(StscRuns(StblAtom(file, "soun", "stsc")), (Runs{{1, 300}, {4, 100}}));
    EXPECT_EQ(StscRuns(StblAtom(file, "vide", "stsc")), (Runs{{1, 15}, {3, 1}}));
    EXPECT_EQ(U32(StblAtom(file, "soun", "stco"), 4), 4U);

    recipe.sound.chunkSampleCounts = {100, 100, 50, 50, 70, 630};
    file = BuildOk(recipe, &layout);
    EXPECT_EQ(StscRuns(StblAtom(file, "soun", "stsc")), (Runs{{1, 100}, {3, 50}, {5, 70}, {6, 630}}));
    EXPECT_EQ(layout.soundChunks[5].firstSample, 370U);

    recipe.sound.chunkSampleCounts = {100, 100};
    std::string error;
    EXPECT_TRUE(moviekit::BuildMovie(recipe, nullptr, &error).empty());
    EXPECT_NE(error.find("add up"), std::string::npos) << error;
}

TEST(MovieStructureTest, ChunksInterleaveInTimeOrder)
{
    for (bool soundFirst : {false, true}) {
        MovieSpec recipe;
        recipe.soundFirstInPeriod = soundFirst;
        recipe.video.frameCount = 90;  // six periods of 15 frames (0.5005 s)
        recipe.sound.samplesPerChunk = 9600;  // 0.2 s
        MovieLayout layout;
        BuildOk(recipe, &layout);
        struct Placed {
            uint64_t offset;
            double start;
            bool sound;
        };
        std::vector<Placed> placed;
        for (const auto& chunk : layout.videoChunks) {
            placed.push_back({chunk.offset, chunk.firstSample * 1001.0 / 30000, false});
        }
        for (const auto& chunk : layout.soundChunks) {
            placed.push_back({chunk.offset, chunk.firstSample / 48000.0, true});
        }
        std::sort(placed.begin(), placed.end(), [](const Placed& a, const Placed& b) { return a.offset < b.offset; });
        ASSERT_EQ(placed.front().sound, soundFirst);
        // Each sound chunk follows the video chunk of its own period (video first) or of the
        // period before (sound first), so neither track runs ahead of the other.
        double lastVideo = -1;
        for (size_t i = 0; i < placed.size(); ++i) {
            if (!placed[i].sound) {
                EXPECT_GT(placed[i].start, lastVideo);
                lastVideo = placed[i].start;
                continue;
            }
            const double periodStart = std::floor(placed[i].start / 0.5005) * 0.5005;
            const double expected = !soundFirst ? periodStart : periodStart == 0 ? -1 : periodStart - 0.5005;
            EXPECT_NEAR(lastVideo, expected, 1e-6) << "chunk " << i;
        }
    }
}

TEST(MovieStructureTest, EditListAndMakerAtomOptions)
{
    MovieSpec recipe;
    recipe.sound.mediaTime = 2112;
    recipe.soundTrackFirst = true;
    recipe.dataHandlerInMinf = false;
    recipe.maker.audioLevel = false;
    recipe.maker.afPayload = Text("foreign camera AF");
    recipe.maker.tags = std::vector<moviekit::Tag>{moviekit::MakeAsciiTag(1, 3, "x")};
    recipe.maker.extraTcdtChildren = {moviekit::Atom("OP02", {1, 2})};
    Bytes file = BuildOk(recipe);
    EXPECT_EQ(TrackKinds(file), (std::vector<std::string>{"mhlr/soun", "mhlr/vide"}));
    EXPECT_EQ(U32(TrackAtom(file, "soun", {"edts", "elst"}), 12), 2112U);
    EXPECT_FALSE(Path(file, Moov(file), {"trak", "mdia", "minf", "hdlr"}));
    EXPECT_EQ(MakerAtom(file, {"udta", "TCDT", "TCDB", "OP01"}), Text("foreign camera AF"));
    EXPECT_FALSE(MakerAtom(file, {"udta", "TCDT", "TCDB", "OP02"}));
    EXPECT_EQ(MakerAtom(file, {"udta", "TCDT", "OP02"}), (Bytes{1, 2}));
    EXPECT_EQ(MakerAtom(file, {"udta", "TCDT", "TCTG"}), (Bytes{0, 1, 0, 3, 0, 2, 0, 2, 'x', 0}));

    recipe = MovieSpec{};
    recipe.sound.elst = false;
    recipe.video.edit = false;
    recipe.maker.afInformation = false;
    recipe.maker.audioLevel = false;
    recipe.maker.tagAtom = false;
    file = BuildOk(recipe);
    const std::optional<AtomView> edts = TrackPath(file, "soun", {"edts"});
    ASSERT_TRUE(edts);
    EXPECT_EQ(edts->size, 8U);  // an edit container without its list
    EXPECT_FALSE(TrackPath(file, "vide", {"edts"}));
    EXPECT_EQ(MakerAtom(file, {"udta"}), Bytes{});

    recipe.sound.edts = false;
    recipe.maker.userData = false;
    file = BuildOk(recipe);
    EXPECT_FALSE(TrackPath(file, "soun", {"edts"}));
    EXPECT_TRUE(TrackPath(file, "soun", {"tkhd"}));
    for (const AtomView& atom : Children(file, Moov(file).PayloadOffset(), Moov(file).offset + Moov(file).size)) {
        EXPECT_NE(atom.type, "udta");
    }
}

TEST(MovieStructureTest, InvalidDescriptionsAreRefused)
{
    struct Row {
        const char* name;
        void (*apply)(MovieSpec&);
    };
    const std::vector<Row> rows = {
        {"no channels", [](MovieSpec& s) { s.sound.channels = 0; }},
        {"rate beyond 16.16", [](MovieSpec& s) { s.sound.sampleRate = 96000; }},
        {"ragged PCM", [](MovieSpec& s) { s.sound.pcm = {1, 2, 3}; }},
        {"PCM and count disagree", [](MovieSpec& s) { s.sound.pcm = {1, 2}; s.sound.sampleCount = 5; }},
        {"empty chunk", [](MovieSpec& s) { s.sound.chunkSampleCounts = {5, 0}; }},
        {"generated 6-channel AAC", [](MovieSpec& s) { s.sound.codec = SoundCodec::Aac; s.sound.channels = 6; }},
        {"no frames", [](MovieSpec& s) { s.video.frameCount = 0; }},
        {"movie time scale 0", [](MovieSpec& s) { s.movieTimeScale = 0; }},
    };
    for (const Row& row : rows) {
        MovieSpec recipe;
        row.apply(recipe);
        std::string error;
        MovieLayout layout;
        EXPECT_TRUE(moviekit::BuildMovie(recipe, &layout, &error).empty()) << row.name;
        EXPECT_FALSE(error.empty()) << row.name;
    }
}

TEST(MovieStructureTest, AacTrackCarriesPacketTableAndDecoderConfig)
{
    MovieSpec recipe;
    recipe.sound.codec = SoundCodec::Aac;
    recipe.sound.esds.averageBitRate = 96000;
    recipe.sound.aacPackets = {Bytes(10, 1), Bytes(20, 2), Bytes(30, 3)};
    recipe.sound.samplesPerChunk = 2;
    MovieLayout layout;
    const Bytes file = BuildOk(recipe, &layout);
    const Bytes stsz = StblAtom(file, "soun", "stsz");
    EXPECT_EQ(Slice(stsz, 4, 8 + 12), (Bytes{0, 0, 0, 0, 0, 0, 0, 3, 0, 0, 0, 10, 0, 0, 0, 20, 0, 0, 0, 30}));
    EXPECT_EQ(Slice(StblAtom(file, "soun", "stts"), 8, 8), (Bytes{0, 0, 0, 3, 0, 0, 4, 0}));
    ASSERT_EQ(layout.soundChunks.size(), 2U);
    EXPECT_EQ(layout.soundChunks[0].sampleSizes, (std::vector<uint32_t>{10, 20}));
    EXPECT_EQ(Slice(file, layout.soundChunks[1].offset, 30), Bytes(30, 3));
    const Bytes stsd = StblAtom(file, "soun", "stsd");
    EXPECT_EQ(Type(stsd, 12), "mp4a");
    EXPECT_EQ(Type(stsd, 16 + 28 + 4), "esds");
    const Bytes esds = Slice(stsd, 16 + 28 + 8, U32(stsd, 16 + 28) - 8);
    // The largest packet, 30 bytes per 1024 frames at 48 kHz, sets the peak rate.
    recipe.sound.esds.maxBitRate = 11250;
    EXPECT_EQ(esds, moviekit::MakeEsdsPayload(recipe.sound.esds, {0x11, 0x90}, 11250, 96000));
}

// ---------------------------------------------------------------------------------------
// ffprobe, an independent reader, must accept the movies and see what MovieLayout says.

struct ProbeCase {
    const char* name;
    SoundCodec codec;
    uint16_t channels;
    uint32_t rate;
    uint16_t descriptionVersion;
    bool co64;
    bool largeMdatHeader;
    bool soundTrackFirst;
    bool moovBeforeMdat;
    const char* codecName;
};

using Fields = std::map<std::string, std::string>;

// One line of ffprobe's compact output ("section|key=value|...").
Fields ParseCompact(const std::string& line)
{
    Fields fields;
    std::stringstream stream(line);
    std::string item;
    std::getline(stream, item, '|');
    fields["section"] = item;
    while (std::getline(stream, item, '|')) {
        const size_t eq = item.find('=');
        fields[item.substr(0, eq)] = eq == std::string::npos ? "" : item.substr(eq + 1);
    }
    return fields;
}

class FfprobeTest : public testing::TestWithParam<ProbeCase> {};

TEST_P(FfprobeTest, ReadsTracksAndPacketsAsLaidOut)
{
    ASSERT_TRUE(testsupport::HaveCommand("ffprobe")) << "ffprobe is required";
    const ProbeCase& c = GetParam();
    MovieSpec recipe;
    recipe.sound.codec = c.codec;
    recipe.sound.channels = c.channels;
    recipe.sound.sampleRate = c.rate;
    recipe.sound.descriptionVersion = c.descriptionVersion;
    recipe.sound.samplesPerChunk = c.codec == SoundCodec::Aac ? 7 : 5000;  // short last chunks
    recipe.video.frameCount = 45;
    recipe.co64 = c.co64;
    recipe.largeMdatHeader = c.largeMdatHeader;
    recipe.soundTrackFirst = c.soundTrackFirst;
    recipe.moovBeforeMdat = c.moovBeforeMdat;
    testsupport::TempDir dir;
    const std::string path = dir.File("movie.mov");
    MovieLayout layout;
    std::string error;
    ASSERT_TRUE(moviekit::WriteMovie(path, recipe, &layout, &error)) << error;
    ASSERT_EQ(layout.co64, c.co64);

    // Edit lists are ignored so that every stored packet is listed; -count_frames decodes them all.
    std::string output;
    const std::string command =
        "ffprobe -v error -ignore_editlist 1 -count_frames -show_entries "
        "stream=index,codec_type,codec_name,sample_rate,channels,width,height,nb_read_frames:"
        "packet=stream_index,pos,size -of compact " +
        testsupport::ShellQuote(path) + " 2>" + testsupport::ShellQuote(dir.File("errors.txt"));
    ASSERT_EQ(testsupport::RunCommand(command, &output), 0);
    const Bytes errors = testsupport::ReadFile(dir.File("errors.txt"));
    EXPECT_TRUE(errors.empty()) << std::string(errors.begin(), errors.end());

    std::map<std::string, Fields> streams;  // by codec type
    std::map<std::string, std::vector<std::pair<uint64_t, uint64_t>>> packets;  // by stream index
    std::stringstream lines(output);
    for (std::string line; std::getline(lines, line);) {
        Fields fields = ParseCompact(line);
        if (fields["section"] == "stream") {
            streams[fields["codec_type"]] = fields;
        } else if (fields["section"] == "packet") {
            packets[fields["stream_index"]].emplace_back(std::stoull(fields["pos"]), std::stoull(fields["size"]));
        }
    }
    ASSERT_EQ(streams.size(), 2U) << output;
    Fields& audio = streams["audio"];
    Fields& video = streams["video"];
    EXPECT_EQ(audio["index"], c.soundTrackFirst ? "0" : "1");
    EXPECT_EQ(audio["codec_name"], c.codecName);
    EXPECT_EQ(audio["sample_rate"], std::to_string(c.rate));
    EXPECT_EQ(audio["channels"], std::to_string(c.channels));
    EXPECT_EQ(video["codec_name"], "rawvideo");
    EXPECT_EQ(video["width"], "64");
    EXPECT_EQ(video["height"], "36");
    EXPECT_EQ(video["nb_read_frames"], "45");

    std::vector<std::pair<uint64_t, uint64_t>> expectedVideo;
    for (const auto& chunk : layout.videoChunks) {
        for (uint32_t i = 0; i < chunk.sampleCount; ++i) {
            expectedVideo.emplace_back(chunk.offset + uint64_t{i} * layout.videoFrameSize, layout.videoFrameSize);
        }
    }
    // ffprobe cuts PCM chunks into packets of at most 1024 frames.
    std::vector<std::pair<uint64_t, uint64_t>> expectedSound;
    const uint64_t frameBytes = 2U * c.channels;
    for (const auto& chunk : layout.soundChunks) {
        uint64_t at = chunk.offset;
        if (c.codec == SoundCodec::Aac) {
            for (uint32_t size : chunk.sampleSizes) {
                expectedSound.emplace_back(at, size);
                at += size;
            }
            continue;
        }
        for (uint32_t done = 0; done < chunk.sampleCount; done += 1024) {
            const uint64_t size = std::min<uint32_t>(1024, chunk.sampleCount - done) * frameBytes;
            expectedSound.emplace_back(at, size);
            at += size;
        }
    }
    EXPECT_EQ(packets[video["index"]], expectedVideo);
    EXPECT_EQ(packets[audio["index"]], expectedSound);
    if (c.codec == SoundCodec::Aac) {
        EXPECT_EQ(audio["nb_read_frames"], std::to_string(layout.soundSampleCount));
    }
    // The sound bytes ffprobe located are those the layout reports.
    const Bytes file = testsupport::ReadFile(path);
    Bytes located;
    for (const auto& [pos, size] : packets[audio["index"]]) {
        const Bytes piece = Slice(file, pos, size);
        located.insert(located.end(), piece.begin(), piece.end());
    }
    EXPECT_EQ(located, layout.soundBytes);
}

INSTANTIATE_TEST_SUITE_P(
    Movies, FfprobeTest,
    testing::Values(
        ProbeCase{"TwosStco", SoundCodec::Twos, 2, 48000, 0, false, false, false, false, "pcm_s16be"},
        ProbeCase{"SowtCo64Version1", SoundCodec::Sowt, 2, 48000, 1, true, true, false, false, "pcm_s16le"},
        ProbeCase{"TwosMonoSoundFirst", SoundCodec::Twos, 1, 32000, 1, false, false, true, true, "pcm_s16be"},
        ProbeCase{"AacStco", SoundCodec::Aac, 2, 48000, 0, false, false, false, false, "aac"},
        ProbeCase{"AacCo64SoundFirst", SoundCodec::Aac, 2, 48000, 0, true, true, true, true, "aac"},
        ProbeCase{"AacMonoVersion1", SoundCodec::Aac, 1, 44100, 1, false, false, false, false, "aac"}),
    [](const testing::TestParamInfo<ProbeCase>& info) { return std::string(info.param.name); });

}  // namespace
