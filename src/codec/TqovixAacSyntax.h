// The few fields of AAC's bitstream the splicing needs: what a decoder configuration
// declares, and the window a raw frame opens with.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <vector>

namespace TqovixAacSyntax {

// Syntactic elements of a raw data block.
enum eElement : uint8_t { kSce = 0, kCpe = 1, kCce = 2, kLfe = 3, kDse = 4, kPce = 5, kFil = 6, kEnd = 7 };
enum eWindowSequence : uint8_t { kOnlyLong = 0, kLongStart = 1, kEightShort = 2, kLongStop = 3 };

struct DecoderConfig {
    uint32_t objectType = 0;
    uint32_t sampleRate = 0;       // 0 when the index names none
    uint32_t channelConfiguration = 0;
    bool shortFrames = false;      // 960 frames a packet
    bool dependsOnCoreCoder = false;
    bool extension = false;        // the extension flag, or anything after the configuration but padding
};
std::optional<DecoderConfig> ReadDecoderConfig(const uint8_t* data, size_t size);

// The first channel element of a raw data block and the window of its (first) channel.
struct FrameHeader {
    uint8_t element = kEnd;
    uint8_t windowSequence = kOnlyLong;
    uint8_t windowShape = 0;       // 0 sine, 1 Kaiser-Bessel derived
};
// Fill and data stream elements before it are passed over; nullopt when the packet is cut
// short or begins with anything else.
std::optional<FrameHeader> ReadFrameHeader(const uint8_t* packet, size_t size);

// The packet made exactly `target` bytes long by fill elements before its closing element, which
// decoders pass over. False when it is longer already or does not end as an encoder closes a
// raw data block (the end element, then zero bits to the byte).
bool PadToSize(const uint8_t* packet, size_t size, size_t target, std::vector<uint8_t>& padded);

}  // namespace TqovixAacSyntax
