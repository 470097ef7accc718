// What an AudioConverterRef points at: one converter of either direction behind the
// C entry points, which check the arguments they can before dispatching.
#pragma once

#include <AudioToolbox/AudioConverter.h>

struct OpaqueAudioConverter {
    OpaqueAudioConverter() = default;
    OpaqueAudioConverter(const OpaqueAudioConverter&) = delete;
    OpaqueAudioConverter& operator=(const OpaqueAudioConverter&) = delete;
    virtual ~OpaqueAudioConverter() = default;

    virtual OSStatus GetProperty(AudioConverterPropertyID id, UInt32* size, void* data) = 0;
    virtual OSStatus SetProperty(AudioConverterPropertyID id, UInt32 size, const void* data) = 0;
    // `output` has exactly one buffer with non-null data.
    virtual OSStatus Fill(AudioConverterComplexInputDataProc proc, void* userData, UInt32* packets,
                          AudioBufferList* output, AudioStreamPacketDescription* descriptions) = 0;
};

namespace atcompat {

// Copies a fixed-size property value out, checking the caller's room for it.
OSStatus CopyPropertyOut(const void* value, UInt32 valueSize, UInt32* size, void* data);

}  // namespace atcompat
