// Movies that another writer made (the ffmpeg command, at test time), given the camera's
// maker atoms: each is processed right in every respect or refused up front, and the
// property query agrees with the job. Judged by ffprobe, ffmpeg and a walker of our own
// that shares nothing with the library's parser.
#include "host/ChunkAccount.h"
#include "host/JobHarness.h"
#include "MakerInjector.h"
#include "support/MotorSound.h"
#include "support/ProcessedRegions.h"

#include <algorithm>
#include <cmath>
#include <filesystem>
#include <sstream>
#include <string>
#include <vector>

namespace {

using jobtest::HostTest;
using jobtest::Spans;
using testsupport::Shell;
using moviekit::AfInterval;

constexpr int kDone = 1;
constexpr int kRefused = 8;
constexpr double kSeconds = 2.0;
// Signal over difference between the decodes of the source and of the re-encoded destination, per
// channel: a second generation measures above 30 dB where nothing was processed, rumble processed
// at 70 % strength about 3 dB.
constexpr double kAacKeptDb = 20.0;
constexpr double kAacChangedDb = 10.0;
// Packets whose frames end further than this before an interval, or begin further after it,
// are the source's own: the two packets whose frames overlap the change, a margin of two on
// either side, the 10 ms ramp and a packet to spare.
constexpr uint64_t kAacAway = 8192;
// A joint whose windows do not cancel leaves an error of the signal's own size.
constexpr double kAacJointPeakShare = 0.1;

enum class Sound { Pcm, Aac };

struct Writer {
    const char* name;
    std::string codec;        // ffmpeg's sound encoder and its options
    uint32_t rate;
    uint32_t channels;
    const char* extension;    // ".mov" or ".mp4"
    std::string extra;        // more of ffmpeg's options (brand, timecode, a second track)
    int expected;             // the property query's answer, and the job's refusal code
    Sound sound = Sound::Pcm;
    const char* reason = "";  // what `tqovix check` says of a refused movie
    // AAC whose long frames are marked sine-windowed, as some encoders make them: ours cannot
    // follow them, so the whole track is re-encoded and `check` says why.
    bool sineWindows = false;
};

void PrintTo(const Writer& writer, std::ostream* out) { *out << writer.name; }

// A sweep under a slow swell: no two stretches alike, so sound moved by any lag shows. Over
// each interval (and 20 ms either side) a loud low rumble, so that processing there must change
// samples, down to the ramp's first steps at low rates.
std::string SoundSource(uint32_t rate, uint32_t channels, const std::vector<AfInterval>& intervals)
{
    std::ostringstream motor;
    motor << "(0";
    for (const AfInterval& interval : intervals) {
        motor << "+between(t," << (static_cast<double>(interval.startFrame) - rate / 50.0) / rate << ","
              << (static_cast<double>(interval.endFrame) + rate / 50.0) / rate << ")";
    }
    motor << ")";
    std::ostringstream expression;
    for (uint32_t c = 0; c < channels; ++c) {
        expression << (c ? "|" : "") << "(0.3+0.1*sin(2*PI*1.3*t+" << c
                   << "))*sin(2*PI*(180*t+260*t*t))+0.08*sin(2*PI*(2100+" << 150 * c << ")*t)+" << motor.str()
                   << "*0.12*(sin(2*PI*47*t+" << c << ")+sin(2*PI*78*t+1.3)+sin(2*PI*109*t+2.6+" << c
                   << ")+sin(2*PI*140*t+3.9))";
    }
    std::ostringstream source;
    source << "-f lavfi -i \"aevalsrc='" << expression.str() << "':s=" << rate << ":d=" << kSeconds << "\"";
    return source.str();
}

std::vector<std::string> StreamList(const std::string& path)
{
    std::string output;
    testsupport::RunCommand("ffprobe -v error -show_entries stream=codec_type,codec_name,sample_rate,channels "
                            "-of csv=p=0 " + testsupport::ShellQuote(path),
                            &output);
    std::vector<std::string> lines;
    for (size_t at = 0; at < output.size();) {
        const size_t end = output.find('\n', at);
        lines.push_back(output.substr(at, end - at));
        at = end == std::string::npos ? output.size() : end + 1;
    }
    return lines;
}

std::string Timecode(const std::string& path)
{
    std::string output;
    testsupport::RunCommand("ffprobe -v error -show_entries stream_tags=timecode -of csv=p=0 " +
                                testsupport::ShellQuote(path),
                            &output);
    output.erase(std::remove(output.begin(), output.end(), '\n'), output.end());
    return output;
}

// Marks every frame's (first) window sine-shaped, in place: one bit of its header.
bool MarkSineWindows(const std::string& path)
{
    std::vector<jobtest::TrackChunks> tracks;
    if (!jobtest::ReadTrackChunks(path, tracks, nullptr)) {
        return false;
    }
    std::vector<uint8_t> file = testsupport::ReadFile(path);
    for (const jobtest::TrackChunks& track : tracks) {
        if (track.handler != "soun") {
            continue;
        }
        for (const auto& [offset, size] : track.samples) {
            if (size < 3 || offset + size > file.size()) {
                return false;
            }
            const uint8_t* p = file.data() + offset;
            const unsigned element = p[0] >> 5;
            // After the element and its tag: a pair's common-window bit, a channel's global gain.
            const bool common = element == 1 && (p[0] & 0x01) != 0;
            const unsigned bit = element == 0 ? 18 : common ? 11 : 19;
            if (element > 1) {
                continue;  // a frame of nothing but fill
            }
            file[offset + bit / 8] &= static_cast<uint8_t>(~(0x80 >> (bit % 8)));
        }
        return testsupport::WriteFile(path, file);
    }
    return false;
}

class InteropBase : public HostTest {
protected:
    // The movie as ffmpeg writes it, with the maker atoms added; empty on failure.
    std::string Make(const Writer& w, const std::vector<AfInterval>& intervals)
    {
        const std::string path = m_dir.File(std::string("source") + w.extension);
        const std::string video = "-f lavfi -i testsrc=size=64x36:rate=30:d=" + std::to_string(kSeconds);
        EXPECT_EQ(Shell("ffmpeg -v error -nostdin -y " + video + " " + SoundSource(w.rate, w.channels, intervals) +
                        " -map 0:v -map 1:a -c:v mjpeg -c:a " + w.codec + " -ac " + std::to_string(w.channels) +
                        " " + w.extra + " " + testsupport::ShellQuote(path)),
                  "");
        moviekit::MovieRecipe recipe;
        recipe.sound.sampleRate = w.rate;
        recipe.maker.afIntervals = intervals;
        std::string error;
        const bool fragmented = w.extra.find("frag_keyframe") != std::string::npos;
        if (!fragmented && !moviekit::AddMakerData(path, recipe, static_cast<uint64_t>(kSeconds * w.rate), &error)) {
            ADD_FAILURE() << error;
            return "";
        }
        if (w.sineWindows && !MarkSineWindows(path)) {
            ADD_FAILURE() << "the windows could not be marked";
            return "";
        }
        return path;
    }

    void ExpectPcmExactOutside(const std::string& source, const std::string& destination, const Writer& w,
                               const std::vector<AfInterval>& intervals)
    {
        // Decoded as doubles, which hold every sample of every depth exactly.
        std::vector<double> exactBefore;
        std::vector<double> exactAfter;
        ASSERT_TRUE(jobtest::DecodeSound(source, exactBefore));
        ASSERT_TRUE(jobtest::DecodeSound(destination, exactAfter));
        // Outside each interval widened by the library's 10 ms ramp: bit-exact, with no other slack.
        const uint64_t ramp = w.rate / 100;
        EXPECT_EQ(jobtest::CheckPcmChangedOnlyInside(exactBefore, exactAfter, w.channels, intervals, ramp), "");
        // At 44.1 and 48 kHz the ramp's first weights (1e-5) cannot move a sample by one step; at
        // low rates they can, so there processing must begin and end where the ramps do.
        if (w.rate < 20000) {
            std::vector<int16_t> before;
            std::vector<int16_t> after;
            ASSERT_TRUE(jobtest::DecodeSound(source, before));
            ASSERT_TRUE(jobtest::DecodeSound(destination, after));
            EXPECT_EQ(testsupport::CheckProcessedRegions(before, after, w.channels, Spans(intervals), ramp), "");
        }
    }

    void ExpectAacInSync(const std::string& source, const std::string& destination, const Writer& w,
                         const std::vector<AfInterval>& intervals, double minKept = 0.2)
    {
        std::vector<int16_t> a;
        std::vector<int16_t> b;
        ASSERT_TRUE(jobtest::DecodeSound(source, a));
        ASSERT_TRUE(jobtest::DecodeSound(destination, b));
        // Frame for frame, with no lag allowed: every channel within coding noise outside (the
        // encoder's lead-in apart), the rumble gone inside.
        EXPECT_EQ(jobtest::CheckReencodedSound(a, b, w.channels, Spans(intervals), 2048, 2048, kAacKeptDb,
                                               kAacChangedDb),
                  "");
        // Away from the intervals the source's own packets; across each joint, no click.
        double kept = 0;
        const std::string spliced = jobtest::CheckSplicedAac(source, destination, w.channels, intervals,
                                                             w.sineWindows ? 0 : kAacAway, kAacKeptDb,
                                                             kAacJointPeakShare, &kept);
        std::string said;
        testsupport::RunCommand(std::string(TQOVIX_TOOL) + " check " + testsupport::ShellQuote(source), &said);
        if (w.sineWindows) {
            EXPECT_EQ(kept, 0.0) << "a packet of the source's stands beside ours";
            EXPECT_NE(said.find("processable; its AAC sound is re-encoded whole: its long frames use sine windows"),
                      std::string::npos)
                << said;
        } else {
            EXPECT_EQ(spliced, "");
            EXPECT_GE(kept, minKept);
            EXPECT_EQ(said, source + ": processable\n");
        }
    }
};

class InteropTest : public InteropBase, public ::testing::WithParamInterface<Writer> {};

TEST_P(InteropTest, ProcessedRightOrRefusedUpFront)
{
    const Writer& w = GetParam();
    const uint64_t frames = static_cast<uint64_t>(kSeconds * w.rate);
    const std::vector<AfInterval> intervals = {{frames / 5, frames / 5 + frames / 8, 1000},
                                               {frames / 2 + 777, frames / 2 + frames / 6, 700}};
    const std::string source = Make(w, intervals);
    ASSERT_FALSE(source.empty());
    const jobtest::FileStamp before = jobtest::StampFile(source);
    const std::string destination = m_dir.File(std::string("processed") + w.extension);

    // The property query runs the job's own analysis: it never promises what the job refuses.
    const int promised = TqGetPropertyOVIX(source.c_str());
    EXPECT_EQ(promised, w.expected);
    const int ended = HostTest::Run(source, destination);
    EXPECT_EQ(jobtest::StampFile(source), before) << "the source was written";
    if (w.expected != 0) {
        EXPECT_EQ(ended, w.expected);
        EXPECT_FALSE(jobtest::Exists(destination));
        std::string said;
        testsupport::RunCommand(std::string(TQOVIX_TOOL) + " check " + testsupport::ShellQuote(source), &said);
        EXPECT_NE(said.find(std::string("not processable: ") + w.reason), std::string::npos) << said;
        return;
    }
    ASSERT_EQ(ended, kDone);
    EXPECT_EQ(jobtest::ProbeErrors(destination), "");
    EXPECT_EQ(StreamList(destination), StreamList(source));
    EXPECT_EQ(Timecode(destination), Timecode(source));
    EXPECT_EQ(jobtest::AccountForEveryByte(destination), "");
    // Every stream but the processed sound is the source's, packet for packet.
    const std::vector<std::string> streams = StreamList(source);
    int sounds = 0;
    for (size_t s = 0; s < streams.size(); ++s) {
        const bool processed = streams[s].find(",audio") != std::string::npos && sounds++ == 0;
        if (!processed) {
            EXPECT_EQ(jobtest::PacketHashes(destination, std::to_string(s)),
                      jobtest::PacketHashes(source, std::to_string(s)))
                << "stream " << s << ": " << streams[s];
        }
    }
    if (w.sound == Sound::Pcm) {
        ExpectPcmExactOutside(source, destination, w, intervals);
        // PCM keeps its bytes: only the movie atom may change the size.
        const auto grown = static_cast<int64_t>(std::filesystem::file_size(destination)) -
                           static_cast<int64_t>(std::filesystem::file_size(source));
        EXPECT_LT(std::abs(grown), 4096);
    } else {
        ExpectAacInSync(source, destination, w, intervals);
    }
    EXPECT_EQ(TqGetPropertyOVIX(destination.c_str()), 20) << "processed movies say so";
}

const std::string kTimecode = "-timecode 10:00:00:00";
const std::string kMp42 = "-brand mp42";
const std::string kSecondSound = "-map 1:a -c:a:1 aac";  // a second microphone, copied bit for bit

INSTANTIATE_TEST_SUITE_P(
    Writers, InteropTest,
    ::testing::Values(Writer{"PcmBigEndian48kStereo", "pcm_s16be", 48000, 2, ".mov", "", 0},
                      Writer{"PcmLittleEndian48kMono", "pcm_s16le", 48000, 1, ".mov", "", 0},
                      Writer{"PcmBigEndian44kMono", "pcm_s16be", 44100, 1, ".mov", "", 0},
                      Writer{"PcmLittleEndian44kStereo", "pcm_s16le", 44100, 2, ".mov", "", 0},
                      Writer{"PcmSixChannels", "pcm_s16le", 48000, 6, ".mov", "", 0},
                      Writer{"PcmBigEndian8kStereo", "pcm_s16be", 8000, 2, ".mov", "", 0},
                      Writer{"AacStereo48kMov", "aac", 48000, 2, ".mov", "", 0, Sound::Aac},
                      Writer{"AacMono44kMov", "aac", 44100, 1, ".mov", "", 0, Sound::Aac},
                      Writer{"AacMono48k256kMp4", "aac -b:a 256k", 48000, 1, ".mp4", kMp42, 0, Sound::Aac},
                      Writer{"AacStereo44k256kMp4", "aac -b:a 256k", 44100, 2, ".mp4", kMp42, 0, Sound::Aac},
                      Writer{"AacSineWindowsReencodedWhole", "aac", 48000, 2, ".mov", "", 0, Sound::Aac, "", true},
                      Writer{"TimecodeTrack", "pcm_s16le", 48000, 2, ".mov", kTimecode, 0},
                      Writer{"TwoSoundTracks", "pcm_s16be", 48000, 2, ".mov", kSecondSound, 0},
                      // Deeper samples: "in24", "in32", "fl32", "fl64" with "enda" in "wave", and past
                      // 65535 Hz the version-2 "lpcm" with its flags.
                      Writer{"Pcm24BitBigEndian", "pcm_s24be", 48000, 2, ".mov", "", 0},
                      Writer{"Pcm24BitLittleEndian", "pcm_s24le", 48000, 2, ".mov", "", 0},
                      Writer{"Pcm32BitLittleEndian", "pcm_s32le", 48000, 2, ".mov", "", 0},
                      Writer{"PcmFloatBigEndian", "pcm_f32be", 48000, 2, ".mov", "", 0},
                      Writer{"PcmFloatLittleEndian", "pcm_f32le", 48000, 2, ".mov", "", 0},
                      Writer{"PcmDoubleLittleEndian44k", "pcm_f64le", 44100, 1, ".mov", "", 0},
                      Writer{"Pcm24Bit96kStereo", "pcm_s24le", 96000, 2, ".mov", "", 0},
                      Writer{"Pcm24BitFourChannels", "pcm_s24be", 48000, 4, ".mov", "", 0},
                      Writer{"Pcm8Bit", "pcm_s8", 48000, 2, ".mov", "", kRefused, Sound::Pcm,
                             "unsupported sound: sound 'sowt' is 8-bit PCM; 16, 24 and 32-bit integer and 32 and "
                             "64-bit float PCM are processed"},
                      Writer{"PcmUnsigned8Bit", "pcm_u8", 48000, 1, ".mov", "", kRefused, Sound::Pcm,
                             "unsupported sound: sound 'raw ' is 8-bit PCM"},
                      Writer{"Fragmented", "aac", 48000, 2, ".mov", "-movflags frag_keyframe+empty_moov",
                             kRefused, Sound::Aac, "fragmented movie"}),
    [](const ::testing::TestParamInfo<Writer>& info) { return std::string(info.param.name); });

// Where splicing has the least room: intervals at the very start and the very end of the track,
// back to back, and one over most of the track.
struct AacLayout {
    const char* name;
    Writer writer;
    std::vector<AfInterval> (*intervals)(uint64_t frames);
    double minKept;  // share of the packets that must be the source's own
};
void PrintTo(const AacLayout& layout, std::ostream* out) { *out << layout.name; }

class InteropAacTest : public InteropBase, public ::testing::WithParamInterface<AacLayout> {};

TEST_P(InteropAacTest, KeepsThePacketsAwayFromTheIntervals)
{
    const AacLayout& layout = GetParam();
    const Writer& w = layout.writer;
    const std::vector<AfInterval> intervals = layout.intervals(static_cast<uint64_t>(kSeconds * w.rate));
    const std::string source = Make(w, intervals);
    ASSERT_FALSE(source.empty());
    const std::string destination = m_dir.File(std::string("processed") + w.extension);
    ASSERT_EQ(HostTest::Run(source, destination), kDone);
    EXPECT_EQ(jobtest::ProbeErrors(destination), "");
    EXPECT_EQ(jobtest::AccountForEveryByte(destination), "");
    ExpectAacInSync(source, destination, w, intervals, layout.minKept);
}

INSTANTIATE_TEST_SUITE_P(
    Layouts, InteropAacTest,
    ::testing::Values(
        AacLayout{"AtTheVeryStartAndEnd", Writer{"", "aac -b:a 256k", 48000, 2, ".mov", "", 0, Sound::Aac},
                  [](uint64_t f) { return std::vector<AfInterval>{{0, f / 8, 1000}, {f - f / 10, f, 1000}}; }, 0.3},
        AacLayout{"BackToBack", Writer{"", "aac", 44100, 1, ".mp4", kMp42, 0, Sound::Aac},
                  [](uint64_t f) {
                      return std::vector<AfInterval>{{f / 4, f / 4 + f / 8, 1000}, {f / 4 + f / 8 + 441, f / 2, 700}};
                  },
                  0.3},
        AacLayout{"OverMostOfTheTrack", Writer{"", "aac", 44100, 2, ".mp4", kMp42, 0, Sound::Aac},
                  [](uint64_t f) { return std::vector<AfInterval>{{f / 20, f * 37 / 40, 1000}}; }, 0.0}),
    [](const ::testing::TestParamInfo<AacLayout>& info) { return std::string(info.param.name); });

class InteropSceneTest : public HostTest {};

// A scene (a chord over room ambience) with a lens motor over its AF intervals, muxed by ffmpeg as
// 48 kHz stereo PCM. The job must bring every interval closer to the clean scene, by at least
// 3 dB of scale-invariant signal-to-distortion ratio over the input's, and give back every frame
// outside the intervals and their 10 ms ramps bit-exact.
TEST_F(InteropSceneTest, MotorRemovedInsideBitExactOutside)
{
    if (!testsupport::HaveCommand("ffmpeg")) {
        GTEST_SKIP() << "ffmpeg is not installed";
    }
    constexpr uint32_t kRate = 48000, kChannels = 2;
    constexpr double kSceneSeconds = 6.0;
    const uint64_t frames = static_cast<uint64_t>(kSceneSeconds * kRate);
    const std::vector<AfInterval> intervals = {{48000, 86400, 1000}, {124800, 148800, 1000}, {201600, 254400, 1000}};
    std::vector<testsupport::MotorSpan> spans;
    for (const AfInterval& interval : intervals) {
        spans.push_back({interval.startFrame, interval.endFrame});
    }
    const std::vector<double> clean = testsupport::Sum(testsupport::Chord(frames, kChannels, kRate, 1200.0),
                                                       testsupport::Ambience(frames, kChannels, 300.0));
    const std::vector<int16_t> mixed =
        testsupport::ToPcm(testsupport::Sum(clean, testsupport::MotorNoise(frames, kChannels, kRate, spans, 2500.0)));
    std::vector<uint8_t> bytes(mixed.size() * 2);
    for (size_t k = 0; k < mixed.size(); ++k) {
        bytes[2 * k] = static_cast<uint8_t>(static_cast<uint16_t>(mixed[k]));
        bytes[2 * k + 1] = static_cast<uint8_t>(static_cast<uint16_t>(mixed[k]) >> 8);
    }
    const std::string raw = m_dir.File("scene.raw");
    ASSERT_TRUE(testsupport::WriteFile(raw, bytes));
    const std::string source = m_dir.File("scene.mov");
    ASSERT_EQ(Shell("ffmpeg -v error -nostdin -y -f lavfi -i testsrc=size=64x36:rate=30:d=" +
                    std::to_string(kSceneSeconds) + " -f s16le -ar 48000 -ac 2 -i " + testsupport::ShellQuote(raw) +
                    " -map 0:v -map 1:a -c:v mjpeg -c:a pcm_s16le " + testsupport::ShellQuote(source)),
              "");
    moviekit::MovieRecipe recipe;
    recipe.sound.sampleRate = kRate;
    recipe.maker.afIntervals = intervals;
    std::string error;
    ASSERT_TRUE(moviekit::AddMakerData(source, recipe, frames, &error)) << error;
    const std::string destination = m_dir.File("processed.mov");
    ASSERT_EQ(HostTest::Run(source, destination), kDone);

    std::vector<int16_t> before;
    std::vector<int16_t> after;
    ASSERT_TRUE(jobtest::DecodeSound(source, before));
    ASSERT_TRUE(jobtest::DecodeSound(destination, after));
    ASSERT_TRUE(before == mixed) << "ffmpeg did not keep the scene's samples";
    EXPECT_EQ(jobtest::CheckPcmChangedOnlyInside(before, after, kChannels, intervals, kRate / 100), "");
    for (const AfInterval& interval : intervals) {
        const double input = testsupport::SiSdr(before, clean, kChannels, interval.startFrame, interval.endFrame);
        const double output = testsupport::SiSdr(after, clean, kChannels, interval.startFrame, interval.endFrame);
        EXPECT_GE(output - input, 3.0) << "interval at " << interval.startFrame << ": " << input << " dB in, " << output
                                       << " dB out";
    }
}

}  // namespace
