#include "bridge/TqovixInterfaceConvert.h"

#include "bridge/TqovixCodeTable.h"

#include <new>

namespace TqovixInterfaceConvert {

InputFunc g_pfnInputAFInformationFunc = nullptr;
InputFunc g_pfnInputAudioLevelInformationFunc = nullptr;
InputFunc g_pfnInputAudioFunc = nullptr;
OutputFunc g_pfnOutputAudioFunc = nullptr;
NotifyFunc g_pfnNotifyProgressFunc = nullptr;

namespace {

// The processing library's thread runs our callbacks: nothing thrown may unwind into it.
template <typename Call>
unsigned long Shielded(Call&& call) noexcept
{
    try {
        return call();
    } catch (const std::bad_alloc&) {
        return ovix::kOutOfMemory;
    } catch (...) {
        return ovix::kFailure;
    }
}

unsigned long CallInput(InputFunc callback, void* buffer, unsigned long* delivered, unsigned long size,
                        unsigned long skip)
{
    if (callback == nullptr) {
        return ovix::kFailure;
    }
    return Shielded([&] { return ConvertToLibraryError(callback(buffer, delivered, size, skip)); });
}

}  // namespace

eTqovixErrorCode TqovixLibraryInitialize()
{
    return ConvertToLocalError(::TqovixLibraryInitialize());
}

void TqovixLibraryClose()
{
    ::TqovixLibraryClose();
}

eTqovixErrorCode TqovixIsEnable(void* block, unsigned long size)
{
    const unsigned long code = ::TqovixIsEnable(block, size);
    return code == ovix::kSuccess ? eTqovixEnable : TqovixCodes::FromLibrary(code, true);
}

eTqovixErrorCode TqovixOpenSession(const TqovixAudioInformation& audio, const TqovixTrimInformation& trim)
{
    return ConvertToLocalError(::TqovixOpenSession(MakeLibraryRecord(audio), MakeLibraryRecord(trim)));
}

eTqovixErrorCode TqovixIsSessionFinished()
{
    switch (const unsigned long code = ::TqovixIsSessionFinished()) {
    case 0: return eTqovixRunning;
    case ovix::kSessionFinished: return eTqovixFinished;
    default: return TqovixCodes::FromLibrary(code, true);
    }
}

eTqovixErrorCode TqovixGetProcessedAFInfo(void* buffer, unsigned long size, unsigned long* count)
{
    switch (const unsigned long code = ::TqovixGetProcessedAFInfo(buffer, size, count)) {
    case 0: return eTqovixRunning;
    case ovix::kLastPiece: return eTqovixFinished;
    default: return ConvertToLocalError(code);
    }
}

void TqovixAbortSession()
{
    ::TqovixAbortSession();
}

void TqovixCloseSession(eTqovixErrorCode code)
{
    ::TqovixCloseSession(ConvertToLibraryError(code));
}

void TqovixSetCallbackInputAFInformation(InputFunc callback)
{
    g_pfnInputAFInformationFunc = callback;
    ::TqovixSetCallbackInputAFInformation(InputAFInformationFunc);
}

void TqovixSetCallbackInputAudioLevelInformation(InputFunc callback)
{
    g_pfnInputAudioLevelInformationFunc = callback;
    ::TqovixSetCallbackInputAudioLevelInformation(InputAudioLevelInformationFunc);
}

void TqovixSetCallbackInputAudio(InputFunc callback)
{
    g_pfnInputAudioFunc = callback;
    ::TqovixSetCallbackInputAudio(InputAudioFunc);
}

void TqovixSetCallbackOutputAudio(OutputFunc callback)
{
    g_pfnOutputAudioFunc = callback;
    ::TqovixSetCallbackOutputAudio(OutputAudioFunc);
}

void TqovixSetCallbackNotifyProgress(NotifyFunc callback)
{
    g_pfnNotifyProgressFunc = callback;
    ::TqovixSetCallbackNotifyProgress(NotifyProgressFunc);
}

unsigned long InputAFInformationFunc(void* buffer, unsigned long* delivered, unsigned long size, unsigned long skip)
{
    return CallInput(g_pfnInputAFInformationFunc, buffer, delivered, size, skip);
}

unsigned long InputAudioLevelInformationFunc(void* buffer, unsigned long* delivered, unsigned long size,
                                             unsigned long skip)
{
    return CallInput(g_pfnInputAudioLevelInformationFunc, buffer, delivered, size, skip);
}

unsigned long InputAudioFunc(void* buffer, unsigned long* delivered, unsigned long size, unsigned long skip)
{
    return CallInput(g_pfnInputAudioFunc, buffer, delivered, size, skip);
}

unsigned long OutputAudioFunc(void* data, unsigned long size)
{
    if (g_pfnOutputAudioFunc == nullptr) {
        return ovix::kFailure;
    }
    return Shielded([&] { return ConvertToLibraryError(g_pfnOutputAudioFunc(data, size)); });
}

void NotifyProgressFunc(unsigned long first, unsigned long second)
{
    if (g_pfnNotifyProgressFunc != nullptr) {
        Shielded([&] {
            g_pfnNotifyProgressFunc(first, second);
            return 0ul;
        });
    }
}

::TqovixAudioInformation MakeLibraryRecord(const TqovixAudioInformation& audio)
{
    ::TqovixAudioInformation record{};
    record.size = sizeof record;
    record.sampleRate = audio.sampleRate;
    record.channels = audio.channels;
    record.bitsPerSample = audio.bitsPerSample;
    record.sampleCount = audio.sampleCount;
    record.startOffset = audio.startOffset;
    record.sampleRateHz = audio.sampleRateHz;
    record.floatingPoint = audio.floatingPoint ? 1 : 0;
    return record;
}

::TqovixTrimInformation MakeLibraryRecord(const TqovixTrimInformation& trim)
{
    ::TqovixTrimInformation record{};
    record.size = sizeof record;
    record.frameRateNumerator = trim.frameRateNumerator;
    record.frameRateDenominator = trim.frameRateDenominator;
    record.removedFrameForward = trim.removedFrameForward;
    record.removedFrameBackward = trim.removedFrameBackward;
    return record;
}

unsigned long ConvertToLibraryError(eTqovixErrorCode code) { return TqovixCodes::Library(code); }

eTqovixErrorCode ConvertToLocalError(unsigned long code) { return TqovixCodes::FromLibrary(code, false); }

}  // namespace TqovixInterfaceConvert
