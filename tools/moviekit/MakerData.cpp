#include "MakerData.h"

namespace moviekit {

Bytes MakeAfInformation(uint32_t sampleRate, const std::vector<AfInterval>& intervals, bool processed)
{
    Bytes out;
    out.reserve(16 + 20 * intervals.size());
    PutType(out, "AFR1");
    PutU16(out, 1);
    PutU16(out, processed ? 1 : 0);
    PutU32(out, sampleRate);
    PutU32(out, static_cast<uint32_t>(intervals.size()));
    for (const AfInterval& interval : intervals) {
        PutU64(out, interval.startFrame);
        PutU64(out, interval.endFrame);
        PutU16(out, interval.strength);
        PutU16(out, 0);
    }
    return out;
}

Bytes MakeAudioLevel(int32_t levelDb100)
{
    Bytes out;
    PutType(out, "ALV1");
    PutU16(out, 1);
    PutU16(out, 0);
    PutU32(out, static_cast<uint32_t>(levelDb100));
    return out;
}

Tag MakeLongTag(uint16_t group, uint16_t number, const std::vector<uint32_t>& values)
{
    Tag tag{group, number, kTagLong, static_cast<uint16_t>(values.size()), {}};
    for (uint32_t value : values) {
        PutU32(tag.data, value);
    }
    return tag;
}

Tag MakeRationalTag(uint16_t group, uint16_t number, uint32_t numerator, uint32_t denominator)
{
    Tag tag{group, number, kTagRational, 1, {}};
    PutU32(tag.data, numerator);
    PutU32(tag.data, denominator);
    return tag;
}

Tag MakeAsciiTag(uint16_t group, uint16_t number, const std::string& text)
{
    Tag tag{group, number, kTagAscii, static_cast<uint16_t>(text.size() + 1), {}};
    PutString(tag.data, text);
    PutU8(tag.data, 0);
    return tag;
}

std::vector<Tag> MakeTrimTags(uint32_t removedForward, uint32_t removedBackward, uint32_t rateNumerator,
                              uint32_t rateDenominator)
{
    return {MakeLongTag(0, kRemovedFrameForwardTag, {removedForward, 0}),
            MakeLongTag(0, kRemovedFrameBackwardTag, {removedBackward, 0}),
            MakeRationalTag(0, kFrameRateTag, rateNumerator, rateDenominator)};
}

Bytes SerializeTag(const Tag& tag)
{
    Bytes out;
    out.reserve(8 + tag.data.size());
    PutU16(out, tag.group);
    PutU16(out, tag.number);
    PutU16(out, tag.type);
    PutU16(out, tag.count);
    PutBytes(out, tag.data);
    return out;
}

Bytes SerializeTags(const std::vector<Tag>& tags)
{
    Bytes out;
    for (const Tag& tag : tags) {
        PutBytes(out, SerializeTag(tag));
    }
    return out;
}

}  // namespace moviekit
