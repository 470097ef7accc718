// Typed reader of a sound track's sample description: the first entry of "stsd"
// in its QuickTime versions 0, 1 and 2 (ISO files write the version-0 layout),
// and the AAC decoder configuration found among its children ("esds", also
// inside QuickTime's "wave").
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <vector>

#include "atom/TqovixAtomType.h"

namespace TqovixSoundEntry {

struct Entry {
    eTqovixAtomType format{};
    uint16_t version = 0;
    uint32_t channels = 0;
    uint32_t bitsPerChannel = 0;
    uint32_t sampleRateHz = 0;  // whole hertz
    // Version 1: what one packet and one frame take; zero when absent.
    uint32_t samplesPerPacket = 0;
    uint32_t bytesPerPacket = 0;
    uint32_t bytesPerFrame = 0;
    // Version 2: the linear PCM flags (float, big-endian, signed, ...).
    uint32_t formatFlags = 0;
    // Extension atoms after the fixed fields, inside the payload the entry was read from.
    std::span<const uint8_t> children;
};

// The first sample entry of an "stsd" payload.
std::optional<Entry> Parse(std::span<const uint8_t> stsd);

// Bytes one frame of uncompressed sound takes: version 1 and 2 say so, version 0
// leaves it to channels × bits.
uint32_t FrameBytes(const Entry& entry);

// Formats whose samples are frames of integer PCM, and which of them are
// 16-bit little-endian ("sowt") or big-endian.
bool IsPcmFormat(const Entry& entry);
bool IsLittleEndianPcm(const Entry& entry);
bool IsAac(const Entry& entry);

struct DecoderConfig {
    uint8_t objectType = 0;
    uint32_t averageBitRate = 0;
    std::vector<uint8_t> audioSpecificConfig;
};

// The payload of the "esds" atom among `children` (or inside a "wave" child).
std::optional<std::span<const uint8_t>> FindEsds(std::span<const uint8_t> children);

// An "esds" payload from its version and flags on. Descriptor sizes are read in every
// form from one to four bytes.
std::optional<DecoderConfig> ParseEsds(std::span<const uint8_t> esds);

}  // namespace TqovixSoundEntry
