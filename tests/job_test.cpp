// Whole jobs through the exported API on moviekit movies, judged by ffprobe and ffmpeg.
#include "host/JobHarness.h"

namespace {

using jobtest::HostTest;

class JobTest : public HostTest {};

TEST_F(JobTest, PcmSmoke)
{
    moviekit::MovieSpec recipe;
    const std::string source = Write(recipe, "src.mov");
    const std::string destination = m_dir.File("dst.mov");
    EXPECT_EQ(Run(source, destination), 1);
    EXPECT_EQ(jobtest::ProbeErrors(destination), "");
    EXPECT_EQ(jobtest::PacketHashes(source, "v:0"), jobtest::PacketHashes(destination, "v:0"));
    EXPECT_EQ(TqGetPropertyOVIX(destination.c_str()), 20);
}

}  // namespace

namespace {
TEST_F(JobTest, AacSmoke)
{
    moviekit::MovieSpec recipe;
    recipe.sound.codec = moviekit::SoundCodec::Aac;
    const std::string source = Write(recipe, "src.mov");
    const std::string destination = m_dir.File("dst.mov");
    EXPECT_EQ(Run(source, destination), 1);
    EXPECT_EQ(jobtest::ProbeErrors(destination), "");
    EXPECT_EQ(jobtest::PacketHashes(source, "v:0"), jobtest::PacketHashes(destination, "v:0"));
    EXPECT_EQ(jobtest::PacketCount(source, "a:0"), jobtest::PacketCount(destination, "a:0"));
    EXPECT_EQ(TqGetPropertyOVIX(destination.c_str()), 20);
}
}  // namespace
