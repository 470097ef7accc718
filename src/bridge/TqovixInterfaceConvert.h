// The only code that calls the processing library: one wrapper per library function under
// the library's own name, the records handed to it, the callback trampolines and the
// conversions between its result codes and ours.
#pragma once

#include "bridge/TqovixErrorCode.h"

#include <ovix/Ovix.h>

#include <cstdint>

namespace TqovixInterfaceConvert {

// What the rest of the system fills; the library's own form adds a leading size field.
struct TqovixAudioInformation {
    uint64_t sampleRate = 0;  // kHz, integer
    uint64_t channels = 0;
    uint64_t bitsPerSample = 0;
    uint64_t sampleCount = 0;  // PCM sample frames
    uint32_t startOffset = 0;  // frames
    // Ours: what the kHz and the bits alone do not say.
    uint64_t sampleRateHz = 0;  // the exact rate; 0 leaves it to sampleRate
    bool floatingPoint = false;  // IEEE floats of bitsPerSample bits, else signed integers
};

struct TqovixTrimInformation {
    uint64_t frameRateNumerator = 0;
    uint64_t frameRateDenominator = 0;
    uint64_t removedFrameForward = 0;
    uint64_t removedFrameBackward = 0;
};

using InputFunc = eTqovixErrorCode (*)(void*, unsigned long*, unsigned long, unsigned long);
using OutputFunc = eTqovixErrorCode (*)(const void*, unsigned long);
using NotifyFunc = void (*)(unsigned long, unsigned long);

// Written only while the engine initialises, before any session exists; the trampolines
// read them without a lock.
extern InputFunc g_pfnInputAFInformationFunc;
extern InputFunc g_pfnInputAudioLevelInformationFunc;
extern InputFunc g_pfnInputAudioFunc;
extern OutputFunc g_pfnOutputAudioFunc;
extern NotifyFunc g_pfnNotifyProgressFunc;

eTqovixErrorCode TqovixLibraryInitialize();
void TqovixLibraryClose();
// 17 accepts; 18, 19, 20 and 153 are the library's verdicts 7, 8, 9 and 20.
eTqovixErrorCode TqovixIsEnable(void* block, unsigned long size);
eTqovixErrorCode TqovixOpenSession(const TqovixAudioInformation& audio, const TqovixTrimInformation& trim);
// 1 running, 2 finished, otherwise a verdict or an error.
eTqovixErrorCode TqovixIsSessionFinished();
// 1 a piece was delivered and more remain, 2 the last piece was delivered.
eTqovixErrorCode TqovixGetProcessedAFInfo(void* buffer, unsigned long size, unsigned long* count);
void TqovixAbortSession();
void TqovixCloseSession(eTqovixErrorCode code);

// Each stores the callback, then registers the matching trampoline with the library.
void TqovixSetCallbackInputAFInformation(InputFunc callback);
void TqovixSetCallbackInputAudioLevelInformation(InputFunc callback);
void TqovixSetCallbackInputAudio(InputFunc callback);
void TqovixSetCallbackOutputAudio(OutputFunc callback);
void TqovixSetCallbackNotifyProgress(NotifyFunc callback);

// The trampolines the library calls: 190 when nothing is registered, otherwise the
// callback's result as a library code.
unsigned long InputAFInformationFunc(void* buffer, unsigned long* delivered, unsigned long size, unsigned long skip);
unsigned long InputAudioLevelInformationFunc(void* buffer, unsigned long* delivered, unsigned long size,
                                             unsigned long skip);
unsigned long InputAudioFunc(void* buffer, unsigned long* delivered, unsigned long size, unsigned long skip);
unsigned long OutputAudioFunc(void* data, unsigned long size);
void NotifyProgressFunc(unsigned long first, unsigned long second);

// The library-form records, size fields set and fields copied in order.
::TqovixAudioInformation MakeLibraryRecord(const TqovixAudioInformation& audio);
::TqovixTrimInformation MakeLibraryRecord(const TqovixTrimInformation& trim);

unsigned long ConvertToLibraryError(eTqovixErrorCode code);
eTqovixErrorCode ConvertToLocalError(unsigned long code);

}  // namespace TqovixInterfaceConvert
