// The processing library driven directly, with the harness playing the system's side.
#include <gtest/gtest.h>

#include <ovix/Ovix.h>

#include "ByteWriter.h"
#include "MakerData.h"
#include "support/OvixHarness.h"
#include "support/TestSupport.h"

#include <algorithm>
#include <cmath>
#include <functional>
#include <numbers>
#include <set>
#include <sstream>
#include <tuple>

using moviekit::AfInterval;
using moviekit::Atom;
using namespace ovixtest;

namespace {

constexpr unsigned long kBlockFrames = 1024;
constexpr unsigned long kRate = 48000;
const TqovixTrimInformation kTrim{sizeof(TqovixTrimInformation), 30000, 1001, 0, 0};

Bytes AfBlock(const std::vector<AfInterval>& intervals, uint32_t rate = kRate, bool processed = false)
{
    return Atom("OP01", moviekit::MakeAfInformation(rate, intervals, processed));
}

const Bytes kForeignAfBlock = Atom("OP01", Bytes{'X', 'Q', 'Z', '7', 1, 2, 3, 4, 5, 6, 7, 8});

TqovixAudioInformation Audio(unsigned long channels, unsigned long count, unsigned long kHz = 48, unsigned offset = 0)
{
    return {sizeof(TqovixAudioInformation), kHz, channels, 16, count, offset, 0};
}

// Distinct, full-range values, so that reordered, dropped or altered samples show.
std::vector<int16_t> Pattern(size_t frames, unsigned channels)
{
    std::vector<int16_t> pcm(frames * channels);
    for (size_t i = 0; i < pcm.size(); ++i) {
        pcm[i] = static_cast<int16_t>((i * 7919 + 13) % 65536 - 32768);
    }
    return pcm;
}

// Harness and gate live in the fixture, so that they outlive a worker still running when an
// assertion fails.
class OvixTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ(TqovixLibraryInitialize(), ovix::kSuccess);
        Harness::Register();
    }
    void TearDown() override
    {
        m_gate.Open();
        TqovixLibraryClose();
    }
    Harness& Play(Script script) { return m_harness.emplace(std::move(script)); }
    // One whole session; returns the end state seen before closing.
    unsigned long Run(Script script, const TqovixAudioInformation& audio)
    {
        Play(std::move(script));
        EXPECT_EQ(TqovixOpenSession(audio, kTrim), ovix::kSuccess);
        unsigned long state = 0;
        EXPECT_TRUE(WaitFor([&] { return (state = TqovixIsSessionFinished()) != 0; }));
        EXPECT_EQ(TqovixCloseSession(0), ovix::kSuccess);
        return state;
    }
    std::vector<int16_t> Process(Script script, unsigned long kHz = 48, unsigned offset = 0)
    {
        const unsigned long frames = script.pcm.size() / script.channels;
        EXPECT_EQ(Run(script, Audio(script.channels, frames, kHz, offset)), ovix::kSessionFinished);
        return m_harness->pushed;
    }

    Gate m_gate;
    std::optional<Harness> m_harness;
};

TEST(OvixExports, OnlyTheThirteenFunctions)
{
    if (!testsupport::HaveCommand("nm")) {
        GTEST_SKIP() << "nm is not installed";
    }
    std::string output;
    ASSERT_EQ(testsupport::RunCommand("nm -DC --defined-only " + testsupport::ShellQuote(OVIX_LIBRARY_FILE), &output), 0);
    std::set<std::string> exported;
    std::istringstream lines(output);
    for (std::string line; std::getline(lines, line);) {
        // "address type name", the name possibly with spaces
        exported.insert(line.substr(line.find(' ', line.find(' ') + 1) + 1));
    }
    const std::string input = "(unsigned long (*)(void*, unsigned long*, unsigned long, unsigned long))";
    const std::set<std::string> expected = {
        "TqovixLibraryInitialize()", "TqovixLibraryClose()", "TqovixIsSessionFinished()", "TqovixAbortSession()",
        "TqovixIsEnable(void*, unsigned long)", "TqovixCloseSession(unsigned long)",
        "TqovixOpenSession(TqovixAudioInformation const&, TqovixTrimInformation const&)",
        "TqovixGetProcessedAFInfo(void*, unsigned long, unsigned long*)",
        "TqovixSetCallbackInputAFInformation" + input, "TqovixSetCallbackInputAudio" + input,
        "TqovixSetCallbackInputAudioLevelInformation" + input,
        "TqovixSetCallbackOutputAudio(unsigned long (*)(void*, unsigned long))",
        "TqovixSetCallbackNotifyProgress(void (*)(unsigned long, unsigned long))",
    };
    EXPECT_EQ(exported, expected);
}

// AF block fields: version at 12, flags at 14, interval count at 20.
Bytes Patched(Bytes block, size_t at, const Bytes& bytes)
{
    std::ranges::copy(bytes, block.begin() + at);
    return block;
}

TEST(OvixIsEnable, VerdictsOnAfBlocks)
{
    using ovix::kSuccess, ovix::kVerdictNotAfBlock, ovix::kVerdictNoAfInformation, ovix::kVerdictMalformed;
    const Bytes good = AfBlock({{100, 200}, {200, 300}});
    const Bytes goodPayload(good.begin() + 8, good.end());
    const std::tuple<const char*, Bytes, unsigned long> rows[] = {
        {"EmptyBlock", {}, kVerdictNotAfBlock},
        {"ShorterThanHeader", {0, 0, 0, 6, 'O', 'P'}, kVerdictNotAfBlock},
        {"SizeFieldDiffers", Bytes(good.begin(), good.end() - 1), kVerdictNotAfBlock},
        {"WrongType", Atom("OP02", goodPayload), kVerdictNotAfBlock},
        {"EmptyPayload", Atom("OP01", {}), kVerdictNoAfInformation},
        {"ThreeBytePayload", Atom("OP01", {'A', 'F', 'R'}), kVerdictNoAfInformation},
        {"UnknownVersion", Patched(AfBlock({}), 13, {2}), kVerdictMalformed},
        {"TruncatedHeader", Atom("OP01", Bytes(goodPayload.begin(), goodPayload.begin() + 10)), kVerdictMalformed},
        {"TableRunsPastEnd", Patched(AfBlock({{1, 2}, {3, 4}}), 23, {3}), kVerdictMalformed},
        {"CountNearFourGiga", Patched(AfBlock({{1, 2}}), 20, {0xFF, 0xFF, 0xFF, 0xFF}), kVerdictMalformed},
        {"TableCutMidEntry", Atom("OP01", Bytes(goodPayload.begin(), goodPayload.end() - 1)), kVerdictMalformed},
        {"Unsorted", AfBlock({{500, 600}, {100, 200}}), kVerdictMalformed},
        {"Overlapping", AfBlock({{100, 300}, {200, 400}}), kVerdictMalformed},
        {"EndBeforeStart", AfBlock({{300, 100}}), kVerdictMalformed},
        {"AlreadyProcessed", AfBlock({{100, 200}, {200, 300}}, kRate, true), ovix::kVerdictAlreadyProcessed},
        {"TouchingIntervals", good, kSuccess},
        {"EmptyInterval", AfBlock({{100, 100}}), kSuccess},
        {"OtherFlagBitsIgnored", Patched(AfBlock({}), 15, {6}), kSuccess},
        {"TrailingBytes", Atom("OP01", moviekit::Concat({goodPayload, Bytes(5, 9)})), kSuccess},
        {"ForeignFourBytes", Atom("OP01", {'A', 'B', 'C', 'D'}), kSuccess},
        {"ForeignPayload", kForeignAfBlock, kSuccess},
    };
    EXPECT_EQ(TqovixIsEnable(nullptr, 100), kVerdictNotAfBlock);
    for (auto [name, block, verdict] : rows) {
        EXPECT_EQ(TqovixIsEnable(block.empty() ? nullptr : block.data(), block.size()), verdict) << name;
    }
}

// Pushes exactly what was pulled (PCM) or the sample count (AAC, zeros after the track); progress is
// monotone up to (count, count), and the last notification already sees the end and the AF result.
TEST_F(OvixTest, PullsPushesAndNotifiesInOrder)
{
    // name, channels, frames of data, sample count, AAC, AF and level piece limit, level, foreign
    const std::tuple<const char*, unsigned, size_t, unsigned long, bool, size_t, bool, bool> rows[] = {
        {"StereoPcmShortLastBlock", 2, 5000, 5000, false, 1024, false, false},
        {"MonoPcmEndsAtEmptyDelivery", 1, 3000, 4096, false, 7, true, false},
        {"PcmWholeBlocksEndsAtEmptyDelivery", 2, 2048, 9000, false, 1024, false, true},
        {"SixChannelAacStopsAtSampleCount", 6, 2500, 3000, true, 5, true, false},
        {"EightChannelAacShortTrack", 8, 100, 1500, true, 1024, false, true},
        {"SingleFrame", 2, 1, 1, false, 3, false, false},
    };
    const Bytes level = Atom("OP02", moviekit::MakeAudioLevel(-1250));
    for (const auto& [name, channels, dataFrames, sampleCount, aac, pieceLimit, withLevel, foreign] : rows) {
        SCOPED_TRACE(name);
        const Bytes af = foreign ? kForeignAfBlock : AfBlock({});
        const std::vector<int16_t> pcm = Pattern(dataFrames, channels);
        const Script script{.afBlock = af, .levelBlock = withLevel ? level : Bytes{}, .pcm = pcm, .channels = channels,
                            .zerosAfterEnd = aac, .infoPieceLimit = pieceLimit};
        EXPECT_EQ(Run(script, Audio(channels, sampleCount)), ovix::kSessionFinished);

        const size_t frames = aac ? sampleCount : std::min<size_t>(dataFrames, sampleCount);
        std::vector<int16_t> pushed(pcm.begin(), pcm.begin() + std::min(frames, dataFrames) * channels);
        pushed.resize(frames * channels, 0);
        EXPECT_EQ(m_harness->pushed, pushed);

        const auto reads = [&](const Bytes& block, char event) {
            return std::string((block.size() + pieceLimit - 1) / pieceLimit, event);
        };
        std::string events = "a" + reads(af, 'A') + "l" + reads(script.levelBlock, 'L');
        std::vector<Note> notes;
        for (size_t done = 0; done < frames; done += kBlockFrames) {
            events += "ION";
            notes.push_back({std::min<unsigned long>(done + kBlockFrames, frames), sampleCount, 0});
        }
        notes.push_back({sampleCount, sampleCount, ovix::kSessionFinished});
        EXPECT_EQ(m_harness->notes, notes);
        EXPECT_EQ(m_harness->events, events + (frames < sampleCount ? "IN" : "N"));
        EXPECT_EQ(m_harness->processedAtEnd, foreign ? af : AfBlock({}, kRate, true));
    }
}

// A refused AF block or a failing callback ends the session with one notification repeating the
// last progress; an abort inside a callback stops the worker before its next callback, silently.
TEST_F(OvixTest, FailuresAndAbortsInsideCallbacks)
{
    using S = Script&;
    const std::tuple<const char*, std::function<void(S)>, unsigned long, std::string> rows[] = {
        {"AfSizeQueryFails", [](S s) { s.failAt = {'a', 0}; }, ovix::kFailure, "aN"},
        {"AfReadFails", [](S s) { s.failAt = {'A', 1}; }, ovix::kFailure, "aAAN"},
        {"AfLargerThanAccepted", [](S s) { s.afSize = (16ul << 20) + 1; }, ovix::kFailure, "aN"},
        {"AfShorterThanAnnounced", [](S s) { s.afSize = 40; }, ovix::kFailure, "aAAAAN"},
        {"LevelSizeQueryFails", [](S s) { s.failAt = {'l', 0}; }, ovix::kFailure, "aAAAlN"},
        {"LevelReadFails", [](S s) { s.failAt = {'L', 2}; }, ovix::kFailure, "aAAAlLLLN"},
        {"AudioPullFails", [](S s) { s.failAt = {'I', 3}; }, ovix::kFailure, "aAAAlLLLIONIONIONIN"},
        {"AudioPushFails", [](S s) { s.failAt = {'O', 2}; }, ovix::kFailure, "aAAAlLLLIONIONION"},
        {"AudioOverDelivers", [](S s) { s.overDeliver = true; }, ovix::kFailure, "aAAAlLLLIN"},
        {"EmptyAfBlock", [](S s) { s.afBlock = {}; }, ovix::kVerdictNotAfBlock, "aN"},
        {"AfBlockWithoutPayload", [](S s) { s.afBlock = Atom("OP01", {}); }, ovix::kVerdictNoAfInformation, "aAN"},
        {"MalformedAfBlock", [](S s) { s.afBlock = Patched(AfBlock({}), 13, {2}); }, ovix::kVerdictMalformed, "aAAAN"},
        {"ProcessedAfBlock", [](S s) { s.afBlock = AfBlock({}, 1, true); }, ovix::kVerdictAlreadyProcessed, "aAAAN"},
        {"AbortInAfSizeQuery", [](S s) { s.abortAt = {'a', 0}; }, ovix::kAborted, "a"},
        {"AbortInLevelQuery", [](S s) { s.abortAt = {'l', 0}; }, ovix::kAborted, "aAAAl"},
        {"AbortInFirstPull", [](S s) { s.abortAt = {'I', 0}; }, ovix::kAborted, "aAAAlLLLI"},
        {"AbortInThirdPush", [](S s) { s.abortAt = {'O', 2}; }, ovix::kAborted, "aAAAlLLLIONIONIO"},
        {"AbortInFourthNotification", [](S s) { s.abortAt = {'N', 3}; }, ovix::kAborted, "aAAAlLLLIONIONIONION"},
    };
    for (const auto& [name, fault, end, events] : rows) {
        SCOPED_TRACE(name);
        Script script{.afBlock = AfBlock({}), .levelBlock = Atom("OP02", moviekit::MakeAudioLevel(0)),
                      .pcm = Pattern(6000, 2), .infoPieceLimit = 8};
        fault(script);
        EXPECT_EQ(Run(script, Audio(2, 6000)), end);
        EXPECT_EQ(m_harness->events, events);
        // Progress block by block; a notification inside which the end happened carries it.
        std::vector<Note> notes;
        for (unsigned long n = 1; n <= static_cast<unsigned long>(std::ranges::count(events, 'N')); ++n) {
            notes.push_back({n * kBlockFrames, 6000, 0});
        }
        if (events.back() == 'N') {
            notes.back() = {notes.back().done - (end == ovix::kAborted ? 0 : kBlockFrames), 6000, end};
        }
        EXPECT_EQ(m_harness->notes, notes);
    }
}

// While the worker is held inside a callback: an abort from another thread shows at once, and of
// two simultaneous closes only one joins the worker; the other is refused without waiting.
TEST_F(OvixTest, AbortAndTwoClosesFromOtherThreads)
{
    Harness& harness = Play({.afBlock = AfBlock({}), .pcm = Pattern(8000, 2), .holdAt = {'O', 1}, .gate = &m_gate});
    ASSERT_EQ(TqovixOpenSession(Audio(2, 8000), kTrim), ovix::kSuccess);
    ASSERT_TRUE(m_gate.WaitArrived());
    EXPECT_EQ(TqovixIsSessionFinished(), 0u);
    EXPECT_EQ(TqovixAbortSession(), ovix::kSuccess);
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kAborted);
    std::atomic<unsigned long> first{~0ul}, second{~0ul};
    std::thread a([&] { first = TqovixCloseSession(0); });
    std::thread b([&] { second = TqovixCloseSession(ovix::kAborted); });
    EXPECT_TRUE(WaitFor([&] { return first == ovix::kFailure || second == ovix::kFailure; }));
    m_gate.Open();
    // Joinable threads left behind end the process rather than hang it.
    ASSERT_TRUE(WaitFor([&] { return first != ~0ul && second != ~0ul; }));
    a.join();
    b.join();
    EXPECT_EQ(std::minmax({first.load(), second.load()}), std::pair(ovix::kSuccess, ovix::kFailure));
    EXPECT_EQ(harness.events, "aAlIONIO");
    EXPECT_EQ(harness.notes.size(), 1u);
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kFailure);
}

// Refused records start nothing; one session at a time, serving its processed AF information in
// pieces while it runs (rewinding after the last); closing the library ends it.
TEST_F(OvixTest, LifecycleOfLibraryAndSessions)
{
    using A = TqovixAudioInformation;
    uint8_t piece[16];
    unsigned long count = 0;
    EXPECT_EQ(TqovixLibraryInitialize(), ovix::kFailure);
    const Bytes af = AfBlock({{0, 1ul << 40, 700}});
    Harness& harness = Play({.afBlock = af, .zerosAfterEnd = true, .holdAt = {'N', 2}, .gate = &m_gate});
    const std::pair<unsigned long A::*, unsigned long> spoilt[] = {
        {&A::size, 40},          {&A::channels, 0},   {&A::channels, 9},           {&A::bitsPerSample, 8},
        {&A::bitsPerSample, 24}, {&A::sampleRate, 0}, {&A::sampleRate, 1ul << 40}, {&A::sampleCount, 0}};
    for (const auto& [field, value] : spoilt) {
        A audio = Audio(2, 100);
        audio.*field = value;
        EXPECT_EQ(TqovixOpenSession(audio, kTrim), ovix::kFailure) << value;
    }
    EXPECT_EQ(TqovixOpenSession(Audio(2, 100), {48, 30000, 1001, 0, 0}), ovix::kFailure);
    EXPECT_EQ(TqovixCloseSession(0), ovix::kFailure);
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kFailure);
    EXPECT_TRUE(harness.events.empty());

    ASSERT_EQ(TqovixOpenSession(Audio(2, 1ul << 40), kTrim), ovix::kSuccess);
    ASSERT_TRUE(m_gate.WaitArrived());
    EXPECT_EQ(TqovixOpenSession(Audio(2, 100), kTrim), ovix::kFailure);
    EXPECT_EQ(TqovixGetProcessedAFInfo(nullptr, sizeof piece, &count), ovix::kFailure);
    EXPECT_EQ(TqovixGetProcessedAFInfo(piece, 0, &count), ovix::kFailure);
    EXPECT_EQ(TqovixGetProcessedAFInfo(piece, sizeof piece, nullptr), ovix::kFailure);
    Bytes read;
    for (int calls = 0; calls < 100 && read.size() < 2 * af.size(); ++calls) {
        EXPECT_LE(TqovixGetProcessedAFInfo(piece, 7, &count), ovix::kLastPiece);
        read.insert(read.end(), piece, piece + std::min(count, 7ul));
    }
    const Bytes processed = AfBlock({{0, 1ul << 40, 700}}, kRate, true);
    EXPECT_EQ(read, moviekit::Concat({processed, processed}));
    m_gate.Open();
    EXPECT_EQ(TqovixLibraryClose(), ovix::kSuccess);
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kFailure);
    EXPECT_EQ(TqovixOpenSession(Audio(2, 100), kTrim), ovix::kFailure);
    // Progress only: an end notification would repeat the last count.
    EXPECT_TRUE(std::ranges::adjacent_find(harness.notes, std::greater_equal{}, &Note::done) == harness.notes.end());
    EXPECT_EQ(TqovixLibraryInitialize(), ovix::kSuccess);
}

// A 4 kHz tone, well above the motor band, plus motor noise: 24 partials between 80 and 500 Hz.
std::vector<int16_t> Sound(size_t frames, unsigned channels, double tone, double noise)
{
    std::vector<int16_t> out(frames * channels);
    for (size_t i = 0; i < out.size(); ++i) {
        const double t = static_cast<double>(i / channels) / kRate;
        double value = tone * std::sin(2.0 * std::numbers::pi * 4000.0 * t);
        for (int k = 0; k < 24 && noise != 0.0; ++k) {
            value += noise * std::sin(2.0 * std::numbers::pi * (80 + k * 359 % 420) * t + k + i % channels);
        }
        out[i] = static_cast<int16_t>(std::lrint(value));
    }
    return out;
}

// The filters are linear, so noise and tone are measured apart over the intervals.
TEST_F(OvixTest, NoiseDropsInsideIntervalsToneStaysAndEdgesSaturate)
{
    const auto inside = [](uint64_t t) { return (t >= 30000 && t < 60000) || (t >= 90000 && t < 120000); };
    const std::vector<int16_t> noise = Sound(3 * kRate, 2, 0.0, 250.0);
    const std::vector<int16_t> tone = Sound(3 * kRate, 2, 8000.0, 0.0);
    const auto decibels = [&](const std::vector<int16_t>& in, const std::vector<int16_t>& out) {
        double before = 0.0, after = 0.0;
        for (size_t i = 0; i < std::min(in.size(), out.size()); ++i) {
            before += inside(i / 2) ? std::pow(in[i], 2) : 0.0;
            after += inside(i / 2) ? std::pow(out[i], 2) : 0.0;
        }
        return 10.0 * std::log10(after / before);
    };
    const std::tuple<uint16_t, double, double> rows[] = {{1000, -99.0, -12.0}, {500, -9.0, -3.0}, {4000, -99.0, -12.0}};
    for (const auto& [strength, least, most] : rows) {
        SCOPED_TRACE(strength);
        const Bytes af = AfBlock({{30000, 60000, strength}, {90000, 120000, strength}});
        const std::vector<int16_t> out = Process({.afBlock = af, .pcm = noise});
        EXPECT_GE(decibels(noise, out), least);
        EXPECT_LE(decibels(noise, out), most);
        EXPECT_NEAR(decibels(tone, Process({.afBlock = af, .pcm = tone})), 0.0, 1.0);
        // The filters' state carries from block to block, wherever the blocks begin.
        EXPECT_EQ(Process({.afBlock = af, .pcm = noise, .audioFrameLimit = 700}), out);
    }

    // A full-scale 50 Hz square wave: the high-pass doubles every edge, which must clip, not wrap.
    std::vector<int16_t> square(24000);
    for (size_t t = 0; t < square.size(); ++t) {
        square[t] = (t / 480) % 2 == 0 ? -32000 : 32000;
    }
    const std::vector<int16_t> out = Process({.afBlock = AfBlock({{0, 24000, 1000}}), .pcm = square, .channels = 1});
    for (size_t t = 480; t < std::min(out.size(), square.size()); t += 480) {
        EXPECT_EQ(out[t], square[t] > 0 ? INT16_MAX : INT16_MIN) << "edge at " << t;
    }
}

// Changes lie within the mapped interval and its ramps only; nearly every frame of the interval
// changes, and so do some in each ramp inside the track. Rows that change nothing map to 0..0.
TEST_F(OvixTest, IntervalsLandWhereTheRecordSays)
{
    const std::tuple<const char*, Bytes, unsigned long, unsigned, uint64_t, uint64_t> rows[] = {
        {"SameRate", AfBlock({{10000, 20000, 1000}}), 48, 0, 10000, 20000},
        {"RecordAtHalfRate", AfBlock({{5000, 10000, 1000}}, 24000), 48, 0, 10000, 20000},
        {"SessionAt44kHzMeans44100", AfBlock({{48000, 96000, 1000}}), 44, 0, 44100, 88200},
        {"RecordWithoutRate", AfBlock({{10000, 20000, 1000}}, 0), 48, 0, 10000, 20000},
        {"StartOffsetShiftsLater", AfBlock({{10000, 20000, 1000}}), 48, 1500, 11500, 21500},
        {"WrappedStartOffsetShiftsEarlier", AfBlock({{10000, 20000, 1000}}), 48, 0xFFFFFC18u, 9000, 19000},
        {"ClippedAtTrackEnd", AfBlock({{95000, 400000, 1000}}), 48, 0, 95000, 100000},
        {"RampBeforeTrackStart", AfBlock({{100, 5000, 1000}}), 48, 0, 100, 5000},
        {"PastTheEnd", AfBlock({{150000, 160000, 1000}}), 48, 0, 0, 0},
        {"FarPositionsDoNotWrap", AfBlock({{1ull << 62, ~0ull, 1000}}, 1), 48, 0, 0, 0},
        {"StrengthZero", AfBlock({{0, 100000, 0}}), 48, 0, 0, 0},
        {"ForeignPayload", kForeignAfBlock, 48, 0, 0, 0},
    };
    const std::vector<int16_t> pcm = Sound(100000, 1, 0.0, 250.0);
    for (const auto& [name, af, kHz, offset, start, end] : rows) {
        SCOPED_TRACE(name);
        const std::vector<int16_t> out = Process({.afBlock = af, .pcm = pcm, .channels = 1}, kHz, offset);
        if (start == end) {
            EXPECT_EQ(out, pcm);
            continue;
        }
        ASSERT_EQ(out.size(), pcm.size());
        const uint64_t ramp = (kHz == 44 ? 44100 : kHz * 1000) / 100;
        size_t inside = 0, rampIn = 0, rampOut = 0, outside = 0;
        for (uint64_t t = 0; t < pcm.size(); ++t) {
            const bool changed = out[t] != pcm[t];
            inside += changed && t >= start && t < end;
            rampIn += changed && t < start && t + ramp >= start;
            rampOut += changed && t >= end && t < end + ramp;
            outside += changed && (t + ramp < start || t >= end + ramp);
        }
        EXPECT_EQ(outside, 0u);
        EXPECT_GE(inside, (end - start) * 9 / 10);
        EXPECT_TRUE(start <= ramp || rampIn > 0);
        EXPECT_TRUE(end >= pcm.size() || rampOut > 0);
    }
}

}  // namespace
