// The processing library driven directly, with the harness playing the system's side.
#include <gtest/gtest.h>

#include <ovix/Ovix.h>

#include "ByteWriter.h"
#include "MakerData.h"
#include "support/OvixHarness.h"
#include "support/ProcessedRegions.h"
#include "NoiseSuppressor.h"

#include <algorithm>
#include <cmath>
#include <functional>
#include <numbers>
#include <optional>
#include <ostream>
#include <string>

using moviekit::Atom;
using namespace ovixtest;

namespace {

constexpr unsigned long kBlockFrames = 1024, kRate = 48000;
const TqovixTrimInformation kTrim{sizeof(TqovixTrimInformation), 30000, 1001, 0, 0};

Bytes AfBlock(const std::vector<moviekit::AfInterval>& intervals, uint32_t rate = kRate, bool processed = false)
{
    return Atom("OP01", moviekit::MakeAfInformation(rate, intervals, processed));
}

// AF block fields: version at 12, flags at 14, interval count at 20.
Bytes Patched(Bytes block, size_t at, const Bytes& bytes)
{
    std::ranges::copy(bytes, block.begin() + at);
    return block;
}

TqovixAudioInformation Audio(unsigned long channels, unsigned long count)
{
    return {sizeof(TqovixAudioInformation), 48, channels, 16, count, 0, 0};
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

// The harness outlives a worker still running when an assertion fails.
class OvixTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ(TqovixLibraryInitialize(), ovix::kSuccess);
        Harness::Register();
    }
    void TearDown() override
    {
        if (m_harness) {
            m_harness->gate.open = true;
        }
        TqovixLibraryClose();
    }
    // One whole session; the end state seen before closing.
    unsigned long Run(Script script, const TqovixAudioInformation& audio)
    {
        m_harness.emplace(std::move(script));
        EXPECT_EQ(TqovixOpenSession(audio, kTrim), ovix::kSuccess);
        unsigned long state = 0;
        EXPECT_TRUE(WaitFor([&] { return (state = TqovixIsSessionFinished()) != 0; }));
        EXPECT_EQ(TqovixCloseSession(0), ovix::kSuccess);
        return state;
    }
    std::vector<int16_t> Process(Script script)
    {
        EXPECT_EQ(Run(script, Audio(script.channels, script.pcm.size() / script.channels)), ovix::kSessionFinished);
        return m_harness->pushed;
    }

    std::optional<Harness> m_harness;
};

Bytes Good() { return AfBlock({{100, 200}, {200, 300}}); }
Bytes GoodPayload()
{
    const Bytes good = Good();
    return Bytes(good.begin() + 8, good.end());
}

struct EnableRow {
    const char* name;
    Bytes (*block)();
    unsigned long verdict;
};
void PrintTo(const EnableRow& row, std::ostream* os) { *os << row.name; }

class OvixIsEnable : public ::testing::TestWithParam<EnableRow> {};

TEST_P(OvixIsEnable, VerdictOnTheAfBlock)
{
    Bytes block = GetParam().block();
    EXPECT_EQ(TqovixIsEnable(block.data(), block.size()), GetParam().verdict);
}

TEST(OvixIsEnableNull, IsNotAnAfBlock) { EXPECT_EQ(TqovixIsEnable(nullptr, 100), ovix::kVerdictNotAfBlock); }

INSTANTIATE_TEST_SUITE_P(
    Blocks, OvixIsEnable,
    ::testing::Values(
        EnableRow{"ShorterThanHeader", [] { return Bytes({0, 0, 0, 6, 'O', 'P'}); }, ovix::kVerdictNotAfBlock},
        EnableRow{"SizeFieldDiffers", [] { Bytes block = Good(); block.pop_back(); return block; },
                  ovix::kVerdictNotAfBlock},
        EnableRow{"WrongType", [] { return Atom("OP02", GoodPayload()); }, ovix::kVerdictNotAfBlock},
        EnableRow{"ThreeBytePayload", [] { return Atom("OP01", {'A', 'F', 'R'}); },
                  ovix::kVerdictNoAfInformation},
        EnableRow{"UnknownVersion", [] { return Patched(AfBlock({}), 13, {2}); }, ovix::kVerdictMalformed},
        EnableRow{"TruncatedHeader",
                  [] {
                      const Bytes payload = GoodPayload();
                      return Atom("OP01", Bytes(payload.begin(), payload.begin() + 10));
                  },
                  ovix::kVerdictMalformed},
        EnableRow{"TableRunsPastEnd", [] { return Patched(AfBlock({{1, 2}, {3, 4}}), 23, {3}); },
                  ovix::kVerdictMalformed},
        EnableRow{"CountNearFourGiga", [] { return Patched(AfBlock({{1, 2}}), 20, {0xFF, 0xFF, 0xFF, 0xFF}); },
                  ovix::kVerdictMalformed},
        EnableRow{"Overlapping", [] { return AfBlock({{100, 300}, {200, 400}}); }, ovix::kVerdictMalformed},
        EnableRow{"EndBeforeStart", [] { return AfBlock({{300, 100}}); }, ovix::kVerdictMalformed},
        EnableRow{"AlreadyProcessed", [] { return AfBlock({{100, 200}, {200, 300}}, kRate, true); },
                  ovix::kVerdictAlreadyProcessed},
        EnableRow{"TouchingIntervals", Good, ovix::kSuccess},
        EnableRow{"EmptyInterval", [] { return AfBlock({{100, 100}}); }, ovix::kSuccess},
        EnableRow{"OtherFlagBitsIgnored", [] { return Patched(AfBlock({}), 15, {6}); }, ovix::kSuccess},
        EnableRow{"TrailingBytes", [] { return Atom("OP01", moviekit::Concat({GoodPayload(), Bytes(5, 9)})); },
                  ovix::kSuccess},
        EnableRow{"ForeignFourBytes", [] { return Atom("OP01", {'A', 'B', 'C', 'D'}); }, ovix::kSuccess}),
    [](const ::testing::TestParamInfo<EnableRow>& info) { return std::string(info.param.name); });

struct FaultRow {
    const char* name;
    void (*fault)(Script&);
    unsigned long end;
    std::string events;
};
void PrintTo(const FaultRow& row, std::ostream* os) { *os << row.name; }

class OvixFaultTest : public OvixTest, public ::testing::WithParamInterface<FaultRow> {};

// A refused AF block or a failing callback ends the session with one notification repeating the
// last progress; an abort inside a callback stops the worker before its next callback, silently.
TEST_P(OvixFaultTest, EndsWithOneNotificationOrSilentlyOnAbort)
{
    const auto& [name, fault, end, events] = GetParam();
    Script script{.afBlock = AfBlock({}), .levelBlock = Atom("OP02", moviekit::MakeAudioLevel(0)),
                  .pcm = std::vector<int16_t>(12000, 7), .infoPieceLimit = 8};
    fault(script);
    EXPECT_EQ(Run(script, Audio(2, 6000)), end);
    EXPECT_EQ(m_harness->events, events);
    // Progress block by block; a notification inside which the end happened repeats it, with the end.
    const auto n = static_cast<unsigned long>(std::ranges::count(events, 'N'));
    const bool noted = events.back() == 'N';
    ASSERT_EQ(m_harness->notes.size(), n);
    EXPECT_EQ(m_harness->notes.back(),
              (Note{(n - (noted && end != ovix::kAborted)) * kBlockFrames, 6000, noted ? end : 0}));
}

using S = Script&;
INSTANTIATE_TEST_SUITE_P(
    Callbacks, OvixFaultTest,
    ::testing::Values(
        FaultRow{"AfReadFails", [](S s) { s.failAt = {'A', 1}; }, ovix::kFailure, "aAAN"},
        FaultRow{"AfLargerThanAccepted", [](S s) { s.afSize = (16ul << 20) + 1; }, ovix::kFailure, "aN"},
        FaultRow{"AfShorterThanAnnounced", [](S s) { s.afSize = 40; }, ovix::kFailure, "aAAAAN"},
        FaultRow{"AudioPullFails", [](S s) { s.failAt = {'I', 3}; }, ovix::kFailure, "aAAAlLLLIONIONIONIN"},
        FaultRow{"AudioOverDelivers", [](S s) { s.overDeliver = true; }, ovix::kFailure, "aAAAlLLLIN"},
        FaultRow{"MalformedAfBlock", [](S s) { s.afBlock = Patched(AfBlock({}), 13, {2}); }, ovix::kVerdictMalformed,
                 "aAAAN"},
        FaultRow{"AbortInThirdPush", [](S s) { s.abortAt = {'O', 2}; }, ovix::kAborted, "aAAAlLLLIONIONIO"},
        FaultRow{"AbortInFourthNotification", [](S s) { s.abortAt = {'N', 3}; }, ovix::kAborted,
                 "aAAAlLLLIONIONIONION"}),
    [](const ::testing::TestParamInfo<FaultRow>& info) { return std::string(info.param.name); });

// Refused records and arguments start nothing; one session runs at a time. With its worker held in a callback,
// an abort from another thread shows at once, and of two simultaneous closes only one joins the worker.
TEST_F(OvixTest, RefusalsAbortAndTwoClosesFromOtherThreads)
{
    using A = TqovixAudioInformation;
    EXPECT_EQ(TqovixLibraryInitialize(), ovix::kFailure);
    Harness& harness = m_harness.emplace(Script{.afBlock = AfBlock({}), .zerosAfterEnd = true, .holdAt = {'O', 1}});
    const std::pair<unsigned long A::*, unsigned long> spoilt[] = {
        {&A::size, 40}, {&A::channels, 0}, {&A::channels, 9}, {&A::bitsPerSample, 24},
        {&A::sampleRate, 0}, {&A::sampleRate, 1ul << 40}, {&A::sampleCount, 0}};
    for (const auto& [field, value] : spoilt) {
        A audio = Audio(2, 100);
        audio.*field = value;
        EXPECT_EQ(TqovixOpenSession(audio, kTrim), ovix::kFailure) << value;
    }
    EXPECT_EQ(TqovixOpenSession(Audio(2, 100), {48, 30000, 1001, 0, 0}), ovix::kFailure);
    EXPECT_EQ(TqovixCloseSession(0), ovix::kFailure);
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kFailure);
    EXPECT_TRUE(harness.events.empty());

    ASSERT_EQ(TqovixOpenSession(Audio(2, 8000), kTrim), ovix::kSuccess);
    ASSERT_TRUE(harness.gate.WaitArrived());
    EXPECT_EQ(TqovixOpenSession(Audio(2, 100), kTrim), ovix::kFailure);
    uint8_t piece[16];
    unsigned long count = 0;
    EXPECT_EQ(TqovixGetProcessedAFInfo(nullptr, sizeof piece, &count), ovix::kFailure);
    EXPECT_EQ(TqovixGetProcessedAFInfo(piece, 0, &count), ovix::kFailure);
    EXPECT_EQ(TqovixGetProcessedAFInfo(piece, sizeof piece, nullptr), ovix::kFailure);
    EXPECT_EQ(TqovixIsSessionFinished(), 0u);
    EXPECT_EQ(TqovixAbortSession(), ovix::kSuccess);
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kAborted);
    std::atomic<unsigned long> first{~0ul}, second{~0ul};
    std::thread a([&] { first = TqovixCloseSession(0); });
    std::thread b([&] { second = TqovixCloseSession(ovix::kAborted); });
    EXPECT_TRUE(WaitFor([&] { return first == ovix::kFailure || second == ovix::kFailure; }));
    harness.gate.open = true;
    // Joinable threads left behind end the process rather than hang it.
    ASSERT_TRUE(WaitFor([&] { return first != ~0ul && second != ~0ul; }));
    a.join();
    b.join();
    EXPECT_EQ(std::minmax({first.load(), second.load()}), std::pair(ovix::kSuccess, ovix::kFailure));
    EXPECT_EQ(harness.events, "aAlIONIO");
    EXPECT_EQ(harness.notes.size(), 1u);
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kFailure);
}

// Closing the library ends a running session, without an end notification repeating the last count.
TEST_F(OvixTest, ClosingTheLibraryEndsASession)
{
    Harness& harness = m_harness.emplace(Script{.afBlock = AfBlock({}), .zerosAfterEnd = true, .holdAt = {'N', 2}});
    ASSERT_EQ(TqovixOpenSession(Audio(2, 1ul << 40), kTrim), ovix::kSuccess);
    ASSERT_TRUE(harness.gate.WaitArrived());
    harness.gate.open = true;
    EXPECT_EQ(TqovixLibraryClose(), ovix::kSuccess);
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kFailure);
    EXPECT_EQ(TqovixOpenSession(Audio(2, 100), kTrim), ovix::kFailure);
    EXPECT_TRUE(std::ranges::adjacent_find(harness.notes, std::greater_equal{}, &Note::done) == harness.notes.end());
    EXPECT_EQ(TqovixLibraryInitialize(), ovix::kSuccess);
}

struct StrengthRow {
    const char* name;
    uint16_t strength;
    double least, most;  // noise change inside the intervals, dB
};
void PrintTo(const StrengthRow& row, std::ostream* os) { *os << row.name; }

class OvixStrengthTest : public OvixTest, public ::testing::WithParamInterface<StrengthRow> {};

// The filters are linear, so noise and tone are measured apart over the intervals.
TEST_P(OvixStrengthTest, NoiseDropsInsideIntervalsAndToneStays)
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
    const uint16_t strength = GetParam().strength;
    const Bytes af = AfBlock({{30000, 60000, strength}, {90000, 120000, strength}});
    const std::vector<int16_t> out = Process({.afBlock = af, .pcm = noise});
    EXPECT_GE(decibels(noise, out), GetParam().least);
    EXPECT_LE(decibels(noise, out), GetParam().most);
    EXPECT_NEAR(decibels(tone, Process({.afBlock = af, .pcm = tone})), 0.0, 1.0);
    // The filters' state carries from block to block, wherever the blocks begin.
    EXPECT_EQ(Process({.afBlock = af, .pcm = noise, .audioFrameLimit = 700}), out);
}

INSTANTIATE_TEST_SUITE_P(Strengths, OvixStrengthTest,
                         ::testing::Values(StrengthRow{"Full", 1000, -99.0, -12.0}, StrengthRow{"Half", 500, -9.0, -3.0},
                                           StrengthRow{"BeyondFull", 4000, -99.0, -12.0}),
                         [](const ::testing::TestParamInfo<StrengthRow>& info) { return std::string(info.param.name); });

struct RegionRow {
    const char* name;
    unsigned long kiloHertz;
    uint32_t rate;        // what those kHz stand for
    unsigned channels;
    int32_t startOffset;  // frames the record's positions move by
    uint32_t recordRate;  // the rate the AF record counts in
    size_t deliveryFrames;
};
void PrintTo(const RegionRow& row, std::ostream* os) { *os << row.name; }

class OvixRegionTest : public OvixTest, public ::testing::WithParamInterface<RegionRow> {};

// Processing begins and ends where the intervals, moved by the start offset and widened by the ramp,
// do: to the frame, give or take one. At these rates the ramp's first weights change loud samples,
// so an interval placed one frame late or early shows at one end or the other.
TEST_P(OvixRegionTest, ProcessingKeepsToTheIntervalsAndTheirRamps)
{
    const RegionRow& row = GetParam();
    const uint64_t frames = 3 * uint64_t{row.rate};
    const std::vector<moviekit::AfInterval> intervals = {
        {row.recordRate / 2, row.recordRate * 7 / 8, 1000},
        {row.recordRate * 5 / 4, row.recordRate * 5 / 4 + row.recordRate / 20, 600},
        {row.recordRate * 2, row.recordRate * 5 / 2, 300}};
    std::vector<testsupport::FrameSpan> spans;
    for (const moviekit::AfInterval& interval : intervals) {
        // Starts round down and ends up when the record counts in another rate.
        const uint64_t start = interval.startFrame * row.rate / row.recordRate;
        const uint64_t end = (interval.endFrame * uint64_t{row.rate} + row.recordRate - 1) / row.recordRate;
        spans.push_back({start + row.startOffset, end + row.startOffset});
    }
    Script script{.afBlock = AfBlock(intervals, row.recordRate),
                  .pcm = testsupport::MotorOverSpans(frames, row.channels, row.rate, spans),
                  .channels = row.channels,
                  .audioFrameLimit = row.deliveryFrames};
    const std::vector<int16_t> input = script.pcm;
    const TqovixAudioInformation audio{sizeof(TqovixAudioInformation), row.kiloHertz, row.channels, 16, frames,
                                       static_cast<unsigned>(row.startOffset), 0};
    ASSERT_EQ(Run(std::move(script), audio), ovix::kSessionFinished);
    EXPECT_EQ(testsupport::CheckProcessedRegions(input, m_harness->pushed, row.channels, spans, row.rate / 100), "");
}

INSTANTIATE_TEST_SUITE_P(
    Placements, OvixRegionTest,
    ::testing::Values(RegionRow{"Stereo8k", 8, 8000, 2, 0, 8000, SIZE_MAX / 64},
                      RegionRow{"Stereo8kShiftedLater", 8, 8000, 2, 333, 8000, SIZE_MAX / 64},
                      RegionRow{"Stereo8kShiftedEarlierInOddDeliveries", 8, 8000, 2, -250, 8000, 700},
                      RegionRow{"FourChannels11025RecordAt48k", 11, 11025, 4, 0, 48000, SIZE_MAX / 64},
                      RegionRow{"SixChannels8kShiftedLater", 8, 8000, 6, 77, 8000, SIZE_MAX / 64}),
    [](const ::testing::TestParamInfo<RegionRow>& info) { return std::string(info.param.name); });

// A full-scale 50 Hz square wave: the high-pass doubles every edge, which must clip, not wrap.
TEST_F(OvixTest, EdgesSaturate)
{
    std::vector<int16_t> square(24000);
    for (size_t t = 0; t < square.size(); ++t) {
        square[t] = (t / 480) % 2 == 0 ? -32000 : 32000;
    }
    const std::vector<int16_t> out = Process({.afBlock = AfBlock({{0, 24000, 1000}}), .pcm = square, .channels = 1});
    for (size_t t = 480; t < std::min(out.size(), square.size()); t += 480) {
        EXPECT_EQ(out[t], square[t] > 0 ? INT16_MAX : INT16_MIN) << "edge at " << t;
    }
}

}  // namespace

// Outside the spans the filters are skipped and restarted a warm-up before the next ramp:
// what comes out must be what a filter that ran through the whole track gives.
struct SuppressorRow {
    const char* name;
    uint64_t rate;
    unsigned channels;
};
void PrintTo(const SuppressorRow& row, std::ostream* out) { *out << row.name; }

class SuppressorWarmUp : public ::testing::TestWithParam<SuppressorRow> {};

TEST_P(SuppressorWarmUp, SkippingMatchesTheFilterThatRanThroughout)
{
    const uint64_t rate = GetParam().rate;
    const unsigned channels = GetParam().channels;
    const uint64_t frames = 3 * rate;
    std::vector<int16_t> input(frames * channels);
    uint32_t seed = 7;
    for (size_t k = 0; k < input.size(); ++k) {
        seed = seed * 1664525u + 1013904223u;
        const double t = static_cast<double>(k / channels) / static_cast<double>(rate);
        input[k] = static_cast<int16_t>(6000 * std::sin(2 * std::numbers::pi * 90 * t) + ((seed >> 16) % 4000) - 2000);
    }
    const std::vector<ovix::DriveSpan> spans = {
        {rate / 2, rate / 2 + rate / 5, 1.0f}, {rate + 300, rate + 900, 0.5f}, {2 * rate, 2 * rate + rate / 3, 0.8f}};
    const auto run = [&](uint64_t warmUp, const std::vector<ovix::DriveSpan>& processed) {
        ovix::NoiseSuppressor suppressor(rate, channels);
        suppressor.SetWarmUpFrames(warmUp);
        suppressor.SetSpans(processed);
        std::vector<int16_t> out = input;
        for (uint64_t at = 0; at < frames; at += 1024) {
            suppressor.Process(out.data() + at * channels, at, std::min<uint64_t>(1024, frames - at));
        }
        return out;
    };
    const std::vector<int16_t> skipping = run(rate / 10, spans);
    const std::vector<int16_t> throughout = run(UINT64_MAX, spans);
    ASSERT_NE(throughout, input) << "the spans were not processed";
    size_t differing = 0;
    int largest = 0;
    for (size_t k = 0; k < input.size(); ++k) {
        const int difference = std::abs(skipping[k] - throughout[k]);
        differing += difference != 0 ? 1 : 0;
        largest = std::max(largest, difference);
    }
    EXPECT_LE(largest, 1) << "a restarted filter had not settled";
    EXPECT_LT(differing, input.size() / 10000);
    // No warm-up, with a ramp that starts on a block: the test tells a cold filter from a settled one.
    const uint64_t ramp = rate / 100;
    const std::vector<ovix::DriveSpan> aligned = {{1024 * 40 + ramp, 1024 * 60, 1.0f}};
    const std::vector<int16_t> cold = run(0, aligned);
    const std::vector<int16_t> settled = run(UINT64_MAX, aligned);
    int coldLargest = 0;
    for (size_t k = 0; k < input.size(); ++k) {
        coldLargest = std::max(coldLargest, std::abs(cold[k] - settled[k]));
    }
    EXPECT_GT(coldLargest, 1);
}

INSTANTIATE_TEST_SUITE_P(Rates, SuppressorWarmUp,
                         ::testing::Values(SuppressorRow{"Stereo48k", 48000, 2}, SuppressorRow{"Mono44k", 44100, 1},
                                           SuppressorRow{"SixChannels48k", 48000, 6}),
                         [](const ::testing::TestParamInfo<SuppressorRow>& info) { return std::string(info.param.name); });
