// moviekit: maker payloads byte for byte, and ffprobe as an independent reader of the movies.
#include "Movie.h"
#include "support/TestSupport.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <sstream>

namespace {

using moviekit::Bytes;
using moviekit::MovieLayout;
using Recipe = moviekit::MovieRecipe;
using moviekit::SoundCodec;
using namespace std::string_literals;

uint32_t U32(const Bytes& b, size_t at)
{
    return uint32_t{b.at(at)} << 24 | b.at(at + 1) << 16 | b.at(at + 2) << 8 | b.at(at + 3);
}
uint64_t U64(const Bytes& b, size_t at) { return uint64_t{U32(b, at)} << 32 | U32(b, at + 4); }
Bytes Slice(const Bytes& b, uint64_t at, uint64_t size) { return Bytes(b.begin() + at, b.begin() + at + size); }
Bytes Text(const std::string& text) { return Bytes(text.begin(), text.end()); }
bool Contains(const Bytes& hay, const Bytes& needle)
{
    return std::search(hay.begin(), hay.end(), needle.begin(), needle.end()) != hay.end();
}

TEST(MakerPayloadTest, MatchesHandWrittenBytes)
{
    const Bytes af = {'A', 'F', 'R', '1', 0, 1, 0, 0,  // magic, version 1, flags
                      0, 0, 0xBB, 0x80, 0, 0, 0, 2,  // 48000 Hz, two intervals
                      0, 0, 0, 0, 0, 0, 0x03, 0xE8, 0, 0, 0, 0, 0, 0, 0x07, 0xD0, 0x02, 0xEE, 0, 0,
                      0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 2, 0x03, 0xE8, 0, 0};
    EXPECT_EQ(moviekit::MakeAfInformation(48000, {{1000, 2000, 750}, {0x100000000ULL, 0x100000002ULL, 1000}}, false),
              af);
    EXPECT_EQ(moviekit::MakeAfInformation(44100, {}, true),
              (Bytes{'A', 'F', 'R', '1', 0, 1, 0, 1, 0, 0, 0xAC, 0x44, 0, 0, 0, 0}));

    EXPECT_EQ(moviekit::MakeAudioLevel(-1200), (Bytes{'A', 'L', 'V', '1', 0, 1, 0, 0, 0xFF, 0xFF, 0xFB, 0x50}));
    EXPECT_EQ(moviekit::MakeAudioLevel(350), (Bytes{'A', 'L', 'V', '1', 0, 1, 0, 0, 0, 0, 0x01, 0x5E}));

    EXPECT_EQ(moviekit::SerializeTag(moviekit::MakeAsciiTag(0, 3, "Camera Firmware 1X")),
              moviekit::Concat({{0, 0, 0, 3, 0, 2, 0, 0x13}, Text("Camera Firmware 1X\0"s)}));
    const Bytes trim = {0, 0, 0, 20, 0, 4, 0, 2, 0, 0, 0, 12, 0, 0, 0, 0,  //
                        0, 0, 0, 21, 0, 4, 0, 2, 0, 0, 0, 7,  0, 0, 0, 0,  //
                        0, 0, 0, 22, 0, 5, 0, 1, 0, 0, 0x75, 0x30, 0, 0, 0x03, 0xE9};
    EXPECT_EQ(moviekit::SerializeTags(moviekit::MakeTrimTags(12, 7, 30000, 1001)), trim);
    // Tests rely on a count that lies about the data.
    EXPECT_EQ(moviekit::SerializeTag({1, 20, moviekit::kTagLong, 2, {0, 0, 0, 9}}),
              (Bytes{0, 1, 0, 20, 0, 4, 0, 2, 0, 0, 0, 9}));
}

TEST(AacConfigTest, MatchesHandWrittenBytes)
{
    EXPECT_EQ(moviekit::MakeAudioSpecificConfig(48000, 2), (Bytes{0x11, 0x90}));
    EXPECT_EQ(moviekit::MakeAudioSpecificConfig(44100, 1), (Bytes{0x12, 0x08}));
    EXPECT_EQ(moviekit::MakeAudioSpecificConfig(50000, 2), (Bytes{0x17, 0x80, 0x61, 0xA8, 0x10}));  // escape 15

    moviekit::EsdsRecipe recipe;
    EXPECT_EQ(moviekit::MakeEsdsPayload(recipe, {0x11, 0x90}, 256000, 128000),
              (Bytes{0, 0, 0, 0, 0x03, 25, 0, 1, 0,                                       // ES_Descriptor, ES_ID 1
                     0x04, 17, 0x40, 0x15, 0, 0x18, 0, 0, 0x03, 0xE8, 0, 0, 0x01, 0xF4, 0,  // DecoderConfig
                     0x05, 2, 0x11, 0x90, 0x06, 1, 0x02}));
    recipe.longSizes = true;
    EXPECT_EQ(moviekit::MakeEsdsPayload(recipe, {0x11, 0x90}, 256000, 128000),
              (Bytes{0, 0, 0, 0, 0x03, 0x80, 0x80, 0x80, 34, 0, 1, 0,  //
                     0x04, 0x80, 0x80, 0x80, 20, 0x40, 0x15, 0, 0x18, 0, 0, 0x03, 0xE8, 0, 0, 0x01, 0xF4, 0,
                     0x05, 0x80, 0x80, 0x80, 2, 0x11, 0x90, 0x06, 0x80, 0x80, 0x80, 1, 0x02}));
    recipe = {};
    recipe.esFlags = 0xE0;  // depends-on ES_ID, empty URL, OCR ES_ID
    recipe.profileLevelAfterConfig = true;
    EXPECT_EQ(moviekit::MakeEsdsPayload(recipe, {0x11, 0x90}, 1, 1),
              (Bytes{0, 0, 0, 0, 0x03, 33, 0, 1, 0xE0, 0, 0, 0, 0, 0,  //
                     0x04, 20, 0x40, 0x15, 0, 0x18, 0, 0, 0, 0, 1, 0, 0, 0, 1,
                     0x05, 2, 0x11, 0x90, 0x14, 1, 0x01, 0x06, 1, 0x02}));

    // The layout plans with the size function; the writer emits the packets.
    for (uint16_t channels : {1, 2}) {
        for (uint32_t fill = 0; fill <= moviekit::kMaxAacFillBytes; ++fill) {
            ASSERT_EQ(moviekit::MakeSilentAacPacket(channels, fill, fill).size(),
                      moviekit::SilentAacPacketSize(channels, fill));
        }
    }
}

TEST(MovieKitTest, PcmInTheTrackByteOrderAndMakerAtoms)
{
    for (SoundCodec codec : {SoundCodec::Twos, SoundCodec::Sowt}) {
        Recipe recipe;
        recipe.sound.codec = codec;
        recipe.sound.channels = 1;
        recipe.sound.pcm = {0x1234, -2, 0x7F00};
        MovieLayout layout;
        std::string error;
        ASSERT_FALSE(moviekit::BuildMovie(recipe, &layout, &error).empty()) << error;
        EXPECT_EQ(layout.soundBytes, codec == SoundCodec::Twos ? (Bytes{0x12, 0x34, 0xFF, 0xFE, 0x7F, 0})
                                                               : (Bytes{0x34, 0x12, 0xFE, 0xFF, 0, 0x7F}));
    }

    // The default movie carries the maker atoms.
    const Bytes file = moviekit::BuildMovie(Recipe{});
    EXPECT_TRUE(Contains(file, Text("OP01AFR1")));
    EXPECT_TRUE(Contains(file, moviekit::Atom("OP02", moviekit::MakeAudioLevel(-1200))));
    std::vector<moviekit::Tag> tags = moviekit::MakeTrimTags(0, 0, 30000, 1001);
    tags.insert(tags.begin(), moviekit::MakeAsciiTag(0, 3, "Camera Firmware 1.00"));
    EXPECT_TRUE(Contains(file, moviekit::Atom("TCTG", moviekit::SerializeTags(tags))));
}

TEST(MovieKitTest, InvalidDescriptionsAreRefused)
{
    const std::vector<std::pair<const char*, void (*)(Recipe&)>> rows = {
        {"no channels", [](Recipe& r) { r.sound.channels = 0; }},
        {"rate beyond 16.16", [](Recipe& r) { r.sound.sampleRate = 96000; }},
        {"ragged PCM", [](Recipe& r) { r.sound.pcm = {1, 2, 3}; }},
        {"PCM and count disagree", [](Recipe& r) { r.sound.pcm = {1, 2}; r.sound.sampleCount = 5; }},
        {"empty chunk", [](Recipe& r) { r.sound.chunkSampleCounts = {5, 0}; }},
        {"chunks short of count", [](Recipe& r) { r.sound.sampleCount = 9; r.sound.chunkSampleCounts = {1, 2}; }},
        {"generated 6-channel AAC", [](Recipe& r) { r.sound.codec = SoundCodec::Aac; r.sound.channels = 6; }},
        {"no frames", [](Recipe& r) { r.video.frameCount = 0; }},
        {"movie time scale 0", [](Recipe& r) { r.movieTimeScale = 0; }},
    };
    for (const auto& [name, apply] : rows) {
        Recipe recipe;
        apply(recipe);
        std::string error;
        EXPECT_TRUE(moviekit::BuildMovie(recipe, nullptr, &error).empty()) << name;
        EXPECT_FALSE(error.empty()) << name;
    }
}

using Fields = std::map<std::string, std::string>;

// One line of ffprobe's compact output ("section|key=value|...").
Fields ParseCompact(const std::string& line)
{
    Fields fields;
    std::stringstream stream("section=" + line);
    for (std::string item; std::getline(stream, item, '|');) {
        const size_t eq = item.find('=');
        fields[item.substr(0, eq)] = eq == std::string::npos ? "" : item.substr(eq + 1);
    }
    return fields;
}

// ffprobe, an independent reader, must accept the movies and see what MovieLayout says.
struct ProbeCase {
    SoundCodec codec;
    uint16_t channels;
    uint32_t rate;
    uint16_t descriptionVersion;
    bool wide;                // co64 and a 64-bit mdat size
    bool soundAndMoovFirst;  // the sound track, and the movie atom before the media
    const char* codecName;
};

void ProbeMovie(const ProbeCase& c)
{
    Recipe recipe;
    recipe.sound.codec = c.codec;
    recipe.sound.channels = c.channels;
    recipe.sound.sampleRate = c.rate;
    recipe.sound.descriptionVersion = c.descriptionVersion;
    recipe.sound.samplesPerChunk = c.codec == SoundCodec::Aac ? 7 : 5000;  // short last chunks
    recipe.video.frameCount = 45;
    recipe.co64 = recipe.largeMdatHeader = c.wide;
    recipe.soundTrackFirst = recipe.moovBeforeMdat = c.soundAndMoovFirst;
    testsupport::TempDir dir;
    const std::string path = dir.File("movie.mov");
    MovieLayout layout;
    std::string error;
    ASSERT_TRUE(moviekit::WriteMovie(path, recipe, &layout, &error)) << error;
    const Bytes file = testsupport::ReadFile(path);
    ASSERT_EQ(file.size(), layout.fileSize);

    // ffprobe reads either form, so the choices are checked in the bytes.
    EXPECT_EQ(layout.co64, c.wide);
    EXPECT_EQ(Contains(Slice(file, layout.moovOffset, layout.moovSize), Text("co64")), c.wide);
    EXPECT_EQ(layout.moovOffset < layout.mdatOffsets.at(0), c.soundAndMoovFirst);
    const uint64_t mdat = layout.mdatOffsets[0];
    const uint64_t header = c.wide ? 16 : 8;
    EXPECT_EQ(layout.mdatPayloadOffsets.at(0), mdat + header);
    EXPECT_EQ(U32(file, mdat), c.wide ? 1 : header + layout.mdatPayloadSizes.at(0));
    if (c.wide) {
        EXPECT_EQ(U64(file, mdat + 8), header + layout.mdatPayloadSizes[0]);
    }

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
    EXPECT_EQ(audio["index"] + " " + audio["codec_name"] + " " + audio["sample_rate"] + " Hz " + audio["channels"],
              (c.soundAndMoovFirst ? "0 " : "1 ") + std::string(c.codecName) + " " + std::to_string(c.rate) + " Hz " +
                  std::to_string(c.channels));
    EXPECT_EQ(video["codec_name"] + " " + video["width"] + "x" + video["height"] + " " + video["nb_read_frames"],
              "rawvideo 64x36 45");

    std::vector<std::pair<uint64_t, uint64_t>> expectedVideo;
    for (const auto& chunk : layout.videoChunks) {
        for (uint32_t i = 0; i < chunk.sampleCount; ++i) {
            expectedVideo.emplace_back(chunk.offset + uint64_t{i} * layout.videoFrameSize, layout.videoFrameSize);
        }
    }
    // ffprobe cuts PCM chunks into packets of at most 1024 frames.
    std::vector<std::pair<uint64_t, uint64_t>> expectedSound;
    for (const auto& chunk : layout.soundChunks) {
        uint64_t at = chunk.offset;
        std::vector<uint32_t> sizes = chunk.sampleSizes;
        for (uint32_t done = 0; c.codec != SoundCodec::Aac && done < chunk.sampleCount; done += 1024) {
            sizes.push_back(std::min<uint32_t>(1024, chunk.sampleCount - done) * 2U * c.channels);
        }
        for (uint32_t size : sizes) {
            expectedSound.emplace_back(at, size);
            at += size;
        }
    }
    EXPECT_EQ(packets[video["index"]], expectedVideo);
    EXPECT_EQ(packets[audio["index"]], expectedSound);
    if (c.codec == SoundCodec::Aac) {
        EXPECT_EQ(audio["nb_read_frames"], std::to_string(layout.soundSampleCount));
    }
    Bytes located;
    for (const auto& [pos, size] : packets[audio["index"]]) {
        located.insert(located.end(), file.begin() + pos, file.begin() + pos + size);
    }
    EXPECT_EQ(located, layout.soundBytes);
}

TEST(FfprobeTest, ReadsTracksAndPacketsAsLaidOut)
{
    ASSERT_TRUE(testsupport::HaveCommand("ffprobe")) << "ffprobe is required";
    for (const ProbeCase& c : {ProbeCase{SoundCodec::Twos, 1, 32000, 0, false, false, "pcm_s16be"},
                               ProbeCase{SoundCodec::Sowt, 2, 48000, 1, true, false, "pcm_s16le"},
                               ProbeCase{SoundCodec::Aac, 2, 44100, 1, false, false, "aac"},
                               ProbeCase{SoundCodec::Aac, 2, 48000, 0, true, true, "aac"}}) {
        SCOPED_TRACE(std::string(c.codecName) + (c.wide ? " co64" : " stco"));
        ProbeMovie(c);
    }
}

}  // namespace
