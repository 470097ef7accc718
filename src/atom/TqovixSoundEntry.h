// Typed reader of a sound track's sample description: the first entry of "stsd"
// in its QuickTime versions 0, 1 and 2 (ISO files write the version-0 layout),
// and the AAC decoder configuration found among its children ("esds", also
// inside QuickTime's "wave").
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
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
    // An "enda" among the extension atoms (or in their "wave"): the samples' byte order.
    std::optional<bool> littleEndianAtom;
    // Extension atoms after the fixed fields, inside the payload the entry was read from.
    std::span<const uint8_t> children;
};

// How the samples of uncompressed sound are stored.
struct PcmLayout {
    uint32_t bits = 0;
    bool floating = false;
    bool littleEndian = false;
    uint32_t SampleBytes() const { return bits / 8; }
};

// The first sample entry of an "stsd" payload.
std::optional<Entry> Parse(std::span<const uint8_t> stsd);

// Bytes one frame of uncompressed sound takes: version 1 and 2 say so, version 0
// leaves it to channels × bits.
uint32_t FrameBytes(const Entry& entry);

// Formats whose samples are frames of uncompressed PCM, and which of them are stored
// little-endian: "sowt", the version-2 "lpcm" without its big-endian flag, and the formats
// an "enda" may turn ("in24", "in32", "fl32", "fl64", "lpcm" of the older versions).
bool IsPcmFormat(const Entry& entry);
bool IsLittleEndianPcm(const Entry& entry);
bool IsAac(const Entry& entry);

// The layout of uncompressed sound we process: interleaved, packed 16, 24 or 32-bit signed
// integers or 32 or 64-bit floats, in either byte order, one frame being as many bytes as the
// description says. Otherwise nullopt, and `why` says what the sound is, in words.
std::optional<PcmLayout> ReadPcmLayout(const Entry& entry, std::string& why);

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
