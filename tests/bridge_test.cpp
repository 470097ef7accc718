// The bridge to the processing library: conversion tables, trampolines, records, and the
// results of the real library as the bridge reports them.
#include <gtest/gtest.h>

#include "ByteWriter.h"
#include "MakerData.h"
#include "bridge/TqovixInterfaceConvert.h"
#include "support/OvixHarness.h"

#include <cstring>
#include <tuple>

namespace TC = TqovixInterfaceConvert;
using moviekit::Bytes;
using UL = unsigned long;
using Audio = TC::TqovixAudioInformation;

namespace {

TEST(BridgeConversion, CodesBothWays)
{
    using CodeRows = std::vector<std::pair<int32_t, UL>>;  // internal, library
    const CodeRows toLibrary = {{0, 0}, {2, 0}, {154, 30}, {4352, 100}, {4353, 110}, {4354, 111}, {4355, 120},
                                {4356, 121}, {4357, 130}, {4358, 131}, {4608, 200},
                                // everything else is a failure
                                {1, 190}, {17, 190}, {19, 190}, {156, 190}, {4359, 190}, {4360, 190}, {4361, 190},
                                {8192, 190}, {8198, 190}, {12288, 190}, {36864, 190}, {-1, 190}};
    for (const auto& [internal, library] : toLibrary) {
        EXPECT_EQ(TC::ConvertToLibraryError(static_cast<eTqovixErrorCode>(internal)), library) << internal;
    }
    const CodeRows toInternal = {{0, 0}, {154, 30}, {4352, 100}, {4353, 110}, {4354, 111}, {4355, 120},
                                 {4356, 121}, {4357, 130}, {4358, 131}, {4608, 200},
                                 // everything else, verdicts outside their query and high bits too, is general
                                 {4361, 190}, {4361, 5}, {4361, 1}, {4361, 8}, {4361, (1ul << 32) + 30},
                                 {4361, 1ul << 32}};
    for (const auto& [internal, library] : toInternal) {
        EXPECT_EQ(TC::ConvertToLocalError(library), internal) << library;
    }
}

// What the last callback behind a trampoline was given.
using Call = std::tuple<const void*, UL*, UL, UL>;
Call g_call;

TEST(BridgeTrampoline, NullGives190ElseForwardsAndConverts)
{
    const std::tuple<const char*, UL (*)(void*, UL*, UL, UL), TC::InputFunc*> inputs[] = {
        {"AFInformation", TC::InputAFInformationFunc, &TC::g_pfnInputAFInformationFunc},
        {"AudioLevel", TC::InputAudioLevelInformationFunc, &TC::g_pfnInputAudioLevelInformationFunc},
        {"Audio", TC::InputAudioFunc, &TC::g_pfnInputAudioFunc},
    };
    uint8_t buffer[8] = {};
    UL delivered = 0;
    for (const auto& [name, trampoline, global] : inputs) {
        *global = nullptr;
        EXPECT_EQ(trampoline(buffer, &delivered, sizeof buffer, 0), 190u) << name;
        *global = [](void* data, UL* count, UL size, UL skip) {
            g_call = {data, count, size, skip};
            return eTqovixErrorAborted;
        };
        EXPECT_EQ(trampoline(buffer, &delivered, 77, 5), 200u) << name;
        EXPECT_EQ(g_call, Call(buffer, &delivered, 77, 5)) << name;
        *global = nullptr;
    }

    TC::g_pfnOutputAudioFunc = nullptr;
    EXPECT_EQ(TC::OutputAudioFunc(buffer, sizeof buffer), 190u);
    TC::g_pfnOutputAudioFunc = [](const void* data, UL size) {
        g_call = {data, nullptr, size, 0};
        return eTqovixFinished;
    };
    EXPECT_EQ(TC::OutputAudioFunc(buffer, 6), 0u);
    EXPECT_EQ(g_call, Call(buffer, nullptr, 6, 0));
    TC::g_pfnOutputAudioFunc = nullptr;

    TC::g_pfnNotifyProgressFunc = [](UL done, UL total) { g_call = {nullptr, nullptr, done, total}; };
    TC::NotifyProgressFunc(1ul << 40, 7);
    EXPECT_EQ(g_call, Call(nullptr, nullptr, 1ul << 40, 7));
    TC::g_pfnNotifyProgressFunc = nullptr;
    TC::NotifyProgressFunc(1, 2);  // nothing registered: must not call through null
}

TEST(BridgeRecords, LibraryFormsCarryTheirSizeAndFieldsInOrder)
{
    constexpr uint64_t kOne = 0x1111111111111111;
    const auto audio = TC::MakeLibraryRecord(Audio{kOne, 2 * kOne, 3 * kOne, 4 * kOne, 0x55667788});
    const auto trim = TC::MakeLibraryRecord(TC::TqovixTrimInformation{6 * kOne, 7 * kOne, 8 * kOne, 9 * kOne});
    // Audio's six words (the last: start offset, zero padding), then trim's five.
    std::vector<uint64_t> words(11);
    std::memcpy(words.data(), &audio, 48);
    std::memcpy(words.data() + 6, &trim, 40);
    EXPECT_EQ(words, (std::vector<uint64_t>{48, kOne, 2 * kOne, 3 * kOne, 4 * kOne, 0x55667788, 40, 6 * kOne,
                                            7 * kOne, 8 * kOne, 9 * kOne}));
}

Bytes AfBlock(std::vector<moviekit::AfInterval> intervals, bool processed = false, const char* type = "OP01")
{
    return moviekit::Atom(type, moviekit::MakeAfInformation(48000, intervals, processed));
}

// The engine's side: memory served through the system-form callbacks.
struct SystemSide {
    Bytes af;
    Bytes pcm;
    size_t pcmAt = 0;
    eTqovixErrorCode audioAnswer = eTqovixSuccess;  // aborted: also aborts the session first
    eTqovixErrorCode stateInside = eTqovixSuccess;
    Bytes pushed;  // processed: only its length is known
    std::pair<UL, UL> lastNote;
};
SystemSide* g_system = nullptr;

class BridgeSession : public ::testing::Test {
protected:
    void SetUp() override
    {
        g_system = &m_system;
        ASSERT_EQ(TC::TqovixLibraryInitialize(), eTqovixSuccess);
        // The library reads the block whole after asking for its size.
        TC::TqovixSetCallbackInputAFInformation([](void* buffer, UL* delivered, UL size, UL) {
            *delivered = buffer == nullptr ? g_system->af.size() : std::min<size_t>(size, g_system->af.size());
            std::copy_n(g_system->af.begin(), buffer == nullptr ? 0 : *delivered, static_cast<uint8_t*>(buffer));
            return eTqovixSuccess;
        });
        TC::TqovixSetCallbackInputAudioLevelInformation([](void*, UL* delivered, UL, UL) {
            *delivered = 0;
            return eTqovixNoAudioLevel;
        });
        TC::TqovixSetCallbackInputAudio([](void* buffer, UL* delivered, UL size, UL) {
            SystemSide& s = *g_system;
            s.stateInside = TC::TqovixIsSessionFinished();
            if (s.audioAnswer == eTqovixErrorAborted) {
                TC::TqovixAbortSession();
            }
            *delivered = std::min<size_t>(size, s.pcm.size() - s.pcmAt);
            std::copy_n(s.pcm.begin() + s.pcmAt, *delivered, static_cast<uint8_t*>(buffer));
            s.pcmAt += *delivered;
            return s.audioAnswer;
        });
        TC::TqovixSetCallbackOutputAudio([](const void* data, UL size) {
            g_system->pushed.insert(g_system->pushed.end(), static_cast<const uint8_t*>(data),
                                    static_cast<const uint8_t*>(data) + size);
            return eTqovixFinished;  // which the library must take as success
        });
        TC::TqovixSetCallbackNotifyProgress([](UL done, UL total) { g_system->lastNote = {done, total}; });
    }
    void TearDown() override
    {
        TC::TqovixLibraryClose();
        g_system = nullptr;
    }

    SystemSide m_system;
};

// Refusals and calls without a session are general failures; verdicts, states and processed pieces
// are mapped to internal codes.
TEST_F(BridgeSession, RefusalsVerdictsStatesAndProcessedPiecesAreMapped)
{
    EXPECT_EQ(TC::TqovixLibraryInitialize(), eTqovixErrorGeneral) << "already initialised";
    EXPECT_EQ(TC::TqovixOpenSession(Audio{48, 2, 24, 100}, {}), eTqovixErrorGeneral);
    EXPECT_EQ(TC::TqovixIsSessionFinished(), eTqovixErrorGeneral);
    uint8_t out[16];
    UL count = 0;
    EXPECT_EQ(TC::TqovixGetProcessedAFInfo(out, sizeof out, &count), eTqovixErrorGeneral);

    const Bytes accepted = AfBlock({{10, 20, 500}});
    // name, block, IsEnable, audio callback's answer, end of the session
    const std::vector<std::tuple<const char*, Bytes, eTqovixErrorCode, eTqovixErrorCode, eTqovixErrorCode>> rows = {
        {"Accepted", accepted, eTqovixEnable, eTqovixSuccess, eTqovixFinished},
        {"FailedCallback", accepted, eTqovixEnable, eTqovixErrorInvalidMovie, eTqovixErrorGeneral},
        {"AbortedInsideACallback", accepted, eTqovixEnable, eTqovixErrorAborted, eTqovixErrorAborted},
        {"NoAfInformation", moviekit::Atom("OP01", {1, 2}), eTqovixVerdict7, eTqovixSuccess, eTqovixVerdict7},
        {"NotAnAfBlock", AfBlock({}, false, "OP02"), eTqovixVerdict8, eTqovixSuccess, eTqovixVerdict8},
        {"Malformed", AfBlock({{5, 6, 1}, {1, 2, 1}}), eTqovixVerdict9, eTqovixSuccess, eTqovixVerdict9},
        {"AlreadyProcessed", AfBlock({}, true), eTqovixVerdict20, eTqovixSuccess, eTqovixVerdict20},
    };
    for (const auto& [name, block, isEnable, audioAnswer, end] : rows) {
        const bool enabled = isEnable == eTqovixEnable;
        m_system = SystemSide{};
        m_system.af = block;
        m_system.audioAnswer = audioAnswer;
        for (size_t i = 0; i < 3 * 1500 * 2; ++i) {
            m_system.pcm.push_back(static_cast<uint8_t>(i * 31));
        }
        EXPECT_EQ(TC::TqovixIsEnable(const_cast<uint8_t*>(block.data()), block.size()), isEnable) << name;
        ASSERT_EQ(TC::TqovixOpenSession(Audio{48, 3, 16, 1500}, {}), eTqovixSuccess) << name;
        eTqovixErrorCode state = eTqovixRunning;
        EXPECT_TRUE(ovixtest::WaitFor([&] { return (state = TC::TqovixIsSessionFinished()) != eTqovixRunning; }));
        EXPECT_EQ(state, end) << name;
        // 44 bytes: two full pieces, then the last, marked processed; none after a refusal.
        Bytes read;
        for (eTqovixErrorCode piece : {eTqovixRunning, eTqovixRunning, eTqovixFinished}) {
            count = 0;
            EXPECT_EQ(TC::TqovixGetProcessedAFInfo(out, sizeof out, &count), enabled ? piece : eTqovixErrorGeneral);
            read.insert(read.end(), out, out + count);
        }
        EXPECT_EQ(read, enabled ? AfBlock({{10, 20, 500}}, true) : Bytes{}) << name;
        TC::TqovixCloseSession(eTqovixFinished);
        EXPECT_EQ(m_system.stateInside, enabled ? eTqovixRunning : eTqovixSuccess) << name;
        // The record's fields arrive where they belong: 16 bits are accepted, every byte of
        // three channels comes back, the sample count ends the progress.
        if (end == eTqovixFinished) {
            EXPECT_EQ(m_system.pushed.size(), m_system.pcm.size());
            EXPECT_EQ(m_system.lastNote, std::make_pair(1500ul, 1500ul));
        }
    }
}

}  // namespace
