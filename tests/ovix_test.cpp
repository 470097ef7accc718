// The processing library driven directly, with the harness playing the system's side.
#include <gtest/gtest.h>

#include <ovix/Ovix.h>

#include "ByteWriter.h"
#include "MakerData.h"
#include "support/OvixHarness.h"
#include "support/TestSupport.h"

#include <cmath>
#include <functional>
#include <numbers>
#include <random>
#include <set>
#include <sstream>

using moviekit::AfInterval;
using moviekit::Atom;
using ovixtest::Bytes;
using ovixtest::Gate;
using ovixtest::Harness;
using ovixtest::Note;
using ovixtest::Script;
using ovixtest::WaitFor;

namespace {

constexpr unsigned long kBlockFrames = 1024;

Bytes AfBlock(const std::vector<AfInterval>& intervals, uint32_t rate = 48000, bool processed = false)
{
    return Atom("OP01", moviekit::MakeAfInformation(rate, intervals, processed));
}

Bytes ForeignAfBlock()
{
    return Atom("OP01", Bytes{'X', 'Q', 'Z', '7', 1, 2, 3, 4, 5, 6, 7, 8});
}

Bytes WithProcessedFlag(Bytes block)
{
    block[15] |= 1;
    return block;
}

TqovixAudioInformation AudioRecord(unsigned long rateKiloHertz, unsigned long channels, unsigned long sampleCount,
                                   unsigned int startOffset = 0)
{
    return {sizeof(TqovixAudioInformation), rateKiloHertz, channels, 16, sampleCount, startOffset, 0};
}

TqovixTrimInformation TrimRecord()
{
    return {sizeof(TqovixTrimInformation), 30000, 1001, 0, 0};
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

// Opens a session on the harness's callbacks, lets it end, closes it. Harness and gate live in
// the fixture, so that they outlive a worker still running when an assertion fails.
template <typename Base>
class WithLibrary : public Base {
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

    Harness& Play(Script script)
    {
        m_harness.reset();
        m_harness.emplace(std::move(script));
        return *m_harness;
    }

    // The end state as TqovixIsSessionFinished reported it before closing.
    unsigned long Run(const TqovixAudioInformation& audio)
    {
        EXPECT_EQ(TqovixOpenSession(audio, TrimRecord()), ovix::kSuccess);
        unsigned long state = 0;
        EXPECT_TRUE(WaitFor([&] { return (state = TqovixIsSessionFinished()) != 0; }));
        EXPECT_EQ(TqovixCloseSession(0), ovix::kSuccess);
        return state;
    }

    std::vector<int16_t> Process(const Bytes& af, std::vector<int16_t> pcm, unsigned channels,
                                 unsigned long rateKiloHertz = 48, unsigned int startOffset = 0)
    {
        const unsigned long frames = pcm.size() / channels;
        Script script;
        script.afBlock = af;
        script.pcm = std::move(pcm);
        script.channels = channels;
        Harness& harness = Play(std::move(script));
        EXPECT_EQ(Run(AudioRecord(rateKiloHertz, channels, frames, startOffset)), ovix::kSessionFinished);
        return harness.pushed;
    }

    Gate m_gate;
    std::optional<Harness> m_harness;
};

using OvixTest = WithLibrary<::testing::Test>;

template <typename Row>
std::string RowName(const ::testing::TestParamInfo<Row>& info)
{
    return info.param.name;
}

// Failures name the row instead of dumping its bytes.
template <typename Row>
    requires requires(const Row& row) { row.name; }
void PrintTo(const Row& row, std::ostream* out)
{
    *out << row.name;
}

std::string Repeat(const std::string& text, size_t times)
{
    std::string out;
    for (size_t i = 0; i < times; ++i) {
        out += text;
    }
    return out;
}

size_t Pieces(size_t size, unsigned long limit)
{
    return (size + limit - 1) / limit;
}

// ---- exported interface ----

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
        const size_t name = line.find(' ', line.find(' ') + 1);
        ASSERT_NE(name, std::string::npos) << line;
        exported.insert(line.substr(name + 1));
    }
    const std::string input = "unsigned long (*)(void*, unsigned long*, unsigned long, unsigned long)";
    const std::set<std::string> expected = {
        "TqovixLibraryInitialize()",
        "TqovixLibraryClose()",
        "TqovixIsEnable(void*, unsigned long)",
        "TqovixOpenSession(TqovixAudioInformation const&, TqovixTrimInformation const&)",
        "TqovixIsSessionFinished()",
        "TqovixGetProcessedAFInfo(void*, unsigned long, unsigned long*)",
        "TqovixAbortSession()",
        "TqovixCloseSession(unsigned long)",
        "TqovixSetCallbackInputAFInformation(" + input + ")",
        "TqovixSetCallbackInputAudioLevelInformation(" + input + ")",
        "TqovixSetCallbackInputAudio(" + input + ")",
        "TqovixSetCallbackOutputAudio(unsigned long (*)(void*, unsigned long))",
        "TqovixSetCallbackNotifyProgress(void (*)(unsigned long, unsigned long))",
    };
    EXPECT_EQ(exported, expected);
}

// ---- verdicts ----

struct VerdictRow {
    std::string name;
    Bytes block;
    unsigned long verdict;
};

Bytes Payload(uint16_t version, uint16_t flags, uint32_t count, const std::vector<std::pair<uint64_t, uint64_t>>& entries)
{
    Bytes out;
    moviekit::PutType(out, "AFR1");
    moviekit::PutU16(out, version);
    moviekit::PutU16(out, flags);
    moviekit::PutU32(out, 48000);
    moviekit::PutU32(out, count);
    for (const auto& [start, end] : entries) {
        moviekit::PutU64(out, start);
        moviekit::PutU64(out, end);
        moviekit::PutU16(out, 1000);
        moviekit::PutU16(out, 0);
    }
    return out;
}

Bytes Truncated(Bytes bytes, size_t size)
{
    bytes.resize(size);
    return bytes;
}

std::vector<VerdictRow> VerdictRows()
{
    const Bytes good = Payload(1, 0, 2, {{100, 200}, {200, 300}});
    return {
        {"EmptyBlock", {}, ovix::kVerdictNotAfBlock},
        {"ShorterThanHeader", {0, 0, 0, 6, 'O', 'P'}, ovix::kVerdictNotAfBlock},
        {"SizeFieldDiffers", Atom("OP01", good, {false, true, 99}), ovix::kVerdictNotAfBlock},
        {"WrongType", Atom("OP02", good), ovix::kVerdictNotAfBlock},
        {"EmptyPayload", Atom("OP01", {}), ovix::kVerdictNoAfInformation},
        {"ThreeBytePayload", Atom("OP01", {'A', 'F', 'R'}), ovix::kVerdictNoAfInformation},
        {"UnknownVersion", Atom("OP01", Payload(2, 0, 0, {})), ovix::kVerdictMalformed},
        {"TruncatedHeader", Atom("OP01", Truncated(good, 10)), ovix::kVerdictMalformed},
        {"TableRunsPastEnd", Atom("OP01", Payload(1, 0, 3, {{1, 2}, {3, 4}})), ovix::kVerdictMalformed},
        {"CountNearFourGiga", Atom("OP01", Payload(1, 0, 0xFFFFFFFFu, {{1, 2}})), ovix::kVerdictMalformed},
        {"TableCutMidEntry", Atom("OP01", Truncated(good, good.size() - 1)), ovix::kVerdictMalformed},
        {"Unsorted", Atom("OP01", Payload(1, 0, 2, {{500, 600}, {100, 200}})), ovix::kVerdictMalformed},
        {"Overlapping", Atom("OP01", Payload(1, 0, 2, {{100, 300}, {200, 400}})), ovix::kVerdictMalformed},
        {"EndBeforeStart", Atom("OP01", Payload(1, 0, 1, {{300, 100}})), ovix::kVerdictMalformed},
        {"AlreadyProcessed", Atom("OP01", Payload(1, 1, 2, {{100, 200}, {200, 300}})), ovix::kVerdictAlreadyProcessed},
        {"TouchingIntervals", Atom("OP01", good), ovix::kSuccess},
        {"EmptyInterval", Atom("OP01", Payload(1, 0, 1, {{100, 100}})), ovix::kSuccess},
        {"NoIntervals", AfBlock({}), ovix::kSuccess},
        {"OtherFlagBitsIgnored", Atom("OP01", Payload(1, 6, 0, {})), ovix::kSuccess},
        {"TrailingBytes", Atom("OP01", moviekit::Concat({good, Bytes(5, 9)})), ovix::kSuccess},
        {"ForeignFourBytes", Atom("OP01", {'A', 'B', 'C', 'D'}), ovix::kSuccess},
        {"ForeignPayload", ForeignAfBlock(), ovix::kSuccess},
    };
}

class OvixVerdict : public WithLibrary<::testing::TestWithParam<VerdictRow>> {};

TEST_P(OvixVerdict, IsEnableJudgesTheBlock)
{
    Bytes block = GetParam().block;
    EXPECT_EQ(TqovixIsEnable(block.empty() ? nullptr : block.data(), block.size()), GetParam().verdict);
}

// A refused block ends the session before any audio moves, with one notification that
// already sees the verdict; an accepted one runs to the end.
TEST_P(OvixVerdict, SessionEndsWithTheVerdict)
{
    Script script;
    script.afBlock = GetParam().block;
    script.pcm = Pattern(1500, 2);
    script.infoPieceLimit = 8;
    Harness& harness = Play(std::move(script));
    const unsigned long state = Run(AudioRecord(48, 2, 1500));
    const std::string reads = "a" + Repeat("A", Pieces(GetParam().block.size(), 8));
    if (GetParam().verdict == ovix::kSuccess) {
        EXPECT_EQ(state, ovix::kSessionFinished);
        EXPECT_EQ(harness.events, reads + "l" + Repeat("ION", 2) + "N");
        return;
    }
    EXPECT_EQ(state, GetParam().verdict);
    EXPECT_EQ(harness.events, reads + "N");
    ASSERT_EQ(harness.notes.size(), 1u);
    EXPECT_EQ(harness.notes[0].done, 0u);
    EXPECT_EQ(harness.notes[0].total, 1500u);
    EXPECT_EQ(harness.notes[0].state, GetParam().verdict);
    EXPECT_TRUE(harness.processedAtEnd.empty());
}

INSTANTIATE_TEST_SUITE_P(Blocks, OvixVerdict, ::testing::ValuesIn(VerdictRows()), RowName<VerdictRow>);

TEST(OvixIsEnable, NullBlockWithASizeIsRefused)
{
    EXPECT_EQ(TqovixIsEnable(nullptr, 100), ovix::kVerdictNotAfBlock);
}

// ---- the session's flow ----

struct FlowRow {
    std::string name;
    unsigned channels;
    size_t dataFrames;
    unsigned long sampleCount;
    bool zerosAfterEnd;
    unsigned long infoPieceLimit;
    bool withLevel;
    bool foreign;
};

class OvixFlow : public WithLibrary<::testing::TestWithParam<FlowRow>> {};

TEST_P(OvixFlow, PullsPushesAndNotifiesInOrder)
{
    const FlowRow& row = GetParam();
    const Bytes af = row.foreign ? ForeignAfBlock() : AfBlock({});
    const Bytes level = Atom("OP02", moviekit::MakeAudioLevel(-1250));
    Script script;
    script.afBlock = af;
    if (row.withLevel) {
        script.levelBlock = level;
    }
    script.pcm = Pattern(row.dataFrames, row.channels);
    script.channels = row.channels;
    script.zerosAfterEnd = row.zerosAfterEnd;
    script.infoPieceLimit = row.infoPieceLimit;
    Harness& harness = Play(script);

    EXPECT_EQ(Run(AudioRecord(48, row.channels, row.sampleCount)), ovix::kSessionFinished);

    // What the system delivers: the data up to the sample count, zero-padded for AAC.
    const size_t frames = row.zerosAfterEnd ? row.sampleCount : std::min<size_t>(row.dataFrames, row.sampleCount);
    std::vector<int16_t> expected(script.pcm.begin(), script.pcm.begin() + std::min(frames, row.dataFrames) * row.channels);
    expected.resize(frames * row.channels, 0);
    EXPECT_EQ(harness.pushed, expected);

    const size_t blocks = Pieces(frames, kBlockFrames);
    const bool endsByEmptyDelivery = frames < row.sampleCount;
    const std::string levelEvents = row.withLevel ? "l" + Repeat("L", Pieces(level.size(), row.infoPieceLimit)) : "l";
    EXPECT_EQ(harness.events, "a" + Repeat("A", Pieces(af.size(), row.infoPieceLimit)) + levelEvents +
                                  Repeat("ION", blocks) + (endsByEmptyDelivery ? "I" : "") + "N");

    std::vector<unsigned long> requests;
    std::vector<Note> notes;
    for (size_t done = 0; done < frames; done += kBlockFrames) {
        requests.push_back(std::min<unsigned long>(kBlockFrames, row.sampleCount - done) * row.channels * 2);
        notes.push_back({std::min<unsigned long>(done + kBlockFrames, frames), row.sampleCount, 0});
    }
    if (endsByEmptyDelivery) {
        requests.push_back(std::min<unsigned long>(kBlockFrames, row.sampleCount - frames) * row.channels * 2);
    }
    notes.push_back({row.sampleCount, row.sampleCount, ovix::kSessionFinished});
    EXPECT_EQ(harness.audioRequests, requests);
    ASSERT_EQ(harness.notes.size(), notes.size());
    for (size_t i = 0; i < notes.size(); ++i) {
        EXPECT_EQ(harness.notes[i].done, notes[i].done) << "notification " << i;
        EXPECT_EQ(harness.notes[i].total, notes[i].total) << "notification " << i;
        EXPECT_EQ(harness.notes[i].state, notes[i].state) << "notification " << i;
    }
    EXPECT_EQ(harness.processedAtEnd, row.foreign ? af : WithProcessedFlag(af));
}

INSTANTIATE_TEST_SUITE_P(
    Feeds, OvixFlow,
    ::testing::Values(FlowRow{"StereoPcmShortLastBlock", 2, 5000, 5000, false, 1024, false, false},
                      FlowRow{"MonoPcmEndsAtEmptyDelivery", 1, 3000, 4096, false, 7, true, false},
                      FlowRow{"PcmWholeBlocksEndsAtEmptyDelivery", 2, 2048, 9000, false, 1024, false, true},
                      FlowRow{"SixChannelAacStopsAtSampleCount", 6, 2500, 3000, true, 5, true, false},
                      FlowRow{"EightChannelAacShortTrack", 8, 100, 1500, true, 1024, false, true},
                      FlowRow{"SingleFrame", 2, 1, 1, false, 3, false, false}),
    RowName<FlowRow>);

// ---- failures, aborts and closing ----

struct FaultRow {
    std::string name;
    std::function<void(Script&)> fault;
    std::string events;
    unsigned long done;  // frames reported in the one notification after the failure
};

class OvixFault : public WithLibrary<::testing::TestWithParam<FaultRow>> {};

// AF block of 24 bytes read in 8-byte pieces, a level block of 20 bytes, 6000 frames.
TEST_P(OvixFault, FailedCallbackEndsWithOneNotification)
{
    Script script;
    script.afBlock = AfBlock({});
    script.levelBlock = Atom("OP02", moviekit::MakeAudioLevel(0));
    script.pcm = Pattern(6000, 2);
    script.infoPieceLimit = 8;
    GetParam().fault(script);
    Harness& harness = Play(std::move(script));

    EXPECT_EQ(Run(AudioRecord(48, 2, 6000)), ovix::kFailure);
    EXPECT_EQ(harness.events, GetParam().events);
    ASSERT_FALSE(harness.notes.empty());
    const Note& last = harness.notes.back();
    EXPECT_EQ(last.done, GetParam().done);
    EXPECT_EQ(last.total, 6000u);
    EXPECT_EQ(last.state, ovix::kFailure);
    for (size_t i = 0; i + 1 < harness.notes.size(); ++i) {
        EXPECT_EQ(harness.notes[i].state, 0u);
    }
}

INSTANTIATE_TEST_SUITE_P(
    Callbacks, OvixFault,
    ::testing::Values(
        FaultRow{"AfSizeQueryFails", [](Script& s) { s.failOn = 'a'; }, "aN", 0},
        FaultRow{"AfReadFails", [](Script& s) { s.failOn = 'A'; s.failOrdinal = 1; }, "aAAN", 0},
        FaultRow{"AfLargerThanAccepted", [](Script& s) { s.afSizeOverride = (16ul << 20) + 1; }, "aN", 0},
        FaultRow{"AfShorterThanAnnounced", [](Script& s) { s.afSizeOverride = 40; }, "aAAAAN", 0},
        FaultRow{"LevelSizeQueryFails", [](Script& s) { s.failOn = 'l'; }, "aAAAlN", 0},
        FaultRow{"LevelReadFails", [](Script& s) { s.failOn = 'L'; s.failOrdinal = 2; }, "aAAAlLLLN", 0},
        FaultRow{"AudioPullFails", [](Script& s) { s.failOn = 'I'; s.failOrdinal = 3; },
                 "aAAAlLLL" + Repeat("ION", 3) + "IN", 3072},
        FaultRow{"AudioPushFails", [](Script& s) { s.failOn = 'O'; s.failOrdinal = 2; },
                 "aAAAlLLL" + Repeat("ION", 2) + "ION", 2048},
        FaultRow{"AudioOverDelivers", [](Script& s) { s.overDeliver = true; }, "aAAAlLLLIN", 0}),
    RowName<FaultRow>);

struct AbortRow {
    std::string name;
    char event;
    int ordinal;
    std::string events;
};

class OvixAbortInside : public WithLibrary<::testing::TestWithParam<AbortRow>> {};

// The worker stops before its next callback and sends no notification.
TEST_P(OvixAbortInside, StopsBeforeTheNextCallback)
{
    Script script;
    script.afBlock = AfBlock({{100, 5000, 1000}});
    script.pcm = Pattern(8000, 2);
    script.abortOn = GetParam().event;
    script.abortOrdinal = GetParam().ordinal;
    Harness& harness = Play(std::move(script));

    EXPECT_EQ(Run(AudioRecord(48, 2, 8000)), ovix::kAborted);
    EXPECT_EQ(harness.events, GetParam().events);
    for (const Note& note : harness.notes) {
        EXPECT_EQ(note.total, 8000u);
        EXPECT_LT(note.done, 8000u);
    }
}

INSTANTIATE_TEST_SUITE_P(Callbacks, OvixAbortInside,
                         ::testing::Values(AbortRow{"AfSizeQuery", 'a', 0, "a"}, AbortRow{"LevelQuery", 'l', 0, "aAl"},
                                           AbortRow{"FirstPull", 'I', 0, "aAlI"},
                                           AbortRow{"ThirdPush", 'O', 2, "aAl" + Repeat("ION", 2) + "IO"},
                                           AbortRow{"FourthNotification", 'N', 3, "aAl" + Repeat("ION", 4)}),
                         RowName<AbortRow>);

TEST_F(OvixTest, AbortFromAnotherThreadWhileWorkerIsInsideACallback)
{
    Script script;
    script.afBlock = AfBlock({});
    script.pcm = Pattern(8000, 2);
    script.holdOn = 'O';
    script.holdOrdinal = 1;
    script.gate = &m_gate;
    Harness& harness = Play(std::move(script));

    ASSERT_EQ(TqovixOpenSession(AudioRecord(48, 2, 8000), TrimRecord()), ovix::kSuccess);
    ASSERT_TRUE(m_gate.WaitArrived());
    EXPECT_EQ(TqovixIsSessionFinished(), 0u);
    EXPECT_EQ(TqovixAbortSession(), ovix::kSuccess);
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kAborted);
    m_gate.Open();
    EXPECT_EQ(TqovixCloseSession(ovix::kAborted), ovix::kSuccess);
    EXPECT_EQ(harness.events, "aAlIONIO");
    EXPECT_EQ(harness.notes.size(), 1u);
}

// Only one of two simultaneous closes joins the worker; the other is refused at once.
TEST_F(OvixTest, CloseSessionTwiceAtOnce)
{
    Script script;
    script.afBlock = AfBlock({});
    script.pcm = Pattern(8000, 2);
    script.holdOn = 'O';
    script.gate = &m_gate;
    Harness& harness = Play(std::move(script));

    ASSERT_EQ(TqovixOpenSession(AudioRecord(48, 2, 8000), TrimRecord()), ovix::kSuccess);
    ASSERT_TRUE(m_gate.WaitArrived());
    std::atomic<unsigned long> first{~0ul};
    std::atomic<unsigned long> second{~0ul};
    std::thread a([&] { first = TqovixCloseSession(0); });
    std::thread b([&] { second = TqovixCloseSession(0); });
    // The worker is held, so whichever close claimed the session is still joining.
    EXPECT_TRUE(WaitFor([&] { return first == ovix::kFailure || second == ovix::kFailure; }));
    m_gate.Open();
    a.join();
    b.join();
    EXPECT_EQ(std::multiset<unsigned long>({first, second}), std::multiset<unsigned long>({ovix::kSuccess, ovix::kFailure}));
    EXPECT_EQ(harness.events, "aAlIO");
    EXPECT_TRUE(harness.notes.empty());
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kFailure);
    EXPECT_EQ(TqovixCloseSession(0), ovix::kFailure);
}

TEST_F(OvixTest, LibraryCloseEndsARunningSession)
{
    Script script;
    script.afBlock = AfBlock({{0, 1ul << 40, 700}});
    script.zerosAfterEnd = true;
    Harness& harness = Play(std::move(script));

    ASSERT_EQ(TqovixOpenSession(AudioRecord(48, 2, 1ul << 40), TrimRecord()), ovix::kSuccess);
    ASSERT_TRUE(WaitFor([&] { return harness.notifications >= 3; }));
    EXPECT_EQ(TqovixLibraryClose(), ovix::kSuccess);
    const size_t events = harness.events.size();
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kFailure);
    EXPECT_EQ(TqovixOpenSession(AudioRecord(48, 2, 100), TrimRecord()), ovix::kFailure);
    EXPECT_EQ(harness.events.size(), events);
    for (const Note& note : harness.notes) {
        EXPECT_EQ(note.state, 0u);
    }
}

// Not how the system closes, but a worker cannot join itself: it must finish on its own and
// leave the library usable.
TEST_F(OvixTest, ClosingFromInsideACallbackLeavesTheLibraryUsable)
{
    for (const bool closeLibrary : {false, true}) {
        Script script;
        script.afBlock = AfBlock({});
        script.pcm = Pattern(8000, 2);
        script.closeInNotification = 1;
        script.closeLibrary = closeLibrary;
        Harness& harness = Play(std::move(script));
        ASSERT_EQ(TqovixOpenSession(AudioRecord(48, 2, 8000), TrimRecord()), ovix::kSuccess);
        ASSERT_TRUE(WaitFor([&] { return harness.closedInside >= 0; }));
        EXPECT_EQ(harness.closedInside, static_cast<long>(ovix::kSuccess));
        EXPECT_EQ(harness.events, "aAlIONION");
        EXPECT_EQ(TqovixIsSessionFinished(), ovix::kFailure);
        if (closeLibrary) {
            EXPECT_EQ(TqovixLibraryInitialize(), ovix::kSuccess);
        }

        Script next;
        next.afBlock = AfBlock({});
        next.pcm = Pattern(3000, 2);
        Harness& again = Play(std::move(next));
        EXPECT_EQ(Run(AudioRecord(48, 2, 3000)), ovix::kSessionFinished)
            << "after closing the " << (closeLibrary ? "library" : "session");
        EXPECT_EQ(again.pushed.size(), 6000u);
    }
}

// ---- library and session lifecycle ----

TEST_F(OvixTest, InitializeOnlyOnce)
{
    EXPECT_EQ(TqovixLibraryInitialize(), ovix::kFailure);
    EXPECT_EQ(TqovixLibraryClose(), ovix::kSuccess);
    EXPECT_EQ(TqovixOpenSession(AudioRecord(48, 2, 100), TrimRecord()), ovix::kFailure);
    EXPECT_EQ(TqovixLibraryInitialize(), ovix::kSuccess);
}

TEST_F(OvixTest, OneSessionAtATimeUntilClosed)
{
    Script script;
    script.afBlock = AfBlock({});
    script.pcm = Pattern(100, 2);
    Play(std::move(script));
    EXPECT_EQ(TqovixCloseSession(0), ovix::kFailure);
    ASSERT_EQ(TqovixOpenSession(AudioRecord(48, 2, 100), TrimRecord()), ovix::kSuccess);
    ASSERT_TRUE(WaitFor([] { return TqovixIsSessionFinished() == ovix::kSessionFinished; }));
    EXPECT_EQ(TqovixOpenSession(AudioRecord(48, 2, 100), TrimRecord()), ovix::kFailure);
    EXPECT_EQ(TqovixCloseSession(0), ovix::kSuccess);
    EXPECT_EQ(TqovixCloseSession(0), ovix::kFailure);
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kFailure);
}

struct RecordRow {
    std::string name;
    std::function<void(TqovixAudioInformation&, TqovixTrimInformation&)> spoil;
};

class OvixRecords : public WithLibrary<::testing::TestWithParam<RecordRow>> {};

TEST_P(OvixRecords, OpenSessionRefusesTheRecordWithoutStarting)
{
    Script script;
    script.afBlock = AfBlock({});
    script.pcm = Pattern(100, 2);
    Harness& harness = Play(std::move(script));
    TqovixAudioInformation audio = AudioRecord(48, 2, 100);
    TqovixTrimInformation trim = TrimRecord();
    GetParam().spoil(audio, trim);
    EXPECT_EQ(TqovixOpenSession(audio, trim), ovix::kFailure);
    EXPECT_EQ(TqovixIsSessionFinished(), ovix::kFailure);
    EXPECT_EQ(TqovixCloseSession(0), ovix::kFailure);
    EXPECT_TRUE(harness.events.empty());
}

using Audio = TqovixAudioInformation;
using Trim = TqovixTrimInformation;
INSTANTIATE_TEST_SUITE_P(
    Fields, OvixRecords,
    ::testing::Values(RecordRow{"AudioSizeField", [](Audio& a, Trim&) { a.size = 40; }},
                      RecordRow{"TrimSizeField", [](Audio&, Trim& t) { t.size = 48; }},
                      RecordRow{"NoChannels", [](Audio& a, Trim&) { a.channels = 0; }},
                      RecordRow{"NineChannels", [](Audio& a, Trim&) { a.channels = 9; }},
                      RecordRow{"EightBitSamples", [](Audio& a, Trim&) { a.bitsPerSample = 8; }},
                      RecordRow{"TwentyFourBitSamples", [](Audio& a, Trim&) { a.bitsPerSample = 24; }},
                      RecordRow{"ZeroRate", [](Audio& a, Trim&) { a.sampleRate = 0; }},
                      RecordRow{"RateNoRecordingHas", [](Audio& a, Trim&) { a.sampleRate = 1ul << 40; }},
                      RecordRow{"ZeroSampleCount", [](Audio& a, Trim&) { a.sampleCount = 0; }}),
    RowName<RecordRow>);

TEST_F(OvixTest, ProcessedAfInformationInPiecesRewindsAfterTheLast)
{
    uint8_t buffer[16];
    unsigned long count = 0;
    EXPECT_EQ(TqovixGetProcessedAFInfo(buffer, sizeof buffer, &count), ovix::kFailure);

    const Bytes af = AfBlock({{10, 20, 300}, {40, 90, 1000}});
    Script script;
    script.afBlock = af;
    script.pcm = Pattern(100, 1);
    script.channels = 1;
    Play(std::move(script));
    ASSERT_EQ(TqovixOpenSession(AudioRecord(48, 1, 100), TrimRecord()), ovix::kSuccess);
    ASSERT_TRUE(WaitFor([] { return TqovixIsSessionFinished() == ovix::kSessionFinished; }));

    EXPECT_EQ(TqovixGetProcessedAFInfo(nullptr, sizeof buffer, &count), ovix::kFailure);
    EXPECT_EQ(TqovixGetProcessedAFInfo(buffer, 0, &count), ovix::kFailure);
    EXPECT_EQ(TqovixGetProcessedAFInfo(buffer, sizeof buffer, nullptr), ovix::kFailure);
    for (int round = 0; round < 2; ++round) {
        Bytes read;
        unsigned long result = 0;
        size_t calls = 0;
        do {
            result = TqovixGetProcessedAFInfo(buffer, 7, &count);
            ASSERT_LE(result, ovix::kLastPiece);
            read.insert(read.end(), buffer, buffer + count);
            ++calls;
        } while (result == 0 && calls < 100);
        EXPECT_EQ(read, WithProcessedFlag(af)) << "round " << round;
        EXPECT_EQ(calls, Pieces(af.size(), 7));
    }
    EXPECT_EQ(TqovixCloseSession(0), ovix::kSuccess);
}

// ---- processing ----

constexpr unsigned long kRate = 48000;
constexpr uint64_t kRamp = kRate / 100;  // 10 ms

// A steady 4 kHz tone, well above the motor band.
std::vector<double> Tone(size_t frames, unsigned channels)
{
    std::vector<double> out(frames * channels);
    for (size_t i = 0; i < out.size(); ++i) {
        out[i] = 8000.0 * std::sin(2.0 * std::numbers::pi * 4000.0 * static_cast<double>(i / channels) / kRate);
    }
    return out;
}

// Motor noise: many partials between 80 and 500 Hz with random phases, present only inside
// the given stretches.
std::vector<double> MotorNoise(size_t frames, unsigned channels, const std::vector<AfInterval>& bursts)
{
    std::mt19937 random(20240611);
    std::uniform_real_distribution<double> frequency(80.0, 500.0);
    std::uniform_real_distribution<double> phase(0.0, 2.0 * std::numbers::pi);
    std::vector<std::pair<double, double>> partials(24);
    for (auto& partial : partials) {
        partial = {frequency(random), phase(random)};
    }
    std::vector<double> out(frames * channels, 0.0);
    for (const AfInterval& burst : bursts) {
        for (uint64_t t = burst.startFrame; t < burst.endFrame && t < frames; ++t) {
            for (unsigned c = 0; c < channels; ++c) {
                double value = 0.0;
                for (const auto& [f, p] : partials) {
                    value += 250.0 * std::sin(2.0 * std::numbers::pi * f * static_cast<double>(t) / kRate + p + c);
                }
                out[t * channels + c] = value;
            }
        }
    }
    return out;
}

std::vector<int16_t> ToPcm(const std::vector<double>& a, const std::vector<double>& b = {})
{
    std::vector<int16_t> pcm(a.size());
    for (size_t i = 0; i < a.size(); ++i) {
        pcm[i] = static_cast<int16_t>(std::lrint(a[i] + (b.empty() ? 0.0 : b[i])));
    }
    return pcm;
}

template <typename A, typename B>
double EnergyDb(const A& numerator, const B& denominator)
{
    double top = 0.0;
    double bottom = 0.0;
    for (size_t i = 0; i < numerator.size(); ++i) {
        top += static_cast<double>(numerator[i]) * static_cast<double>(numerator[i]);
        bottom += static_cast<double>(denominator[i]) * static_cast<double>(denominator[i]);
    }
    return 10.0 * std::log10(top / bottom);
}

bool Touched(uint64_t frame, const std::vector<AfInterval>& intervals)
{
    for (const AfInterval& interval : intervals) {
        if (frame + kRamp >= interval.startFrame && frame < interval.endFrame + kRamp) {
            return true;
        }
    }
    return false;
}

struct SuppressionRow {
    std::string name;
    uint16_t strength;
    double minNoiseDb;
    double maxNoiseDb;
};

class OvixSuppression : public WithLibrary<::testing::TestWithParam<SuppressionRow>> {};

// Noise is measured as what the noise adds to the output: the processed mixture minus the
// processed tone alone, over the intervals.
TEST_P(OvixSuppression, NoiseInsideIntervalsDropsToneStaysOutsideIsBitExact)
{
    constexpr unsigned kChannels = 2;
    constexpr size_t kFrames = 3 * kRate;
    const std::vector<AfInterval> intervals = {{30000, 60000, GetParam().strength}, {90000, 120000, GetParam().strength}};
    const Bytes af = AfBlock(intervals);
    const std::vector<double> tone = Tone(kFrames, kChannels);
    const std::vector<double> noise = MotorNoise(kFrames, kChannels, intervals);
    const std::vector<int16_t> mixture = ToPcm(tone, noise);
    const std::vector<int16_t> toneOnly = ToPcm(tone);

    const std::vector<int16_t> outMixture = Process(af, mixture, kChannels);
    const std::vector<int16_t> outTone = Process(af, toneOnly, kChannels);
    ASSERT_EQ(outMixture.size(), mixture.size());
    ASSERT_EQ(outTone.size(), toneOnly.size());

    std::vector<double> noiseIn, noiseOut, toneIn, toneOut;
    size_t changedOutside = 0;
    for (size_t t = 0; t < kFrames; ++t) {
        const bool inside = (t >= 30000 && t < 60000) || (t >= 90000 && t < 120000);
        for (unsigned c = 0; c < kChannels; ++c) {
            const size_t i = t * kChannels + c;
            if (inside) {
                noiseIn.push_back(mixture[i] - toneOnly[i]);
                noiseOut.push_back(outMixture[i] - outTone[i]);
                toneIn.push_back(toneOnly[i]);
                toneOut.push_back(outTone[i]);
            }
            if (!Touched(t, intervals) && outMixture[i] != mixture[i]) {
                ++changedOutside;
            }
        }
    }
    const double noiseDb = EnergyDb(noiseOut, noiseIn);
    EXPECT_GE(noiseDb, GetParam().minNoiseDb);
    EXPECT_LE(noiseDb, GetParam().maxNoiseDb);
    EXPECT_NEAR(EnergyDb(toneOut, toneIn), 0.0, 1.0);
    EXPECT_EQ(changedOutside, 0u);
}

INSTANTIATE_TEST_SUITE_P(Strengths, OvixSuppression,
                         ::testing::Values(SuppressionRow{"Full", 1000, -200.0, -12.0},
                                           SuppressionRow{"Half", 500, -9.0, -3.0},
                                           SuppressionRow{"AboveFullCountsAsFull", 4000, -200.0, -12.0}),
                         RowName<SuppressionRow>);

TEST_F(OvixTest, StrengthZeroAndForeignPayloadsLeaveAudioBitExact)
{
    const std::vector<AfInterval> everywhere = {{0, 50000, 0}};
    const std::vector<int16_t> pcm = ToPcm(Tone(50000, 2), MotorNoise(50000, 2, {{0, 50000, 0}}));
    EXPECT_EQ(Process(AfBlock(everywhere), pcm, 2), pcm);
    EXPECT_EQ(Process(ForeignAfBlock(), pcm, 2), pcm);
    EXPECT_EQ(m_harness->processedAtEnd, ForeignAfBlock());
}

// The filters' state must carry from one block to the next, wherever the blocks begin.
TEST_F(OvixTest, OutputDoesNotDependOnHowTheAudioIsDelivered)
{
    const std::vector<AfInterval> intervals = {{2000, 40000, 800}};
    const std::vector<int16_t> pcm = ToPcm(Tone(48000, 2), MotorNoise(48000, 2, {{0, 48000, 0}}));
    const std::vector<int16_t> whole = Process(AfBlock(intervals), pcm, 2);

    Script script;
    script.afBlock = AfBlock(intervals);
    script.pcm = pcm;
    script.audioFrameLimit = 700;
    Harness& harness = Play(std::move(script));
    EXPECT_EQ(Run(AudioRecord(48, 2, 48000)), ovix::kSessionFinished);
    EXPECT_EQ(harness.pushed, whole);
    EXPECT_NE(whole, pcm);
}

TEST_F(OvixTest, SaturatesInsteadOfWrapping)
{
    // A full-scale 50 Hz square wave: the high-pass doubles every edge.
    std::vector<int16_t> square(24000);
    for (size_t t = 0; t < square.size(); ++t) {
        square[t] = (t / 480) % 2 == 0 ? -32000 : 32000;
    }
    const std::vector<int16_t> out = Process(AfBlock({{0, 24000, 1000}}), square, 1);
    ASSERT_EQ(out.size(), square.size());
    for (size_t t = 480; t < square.size(); t += 480) {
        EXPECT_EQ(out[t], square[t] > 0 ? INT16_MAX : INT16_MIN) << "edge at " << t;
    }
}

struct PlacementRow {
    std::string name;
    uint32_t recordRate;
    unsigned long sessionKiloHertz;
    unsigned int startOffset;
    AfInterval interval;
    uint64_t expectedStart;  // where the interval lands in the session's frames
    uint64_t expectedEnd;
};

class OvixPlacement : public WithLibrary<::testing::TestWithParam<PlacementRow>> {};

constexpr size_t kPlacementFrames = 100000;

// Changes lie within the mapped interval and its ramps only, nearly every frame of the interval
// changes, and the ramps inside the track change some frames.
TEST_P(OvixPlacement, IntervalLandsWhereTheRecordSays)
{
    const PlacementRow& row = GetParam();
    const uint64_t rateHz = row.sessionKiloHertz == 44 ? 44100 : row.sessionKiloHertz * 1000;
    const uint64_t ramp = rateHz / 100;
    const std::vector<int16_t> pcm = ToPcm(MotorNoise(kPlacementFrames, 1, {{0, kPlacementFrames, 0}}));
    const std::vector<int16_t> out =
        Process(AfBlock({row.interval}, row.recordRate), pcm, 1, row.sessionKiloHertz, row.startOffset);
    ASSERT_EQ(out.size(), pcm.size());
    if (row.expectedStart == row.expectedEnd) {
        EXPECT_EQ(out, pcm);
        return;
    }

    size_t inside = 0, rampIn = 0, rampOut = 0, outside = 0;
    for (uint64_t t = 0; t < kPlacementFrames; ++t) {
        if (out[t] == pcm[t]) {
            continue;
        }
        if (t >= row.expectedStart && t < row.expectedEnd) {
            ++inside;
        } else if (t + ramp >= row.expectedStart && t < row.expectedStart) {
            ++rampIn;
        } else if (t >= row.expectedEnd && t < row.expectedEnd + ramp) {
            ++rampOut;
        } else {
            ++outside;
        }
    }
    EXPECT_EQ(outside, 0u);
    EXPECT_GE(inside, (row.expectedEnd - row.expectedStart) * 9 / 10);
    if (row.expectedStart > ramp) {
        EXPECT_GT(rampIn, 0u);
    }
    if (row.expectedEnd < kPlacementFrames) {
        EXPECT_GT(rampOut, 0u);
    }
}

INSTANTIATE_TEST_SUITE_P(
    Records, OvixPlacement,
    ::testing::Values(PlacementRow{"SameRate", 48000, 48, 0, {10000, 20000, 1000}, 10000, 20000},
                      PlacementRow{"RecordAtHalfRate", 24000, 48, 0, {5000, 10000, 1000}, 10000, 20000},
                      PlacementRow{"SessionAt44kHzMeans44100", 48000, 44, 0, {48000, 96000, 1000}, 44100, 88200},
                      PlacementRow{"RecordWithoutRate", 0, 48, 0, {10000, 20000, 1000}, 10000, 20000},
                      PlacementRow{"StartOffsetShiftsLater", 48000, 48, 1500, {10000, 20000, 1000}, 11500, 21500},
                      PlacementRow{"WrappedStartOffsetShiftsEarlier", 48000, 48, 0xFFFFFC18u, {10000, 20000, 1000}, 9000,
                                   19000},
                      PlacementRow{"ClippedAtTrackEnd", 48000, 48, 0, {95000, 400000, 1000}, 95000, 100000},
                      PlacementRow{"RampBeforeTrackStart", 48000, 48, 0, {100, 5000, 1000}, 100, 5000},
                      PlacementRow{"PastTheEnd", 48000, 48, 0, {150000, 160000, 1000}, 100000, 100000},
                      PlacementRow{"FarPositionsDoNotWrap", 1, 48, 0, {1ull << 62, ~0ull, 1000}, 100000, 100000}),
    RowName<PlacementRow>);

}  // namespace
