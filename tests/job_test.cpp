// Whole jobs through the exported API on moviekit movies, judged by ffprobe and ffmpeg.
#include "host/ChunkAccount.h"
#include "host/JobHarness.h"
#include "support/ProcessedRegions.h"

#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cmath>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <numbers>

namespace {

using jobtest::HostTest;
using jobtest::Spans;
using moviekit::AfInterval;
using moviekit::SoundCodec;

constexpr int kDone = 1;
constexpr int kAborted = 200;
constexpr int kAlreadyProcessed = 20;
constexpr char kSoftwareName[] = "VELDA OVIX Utility";
constexpr uint64_t k4GiB = uint64_t{1} << 32;
// Frames around an AF interval that re-encoded AAC may blur.
constexpr uint64_t kMargin = 4096;
// Signal over difference, per channel, between the decodes of an AAC source and its re-encoding:
// a second generation at 192 kbit/s measures above 30 dB where nothing was processed; rumble
// processed at half strength falls to about 6 dB, at full strength to 0.
constexpr double kAacKeptDb = 20.0;
constexpr double kAacChangedDb = 10.0;
// Inside the default movie's sound (48 048 PCM frames, 47 AAC packets).
const std::vector<AfInterval> kIntervals = {{8000, 18000, 1000}, {28000, 40000, 500}};
// The AAC movies run 3 s, so that most packets lie away from their intervals.
constexpr uint32_t kAacRate = 48000;
constexpr uint64_t kAacPackets = 141;
const std::vector<AfInterval> kAacIntervals = {{kAacRate, kAacRate * 5 / 4, 1000}, {2 * kAacRate, kAacRate * 7 / 3, 500}};
// Packets whose frames end further than this before an interval, or begin further after it, are
// the source's own; a joint between the source's and re-encoded packets never clicks.
constexpr uint64_t kAacAway = 8192;
constexpr double kAacJointPeakShare = 0.1;

// The same places at any rate, in the track's own frames.
std::vector<AfInterval> IntervalsAt(uint32_t rate)
{
    return {{rate / 6, rate * 3 / 8, 1000}, {rate * 7 / 12, rate * 5 / 6, 500}};
}

std::vector<uint8_t> MoovBytes(const std::string& path)
{
    for (const jobtest::TopAtom& atom : jobtest::TopLevelAtoms(path)) {
        if (atom.type == "moov") {
            return jobtest::ReadRange(path, atom.offset, atom.size);
        }
    }
    return {};
}

// Voice-like: low tones that carry most of the energy, a little presence, slow envelopes.
std::vector<int16_t> VoiceLike(uint64_t frames, uint32_t rate)
{
    std::vector<int16_t> pcm(frames * 2);
    const double w = 2.0 * std::numbers::pi / rate;
    for (uint64_t f = 0; f < frames; ++f) {
        const double t = static_cast<double>(f);
        const double syllable = 0.6 + 0.4 * std::sin(w * 3.3 * t);
        const double breath = 0.5 + 0.5 * std::sin(w * 1.7 * t + 0.8);
        const double voice = 5000 * std::sin(w * 220 * t) + 2500 * std::sin(w * 330 * t + 0.3);
        const double presence = 900 * std::sin(w * 1870 * t) + 500 * std::sin(w * 3150 * t + 1.1);
        pcm[2 * f] = static_cast<int16_t>(std::lround(syllable * voice + breath * presence));
        pcm[2 * f + 1] = static_cast<int16_t>(std::lround(0.8 * breath * voice + syllable * presence));
    }
    return pcm;
}

// 3 s of AAC packets: voice-like tones, and loud rumble over the intervals, so that processing
// there cannot leave the sound as it was.
const std::vector<moviekit::Bytes>& RumblingAacPackets()
{
    static const std::vector<moviekit::Bytes> packets = [] {
        constexpr uint64_t kFrames = kAacPackets * 1024;
        std::vector<int16_t> pcm = VoiceLike(kFrames, kAacRate);
        const std::vector<int16_t> motor =
            testsupport::MotorOverSpans(kFrames, 2, kAacRate, Spans(kAacIntervals), 0.6, 0);
        for (size_t k = 0; k < pcm.size(); ++k) {
            pcm[k] = static_cast<int16_t>(std::clamp(pcm[k] + motor[k], -32767, 32767));
        }
        std::vector<moviekit::Bytes> encoded;
        if (!testsupport::EncodeAacPackets(pcm, kAacRate, 2, 192000, encoded) || encoded.size() < kAacPackets) {
            return std::vector<moviekit::Bytes>{};
        }
        encoded.resize(kAacPackets);
        return encoded;
    }();
    return packets;
}

class JobTest : public HostTest {
protected:
    // What every completed job leaves, whatever the layout; returns the destination's mdat.
    // `video`: the source's video packets, unless its PacketHashes are wanted.
    jobtest::TopAtom ExpectCompleteDestination(const std::string& source, const std::string& destination,
                                               uint32_t videoFrames, std::vector<std::string> video = {})
    {
        EXPECT_EQ(jobtest::ProbeErrors(destination), "");
        if (video.empty()) {
            video = jobtest::PacketHashes(source, "v:0");
        }
        EXPECT_EQ(video.size(), videoFrames);
        EXPECT_EQ(jobtest::PacketHashes(destination, "v:0"), video);
        EXPECT_EQ(TqGetPropertyOVIX(destination.c_str()), kAlreadyProcessed);
        EXPECT_TRUE(jobtest::Contains(MoovBytes(destination), kSoftwareName));
        EXPECT_FALSE(jobtest::Contains(MoovBytes(source), kSoftwareName));
        // One media-data atom, and the movie atom last, ending with the file.
        const std::vector<jobtest::TopAtom> atoms = jobtest::TopLevelAtoms(destination);
        jobtest::TopAtom mdat;
        int mdats = 0;
        for (const jobtest::TopAtom& atom : atoms) {
            if (atom.type == "mdat") {
                mdat = atom;
                ++mdats;
            }
        }
        EXPECT_EQ(mdats, 1);
        EXPECT_TRUE(!atoms.empty() && atoms.back().type == "moov" &&
                    atoms.back().offset + atoms.back().size == std::filesystem::file_size(destination));
        return mdat;
    }

    // PCM left untouched outside the AF intervals and changed inside them. The only slack is the
    // library's 10 ms ramp: an interval placed a frame off fails. At 44.1 and 48 kHz the ramp's first
    // weights (1e-5) cannot move a sample by one step; at low rates they can, so there processing
    // must begin and end where the ramps do.
    void ExpectPcmProcessedOnlyInside(const std::string& source, const std::string& destination,
                                      const std::vector<AfInterval>& intervals, uint32_t channels, uint32_t rate)
    {
        std::vector<double> exactBefore;
        std::vector<double> exactAfter;
        ASSERT_TRUE(jobtest::DecodeSound(source, exactBefore));
        ASSERT_TRUE(jobtest::DecodeSound(destination, exactAfter));
        EXPECT_EQ(jobtest::CheckPcmChangedOnlyInside(exactBefore, exactAfter, channels, intervals, rate / 100), "");
        if (rate < 20000) {
            std::vector<int16_t> before;
            std::vector<int16_t> after;
            ASSERT_TRUE(jobtest::DecodeSound(source, before));
            ASSERT_TRUE(jobtest::DecodeSound(destination, after));
            EXPECT_EQ(testsupport::CheckProcessedRegions(before, after, channels, Spans(intervals), rate / 100), "");
        }
    }
};

// ---- Successful jobs over the layouts cameras and tools produce ----

struct Layout {
    const char* name;
    SoundCodec codec;
    void (*shape)(moviekit::MovieRecipe&);
};

class JobMatrix : public JobTest, public ::testing::WithParamInterface<Layout> {};

TEST_P(JobMatrix, WritesACompleteMovie)
{
    moviekit::MovieRecipe recipe;
    recipe.sound.codec = GetParam().codec;
    GetParam().shape(recipe);
    const uint32_t rate = recipe.sound.sampleRate;
    const bool aac = recipe.sound.codec == SoundCodec::Aac;
    const std::vector<AfInterval> intervals = aac ? kAacIntervals : IntervalsAt(rate);
    recipe.maker.afIntervals = intervals;
    if (aac) {
        ASSERT_FALSE(RumblingAacPackets().empty());
        recipe.sound.aacPackets = RumblingAacPackets();
        recipe.video.frameCount = 90;
    } else {
        // Loud rumble over the intervals, where the edit list puts them in the track.
        const uint64_t shift = recipe.sound.edts ? recipe.sound.mediaTime.value_or(0) : 0;
        recipe.sound.pcm = testsupport::MotorOverSpans(uint64_t{rate} * 1001 / 1000 + shift, recipe.sound.channels,
                                                       rate, Spans(intervals, shift));
    }
    moviekit::MovieLayout layout;
    const std::string source = Write(recipe, "src.mov", &layout);
    const std::string destination = m_dir.File("dst.mov");
    ASSERT_EQ(TqGetPropertyOVIX(source.c_str()), 0);
    const jobtest::FileStamp before = jobtest::StampFile(source);

    ASSERT_EQ(Run(source, destination), kDone);
    const jobtest::TopAtom mdat = ExpectCompleteDestination(source, destination, recipe.video.frameCount);
    EXPECT_EQ(mdat.headerSize, 8u);  // far below 4 GiB, whatever header the source had
    if (recipe.sound.codec == SoundCodec::Aac) {
        EXPECT_EQ(jobtest::PacketCount(source, "a:0"), layout.soundSampleCount);
        EXPECT_EQ(jobtest::PacketCount(destination, "a:0"), layout.soundSampleCount);
        std::vector<int16_t> sourceSound;
        std::vector<int16_t> destinationSound;
        ASSERT_TRUE(jobtest::DecodeSound(source, sourceSound));
        ASSERT_TRUE(jobtest::DecodeSound(destination, destinationSound));
        // ffmpeg judges: every channel within coding noise outside, and the rumble gone inside;
        // away from the intervals the source's own packets, whatever chunks they lie in.
        EXPECT_EQ(jobtest::CheckReencodedSound(sourceSound, destinationSound, 2, Spans(intervals), kMargin, 2048,
                                               kAacKeptDb, kAacChangedDb),
                  "");
        double kept = 0;
        EXPECT_EQ(jobtest::CheckSplicedAac(source, destination, 2, intervals, kAacAway, kAacKeptDb,
                                           kAacJointPeakShare, &kept),
                  "");
        EXPECT_GT(kept, 0.5);
    } else {
        ExpectPcmProcessedOnlyInside(source, destination, intervals, recipe.sound.channels, rate);
    }
    EXPECT_EQ(jobtest::AccountForEveryByte(destination), "");
    EXPECT_TRUE(jobtest::StampFile(source) == before) << "the source changed";
}

const Layout kLayouts[] = {
    {"Twos", SoundCodec::Twos, [](moviekit::MovieRecipe&) {}},
    {"Sowt", SoundCodec::Sowt, [](moviekit::MovieRecipe&) {}},
    {"Aac", SoundCodec::Aac, [](moviekit::MovieRecipe&) {}},
    {"TwosSoundFirst", SoundCodec::Twos,
     [](moviekit::MovieRecipe& r) { r.soundFirstInPeriod = r.soundTrackFirst = true; }},
    {"AacSoundFirst", SoundCodec::Aac, [](moviekit::MovieRecipe& r) { r.soundFirstInPeriod = r.soundTrackFirst = true; }},
    {"SowtSmallChunks", SoundCodec::Sowt, [](moviekit::MovieRecipe& r) { r.sound.samplesPerChunk = 1000; }},
    {"TwosUnevenChunks", SoundCodec::Twos,
     [](moviekit::MovieRecipe& r) { r.sound.chunkSampleCounts = {1, 7001, 20000, 3, 21043}; }},
    {"AacSmallChunks", SoundCodec::Aac, [](moviekit::MovieRecipe& r) { r.sound.samplesPerChunk = 3; }},
    {"AacUnevenChunksLastOfOne", SoundCodec::Aac,
     [](moviekit::MovieRecipe& r) { r.sound.chunkSampleCounts = {1, 60, 79, 1}; }},
    {"TwosCo64", SoundCodec::Twos, [](moviekit::MovieRecipe& r) { r.co64 = true; }},
    {"AacCo64MoovFirst", SoundCodec::Aac, [](moviekit::MovieRecipe& r) { r.co64 = r.moovBeforeMdat = true; }},
    {"SowtMoovFirst", SoundCodec::Sowt, [](moviekit::MovieRecipe& r) { r.moovBeforeMdat = true; }},
    {"TwosThreeMdats", SoundCodec::Twos, [](moviekit::MovieRecipe& r) { r.mdatCount = 3; }},
    {"AacTwoMdatsSoundFirst", SoundCodec::Aac,
     [](moviekit::MovieRecipe& r) {
         r.mdatCount = 2;
         r.soundFirstInPeriod = true;
     }},
    {"SowtMdatSize64", SoundCodec::Sowt, [](moviekit::MovieRecipe& r) { r.largeMdatHeader = true; }},
    // AF intervals are placed in frames of the track's own rate, not 48 kHz ones.
    {"Twos44100", SoundCodec::Twos, [](moviekit::MovieRecipe& r) { r.sound.sampleRate = 44100; }},
    // PCM has no priming: an edit list shifts both byte orders alike, and without one nothing moves.
    {"TwosEditedIn", SoundCodec::Twos, [](moviekit::MovieRecipe& r) { r.sound.mediaTime = 960; }},
    {"SowtEditedIn", SoundCodec::Sowt, [](moviekit::MovieRecipe& r) { r.sound.mediaTime = 960; }},
    {"TwosWithoutEdits", SoundCodec::Twos, [](moviekit::MovieRecipe& r) { r.sound.edts = false; }},
    // At low rates the ramp's first step is large enough to change samples: an interval one
    // frame off moves where processing begins or ends.
    {"Twos8k", SoundCodec::Twos, [](moviekit::MovieRecipe& r) { r.sound.sampleRate = 8000; }},
    {"Sowt8kEditedIn", SoundCodec::Sowt,
     [](moviekit::MovieRecipe& r) {
         r.sound.sampleRate = 8000;
         r.sound.mediaTime = 161;
     }},
    {"Twos11025SixChannelsUnevenChunks", SoundCodec::Twos,
     [](moviekit::MovieRecipe& r) {
         r.sound.sampleRate = 11025;
         r.sound.channels = 6;
         r.sound.chunkSampleCounts = {1, 1837, 4000, 3, 5195};
     }},
    // Deeper samples, in both writers and both byte orders; past 65535 Hz the intervals land on
    // frames of the track's own rate.
    {"In24LittleEndianEditedIn", SoundCodec::Sowt,
     [](moviekit::MovieRecipe& r) {
         r.sound.bits = 24;
         r.sound.mediaTime = 960;
     }},
    {"Lpcm24Bit96kSixChannels", SoundCodec::Twos,
     [](moviekit::MovieRecipe& r) {
         r.sound.bits = 24;
         r.sound.sampleRate = 96000;
         r.sound.channels = 6;
     }},
    {"In32Co64", SoundCodec::Twos, [](moviekit::MovieRecipe& r) { r.sound.bits = 32; r.co64 = true; }},
    {"Fl32ThreeMdats", SoundCodec::Twos,
     [](moviekit::MovieRecipe& r) {
         r.sound.bits = 32;
         r.sound.floatingPoint = true;
         r.mdatCount = 3;
     }},
    // A rate that is no whole number of kHz: the library is told it exactly.
    {"Twos47952", SoundCodec::Twos, [](moviekit::MovieRecipe& r) { r.sound.sampleRate = 47952; }},
    {"Fl64LittleEndian44100", SoundCodec::Sowt,
     [](moviekit::MovieRecipe& r) {
         r.sound.bits = 64;
         r.sound.floatingPoint = true;
         r.sound.sampleRate = 44100;
     }},
    {"AacMdatSize64ThreeMdats", SoundCodec::Aac,
     [](moviekit::MovieRecipe& r) {
         r.largeMdatHeader = true;
         r.mdatCount = 3;
     }},
};

INSTANTIATE_TEST_SUITE_P(Layouts, JobMatrix, ::testing::ValuesIn(kLayouts),
                         [](const auto& info) { return std::string(info.param.name); });

// ---- What the library does to the sound ----

// AF information the library accepts but does not read as intervals: the sound is not touched.
TEST_F(JobTest, ForeignAfPayloadLeavesPcmUntouched)
{
    for (SoundCodec codec : {SoundCodec::Twos, SoundCodec::Sowt}) {
        moviekit::MovieRecipe recipe;
        recipe.sound.codec = codec;
        recipe.maker.afPayload = moviekit::Bytes{'X', 'A', 'F', '9', 0, 1, 0, 0, 0, 0, 0xBB, 0x80, 0, 0, 0, 2};
        const std::string name = codec == SoundCodec::Twos ? "twos" : "sowt";
        const std::string source = Write(recipe, name + ".mov");
        const std::string destination = m_dir.File(name + "-out.mov");
        ASSERT_EQ(Run(source, destination), kDone) << name;
        EXPECT_EQ(jobtest::ProbeErrors(destination), "") << name;
        EXPECT_EQ(TqGetPropertyOVIX(destination.c_str()), TqGetPropertyOVIX(source.c_str())) << name;
        std::vector<int16_t> before;
        std::vector<int16_t> after;
        ASSERT_TRUE(jobtest::DecodeSound(source, before));
        ASSERT_TRUE(jobtest::DecodeSound(destination, after));
        EXPECT_FALSE(before.empty());
        EXPECT_TRUE(after == before) << name << ": the sound changed";
    }
}

bool CodecLibraryMapped()
{
    std::ifstream maps("/proc/self/maps");
    std::string line;
    while (std::getline(maps, line)) {
        if (line.find("libavcodec.so") != std::string::npos) {
            return true;
        }
    }
    return false;
}

// A host that only ever handles PCM never pays for mapping the AAC codecs.
TEST_F(JobTest, CodecLibrariesLoadOnlyForAac)
{
    moviekit::MovieRecipe pcm;
    pcm.video.frameCount = 30;
    ASSERT_EQ(Run(Write(pcm, "pcm.mov"), m_dir.File("pcm-out.mov")), kDone);
    EXPECT_FALSE(CodecLibraryMapped());
    moviekit::MovieRecipe aac = pcm;
    aac.sound.codec = SoundCodec::Aac;
    ASSERT_EQ(Run(Write(aac, "aac.mov"), m_dir.File("aac-out.mov")), kDone);
    EXPECT_TRUE(CodecLibraryMapped());
}

// ---- Jobs that end early: aborts and host answers ----

std::atomic<int> g_calls{0};
std::atomic<int> g_lastBlockCalls{0};  // notifications that report every frame done
std::atomic<int> g_callsWhenActed{-1};
std::atomic<int> g_actAt{0};           // act at this notification
std::atomic<int> g_actAtLastBlock{0};  // or at this one of those reporting every frame done
std::atomic<int> g_answer{0};          // what to answer when acting; 0: TqAbortOVIX instead

int Notify(int first, int second)
{
    const int call = ++g_calls;
    const int last = first == second ? ++g_lastBlockCalls : 0;
    const bool act = call == g_actAt || (last != 0 && last == g_actAtLastBlock);
    if (!act) {
        return 0;
    }
    g_callsWhenActed = call;
    if (g_answer == 0) {
        TqAbortOVIX();
    }
    return g_answer;
}

struct Ending {
    const char* name;
    SoundCodec codec;
    bool abortAtStart;  // TqAbortOVIX as soon as TqExecuteOVIX returns, on a 20 s movie
    int actAt;
    int actAtLastBlock;
    int answer;
    int expected;
};

class JobEnding : public JobTest, public ::testing::WithParamInterface<Ending> {};

TEST_P(JobEnding, EndsAsTheHostAsked)
{
    const Ending& row = GetParam();
    g_calls = 0;
    g_lastBlockCalls = 0;
    g_callsWhenActed = -1;
    g_actAt = row.actAt;
    g_actAtLastBlock = row.actAtLastBlock;
    g_answer = row.answer;
    moviekit::MovieRecipe recipe;
    recipe.sound.codec = row.codec;
    if (row.abortAtStart) {
        recipe.video.frameCount = 600;
    }
    // Rows that act on the notifications reporting every frame done take the general writer: a
    // copy still running would hold the progress back (the stop suite covers that stage).
    recipe.moovBeforeMdat = row.actAtLastBlock != 0;
    const std::string source = Write(recipe, "src.mov");
    const std::string destination = m_dir.File("dst.mov");
    const jobtest::FileStamp before = jobtest::StampFile(source);
    ASSERT_EQ(TqSetCallBackNotifyProgressOVIX(Notify), 0);

    ASSERT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 0);
    if (row.abortAtStart) {
        TqAbortOVIX();
    }
    ASSERT_EQ(jobtest::WaitForJob(), row.expected);
    if (!row.abortAtStart) {
        EXPECT_NE(g_callsWhenActed.load(), -1) << "the callback never acted";
        if (row.actAt != 0) {
            EXPECT_EQ(g_callsWhenActed.load(), row.actAt);
        }
        // The request is acted on at the very next callback: the host hears nothing more.
        EXPECT_EQ(g_calls.load(), g_callsWhenActed.load());
    }
    if (row.expected == kDone) {
        ExpectCompleteDestination(source, destination, recipe.video.frameCount);
        TqAbortOVIX();  // too late as well
        EXPECT_EQ(TqIsFinishedOVIX(), kDone);
        EXPECT_TRUE(jobtest::Exists(destination));
    } else {
        EXPECT_FALSE(jobtest::Exists(destination));
    }
    EXPECT_TRUE(jobtest::StampFile(source) == before) << "the source changed";
    // The engine is ready for the next job.
    ASSERT_EQ(TqSetCallBackNotifyProgressOVIX(nullptr), 0);
    EXPECT_EQ(Run(source, m_dir.File("again.mov")), kDone);
}

const Ending kEndings[] = {
    {"PcmAbortBeforeFirstAudio", SoundCodec::Twos, true, 0, 0, 0, kAborted},
    {"AacAbortBeforeFirstAudio", SoundCodec::Aac, true, 0, 0, 0, kAborted},
    {"PcmAbortMidway", SoundCodec::Sowt, false, 3, 0, 0, kAborted},
    {"AacAbortMidway", SoundCodec::Aac, false, 3, 0, 0, kAborted},
    // The last block is out, but the job ends only when the library reports its end.
    {"PcmAbortAfterLastBlock", SoundCodec::Twos, false, 0, 1, 0, kAborted},
    {"AacAbortAfterLastBlock", SoundCodec::Aac, false, 0, 1, 0, kAborted},
    // Requested from the notification that reports the end: the job is already complete.
    {"PcmAbortAfterCompletion", SoundCodec::Twos, false, 0, 2, 0, kDone},
    {"AacAbortAfterCompletion", SoundCodec::Aac, false, 0, 2, 0, kDone},
    // Answered to the notification that reports the end: a final result stays final.
    {"PcmHostAnswers200AfterCompletion", SoundCodec::Sowt, false, 0, 2, 200, kDone},
    {"AacHostAnswers120AfterCompletion", SoundCodec::Aac, false, 0, 2, 120, kDone},
    {"PcmHostAnswers200", SoundCodec::Twos, false, 1, 0, 200, 200},
    {"PcmHostAnswers120", SoundCodec::Sowt, false, 2, 0, 120, 120},
    {"AacHostAnswers120", SoundCodec::Aac, false, 4, 0, 120, 120},
};

INSTANTIATE_TEST_SUITE_P(Endings, JobEnding, ::testing::ValuesIn(kEndings),
                         [](const auto& info) { return std::string(info.param.name); });

// ---- A destination volume that fills up ----

// A small tmpfs with room for 95 % of the source: the start's free-space test passes, writing fails.
TEST_F(JobTest, DestinationVolumeFillsUp)
{
    const std::string source = Write(moviekit::MovieRecipe{}, "src.mov");
    const std::string volume = m_dir.File("volume");
    ASSERT_TRUE(std::filesystem::create_directory(volume));
    const uint64_t room = std::filesystem::file_size(source) * 95 / 100 / 4096 * 4096;
    if (mount("tmpfs", volume.c_str(), "tmpfs", 0, ("size=" + std::to_string(room)).c_str()) != 0) {
        GTEST_SKIP() << "cannot mount a tmpfs here: " << std::strerror(errno);
    }
    struct Unmount {
        std::string path;
        ~Unmount() { umount2(path.c_str(), MNT_DETACH); }
    } unmount{volume};
    const std::string destination = volume + "/dst.mov";
    ASSERT_EQ(TqExecuteOVIX(source.c_str(), destination.c_str()), 0);
    EXPECT_EQ(jobtest::WaitForJob(), 130);
    EXPECT_FALSE(jobtest::Exists(destination));
}

// ---- Past 4 GiB ----

// 88 video frames of 48 MiB, left as holes in the source; the destination is written in full.
TEST_F(JobTest, LargeMovieGetsA64BitMdat)
{
    struct statvfs volume {};
    ASSERT_EQ(statvfs(m_dir.Path().c_str(), &volume), 0);
    const uint64_t available = uint64_t{volume.f_bavail} * volume.f_frsize;
    if (available < (uint64_t{10} << 30)) {
        GTEST_SKIP() << "needs 10 GiB free in " << m_dir.Path() << ", has " << (available >> 20) << " MiB";
    }
    moviekit::MovieRecipe recipe;
    recipe.video.width = 4096;
    recipe.video.height = 4096;
    recipe.video.frameCount = 88;
    recipe.video.framesPerChunk = 8;
    recipe.keepSoundBytes = false;
    recipe.maker.afIntervals = kIntervals;
    // Motor over the intervals: where nothing but the default tone plays there is nothing to remove.
    const uint64_t soundFrames = uint64_t{recipe.sound.sampleRate} * recipe.video.frameCount * recipe.video.frameDuration /
                                 recipe.video.timeScale;
    recipe.sound.pcm = testsupport::MotorOverSpans(soundFrames, recipe.sound.channels, recipe.sound.sampleRate,
                                                   Spans(kIntervals, 0));
    moviekit::MovieLayout layout;
    const std::string source = m_dir.File("src.mov");
    std::string error;
    ASSERT_TRUE(jobtest::WriteSparseMovie(source, recipe, 16 << 20, &layout, &error)) << error;
    ASSERT_TRUE(layout.co64);
    ASSERT_GT(layout.mdatPayloadSizes.at(0), k4GiB);
    ASSERT_GT(layout.soundChunks.back().offset, k4GiB);
    ASSERT_EQ(jobtest::TopLevelAtoms(source).back().type, "moov");
    struct stat sourceBefore {};
    ASSERT_EQ(stat(source.c_str(), &sourceBefore), 0);

    const std::string destination = m_dir.File("dst.mov");
    ASSERT_EQ(Run(source, destination), kDone);
    // Every source frame is the same hole: hashing one stands for hashing them all.
    const std::vector<std::string> frame = jobtest::FirstPacketHashes(source, "v:0", 1);
    ASSERT_EQ(frame.size(), 1u);
    ASSERT_EQ(std::stoull(frame[0]), layout.videoFrameSize) << frame[0];
    const std::vector<std::string> video(recipe.video.frameCount, frame[0]);
    const jobtest::TopAtom mdat = ExpectCompleteDestination(source, destination, recipe.video.frameCount, video);
    const std::vector<uint8_t> header = jobtest::ReadRange(destination, mdat.offset, 16);
    ASSERT_EQ(header.size(), 16u);
    EXPECT_EQ(std::vector<uint8_t>(header.begin(), header.begin() + 8),
              (std::vector<uint8_t>{0, 0, 0, 1, 'm', 'd', 'a', 't'}));
    uint64_t size = 0;
    for (size_t k = 8; k < 16; ++k) {
        size = size << 8 | header[k];
    }
    EXPECT_EQ(size, 16 + layout.mdatPayloadSizes[0]);
    const std::vector<uint8_t> moov = MoovBytes(destination);
    EXPECT_TRUE(jobtest::Contains(moov, "co64"));
    EXPECT_FALSE(jobtest::Contains(moov, "stco"));
    ExpectPcmProcessedOnlyInside(source, destination, kIntervals, recipe.sound.channels, recipe.sound.sampleRate);
    struct stat sourceAfter {};
    ASSERT_EQ(stat(source.c_str(), &sourceAfter), 0);
    EXPECT_EQ(sourceAfter.st_size, sourceBefore.st_size);
    EXPECT_EQ(sourceAfter.st_mtim.tv_sec, sourceBefore.st_mtim.tv_sec);
    EXPECT_EQ(sourceAfter.st_mtim.tv_nsec, sourceBefore.st_mtim.tv_nsec);
}

}  // namespace
