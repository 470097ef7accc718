// The bridge to the processing library: conversion tables, trampolines, records, and what the
// real libOVIX sees and answers through it.
#include <gtest/gtest.h>

#include "ByteWriter.h"
#include "MakerData.h"
#include "bridge/TqovixInterfaceConvert.h"
#include "support/OvixHarness.h"

#include <cstring>

namespace TC = TqovixInterfaceConvert;
using moviekit::Atom;
using moviekit::Bytes;

namespace {

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

// ---- conversion tables ----

struct ToLibraryRow {
    std::string name;
    int32_t internal;
    unsigned long library;
};

class BridgeToLibrary : public ::testing::TestWithParam<ToLibraryRow> {};

TEST_P(BridgeToLibrary, Converts)
{
    EXPECT_EQ(TC::ConvertToLibraryError(static_cast<eTqovixErrorCode>(GetParam().internal)), GetParam().library);
}

INSTANTIATE_TEST_SUITE_P(
    Codes, BridgeToLibrary,
    ::testing::Values(ToLibraryRow{"Success", 0, 0}, ToLibraryRow{"Finished", 2, 0}, ToLibraryRow{"NoAudioLevel", 154, 30},
                      ToLibraryRow{"OutOfMemory", 4352, 100}, ToLibraryRow{"SourceNotFound", 4353, 110},
                      ToLibraryRow{"DestinationNotFound", 4354, 111}, ToLibraryRow{"SourceAccessDenied", 4355, 120},
                      ToLibraryRow{"DestinationAccessDenied", 4356, 121}, ToLibraryRow{"DiskFull", 4357, 130},
                      ToLibraryRow{"FileTooLarge", 4358, 131}, ToLibraryRow{"Aborted", 4608, 200},
                      ToLibraryRow{"Running", 1, 190}, ToLibraryRow{"Enable", 17, 190}, ToLibraryRow{"Verdict8", 19, 190},
                      ToLibraryRow{"VisitSkip", 156, 190}, ToLibraryRow{"InvalidMovie", 4359, 190},
                      ToLibraryRow{"Reserved", 4360, 190}, ToLibraryRow{"General", 4361, 190},
                      ToLibraryRow{"EndOfFile", 8192, 190}, ToLibraryRow{"FileReserved", 8198, 190},
                      ToLibraryRow{"Device", 12288, 190}, ToLibraryRow{"Internal", 36864, 190},
                      ToLibraryRow{"Negative", -1, 190}),
    RowName<ToLibraryRow>);

struct ToLocalRow {
    std::string name;
    unsigned long library;
    int32_t internal;
};

class BridgeToLocal : public ::testing::TestWithParam<ToLocalRow> {};

TEST_P(BridgeToLocal, Converts)
{
    EXPECT_EQ(TC::ConvertToLocalError(GetParam().library), GetParam().internal);
}

INSTANTIATE_TEST_SUITE_P(
    Codes, BridgeToLocal,
    ::testing::Values(ToLocalRow{"Success", 0, 0}, ToLocalRow{"NoAudioLevel", 30, 154}, ToLocalRow{"OutOfMemory", 100, 4352},
                      ToLocalRow{"SourceNotFound", 110, 4353}, ToLocalRow{"DestinationNotFound", 111, 4354},
                      ToLocalRow{"SourceAccessDenied", 120, 4355}, ToLocalRow{"DestinationAccessDenied", 121, 4356},
                      ToLocalRow{"DiskFull", 130, 4357}, ToLocalRow{"FileTooLarge", 131, 4358},
                      ToLocalRow{"Aborted", 200, 4608}, ToLocalRow{"Failure", 190, 4361}, ToLocalRow{"Unknown5", 5, 4361},
                      ToLocalRow{"One", 1, 4361}, ToLocalRow{"VerdictOutsideItsQuery", 8, 4361},
                      ToLocalRow{"HighBitsAboveThirty", (1ul << 32) + 30, 4361},
                      ToLocalRow{"HighBitsAboveZero", 1ul << 32, 4361}),
    RowName<ToLocalRow>);

// ---- trampolines ----

struct CallRecord {
    const void* buffer = nullptr;
    unsigned long* delivered = nullptr;
    unsigned long size = 0;
    unsigned long skip = 0;
    int calls = 0;
};

CallRecord g_call;
eTqovixErrorCode g_answer = eTqovixSuccess;

eTqovixErrorCode RecordingInput(void* buffer, unsigned long* delivered, unsigned long size, unsigned long skip)
{
    g_call = {buffer, delivered, size, skip, g_call.calls + 1};
    return g_answer;
}

eTqovixErrorCode RecordingOutput(const void* data, unsigned long size)
{
    g_call = {data, nullptr, size, 0, g_call.calls + 1};
    return g_answer;
}

void RecordingNotify(unsigned long first, unsigned long second)
{
    g_call = {nullptr, nullptr, first, second, g_call.calls + 1};
}

using Trampoline = unsigned long (*)(void*, unsigned long*, unsigned long, unsigned long);

struct TrampolineSlot {
    const char* name;
    Trampoline trampoline;
    TC::InputFunc* global;
};

const TrampolineSlot kInputSlots[] = {
    {"InputAFInformationFunc", TC::InputAFInformationFunc, &TC::g_pfnInputAFInformationFunc},
    {"InputAudioLevelInformationFunc", TC::InputAudioLevelInformationFunc, &TC::g_pfnInputAudioLevelInformationFunc},
    {"InputAudioFunc", TC::InputAudioFunc, &TC::g_pfnInputAudioFunc},
};

TEST(BridgeTrampoline, NullGlobalGives190WithoutCalling)
{
    unsigned long delivered = 12345;
    uint8_t buffer[8] = {};
    for (const TrampolineSlot& slot : kInputSlots) {
        *slot.global = nullptr;
        EXPECT_EQ(slot.trampoline(buffer, &delivered, sizeof buffer, 0), 190u) << slot.name;
    }
    TC::g_pfnOutputAudioFunc = nullptr;
    EXPECT_EQ(TC::OutputAudioFunc(buffer, sizeof buffer), 190u);
    EXPECT_EQ(delivered, 12345u);
}

struct AnswerRow {
    std::string name;
    eTqovixErrorCode answer;
    unsigned long library;
};

class BridgeTrampolineAnswer : public ::testing::TestWithParam<AnswerRow> {};

TEST_P(BridgeTrampolineAnswer, ForwardsArgumentsAndConvertsTheResult)
{
    g_answer = GetParam().answer;
    unsigned long delivered = 0;
    uint8_t buffer[8] = {};
    for (const TrampolineSlot& slot : kInputSlots) {
        *slot.global = RecordingInput;
        g_call = {};
        EXPECT_EQ(slot.trampoline(buffer, &delivered, 77, 5), GetParam().library) << slot.name;
        EXPECT_EQ(g_call.calls, 1) << slot.name;
        EXPECT_EQ(g_call.buffer, buffer) << slot.name;
        EXPECT_EQ(g_call.delivered, &delivered) << slot.name;
        EXPECT_EQ(g_call.size, 77u) << slot.name;
        EXPECT_EQ(g_call.skip, 5u) << slot.name;
        *slot.global = nullptr;
    }
    TC::g_pfnOutputAudioFunc = RecordingOutput;
    g_call = {};
    EXPECT_EQ(TC::OutputAudioFunc(buffer, 6), GetParam().library);
    EXPECT_EQ(g_call.buffer, buffer);
    EXPECT_EQ(g_call.size, 6u);
    TC::g_pfnOutputAudioFunc = nullptr;
}

INSTANTIATE_TEST_SUITE_P(Answers, BridgeTrampolineAnswer,
                         ::testing::Values(AnswerRow{"Success", eTqovixSuccess, 0},
                                           AnswerRow{"RunningIsAFailure", eTqovixRunning, 190},
                                           AnswerRow{"FinishedIsSuccess", eTqovixFinished, 0},
                                           AnswerRow{"NoAudioLevel", eTqovixNoAudioLevel, 30},
                                           AnswerRow{"InvalidMovie", eTqovixErrorInvalidMovie, 190},
                                           AnswerRow{"OutOfMemory", eTqovixErrorOutOfMemory, 100},
                                           AnswerRow{"Aborted", eTqovixErrorAborted, 200}),
                         RowName<AnswerRow>);

TEST(BridgeTrampoline, NotifyForwardsBothValues)
{
    TC::g_pfnNotifyProgressFunc = RecordingNotify;
    g_call = {};
    TC::NotifyProgressFunc(1ul << 40, 7);
    EXPECT_EQ(g_call.calls, 1);
    EXPECT_EQ(g_call.size, 1ul << 40);
    EXPECT_EQ(g_call.skip, 7u);
    TC::g_pfnNotifyProgressFunc = nullptr;
    TC::NotifyProgressFunc(1, 2);
    EXPECT_EQ(g_call.calls, 1);
}

// ---- records ----

template <typename T>
T At(const void* record, size_t offset)
{
    T value;
    std::memcpy(&value, static_cast<const uint8_t*>(record) + offset, sizeof value);
    return value;
}

TEST(BridgeRecords, LibraryFormsCarryTheirSizeAndFieldsInOrder)
{
    TC::TqovixAudioInformation audio;
    audio.sampleRate = 0x1111111111111111;
    audio.channels = 0x2222222222222222;
    audio.bitsPerSample = 0x3333333333333333;
    audio.sampleCount = 0x4444444444444444;
    audio.startOffset = 0x55667788;
    const ::TqovixAudioInformation libraryAudio = TC::MakeLibraryRecord(audio);
    ASSERT_EQ(sizeof libraryAudio, 48u);
    EXPECT_EQ(At<uint64_t>(&libraryAudio, 0), 48u);
    EXPECT_EQ(At<uint64_t>(&libraryAudio, 8), audio.sampleRate);
    EXPECT_EQ(At<uint64_t>(&libraryAudio, 16), audio.channels);
    EXPECT_EQ(At<uint64_t>(&libraryAudio, 24), audio.bitsPerSample);
    EXPECT_EQ(At<uint64_t>(&libraryAudio, 32), audio.sampleCount);
    EXPECT_EQ(At<uint32_t>(&libraryAudio, 40), audio.startOffset);

    TC::TqovixTrimInformation trim;
    trim.frameRateNumerator = 0x6666666666666666;
    trim.frameRateDenominator = 0x7777777777777777;
    trim.removedFrameForward = 0x8888888888888888;
    trim.removedFrameBackward = 0x9999999999999999;
    const ::TqovixTrimInformation libraryTrim = TC::MakeLibraryRecord(trim);
    ASSERT_EQ(sizeof libraryTrim, 40u);
    EXPECT_EQ(At<uint64_t>(&libraryTrim, 0), 40u);
    EXPECT_EQ(At<uint64_t>(&libraryTrim, 8), trim.frameRateNumerator);
    EXPECT_EQ(At<uint64_t>(&libraryTrim, 16), trim.frameRateDenominator);
    EXPECT_EQ(At<uint64_t>(&libraryTrim, 24), trim.removedFrameForward);
    EXPECT_EQ(At<uint64_t>(&libraryTrim, 32), trim.removedFrameBackward);
}

// ---- through the real processing library ----

// The engine's side, reduced to serving memory through the system-form callbacks.
struct SystemSide {
    Bytes af;
    std::vector<int16_t> pcm;
    size_t afPosition = 0;
    size_t samplePosition = 0;
    eTqovixErrorCode audioAnswer = eTqovixSuccess;
    ovixtest::Gate* hold = nullptr;
    std::vector<unsigned long> audioRequests;
    std::vector<int16_t> pushed;
    std::vector<std::pair<unsigned long, unsigned long>> notes;
};

SystemSide* g_system = nullptr;

eTqovixErrorCode ServeAf(void* buffer, unsigned long* delivered, unsigned long size, unsigned long)
{
    SystemSide& s = *g_system;
    if (buffer == nullptr) {
        *delivered = s.af.size();
        return eTqovixSuccess;
    }
    const size_t piece = std::min<size_t>(size, s.af.size() - s.afPosition);
    std::memcpy(buffer, s.af.data() + s.afPosition, piece);
    s.afPosition += piece;
    *delivered = piece;
    return eTqovixSuccess;
}

eTqovixErrorCode ServeNoLevel(void*, unsigned long* delivered, unsigned long, unsigned long)
{
    *delivered = 0;
    return eTqovixNoAudioLevel;
}

eTqovixErrorCode ServeAudio(void* buffer, unsigned long* delivered, unsigned long size, unsigned long)
{
    SystemSide& s = *g_system;
    s.audioRequests.push_back(size);
    if (s.audioAnswer != eTqovixSuccess) {
        return s.audioAnswer;
    }
    const size_t piece = std::min<size_t>(size, (s.pcm.size() - s.samplePosition) * sizeof(int16_t));
    if (piece > 0) {
        std::memcpy(buffer, s.pcm.data() + s.samplePosition, piece);
    }
    s.samplePosition += piece / sizeof(int16_t);
    *delivered = piece;
    return eTqovixSuccess;
}

// Answers 2, which the library must take as success.
eTqovixErrorCode TakeAudio(const void* data, unsigned long size)
{
    SystemSide& s = *g_system;
    const int16_t* samples = static_cast<const int16_t*>(data);
    s.pushed.insert(s.pushed.end(), samples, samples + size / sizeof(int16_t));
    if (s.hold != nullptr) {
        s.hold->Arrive();
    }
    return eTqovixFinished;
}

void TakeProgress(unsigned long done, unsigned long total)
{
    g_system->notes.emplace_back(done, total);
}

TC::TqovixAudioInformation Audio(uint64_t rate, uint64_t channels, uint64_t bits, uint64_t count)
{
    TC::TqovixAudioInformation audio;
    audio.sampleRate = rate;
    audio.channels = channels;
    audio.bitsPerSample = bits;
    audio.sampleCount = count;
    return audio;
}

class BridgeSession : public ::testing::Test {
protected:
    void SetUp() override
    {
        g_system = &m_system;
        ASSERT_EQ(TC::TqovixLibraryInitialize(), eTqovixSuccess);
        TC::TqovixSetCallbackInputAFInformation(ServeAf);
        TC::TqovixSetCallbackInputAudioLevelInformation(ServeNoLevel);
        TC::TqovixSetCallbackInputAudio(ServeAudio);
        TC::TqovixSetCallbackOutputAudio(TakeAudio);
        TC::TqovixSetCallbackNotifyProgress(TakeProgress);
    }
    void TearDown() override
    {
        m_gate.Open();
        TC::TqovixLibraryClose();
        g_system = nullptr;
    }

    // The end state as the bridge reports it, read before closing.
    eTqovixErrorCode RunToEnd(const TC::TqovixAudioInformation& audio)
    {
        EXPECT_EQ(TC::TqovixOpenSession(audio, TC::TqovixTrimInformation{}), eTqovixSuccess);
        eTqovixErrorCode state = eTqovixRunning;
        EXPECT_TRUE(ovixtest::WaitFor([&] { return (state = TC::TqovixIsSessionFinished()) != eTqovixRunning; }));
        TC::TqovixCloseSession(eTqovixFinished);
        return state;
    }

    SystemSide m_system;
    ovixtest::Gate m_gate;
};

// The library sees the fields where they belong: three channels make 6144-byte requests,
// the sample count ends the progress, 16 bits are accepted.
TEST_F(BridgeSession, SettersRegisterTrampolinesAndRecordsArriveInOrder)
{
    EXPECT_EQ(TC::g_pfnInputAFInformationFunc, ServeAf);
    EXPECT_EQ(TC::g_pfnInputAudioLevelInformationFunc, ServeNoLevel);
    EXPECT_EQ(TC::g_pfnInputAudioFunc, ServeAudio);
    EXPECT_EQ(TC::g_pfnOutputAudioFunc, TakeAudio);
    EXPECT_EQ(TC::g_pfnNotifyProgressFunc, TakeProgress);

    m_system.af = Atom("OP01", moviekit::MakeAfInformation(48000, {}, false));
    for (int i = 0; i < 3 * 2000; ++i) {
        m_system.pcm.push_back(static_cast<int16_t>(i * 31));
    }
    EXPECT_EQ(RunToEnd(Audio(48, 3, 16, 2000)), eTqovixFinished);
    ASSERT_FALSE(m_system.audioRequests.empty());
    EXPECT_EQ(m_system.audioRequests.front(), 3u * 2 * 1024);
    EXPECT_EQ(m_system.pushed, m_system.pcm);
    ASSERT_FALSE(m_system.notes.empty());
    EXPECT_EQ(m_system.notes.back(), std::make_pair(2000ul, 2000ul));
}

TEST_F(BridgeSession, RefusalsArriveAsGeneralFailure)
{
    EXPECT_EQ(TC::TqovixLibraryInitialize(), eTqovixErrorGeneral);
    EXPECT_EQ(TC::TqovixOpenSession(Audio(48, 0, 16, 100), {}), eTqovixErrorGeneral);
    EXPECT_EQ(TC::TqovixOpenSession(Audio(48, 2, 24, 100), {}), eTqovixErrorGeneral);
    EXPECT_EQ(TC::TqovixOpenSession(Audio(0, 2, 16, 100), {}), eTqovixErrorGeneral);
    EXPECT_EQ(TC::TqovixIsSessionFinished(), eTqovixErrorGeneral);
    uint8_t buffer[8];
    unsigned long count = 0;
    EXPECT_EQ(TC::TqovixGetProcessedAFInfo(buffer, sizeof buffer, &count), eTqovixErrorGeneral);
    TC::TqovixLibraryClose();
    EXPECT_EQ(TC::TqovixOpenSession(Audio(48, 2, 16, 100), {}), eTqovixErrorGeneral);
}

TEST_F(BridgeSession, RunningThenAbortedThenGone)
{
    m_system.af = Atom("OP01", moviekit::MakeAfInformation(48000, {}, false));
    m_system.pcm.assign(2 * 5000, 3);
    m_system.hold = &m_gate;
    ASSERT_EQ(TC::TqovixOpenSession(Audio(48, 2, 16, 5000), {}), eTqovixSuccess);
    ASSERT_TRUE(m_gate.WaitArrived());
    EXPECT_EQ(TC::TqovixIsSessionFinished(), eTqovixRunning);
    TC::TqovixAbortSession();
    EXPECT_EQ(TC::TqovixIsSessionFinished(), eTqovixErrorAborted);
    m_gate.Open();
    TC::TqovixCloseSession(eTqovixErrorAborted);
    EXPECT_EQ(TC::TqovixIsSessionFinished(), eTqovixErrorGeneral);
}

TEST_F(BridgeSession, FailedCallbackEndsAsGeneralFailure)
{
    m_system.af = Atom("OP01", moviekit::MakeAfInformation(48000, {}, false));
    m_system.pcm.assign(2 * 5000, 3);
    m_system.audioAnswer = eTqovixErrorInvalidMovie;
    EXPECT_EQ(RunToEnd(Audio(48, 2, 16, 5000)), eTqovixErrorGeneral);
    EXPECT_EQ(m_system.audioRequests.size(), 1u);
    EXPECT_EQ(m_system.notes, (std::vector<std::pair<unsigned long, unsigned long>>{{0, 5000}}));
}

TEST_F(BridgeSession, ProcessedAfInformationInPieces)
{
    m_system.af = Atom("OP01", moviekit::MakeAfInformation(48000, {{10, 20, 500}}, false));
    m_system.pcm.assign(100, 1);
    ASSERT_EQ(TC::TqovixOpenSession(Audio(48, 1, 16, 100), {}), eTqovixSuccess);
    ASSERT_TRUE(ovixtest::WaitFor([] { return TC::TqovixIsSessionFinished() == eTqovixFinished; }));
    Bytes read;
    std::vector<eTqovixErrorCode> results;
    uint8_t buffer[16];
    unsigned long count = 0;
    do {
        results.push_back(TC::TqovixGetProcessedAFInfo(buffer, sizeof buffer, &count));
        read.insert(read.end(), buffer, buffer + count);
    } while (results.back() == eTqovixRunning && results.size() < 10);
    TC::TqovixCloseSession(eTqovixFinished);
    // 44 bytes: two full pieces, then the last.
    EXPECT_EQ(results, (std::vector<eTqovixErrorCode>{eTqovixRunning, eTqovixRunning, eTqovixFinished}));
    Bytes expected = m_system.af;
    expected[15] |= 1;
    EXPECT_EQ(read, expected);
}

struct VerdictRow {
    std::string name;
    Bytes block;
    eTqovixErrorCode isEnable;
    eTqovixErrorCode sessionEnd;
};

class BridgeVerdict : public BridgeSession, public ::testing::WithParamInterface<VerdictRow> {};

TEST_P(BridgeVerdict, IsEnableAndSessionStateAreMapped)
{
    Bytes block = GetParam().block;
    EXPECT_EQ(TC::TqovixIsEnable(block.data(), block.size()), GetParam().isEnable);
    m_system.af = block;
    m_system.pcm.assign(2 * 1500, 9);
    EXPECT_EQ(RunToEnd(Audio(48, 2, 16, 1500)), GetParam().sessionEnd);
}

Bytes AfPayload(std::vector<moviekit::AfInterval> intervals, bool processed)
{
    return moviekit::MakeAfInformation(48000, intervals, processed);
}

INSTANTIATE_TEST_SUITE_P(
    Blocks, BridgeVerdict,
    ::testing::Values(
        VerdictRow{"Accepted", Atom("OP01", AfPayload({{1, 2, 3}}, false)), eTqovixEnable, eTqovixFinished},
        VerdictRow{"NoAfInformation", Atom("OP01", {1, 2}), eTqovixVerdict7, eTqovixVerdict7},
        VerdictRow{"NotAnAfBlock", Atom("OP02", AfPayload({}, false)), eTqovixVerdict8, eTqovixVerdict8},
        VerdictRow{"Malformed", Atom("OP01", AfPayload({{5, 6, 1}, {1, 2, 1}}, false)), eTqovixVerdict9, eTqovixVerdict9},
        VerdictRow{"AlreadyProcessed", Atom("OP01", AfPayload({}, true)), eTqovixVerdict20, eTqovixVerdict20}),
    RowName<VerdictRow>);

}  // namespace
