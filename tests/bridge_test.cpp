// The bridge to the processing library: codes, trampolines, records, and the real library's answers.
#include <gtest/gtest.h>

#include "ByteWriter.h"
#include "MakerData.h"
#include "bridge/TqovixInterfaceConvert.h"
#include "support/OvixHarness.h"
#include "support/TestSupport.h"

#include <cstring>
#include <ostream>
#include <string>
#include <tuple>

namespace TC = TqovixInterfaceConvert;
using moviekit::Bytes;
using UL = unsigned long;
using Audio = TC::TqovixAudioInformation;

namespace {

using testsupport::PrintTo;

TEST(BridgeConversion, CodesBothWays)
{
    const std::pair<int32_t, UL> both[] = {{0, 0},       {154, 30},   {4352, 100}, {4353, 110}, {4354, 111},
                                           {4355, 120}, {4356, 121}, {4357, 130}, {4358, 131}, {4608, 200}};
    for (const auto& [internal, library] : both) {
        EXPECT_EQ(TC::ConvertToLibraryError(static_cast<eTqovixErrorCode>(internal)), library) << internal;
        EXPECT_EQ(TC::ConvertToLocalError(library), internal) << library;
    }
    EXPECT_EQ(TC::ConvertToLibraryError(eTqovixFinished), 0u);
    // Everything else is a failure, verdicts too; coming back, verdicts outside their query and
    // high bits too are general.
    for (int32_t internal : {1, 17, 4359, -1}) {
        EXPECT_EQ(TC::ConvertToLibraryError(static_cast<eTqovixErrorCode>(internal)), 190u) << internal;
    }
    for (UL library : {190ul, 5ul, (1ul << 32) + 30}) {
        EXPECT_EQ(TC::ConvertToLocalError(library), eTqovixErrorGeneral) << library;
    }
}

// With nothing registered a trampoline fails rather than calling through null.
TEST(BridgeTrampoline, NothingRegisteredGives190)
{
    TC::g_pfnInputAFInformationFunc = TC::g_pfnInputAudioLevelInformationFunc = TC::g_pfnInputAudioFunc = nullptr;
    TC::g_pfnOutputAudioFunc = nullptr;
    TC::g_pfnNotifyProgressFunc = nullptr;
    uint8_t buffer[8] = {};
    UL delivered = 0;
    for (auto* trampoline : {TC::InputAFInformationFunc, TC::InputAudioLevelInformationFunc, TC::InputAudioFunc}) {
        EXPECT_EQ(trampoline(buffer, &delivered, sizeof buffer, 0), 190u);
    }
    EXPECT_EQ(TC::OutputAudioFunc(buffer, sizeof buffer), 190u);
    TC::NotifyProgressFunc(1, 2);
}

TEST(BridgeRecords, LibraryFormsCarryTheirSizeAndFieldsInOrder)
{
    constexpr uint64_t kOne = 0x1111111111111111;
    const auto audio = TC::MakeLibraryRecord(Audio{kOne, 2 * kOne, 3 * kOne, 4 * kOne, 0x55667788, 5 * kOne, true});
    const auto trim = TC::MakeLibraryRecord(TC::TqovixTrimInformation{6 * kOne, 7 * kOne, 8 * kOne, 9 * kOne});
    // audio's eight (the sixth: start offset, zero padding; then the exact rate and the float flag), trim's five
    std::vector<uint64_t> words(13);
    std::memcpy(words.data(), &audio, 64);
    std::memcpy(words.data() + 8, &trim, 40);
    EXPECT_EQ(words, (std::vector<uint64_t>{64, kOne, 2 * kOne, 3 * kOne, 4 * kOne, 0x55667788, 5 * kOne, 1, 40,
                                            6 * kOne, 7 * kOne, 8 * kOne, 9 * kOne}));
}

Bytes AfBlock(std::vector<moviekit::AfInterval> intervals, bool processed = false, const char* type = "OP01")
{
    return moviekit::Atom(type, moviekit::MakeAfInformation(48000, intervals, processed));
}

// The engine's side: the AF block from memory, silence for audio.
Bytes g_af;

class BridgeSession : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ(TC::TqovixLibraryInitialize(), eTqovixSuccess);
        TC::TqovixSetCallbackInputAFInformation([](void* buffer, UL* delivered, UL size, UL) {
            *delivered = buffer == nullptr ? g_af.size() : std::min<size_t>(size, g_af.size());
            std::copy_n(g_af.begin(), buffer == nullptr ? 0 : *delivered, static_cast<uint8_t*>(buffer));
            return eTqovixSuccess;
        });
        TC::TqovixSetCallbackInputAudioLevelInformation([](void*, UL* delivered, UL, UL) {
            *delivered = 0;
            return eTqovixNoAudioLevel;
        });
        TC::TqovixSetCallbackInputAudio([](void* buffer, UL* delivered, UL size, UL) {
            return std::memset(buffer, 0, *delivered = size), eTqovixSuccess;
        });
        TC::TqovixSetCallbackOutputAudio([](const void*, UL) { return eTqovixFinished; });
        TC::TqovixSetCallbackNotifyProgress([](UL, UL) {});
    }
    void TearDown() override { TC::TqovixLibraryClose(); }
};

// Refusals and calls without a session are general failures.
TEST_F(BridgeSession, CallsOutOfTurnAreGeneralFailures)
{
    EXPECT_EQ(TC::TqovixLibraryInitialize(), eTqovixErrorGeneral) << "already initialised";
    EXPECT_EQ(TC::TqovixOpenSession(Audio{48, 2, 20, 100}, {}), eTqovixErrorGeneral);
    EXPECT_EQ(TC::TqovixIsSessionFinished(), eTqovixErrorGeneral);
    uint8_t out[16];
    UL count = 0;
    EXPECT_EQ(TC::TqovixGetProcessedAFInfo(out, sizeof out, &count), eTqovixErrorGeneral);
}

struct SessionRow {
    const char* name;
    Bytes (*block)();
    eTqovixErrorCode isEnable;  // and the end of the session when it is a verdict
};

class BridgeSessionRow : public BridgeSession, public testing::WithParamInterface<SessionRow> {};

TEST_P(BridgeSessionRow, VerdictEndsTheSessionAndProcessedPiecesFollowAcceptance)
{
    const eTqovixErrorCode isEnable = GetParam().isEnable;
    const bool enabled = isEnable == eTqovixEnable;
    g_af = GetParam().block();
    EXPECT_EQ(TC::TqovixIsEnable(g_af.data(), g_af.size()), isEnable);
    ASSERT_EQ(TC::TqovixOpenSession(Audio{48, 3, 16, 1500}, {}), eTqovixSuccess);
    eTqovixErrorCode state = eTqovixRunning;
    EXPECT_TRUE(ovixtest::WaitFor([&] { return (state = TC::TqovixIsSessionFinished()) != eTqovixRunning; }));
    EXPECT_EQ(state, enabled ? eTqovixFinished : isEnable);
    // 44 bytes: two full pieces, then the last, marked processed; none after a refusal.
    uint8_t out[16];
    UL count = 0;
    Bytes read;
    for (eTqovixErrorCode piece : {eTqovixRunning, eTqovixRunning, eTqovixFinished}) {
        count = 0;
        EXPECT_EQ(TC::TqovixGetProcessedAFInfo(out, sizeof out, &count), enabled ? piece : eTqovixErrorGeneral);
        read.insert(read.end(), out, out + count);
    }
    EXPECT_EQ(read, enabled ? AfBlock({{10, 20, 500}}, true) : Bytes{});
    TC::TqovixCloseSession(eTqovixFinished);
}

INSTANTIATE_TEST_SUITE_P(
    Blocks, BridgeSessionRow,
    testing::Values(SessionRow{"Accepted", [] { return AfBlock({{10, 20, 500}}); }, eTqovixEnable},
                    SessionRow{"NoAfInformation", [] { return moviekit::Atom("OP01", {1, 2}); }, eTqovixVerdict7},
                    SessionRow{"NotAnAfBlock", [] { return AfBlock({}, false, "OP02"); }, eTqovixVerdict8},
                    SessionRow{"Malformed", [] { return AfBlock({{5, 6, 1}, {1, 2, 1}}); }, eTqovixVerdict9},
                    SessionRow{"AlreadyProcessed", [] { return AfBlock({}, true); }, eTqovixVerdict20}),
    testsupport::ByName);

}  // namespace
