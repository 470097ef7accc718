// moviekit: maker payloads and PCM byte for byte; whole movies are judged by the job suite's readers.
#include "Movie.h"
#include "support/TestSupport.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <ostream>
#include <string>

namespace {

using testsupport::PrintTo;

using moviekit::Bytes;
using moviekit::MovieLayout;
using Recipe = moviekit::MovieRecipe;
using moviekit::SoundCodec;
using namespace std::string_literals;

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

struct InvalidRecipe {
    const char* name;
    void (*apply)(Recipe&);
};

class InvalidRecipeTest : public testing::TestWithParam<InvalidRecipe> {};

TEST_P(InvalidRecipeTest, IsRefusedWithAReason)
{
    Recipe recipe;
    GetParam().apply(recipe);
    std::string error;
    EXPECT_TRUE(moviekit::BuildMovie(recipe, nullptr, &error).empty());
    EXPECT_FALSE(error.empty());
}

INSTANTIATE_TEST_SUITE_P(
    MovieKit, InvalidRecipeTest,
    testing::Values(
        InvalidRecipe{"NoChannels", [](Recipe& r) { r.sound.channels = 0; }},
        InvalidRecipe{"AacRateBeyond16_16", [](Recipe& r) { r.sound.codec = moviekit::SoundCodec::Aac; r.sound.sampleRate = 96000; }},
        InvalidRecipe{"PcmOf20Bits", [](Recipe& r) { r.sound.bits = 20; }},
        InvalidRecipe{"FloatOf16Bits", [](Recipe& r) { r.sound.floatingPoint = true; }},
        InvalidRecipe{"RaggedPcm", [](Recipe& r) { r.sound.pcm = {1, 2, 3}; }},
        InvalidRecipe{"PcmAndCountDisagree", [](Recipe& r) { r.sound.pcm = {1, 2}; r.sound.sampleCount = 5; }},
        InvalidRecipe{"EmptyChunk", [](Recipe& r) { r.sound.chunkSampleCounts = {5, 0}; }},
        InvalidRecipe{"ChunksShortOfCount",
                      [](Recipe& r) { r.sound.sampleCount = 9; r.sound.chunkSampleCounts = {1, 2}; }},
        InvalidRecipe{"GeneratedSixChannelAac",
                      [](Recipe& r) { r.sound.codec = SoundCodec::Aac; r.sound.channels = 6; }},
        InvalidRecipe{"NoFrames", [](Recipe& r) { r.video.frameCount = 0; }},
        InvalidRecipe{"MovieTimeScale0", [](Recipe& r) { r.movieTimeScale = 0; }}), testsupport::ByName);

}  // namespace
