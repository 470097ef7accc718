// The sound-processing library's interface: thirteen functions, two records, five callback
// shapes and its result codes. Hosts link it by its run-path name, libOVIX.so.
//
// ABI: C++ linkage with exactly these declarations (unsigned long, records by const reference),
// because that is how hosts declare them; the mangled names are the binary interface.
#pragma once

#include <cstddef>

#define OVIX_API __attribute__((visibility("default")))

// The largest AF or audio level block (atom header included) the library reads; hosts refuse
// larger ones before loading them.
inline constexpr unsigned long kOvixMaxBlockSize = 16ul << 20;

// Library-form records: a size field first, so a host built against another layout is refused.
// Sound moves interleaved and packed, in host byte order (little-endian), each sample
// bitsPerSample bits wide; what the library pushes back has the format it pulled.
struct TqovixAudioInformation {
    unsigned long size;  // 64; 48 from hosts of the first layout, which ends at `padding`
    unsigned long sampleRate;  // kHz, integer: 48 for 48 000 Hz, 44 for 44 100 Hz
    unsigned long channels;
    unsigned long bitsPerSample;  // 16, 24 or 32 for signed integers; 32 or 64 for floats
    unsigned long sampleCount;  // PCM sample frames of the track
    unsigned int startOffset;  // frames; a wrapped negative difference is taken as negative
    unsigned int padding;
    // Added to the first layout (a 48-byte record means 16-bit integers at sampleRate's kHz):
    unsigned long sampleRateHz;  // the exact rate; 0 takes it from sampleRate
    unsigned long floatingPoint;  // 1: IEEE floats; 0: signed integers
};

struct TqovixTrimInformation {
    unsigned long size;  // 40
    unsigned long frameRateNumerator;
    unsigned long frameRateDenominator;
    unsigned long removedFrameForward;
    unsigned long removedFrameBackward;
};

static_assert(sizeof(TqovixAudioInformation) == 64 && offsetof(TqovixAudioInformation, startOffset) == 40 &&
              offsetof(TqovixAudioInformation, sampleRateHz) == 48);
// The first layout's size: hosts that send it are served 16-bit integer sound.
inline constexpr unsigned long kOvixFirstAudioRecordSize = 48;
static_assert(sizeof(TqovixTrimInformation) == 40 && offsetof(TqovixTrimInformation, removedFrameBackward) == 32);

// Input: buffer (null asks for the total size), out: bytes delivered, buffer size, bytes to skip.
using TqovixInputCallback = unsigned long (*)(void*, unsigned long*, unsigned long, unsigned long);
using TqovixOutputCallback = unsigned long (*)(void*, unsigned long);
using TqovixProgressCallback = void (*)(unsigned long, unsigned long);

namespace ovix {

inline constexpr unsigned long kSuccess = 0;
inline constexpr unsigned long kSessionFinished = 1;  // TqovixIsSessionFinished
inline constexpr unsigned long kLastPiece = 1;  // TqovixGetProcessedAFInfo
inline constexpr unsigned long kVerdictNoAfInformation = 7;
inline constexpr unsigned long kVerdictNotAfBlock = 8;
inline constexpr unsigned long kVerdictMalformed = 9;
inline constexpr unsigned long kVerdictAlreadyProcessed = 20;
inline constexpr unsigned long kNoAudioLevel = 30;
inline constexpr unsigned long kOutOfMemory = 100;
inline constexpr unsigned long kFailure = 190;
inline constexpr unsigned long kAborted = 200;

}  // namespace ovix

OVIX_API unsigned long TqovixLibraryInitialize();
OVIX_API unsigned long TqovixLibraryClose();
// `block` is the whole "OP01" atom, header included.
OVIX_API unsigned long TqovixIsEnable(void* block, unsigned long size);
OVIX_API unsigned long TqovixOpenSession(const TqovixAudioInformation& audio, const TqovixTrimInformation& trim);
OVIX_API unsigned long TqovixIsSessionFinished();
OVIX_API unsigned long TqovixGetProcessedAFInfo(void* buffer, unsigned long size, unsigned long* count);
OVIX_API unsigned long TqovixAbortSession();
OVIX_API unsigned long TqovixCloseSession(unsigned long code);
OVIX_API unsigned long TqovixSetCallbackInputAFInformation(TqovixInputCallback callback);
OVIX_API unsigned long TqovixSetCallbackInputAudioLevelInformation(TqovixInputCallback callback);
OVIX_API unsigned long TqovixSetCallbackInputAudio(TqovixInputCallback callback);
OVIX_API unsigned long TqovixSetCallbackOutputAudio(TqovixOutputCallback callback);
OVIX_API unsigned long TqovixSetCallbackNotifyProgress(TqovixProgressCallback callback);
