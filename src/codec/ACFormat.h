// The audio pipeline's own description of a stream, which the codec adapter fills and
// the converter wrapper maps onto the platform's stream description.
#pragma once

#include <cstdint>

enum eACFormatID : uint32_t {
    ACFormatAAC = 1,
    ACFormatLinearPCM = 2,
};

struct ACFormat {
    double sampleRate = 0;  // hertz
    eACFormatID formatID{};
    // Bits 0 to 6 as in the platform's flags: float, big-endian, signed integer, packed,
    // aligned high, non-interleaved, non-mixable. Higher bits mean nothing.
    uint32_t formatFlags = 0;
    uint32_t bytesPerPacket = 0;  // 0 for variable-size packets (AAC)
    uint32_t framesPerPacket = 0;
    uint32_t bytesPerFrame = 0;
    uint32_t channelsPerFrame = 0;
    uint32_t bitsPerChannel = 0;
};
