// AAC pieces of a sound track: the AudioSpecificConfig, the "esds" descriptor chain
// that carries it, and silent raw AAC-LC packets padded to chosen sizes.
#pragma once

#include "ByteWriter.h"

#include <cstdint>
#include <optional>

namespace moviekit {

inline constexpr uint32_t kAacFramesPerPacket = 1024;

// AAC-LC (object type 2 unless given); rates outside the index table use the escape form.
Bytes MakeAudioSpecificConfig(uint32_t sampleRate, uint16_t channels, uint8_t objectType = 2);

struct EsdsRecipe {
    uint8_t objectType = 0x40;  // MPEG-4 audio
    uint8_t streamType = 0x15;  // audio stream, upstream 0, reserved 1
    uint32_t bufferSize = 6144; // 24 bits
    std::optional<uint32_t> maxBitRate;      // unset: taken from the packets
    std::optional<uint32_t> averageBitRate;  // unset: taken from the packets
    uint8_t esFlags = 0;  // dependsOn/URL/OCR flags add their fields; priority bits add nothing
    bool longSizes = false;  // sizes as 0x80 0x80 0x80 n instead of one byte
    bool profileLevelAfterConfig = false;  // an extra descriptor inside DecoderConfigDescriptor
    std::optional<Bytes> audioSpecificConfig;  // unset: built from rate and channels
    std::optional<Bytes> rawPayload;  // the whole "esds" payload, for malformed cases
};

// The "esds" payload (version and flags included) with the bit rates already resolved.
Bytes MakeEsdsPayload(const EsdsRecipe& recipe, const Bytes& audioSpecificConfig, uint32_t maxBitRate,
                      uint32_t averageBitRate);

// A raw_data_block that decodes to silence: one SCE (mono) or CPE (stereo) with no spectral
// bands, then a fill element of `fillBytes` (0..269) bytes, then END. Fill bytes follow `seed`.
Bytes MakeSilentAacPacket(uint16_t channels, uint32_t fillBytes, uint64_t seed);
uint32_t SilentAacPacketSize(uint16_t channels, uint32_t fillBytes);
inline constexpr uint32_t kMaxAacFillBytes = 269;

}  // namespace moviekit
