// The camera's maker payloads: AF drive intervals ("AFR1"), the recording level
// ("ALV1") and TIFF-style tags for the tag atom, serialised exactly as cameras store them.
#pragma once

#include "ByteWriter.h"

#include <cstdint>
#include <string>
#include <vector>

namespace moviekit {

// One stretch of sound during which the lens motor ran.
struct AfInterval {
    uint64_t startFrame = 0;
    uint64_t endFrame = 0;  // exclusive
    uint16_t strength = 0;  // per mille
};

Bytes MakeAfInformation(uint32_t sampleRate, const std::vector<AfInterval>& intervals, bool processed);
Bytes MakeAudioLevel(int32_t levelDb100);

enum TagType : uint16_t {
    kTagByte = 1,
    kTagAscii = 2,
    kTagShort = 3,
    kTagLong = 4,
    kTagRational = 5,
    kTagSLong = 9,
    kTagSRational = 10,
};

// `data` holds the values exactly as stored (already big-endian); `count` is written as given,
// so a tag can disagree with its data on purpose.
struct Tag {
    uint16_t group = 0;
    uint16_t number = 0;
    uint16_t type = 0;
    uint16_t count = 0;
    Bytes data;
};

inline constexpr uint16_t kSoftwareNameTag = 3;
inline constexpr uint16_t kRemovedFrameForwardTag = 20;
inline constexpr uint16_t kRemovedFrameBackwardTag = 21;
inline constexpr uint16_t kFrameRateTag = 22;

Tag MakeLongTag(uint16_t group, uint16_t number, const std::vector<uint32_t>& values);
Tag MakeRationalTag(uint16_t group, uint16_t number, uint32_t numerator, uint32_t denominator);
// Count includes the terminating zero byte.
Tag MakeAsciiTag(uint16_t group, uint16_t number, const std::string& text);
// Group 0 tags 20 and 21 (two LONGs each: the count and a zero) and tag 22 (frame rate).
std::vector<Tag> MakeTrimTags(uint32_t removedForward, uint32_t removedBackward, uint32_t rateNumerator,
                              uint32_t rateDenominator);
Bytes SerializeTag(const Tag& tag);
Bytes SerializeTags(const std::vector<Tag>& tags);

}  // namespace moviekit
