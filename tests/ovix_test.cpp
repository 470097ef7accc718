// The processing library driven directly, with the harness playing the system's side.
#include <gtest/gtest.h>

#include <ovix/Ovix.h>

#include "ByteWriter.h"
#include "MakerData.h"
#include "support/MotorSound.h"
#include "support/OvixHarness.h"
#include "support/TestSupport.h"
#include "NoiseSuppressor.h"

#include <algorithm>
#include <atomic>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <new>
#include <numbers>
#include <optional>
#include <ostream>
#include <string>

// Every allocation of the test binary passes here, so that a test can show that processing
// a block allocates nothing. Only the thread that asked is counted.
namespace {
thread_local bool t_countAllocations = false;
thread_local uint64_t t_allocations = 0;
}  // namespace

// Not inlined either way: g++ would pair an inlined malloc or free with the other side of
// `new` and `delete` at every call site and warn.
[[gnu::noinline]] void* operator new(std::size_t size)
{
    if (t_countAllocations) {
        ++t_allocations;
    }
    if (void* block = std::malloc(size != 0 ? size : 1)) {
        return block;
    }
    throw std::bad_alloc();
}
[[gnu::noinline]] void* operator new[](std::size_t size) { return operator new(size); }
[[gnu::noinline]] void* operator new(std::size_t size, const std::nothrow_t&) noexcept
{
    try {
        return operator new(size);
    } catch (const std::bad_alloc&) {
        return nullptr;
    }
}
[[gnu::noinline]] void* operator new[](std::size_t size, const std::nothrow_t& tag) noexcept
{
    return operator new(size, tag);
}
[[gnu::noinline]] void operator delete(void* block) noexcept { std::free(block); }
[[gnu::noinline]] void operator delete[](void* block) noexcept { std::free(block); }
[[gnu::noinline]] void operator delete(void* block, std::size_t) noexcept { std::free(block); }
[[gnu::noinline]] void operator delete[](void* block, std::size_t) noexcept { std::free(block); }

using moviekit::Atom;
using namespace ovixtest;

namespace {

using testsupport::PrintTo;

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
    return {sizeof(TqovixAudioInformation), 48, channels, 16, count, 0, 0, 0, 0};
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

class OvixIsEnable : public ::testing::TestWithParam<EnableRow> {};

// Beside bridge_test's rows (another type, a payload short of the magic, a processed block).
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
        EnableRow{"TouchingIntervals", Good, ovix::kSuccess},
        EnableRow{"EmptyInterval", [] { return AfBlock({{100, 100}}); }, ovix::kSuccess},
        EnableRow{"OtherFlagBitsIgnored", [] { return Patched(AfBlock({}), 15, {6}); }, ovix::kSuccess},
        EnableRow{"TrailingBytes", [] { return Atom("OP01", moviekit::Concat({GoodPayload(), Bytes(5, 9)})); },
                  ovix::kSuccess},
        EnableRow{"ForeignFourBytes", [] { return Atom("OP01", {'A', 'B', 'C', 'D'}); }, ovix::kSuccess}),
    testsupport::ByName);

struct FaultRow {
    const char* name;
    void (*fault)(Script&);
    unsigned long end;
    std::string events;
};

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
                 "aAAAlLLLIONIONIONION"}), testsupport::ByName);

// Refused records and arguments start nothing; one session runs at a time. With its worker held in a callback,
// an abort from another thread shows at once, and of two simultaneous closes only one joins the worker.
TEST_F(OvixTest, RefusalsAbortAndTwoClosesFromOtherThreads)
{
    using A = TqovixAudioInformation;
    EXPECT_EQ(TqovixLibraryInitialize(), ovix::kFailure);
    Harness& harness = m_harness.emplace(Script{.afBlock = AfBlock({}), .zerosAfterEnd = true, .holdAt = {'O', 1}});
    // Widths and kinds of sample it does not take, and an exact rate that its own kHz contradict.
    const std::pair<unsigned long A::*, unsigned long> spoilt[] = {
        {&A::size, 40}, {&A::size, 56}, {&A::channels, 0}, {&A::channels, 9}, {&A::bitsPerSample, 8},
        {&A::bitsPerSample, 20}, {&A::bitsPerSample, 64}, {&A::floatingPoint, 1}, {&A::floatingPoint, 2},
        {&A::sampleRateHz, 47000}, {&A::sampleRate, 0}, {&A::sampleRate, 1ul << 40}, {&A::sampleCount, 0}};
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

using testsupport::MotorSpan;

// Spans in seconds of a track at `rate`.
std::vector<MotorSpan> At(uint32_t rate, const std::vector<std::pair<double, double>>& seconds)
{
    std::vector<MotorSpan> spans;
    for (const auto& [from, to] : seconds) {
        spans.push_back({static_cast<uint64_t>(from * rate), static_cast<uint64_t>(to * rate)});
    }
    return spans;
}

std::vector<ovix::DriveSpan> Drives(const std::vector<MotorSpan>& spans, float strength)
{
    std::vector<ovix::DriveSpan> drives;
    for (const MotorSpan& span : spans) {
        drives.push_back({span.start, span.end, strength});
    }
    return drives;
}

std::vector<moviekit::AfInterval> Intervals(const std::vector<MotorSpan>& spans, uint16_t strength)
{
    std::vector<moviekit::AfInterval> intervals;
    for (const MotorSpan& span : spans) {
        intervals.push_back({span.start, span.end, strength});
    }
    return intervals;
}

// The suppressor driven as the session drives it: appends of at most `delivery` frames as the
// look-ahead has room, final frames read back and released as soon as they are ready.
std::vector<int16_t> Suppress(const std::vector<int16_t>& input, uint64_t rate, unsigned channels,
                              const std::vector<ovix::DriveSpan>& spans, size_t delivery = kBlockFrames)
{
    const uint64_t frames = input.size() / channels;
    ovix::NoiseSuppressor suppressor(rate, channels, frames);
    suppressor.SetSpans(spans);
    std::vector<int16_t> out(input.size());
    uint64_t appended = 0, read = 0;
    const auto drain = [&] {
        const uint64_t ready = suppressor.Ready();
        if (ready > read) {
            suppressor.Read(read, ready - read, out.data() + read * channels);
            read = ready;
            suppressor.Release(read);
        }
    };
    while (appended < frames) {
        const uint64_t n = std::min<uint64_t>({delivery, frames - appended, suppressor.Room()});
        if (n == 0) {
            ADD_FAILURE() << "the look-ahead has no room at frame " << appended << " with " << read << " read";
            return {};
        }
        suppressor.Append(input.data() + appended * channels, n);
        appended += n;
        drain();
    }
    suppressor.Finish();
    drain();
    EXPECT_EQ(read, frames) << "frames never became final";
    return out;
}

// --- Intervals without an audible motor leave as they came.

struct UntouchedRow {
    const char* name;
    uint32_t rate;
    unsigned channels;
    std::vector<double> (*sound)(uint64_t frames, unsigned channels, uint32_t rate, const std::vector<MotorSpan>&);
};

class OvixUntouchedTest : public OvixTest, public ::testing::WithParamInterface<UntouchedRow> {};

// Nothing in the intervals is a motor to remove (what they hold is what their surroundings hold,
// however much that changes): the session gives back every sample as it came. (A motor kept at
// strength 0: the format test.)
TEST_P(OvixUntouchedTest, IntervalsWithoutAMotorToRemoveLeaveBitExact)
{
    const UntouchedRow& row = GetParam();
    const uint64_t frames = static_cast<uint64_t>(3.5 * row.rate);
    const std::vector<MotorSpan> spans = At(row.rate, {{1.0, 1.6}, {2.1, 2.4}});
    const std::vector<int16_t> input = testsupport::ToPcm(row.sound(frames, row.channels, row.rate, spans));
    const TqovixAudioInformation audio{sizeof(TqovixAudioInformation), row.rate / 1000, row.channels, 16, frames, 0, 0, 0, 0};
    ASSERT_EQ(Run({.afBlock = AfBlock(Intervals(spans, 1000), row.rate), .pcm = input, .channels = row.channels}, audio),
              ovix::kSessionFinished);
    const std::vector<int16_t>& out = m_harness->pushed;
    ASSERT_EQ(out.size(), input.size());
    EXPECT_TRUE(out == input) << testsupport::Decibels(testsupport::DifferenceEnergy(out, input, row.channels, 0, frames),
                                                       testsupport::Energy(input, row.channels, 0, frames))
                              << " dB of change";
}

std::vector<double> NoiseThroughout(uint64_t frames, unsigned channels, uint32_t, const std::vector<MotorSpan>&)
{
    return testsupport::Ambience(frames, channels, 2500.0);
}
std::vector<double> QuietNoiseThroughout(uint64_t frames, unsigned channels, uint32_t, const std::vector<MotorSpan>&)
{
    return testsupport::Ambience(frames, channels, 40.0, 9);
}
std::vector<double> ChordThroughout(uint64_t frames, unsigned channels, uint32_t rate, const std::vector<MotorSpan>&)
{
    return testsupport::Sum(testsupport::Chord(frames, channels, rate, 3000.0), testsupport::Ambience(frames, channels, 30.0));
}
std::vector<double> ChordOverNoise(uint64_t frames, unsigned channels, uint32_t rate, const std::vector<MotorSpan>&)
{
    return testsupport::Sum(testsupport::Chord(frames, channels, rate, 1500.0),
                            testsupport::Ambience(frames, channels, 1200.0));
}
// A talker: bursts of band-limited noise 80 to 250 ms long with pauses between them, far louder
// than the room; its steps at a drive's ends are larger than a quiet motor's would be.
std::vector<double> SyllablesThroughout(uint64_t frames, unsigned channels, uint32_t rate, const std::vector<MotorSpan>&)
{
    std::vector<double> out = testsupport::Ambience(frames, channels, 30.0);
    testsupport::WhiteNoise noise(11), timing(12);
    testsupport::BandPass voice(900.0, 0.7, rate);
    bool talking = true;
    uint64_t left = 0;
    for (uint64_t f = 0; f < frames; ++f) {
        if (left-- == 0) {
            talking = !talking;
            left = static_cast<uint64_t>((0.165 + 0.085 * timing.Next()) * rate);
        }
        const double value = voice.Step(noise.Next()) * (talking ? 6000.0 : 0.0);
        for (unsigned c = 0; c < channels; ++c) {
            out[f * channels + c] += value;
        }
    }
    return out;
}

INSTANTIATE_TEST_SUITE_P(
    Sounds, OvixUntouchedTest,
    ::testing::Values(UntouchedRow{"NoiseThroughoutStereo48k", 48000, 2, NoiseThroughout},
                      UntouchedRow{"QuietNoiseThroughoutMono44k", 44100, 1, QuietNoiseThroughout},
                      UntouchedRow{"ChordThroughoutStereo48k", 48000, 2, ChordThroughout},
                      UntouchedRow{"ChordOverNoiseSixChannels48k", 48000, 6, ChordOverNoise},
                      UntouchedRow{"SyllablesThroughoutMono48k", 48000, 1, SyllablesThroughout}), testsupport::ByName);

// One lens, one noise: a chord that plays just while a later drive runs rises there as a motor
// would, but nothing like what the lens made in the first drive; that interval stays as it came.
TEST(OvixWantedSoundTest, UnlikeTheLensHeardBeforeIsKept)
{
    constexpr uint32_t kRate48k = 48000;
    const uint64_t frames = static_cast<uint64_t>(3.5 * kRate48k);
    const std::vector<MotorSpan> spans = At(kRate48k, {{0.5, 1.1}, {1.9, 2.6}});
    std::vector<double> chord = testsupport::Chord(frames, 1, kRate48k, 1500.0);
    for (uint64_t f = 0; f < frames; ++f) {
        chord[f] = f >= spans[1].start && f < spans[1].end ? chord[f] : 0.0;
    }
    const std::vector<double> sound =
        testsupport::Sum(testsupport::Sum(chord, testsupport::Ambience(frames, 1, 60.0)),
                         testsupport::MotorNoise(frames, 1, kRate48k, {spans[0]}, 3000.0));
    const std::vector<int16_t> input = testsupport::ToPcm(sound);
    const std::vector<int16_t> out = Suppress(input, kRate48k, 1, Drives(spans, 1.0f));
    ASSERT_EQ(out.size(), input.size());
    EXPECT_LE(testsupport::Decibels(testsupport::Energy(out, 1, spans[0].start, spans[0].end),
                                    testsupport::Energy(input, 1, spans[0].start, spans[0].end)),
              -10.0)
        << "the lens's own drive";
    const uint64_t after = spans[0].end + kRate48k / 20;
    EXPECT_TRUE(std::equal(out.begin() + static_cast<ptrdiff_t>(after), out.end(), input.begin() + static_cast<ptrdiff_t>(after)))
        << testsupport::Decibels(testsupport::DifferenceEnergy(out, input, 1, after, frames),
                                 testsupport::Energy(input, 1, after, frames))
        << " dB of change after the first drive";
}

// --- One lens, one noise: what the drives show is judged together.

// What a drive's ends could show: `score` (the step in units of the wanted sound's own) over
// bins [from, to), nothing elsewhere.
ovix::IntervalEvidence& Shows(ovix::LensModel& lens, size_t span, size_t from, size_t to, float score)
{
    ovix::IntervalEvidence& evidence = lens.Record(span);
    evidence.judged = true;
    for (size_t k = from; k < to; ++k) {
        evidence.score[k] = score;
        evidence.weak[k] = score > 2.5f ? 1 : 0;
        evidence.step[k] = 1.0f / static_cast<float>(to - from);
        evidence.standing += score > 3.0f ? 1 : 0;
    }
    return evidence;
}

// A drive is believed on clear evidence of its own unless it is unlike what the lens made in an
// earlier drive; weaker evidence only where the lens showed itself in the same bins, in a drive
// before or after it; a drive with nothing around it to judge it by goes with the lens when it
// runs on from a drive that showed it.
TEST(OvixLensModelTest, DrivesAreJudgedTogether)
{
    constexpr size_t kBins = 64;
    ovix::LensModel lens(kBins, 2);
    Shows(lens, 0, 10, 20, 5.0f);
    EXPECT_TRUE(lens.Decide(0, 0)) << "clear evidence alone";

    lens.Reset();
    Shows(lens, 0, 10, 20, 2.7f);
    EXPECT_FALSE(lens.Decide(0, 0)) << "weak evidence alone";
    lens.Reset();
    Shows(lens, 0, 10, 20, 2.7f);
    Shows(lens, 1, 12, 24, 5.0f);
    EXPECT_TRUE(lens.Decide(0, 1)) << "weak evidence where a later drive shows the lens";
    EXPECT_TRUE(lens.Decide(1, 1));
    lens.Reset();
    Shows(lens, 0, 10, 20, 2.7f);
    Shows(lens, 1, 40, 50, 5.0f);
    EXPECT_FALSE(lens.Decide(0, 1)) << "weak evidence where the lens shows nothing";

    lens.Reset();
    Shows(lens, 0, 10, 20, 5.0f);
    Shows(lens, 1, 40, 50, 5.0f);
    EXPECT_TRUE(lens.Decide(0, 1));
    EXPECT_FALSE(lens.Decide(1, 1)) << "clear evidence unlike the lens before";

    lens.Reset();
    Shows(lens, 0, 10, 20, 5.0f);
    lens.Record(1).adjoins = true;
    EXPECT_TRUE(lens.Decide(0, 1));
    EXPECT_TRUE(lens.Decide(1, 1)) << "no surroundings, running on from a drive that showed the lens";
    lens.Reset();
    Shows(lens, 0, 10, 20, 5.0f);
    lens.Record(1);
    EXPECT_TRUE(lens.Decide(0, 1));
    EXPECT_FALSE(lens.Decide(1, 1)) << "no surroundings, apart from the drive that showed the lens";
    lens.Reset();
    lens.Record(0).adjoins = true;
    EXPECT_FALSE(lens.Decide(0, 0)) << "no surroundings and no lens";
}

// --- The motor goes, the wanted sound stays, and outside the intervals and their ramps nothing
// changes, wherever the intervals lie.

struct SceneRow {
    const char* name;
    unsigned long kiloHertz;
    uint32_t rate;  // what those kHz stand for
    unsigned channels;
    double seconds;  // the track's length
    std::vector<std::pair<double, double>> intervals;  // in seconds of the AF record
    int32_t startOffset = 0;  // frames the record's positions move by
    uint32_t recordRate = 0;  // the rate the AF record counts in; 0: the track's
    double motor = 3000.0, chord = 0.0, room = 50.0;  // RMS of motor and room; each note's amplitude
    double removedDb = -10.0;  // what every second of an interval loses in a scene without a chord
};

class OvixSceneTest : public OvixTest, public ::testing::WithParamInterface<SceneRow> {};

// Through the whole session: every frame outside the intervals widened by the 10 ms ramp is
// bit-exact, and every second of every interval (the segments of a long one included) loses at
// least `removedDb`; with a chord throughout, the chord keeps its level within 1 dB (its
// projection onto the clean chord) while what is left of the motor (output less the clean
// sound) is at least 10 dB down.
TEST_P(OvixSceneTest, MotorRemovedWantedSoundKeptOutsideBitExact)
{
    const SceneRow& row = GetParam();
    const uint32_t recordRate = row.recordRate != 0 ? row.recordRate : row.rate;
    const uint64_t frames = static_cast<uint64_t>(row.seconds * row.rate);
    std::vector<moviekit::AfInterval> intervals;
    std::vector<MotorSpan> spans;
    for (const auto& [from, to] : row.intervals) {
        const moviekit::AfInterval interval{static_cast<uint64_t>(std::llround(from * recordRate)),
                                            static_cast<uint64_t>(std::llround(to * recordRate)), 1000};
        intervals.push_back(interval);
        // Starts round down and ends up when the record counts in another rate.
        const int64_t start = static_cast<int64_t>(interval.startFrame * row.rate / recordRate) + row.startOffset;
        const int64_t end =
            static_cast<int64_t>((interval.endFrame * row.rate + recordRate - 1) / recordRate) + row.startOffset;
        spans.push_back({static_cast<uint64_t>(std::clamp<int64_t>(start, 0, static_cast<int64_t>(frames))),
                         static_cast<uint64_t>(std::clamp<int64_t>(end, 0, static_cast<int64_t>(frames)))});
    }
    const std::vector<double> chord = testsupport::Chord(frames, row.channels, row.rate, row.chord);
    const std::vector<double> clean = testsupport::Sum(chord, testsupport::Ambience(frames, row.channels, row.room));
    const std::vector<double> motor = testsupport::MotorNoise(frames, row.channels, row.rate, spans, row.motor);
    const std::vector<int16_t> input = testsupport::ToPcm(testsupport::Sum(clean, motor));
    const TqovixAudioInformation audio{sizeof(TqovixAudioInformation), row.kiloHertz, row.channels, 16, frames,
                                       static_cast<unsigned>(row.startOffset), 0, 0, 0};
    ASSERT_EQ(Run({.afBlock = AfBlock(intervals, recordRate), .pcm = input, .channels = row.channels}, audio),
              ovix::kSessionFinished);
    const std::vector<int16_t>& out = m_harness->pushed;
    ASSERT_EQ(out.size(), input.size());

    const uint64_t ramp = row.rate / 100;
    uint64_t strays = 0, firstStray = 0;
    for (uint64_t f = 0; f < frames; ++f) {
        const bool near = std::ranges::any_of(spans, [&](const MotorSpan& s) { return f + ramp >= s.start && f < s.end + ramp; });
        const auto at = static_cast<std::ptrdiff_t>(f * row.channels);
        if (!near && !std::equal(input.begin() + at, input.begin() + at + row.channels, out.begin() + at)) {
            firstStray = strays++ == 0 ? f : firstStray;
        }
    }
    EXPECT_EQ(strays, 0u) << "frames changed outside the intervals and their ramps, the first at " << firstStray;
    for (const MotorSpan& span : spans) {
        for (uint64_t from = span.start; from < span.end; from += row.rate) {
            const uint64_t to = std::min<uint64_t>(span.end, from + row.rate);
            SCOPED_TRACE("frames " + std::to_string(from) + " to " + std::to_string(to));
            if (row.chord == 0.0) {
                EXPECT_LE(testsupport::Decibels(testsupport::Energy(out, row.channels, from, to),
                                                testsupport::Energy(input, row.channels, from, to)),
                          row.removedDb);
                continue;
            }
            double along = 0.0, norm = 0.0;
            for (uint64_t k = from * row.channels; k < to * row.channels; ++k) {
                along += out[k] * chord[k];
                norm += chord[k] * chord[k];
            }
            EXPECT_NEAR(20.0 * std::log10(along / norm), 0.0, 1.0) << "the chord's level";
            EXPECT_LE(testsupport::Decibels(testsupport::DifferenceEnergy(out, clean, row.channels, from, to),
                                            testsupport::Energy(motor, row.channels, from, to)),
                      -10.0)
                << "the motor's residual against the motor";
        }
    }
}

const std::vector<std::pair<double, double>> kTwoDrives = {{1.0, 2.0}, {2.6, 3.2}};

INSTANTIATE_TEST_SUITE_P(
    Scenes, OvixSceneTest,
    ::testing::Values(
        SceneRow{"MotorInQuietStereo48k", 48, 48000, 2, 4.0, kTwoDrives, 0, 0, 3000.0, 0.0, 25.0, -20.0},
        SceneRow{"MotorInQuietMono44k", 44, 44100, 1, 4.0, kTwoDrives, 0, 0, 3000.0, 0.0, 25.0, -20.0},
        SceneRow{"SoftMotorInQuietSixChannels48k", 48, 48000, 6, 4.0, kTwoDrives, 0, 0, 800.0, 0.0, 25.0, -20.0},
        SceneRow{"LoudMotorOverChordMono44k", 44, 44100, 1, 4.0, kTwoDrives, 0, 0, 3000.0, 1000.0, 25.0},
        SceneRow{"AtTheStartMono44k", 44, 44100, 1, 3.0, {{0.0, 0.5}, {1.6, 2.0}}},
        SceneRow{"AtTheEndStereo48k", 48, 48000, 2, 3.0, {{0.8, 1.1}, {2.2, 3.0}}},
        SceneRow{"BackToBackSixChannels48k", 48, 48000, 6, 3.0, {{0.9, 1.3}, {1.3, 1.7}, {1.71, 2.1}}},
        SceneRow{"LongerThanASegmentStereo48k", 48, 48000, 2, 14.0, {{1.5, 13.0}}},
        SceneRow{"LongerThanASegmentSixChannels44k", 44, 44100, 6, 13.5, {{0.2, 0.6}, {1.5, 13.5}}},
        SceneRow{"ShiftedLaterStereo44k", 44, 44100, 2, 3.0, {{0.7, 1.2}, {2.0, 2.4}}, 333},
        SceneRow{"ShiftedEarlierRecordAt48kMono44k", 44, 44100, 1, 3.0, {{0.7, 1.2}, {2.0, 2.4}}, -250, 48000}),
    testsupport::ByName);

// --- Every format the track may hold: 16, 24 and 32-bit integers, 32 and 64-bit floats.

struct FormatRow {
    const char* name;
    unsigned bits;
    bool floating;
    double perStep;  // the format's own value of one 16-bit step
};

// A value in the format's own units, little-endian.
void PutSample(const FormatRow& f, uint8_t* at, double value)
{
    if (f.floating && f.bits == 32) {
        const auto v = static_cast<float>(value);
        std::memcpy(at, &v, 4);
    } else if (f.floating) {
        std::memcpy(at, &value, 8);
    } else {
        const auto v = static_cast<uint64_t>(std::llround(value));
        for (unsigned b = 0; b < f.bits / 8; ++b) {
            at[b] = static_cast<uint8_t>(v >> (8 * b));
        }
    }
}

double GetSample(const FormatRow& f, const uint8_t* at)
{
    if (f.floating && f.bits == 32) {
        float v;
        std::memcpy(&v, at, 4);
        return v;
    }
    if (f.floating) {
        double v;
        std::memcpy(&v, at, 8);
        return v;
    }
    uint64_t v = 0;
    for (unsigned b = 0; b < f.bits / 8; ++b) {
        v |= uint64_t{at[b]} << (8 * b);
    }
    const unsigned shift = 64 - f.bits;
    return static_cast<double>(static_cast<int64_t>(v << shift) >> shift);
}

Bytes Encoded(const FormatRow& f, const std::vector<int16_t>& samples)
{
    Bytes bytes(samples.size() * f.bits / 8);
    for (size_t k = 0; k < samples.size(); ++k) {
        PutSample(f, bytes.data() + k * f.bits / 8, samples[k] * f.perStep);
    }
    return bytes;
}

class OvixFormatTest : public OvixTest, public ::testing::WithParamInterface<FormatRow> {};

const FormatRow kFormats[] = {{"Int16", 16, false, 1.0}, {"Int24", 24, false, 256.0}, {"Int32", 32, false, 65536.0},
                              {"Float32", 32, true, 1.0 / 32768}, {"Float64", 64, true, 1.0 / 32768}};

// One sample at a time: levels on the 16-bit scale; integers rounded to nearest and held at
// full scale, floats never clipped; a sample nothing is taken from keeps its bytes, a NaN
// among them included, and is heard as silence.
TEST_P(OvixFormatTest, SamplesConvertRoundAndClipAsTheirFormatSays)
{
    const FormatRow& f = GetParam();
    const std::optional<ovix::SampleFormat> format = ovix::SampleFormat::Of(f.bits, f.floating);
    ASSERT_TRUE(format);
    const size_t width = f.bits / 8;
    const double top = f.floating ? 1.0 : std::ldexp(1.0, static_cast<int>(f.bits) - 1) - 1;
    const double bottom = f.floating ? -1.0 : -top - 1;
    Bytes frame(3 * width);
    const double values[] = {top, bottom, 10 * f.perStep};
    for (size_t c = 0; c < 3; ++c) {
        PutSample(f, frame.data() + c * width, values[c]);
    }
    const float window[] = {1.0f, 0.5f, 1.0f};
    float levels[3];
    format->LoadWindowed(frame.data(), width, 3, window, levels);
    EXPECT_NEAR(levels[0], top / f.perStep, 1e-3);
    EXPECT_NEAR(levels[1], 0.5 * bottom / f.perStep, 1e-3);
    EXPECT_NEAR(levels[2], 10.0, 1e-6);

    // 1000 steps added to full scale, 0.4 and 0.6 steps taken from 10 steps.
    const float removed[] = {-1000.0f, 1000.0f, 0.4f};
    Bytes out = frame;
    format->SubtractFromFrame(out.data(), 3, removed, 1.0f);
    const double rounded = f.floating ? 9.6 * f.perStep : std::round(9.6 * f.perStep);
    const double louder = top + 1000 * f.perStep;
    EXPECT_EQ(GetSample(f, out.data()), !f.floating ? top : f.bits == 32 ? static_cast<double>(static_cast<float>(louder)) : louder);
    EXPECT_LT(GetSample(f, out.data() + width), f.floating ? -1.0 : bottom + 1);
    EXPECT_GE(GetSample(f, out.data() + width), f.floating ? -2.0 : bottom);
    EXPECT_NEAR(GetSample(f, out.data() + 2 * width), rounded, f.floating ? 1e-6 * f.perStep : 0.0);
    const float more[] = {0.0f, 0.0f, 0.6f};
    out = frame;
    format->SubtractFromFrame(out.data(), 3, more, 1.0f);
    EXPECT_EQ(Bytes(out.begin(), out.begin() + 2 * static_cast<long>(width)), Bytes(frame.begin(), frame.begin() + 2 * static_cast<long>(width)));
    EXPECT_NEAR(GetSample(f, out.data() + 2 * width), f.floating ? 9.4 * f.perStep : std::round(9.4 * f.perStep),
                f.floating ? 1e-6 * f.perStep : 0.0);
    if (f.floating) {
        PutSample(f, frame.data(), std::nan(""));
        PutSample(f, frame.data() + width, -1e300);
        format->LoadWindowed(frame.data(), width, 2, window, levels);
        EXPECT_EQ(levels[0], 0.0f);
        EXPECT_TRUE(std::isfinite(levels[1]) && levels[1] < -32768.0f);
        out = frame;
        format->SubtractFromFrame(out.data(), 3, more, 1.0f);
        EXPECT_EQ(Bytes(out.begin(), out.begin() + static_cast<long>(width)), Bytes(frame.begin(), frame.begin() + static_cast<long>(width)));
    }
}

// The same sound in every format, through the whole session: outside the intervals and their
// ramps, and inside an interval of strength 0, every byte as it came; inside the others the
// 16-bit result to within half a 16-bit step, written back in the session's own format. The
// 16-bit row sends a record of the first layout, which ends before the float flag.
TEST_P(OvixFormatTest, EveryFormatGivesTheSixteenBitResultAtItsOwnPrecision)
{
    const FormatRow& f = GetParam();
    const uint64_t frames = 3 * kRate;
    const std::vector<MotorSpan> spans = At(kRate, {{0.5, 1.1}, {1.5, 1.9}, {2.2, 2.7}});
    const std::vector<int16_t> input = testsupport::ToPcm(testsupport::Sum(
        testsupport::Sum(testsupport::Chord(frames, 2, kRate, 500.0), testsupport::Ambience(frames, 2, 60.0)),
        testsupport::MotorNoise(frames, 2, kRate, spans, 2500.0)));
    std::vector<moviekit::AfInterval> intervals = Intervals(spans, 1000);
    intervals[1].strength = 0;
    // A drive of strength 0 is still the lens's drive: it is surveyed, only left as it came.
    std::vector<ovix::DriveSpan> drives = Drives(spans, 1.0f);
    drives[1].strength = 0.0f;
    const std::vector<int16_t> reference = Suppress(input, kRate, 2, drives);

    const Bytes sound = Encoded(f, input);
    const size_t width = f.bits / 8;
    TqovixAudioInformation audio = Audio(2, frames);
    audio.bitsPerSample = f.bits;
    audio.floatingPoint = f.floating ? 1 : 0;
    audio.sampleRateHz = kRate;
    if (f.bits == 16 && !f.floating) {
        audio.size = kOvixFirstAudioRecordSize;
    }
    ASSERT_EQ(Run({.afBlock = AfBlock(intervals), .channels = 2, .sound = sound, .frameBytes = 2 * width}, audio),
              ovix::kSessionFinished);
    const Bytes& out = m_harness->pushedSound;
    ASSERT_EQ(out.size(), sound.size());
    const uint64_t ramp = kRate / 100;
    uint64_t strays = 0, changed = 0, farOff = 0;
    for (uint64_t f0 = 0; f0 < frames; ++f0) {
        const bool processed = f0 + ramp >= spans[0].start && f0 < spans[0].end + ramp;
        const bool other = f0 + ramp >= spans[2].start && f0 < spans[2].end + ramp;
        for (size_t k = 2 * f0; k < 2 * f0 + 2; ++k) {
            const bool same = std::equal(out.begin() + static_cast<long>(k * width), out.begin() + static_cast<long>((k + 1) * width),
                                         sound.begin() + static_cast<long>(k * width));
            if (!processed && !other) {
                strays += same ? 0 : 1;
                continue;
            }
            changed += same ? 0 : 1;
            farOff += std::abs(GetSample(f, out.data() + k * width) / f.perStep - reference[k]) > (f.bits == 16 ? 0.0 : 0.51);
        }
    }
    EXPECT_EQ(strays, 0u) << "samples changed outside the processed intervals and their ramps";
    EXPECT_GT(changed, (spans[0].end - spans[0].start) / 2) << "the motor was not processed";
    EXPECT_EQ(farOff, 0u) << "samples further than half a 16-bit step from the 16-bit result";
}

INSTANTIATE_TEST_SUITE_P(Formats, OvixFormatTest, ::testing::ValuesIn(kFormats), testsupport::ByName);

// The look-ahead holds at most 32 MiB of the track's own bytes in every format; where that is
// not what binds, a deeper format holds as many frames as 16 bits do. Widths and kinds it does
// not know are no format.
TEST(OvixFormatBudget, DeeperSamplesKeepTheStoreWithinItsBudget)
{
    for (const FormatRow& f : kFormats) {
        for (const auto& [rate, channels] : {std::pair<uint64_t, unsigned>{48000, 2}, {192000, 8}}) {
            const ovix::NoiseSuppressor deep(rate, channels, rate, *ovix::SampleFormat::Of(f.bits, f.floating));
            const ovix::NoiseSuppressor shallow(rate, channels, rate);
            const uint64_t capacity = deep.Parameters().capacityFrames;
            EXPECT_LE(capacity * channels * f.bits / 8, 32u << 20) << f.name << " " << rate << " Hz " << channels;
            if (shallow.Parameters().capacityFrames * channels * f.bits / 8 <= (32u << 20)) {
                EXPECT_EQ(capacity, shallow.Parameters().capacityFrames) << f.name << " " << rate << " Hz " << channels;
            }
        }
    }
    for (const auto& [bits, floating] : {std::pair{8u, false}, {20u, false}, {64u, false}, {16u, true}, {24u, true}}) {
        EXPECT_FALSE(ovix::SampleFormat::Of(bits, floating)) << bits << (floating ? " float" : "");
    }
}

// --- The same bytes however the sound is delivered.

struct DeliveryRow {
    const char* name;
    std::vector<size_t> cycle;  // frames of successive deliveries, repeated
};

class OvixDeliveryTest : public OvixTest, public ::testing::WithParamInterface<DeliveryRow> {};

// Two runs through the session push what the suppressor gives in whole blocks, byte for byte
// (the motor removed, the last interval running to the track's end), in the pulled blocks' sizes
// and order: some only after later pulls, the truncated last one with its piece of a frame.
// Progress never goes back and ends at the sample count the host gave.
TEST_P(OvixDeliveryTest, SameBytesWhateverTheDeliverySizes)
{
    const uint64_t frames = 2 * kRate;
    const unsigned long count = frames + 10;
    const std::vector<MotorSpan> spans = At(kRate, {{0.4, 0.9}, {0.95, 1.2}, {1.6, 2.0}});
    const std::vector<int16_t> input = testsupport::ToPcm(testsupport::Sum(
        testsupport::Sum(testsupport::Chord(frames, 2, kRate, 600.0), testsupport::Ambience(frames, 2, 80.0)),
        testsupport::MotorNoise(frames, 2, kRate, spans, 2500.0)));
    const std::vector<int16_t> reference = Suppress(input, kRate, 2, Drives(spans, 1.0f));
    ASSERT_EQ(reference.size(), input.size());
    ASSERT_LT(testsupport::Decibels(testsupport::Energy(reference, 2, spans[0].start, spans[0].end),
                                    testsupport::Energy(input, 2, spans[0].start, spans[0].end)),
              -3.0)
        << "the motor was not processed";
    Script script{.afBlock = AfBlock(Intervals(spans, 1000)), .pcm = input, .deliveryCycle = GetParam().cycle};
    script.pcm.push_back(1234);  // one sample of a stereo frame
    for (const char* run : {"first run", "second run"}) {
        SCOPED_TRACE(run);
        ASSERT_EQ(Run(script, Audio(2, count)), ovix::kSessionFinished);
        const Harness& h = *m_harness;
        std::vector<size_t> pulled = h.pulledBytes;
        std::erase(pulled, 0);
        EXPECT_EQ(h.pushedBytes, pulled);
        EXPECT_EQ(pulled.back() % 4, 2u) << "the stream ends in a piece of a frame";
        EXPECT_NE(h.events.find("II"), std::string::npos) << "the suppressor never held a block back";
        ASSERT_EQ(h.pushed.size(), input.size() + 1);
        EXPECT_TRUE(std::equal(reference.begin(), reference.end(), h.pushed.begin())) << "the whole frames";
        EXPECT_EQ(h.pushed.back(), 1234);
        ASSERT_FALSE(h.notes.empty());
        EXPECT_TRUE(std::ranges::is_sorted(h.notes, {}, &Note::done)) << "progress went back";
        EXPECT_EQ(h.notes.back().done, count);
        EXPECT_TRUE(std::ranges::all_of(h.notes, [&](const Note& n) { return n.total == count; }));
    }
}

INSTANTIATE_TEST_SUITE_P(Deliveries, OvixDeliveryTest,
                         ::testing::Values(DeliveryRow{"OneFrame", {1}}, DeliveryRow{"SevenFrames", {7}},
                                           DeliveryRow{"ThousandFrames", {1000}}, DeliveryRow{"WholeBlocks", {1024}},
                                           DeliveryRow{"Mixed", {1024, 1, 333, 7, 1000, 64, 1023}},
                                           DeliveryRow{"Lagging", {1024, 300, 1, 777, 1024, 1024}}),
                         testsupport::ByName);

// --- Blocks allocate nothing, and the look-ahead stays within its budget.

struct BudgetRow {
    const char* name;
    uint32_t rate;
    unsigned channels;
    double seconds;
    std::vector<std::pair<double, double>> intervals;
};

class OvixBudgetTest : public ::testing::TestWithParam<BudgetRow> {};

// Sound made block by block (no track held in the test), appended in odd sizes: after the
// constructor and SetSpans, appending, reading, releasing and finishing allocate nothing; the
// store never exceeds 32 MiB, yet an interval longer than it holds is processed to its end.
TEST_P(OvixBudgetTest, BlocksAllocateNothingWithinTheBudget)
{
    const BudgetRow& row = GetParam();
    const uint64_t frames = static_cast<uint64_t>(row.seconds * row.rate);
    const unsigned channels = row.channels;
    const std::vector<MotorSpan> spans = At(row.rate, row.intervals);
    ovix::NoiseSuppressor suppressor(row.rate, channels, frames);
    suppressor.SetSpans(Drives(spans, 1.0f));
    EXPECT_LE(suppressor.Parameters().capacityFrames * channels * sizeof(int16_t), 32u << 20);

    const size_t delivery = 1000;
    std::vector<int16_t> block(delivery * channels), out(kBlockFrames * channels);
    testsupport::WhiteNoise noise(5);
    double phase = 0.0;
    const auto inside = [&](uint64_t f) { return std::ranges::any_of(spans, [&](const MotorSpan& s) { return f >= s.start && f < s.end; }); };
    std::vector<double> before(spans.size()), after(spans.size());
    const auto add = [&](std::vector<double>& energy, uint64_t first, const int16_t* samples, uint64_t count) {
        for (uint64_t f = 0; f < count; ++f) {
            for (size_t s = 0; s < spans.size(); ++s) {
                if (first + f >= spans[s].start && first + f < spans[s].end) {
                    for (unsigned c = 0; c < channels; ++c) {
                        energy[s] += std::pow(samples[f * channels + c], 2);
                    }
                }
            }
        }
    };
    uint64_t appended = 0, read = 0;
    bool stalled = false;
    const auto drain = [&] {
        for (const uint64_t ready = suppressor.Ready(); read < ready;) {
            const uint64_t n = std::min<uint64_t>(kBlockFrames, ready - read);
            suppressor.Read(read, n, out.data());
            add(after, read, out.data(), n);
            read += n;
            suppressor.Release(read);
        }
    };
    t_allocations = 0;
    t_countAllocations = true;
    while (appended < frames && !stalled) {
        const uint64_t n = std::min<uint64_t>({delivery, frames - appended, suppressor.Room()});
        stalled = n == 0;
        for (uint64_t f = 0; f < n; ++f) {
            // A whine sweeping with the drive and hiss inside the intervals, quiet noise outside.
            const double rise = static_cast<double>((appended + f) % row.rate) / row.rate;
            phase += 2.0 * std::numbers::pi * (400.0 + 900.0 * rise) / row.rate;
            const double motor = inside(appended + f) ? 3000.0 * std::sin(phase) + 1500.0 * noise.Next() : 0.0;
            for (unsigned c = 0; c < channels; ++c) {
                block[f * channels + c] = static_cast<int16_t>(std::lrint(motor + 40.0 * noise.Next()));
            }
        }
        add(before, appended, block.data(), n);
        suppressor.Append(block.data(), n);
        appended += n;
        drain();
    }
    suppressor.Finish();
    drain();
    t_countAllocations = false;
    EXPECT_EQ(t_allocations, 0u) << "allocations while processing blocks";
    ASSERT_FALSE(stalled) << "the look-ahead had no room at frame " << appended;
    EXPECT_EQ(read, frames);
    for (size_t s = 0; s < spans.size(); ++s) {
        EXPECT_LE(testsupport::Decibels(after[s], before[s]), -10.0) << "interval " << s;
    }
}

INSTANTIATE_TEST_SUITE_P(
    Formats, OvixBudgetTest,
    ::testing::Values(BudgetRow{"Stereo48kLongInterval", 48000, 2, 14.0, {{0.5, 1.0}, {1.5, 13.5}}},
                      BudgetRow{"SixChannels44k", 44100, 6, 4.0, {{0.0, 0.7}, {1.0, 1.5}, {3.0, 4.0}}},
                      BudgetRow{"EightChannels192kHeldToTheBudget", 192000, 8, 11.5, {{0.5, 11.0}}}),
    testsupport::ByName);

// --- The session over a suppressor that holds sound back.

// An abort inside a pull, or a close from another thread while the worker sits in one, with
// sound held back: the worker calls nothing more (no push, no end notification), closing joins it.
TEST_F(OvixTest, AbortOrCloseWhileSoundIsHeld)
{
    for (const bool closing : {false, true}) {
        SCOPED_TRACE(closing ? "close" : "abort");
        const std::vector<MotorSpan> spans = At(kRate, {{0.5, 1.3}, {2.0, 3.0}});
        Script script{.afBlock = AfBlock(Intervals(spans, 1000)),
                      .pcm = testsupport::ToPcm(testsupport::Sum(testsupport::Ambience(3 * kRate, 2, 100.0),
                                                                 testsupport::MotorNoise(3 * kRate, 2, kRate, spans, 3000.0))),
                      .deliveryCycle = {1024}};
        (closing ? script.holdAt : script.abortAt) = {'I', 70};  // 1.4 s: the first interval's sound and its surroundings held
        Harness& h = m_harness.emplace(std::move(script));
        ASSERT_EQ(TqovixOpenSession(Audio(2, 3 * kRate), kTrim), ovix::kSuccess);
        std::atomic<unsigned long> closed{~0ul};
        if (closing) {
            ASSERT_TRUE(h.gate.WaitArrived());
            std::thread closer([&] { closed = TqovixCloseSession(0); });
            EXPECT_TRUE(WaitFor([] { return TqovixIsSessionFinished() == ovix::kAborted; }));
            h.gate.open = true;
            // Joinable threads left behind end the process rather than hang it.
            ASSERT_TRUE(WaitFor([&] { return closed != ~0ul; }));
            closer.join();
        } else {
            EXPECT_TRUE(WaitFor([] { return TqovixIsSessionFinished() == ovix::kAborted; }));
            closed = TqovixCloseSession(0);
        }
        EXPECT_EQ(closed.load(), ovix::kSuccess);
        EXPECT_EQ(TqovixIsSessionFinished(), ovix::kFailure);
        EXPECT_EQ(h.events.back(), 'I');
        EXPECT_EQ(std::ranges::count(h.events, 'I'), 71);
        EXPECT_LT(h.pushedBytes.size() + 20, h.pulledBytes.size()) << "sound should have been held back";
        EXPECT_TRUE(std::ranges::all_of(h.notes, [](const Note& n) { return n.state == 0; })) << "no end notification";
    }
}

}  // namespace
