#include "codec/TqovixAacSyntax.h"

#include <iterator>

namespace TqovixAacSyntax {

namespace {

constexpr uint32_t kRates[] = {96000, 88200, 64000, 48000, 44100, 32000, 24000, 22050, 16000, 12000, 11025, 8000, 7350};

// Big-endian bits; reading past the end fails rather than inventing zeros.
class BitReader {
public:
    BitReader(const uint8_t* data, size_t size) : m_data(data), m_bits(data != nullptr ? uint64_t{size} * 8 : 0) {}

    std::optional<uint32_t> Read(unsigned count)
    {
        if (count > 32 || count > m_bits - m_position) {
            return std::nullopt;
        }
        uint32_t value = 0;
        for (unsigned k = 0; k < count; ++k, ++m_position) {
            value = value << 1 | ((m_data[m_position / 8] >> (7 - m_position % 8)) & 1U);
        }
        return value;
    }
    bool Skip(uint64_t count)
    {
        if (count > m_bits - m_position) {
            return false;
        }
        m_position += count;
        return true;
    }
    // To the next byte of the data, where a raw data block's byte alignment counts from.
    bool Align() { return Skip((8 - m_position % 8) % 8); }
    bool RestIsZero()
    {
        while (m_position < m_bits) {
            if (Read(1) != 0U) {
                return false;
            }
        }
        return true;
    }

private:
    const uint8_t* m_data;
    uint64_t m_bits;
    uint64_t m_position = 0;
};

std::optional<uint32_t> ReadObjectType(BitReader& bits)
{
    const std::optional<uint32_t> type = bits.Read(5);
    if (type != 31U) {
        return type;
    }
    const std::optional<uint32_t> escaped = bits.Read(6);
    return escaped ? std::optional<uint32_t>(32 + *escaped) : std::nullopt;
}

// A count of 15 continues in an escape byte.
std::optional<uint32_t> ReadFillCount(BitReader& bits)
{
    const std::optional<uint32_t> count = bits.Read(4);
    if (count != 15U) {
        return count;
    }
    const std::optional<uint32_t> escape = bits.Read(8);
    return escape ? std::optional<uint32_t>(15 + *escape - 1) : std::nullopt;
}

}  // namespace

std::optional<DecoderConfig> ReadDecoderConfig(const uint8_t* data, size_t size)
{
    BitReader bits(data, size);
    DecoderConfig config;
    const std::optional<uint32_t> type = ReadObjectType(bits);
    const std::optional<uint32_t> index = bits.Read(4);
    if (!type || !index) {
        return std::nullopt;
    }
    config.objectType = *type;
    if (*index == 15) {
        const std::optional<uint32_t> rate = bits.Read(24);
        if (!rate) {
            return std::nullopt;
        }
        config.sampleRate = *rate;
    } else if (*index < std::size(kRates)) {
        config.sampleRate = kRates[*index];
    }
    const std::optional<uint32_t> channels = bits.Read(4);
    if (!channels) {
        return std::nullopt;
    }
    config.channelConfiguration = *channels;
    // The general audio specific part follows for the low complexity profile and its kin only.
    if (config.objectType == 1 || config.objectType == 2 || config.objectType == 3 || config.objectType == 4) {
        const std::optional<uint32_t> shortFrames = bits.Read(1);
        const std::optional<uint32_t> core = bits.Read(1);
        if (!shortFrames || !core || (*core == 1 && !bits.Skip(14))) {
            return std::nullopt;
        }
        const std::optional<uint32_t> extension = bits.Read(1);
        if (!extension) {
            return std::nullopt;
        }
        config.shortFrames = *shortFrames == 1;
        config.dependsOnCoreCoder = *core == 1;
        // Writers may say outright that no spectral band replication follows (ffmpeg does); one
        // that is present, a program configuration or anything else after it, ours does not write.
        bool replication = false;
        BitReader ahead = bits;
        if (ahead.Read(11) == 0x2B7U) {
            const std::optional<uint32_t> type = ReadObjectType(ahead);
            const std::optional<uint32_t> present = type == 5U ? ahead.Read(1) : std::nullopt;
            replication = present != 0U;
            bits = ahead;
        }
        config.extension =
            *extension == 1 || config.channelConfiguration == 0 || replication || !bits.RestIsZero();
    }
    return config;
}

std::optional<FrameHeader> ReadFrameHeader(const uint8_t* packet, size_t size)
{
    BitReader bits(packet, size);
    for (;;) {
        const std::optional<uint32_t> element = bits.Read(3);
        if (!element) {
            return std::nullopt;
        }
        FrameHeader header;
        header.element = static_cast<uint8_t>(*element);
        if (*element == kFil) {
            const std::optional<uint32_t> count = ReadFillCount(bits);
            if (!count || !bits.Skip(uint64_t{*count} * 8)) {
                return std::nullopt;
            }
            continue;
        }
        if (*element == kDse) {
            const std::optional<uint32_t> tag = bits.Read(4);
            const std::optional<uint32_t> aligned = bits.Read(1);
            std::optional<uint32_t> count = bits.Read(8);
            if (count == 255U) {
                const std::optional<uint32_t> more = bits.Read(8);
                count = more ? std::optional<uint32_t>(255 + *more) : std::nullopt;
            }
            if (!tag || !aligned || !count || (*aligned == 1 && !bits.Align()) || !bits.Skip(uint64_t{*count} * 8)) {
                return std::nullopt;
            }
            continue;
        }
        if (*element != kSce && *element != kCpe && *element != kLfe) {
            return std::nullopt;
        }
        if (!bits.Read(4)) {  // instance tag
            return std::nullopt;
        }
        bool common = false;
        if (*element == kCpe) {
            const std::optional<uint32_t> window = bits.Read(1);
            if (!window) {
                return std::nullopt;
            }
            common = *window == 1;
        }
        if (!common && !bits.Read(8)) {  // the channel's global gain comes before its own window
            return std::nullopt;
        }
        const std::optional<uint32_t> reserved = bits.Read(1);
        const std::optional<uint32_t> sequence = bits.Read(2);
        const std::optional<uint32_t> shape = bits.Read(1);
        if (!reserved || !sequence || !shape) {
            return std::nullopt;
        }
        header.windowSequence = static_cast<uint8_t>(*sequence);
        header.windowShape = static_cast<uint8_t>(*shape);
        return header;
    }
}

}  // namespace TqovixAacSyntax
