#include "codec/TqovixAacSyntax.h"

#include <algorithm>
#include <iterator>
#include <new>

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

namespace {

// Big-endian bits appended to a byte vector.
class BitWriter {
public:
    explicit BitWriter(std::vector<uint8_t>& bytes) : m_bytes(bytes) { m_bytes.clear(); }
    void Write(uint32_t value, unsigned count)
    {
        for (unsigned k = count; k-- > 0;) {
            if (m_bits % 8 == 0) {
                m_bytes.push_back(0);
            }
            m_bytes.back() |= static_cast<uint8_t>(((value >> k) & 1U) << (7 - m_bits % 8));
            ++m_bits;
        }
    }
    uint64_t Bits() const { return m_bits; }

private:
    std::vector<uint8_t>& m_bytes;
    uint64_t m_bits = 0;
};

// A fill element of `count` payload bytes: its count (escaped past 14), then an extension of the
// kind that only fills.
void WriteFill(BitWriter& out, uint32_t count)
{
    out.Write(kFil, 3);
    if (count < 15) {
        out.Write(count, 4);
    } else {
        out.Write(15, 4);
        out.Write(count - 14, 8);
    }
    for (uint32_t k = 0; k < count; ++k) {
        out.Write(k == 0 ? 0x00 : 0xA5, 8);
    }
}

}  // namespace

bool PadToSize(const uint8_t* packet, size_t size, size_t target, std::vector<uint8_t>& padded)
{
    if (packet == nullptr || size == 0 || target < size) {
        return false;
    }
    // The end element is the last three bits set; only zero bits may follow it.
    uint64_t last = uint64_t{size} * 8;
    while (last > 0 && ((packet[(last - 1) / 8] >> (7 - (last - 1) % 8)) & 1U) == 0) {
        --last;
    }
    if (last < 3 || uint64_t{size} * 8 - last >= 8) {
        return false;
    }
    const uint64_t end = last - 3;
    for (uint64_t bit = end; bit < last; ++bit) {
        if (((packet[bit / 8] >> (7 - bit % 8)) & 1U) == 0) {
            return false;
        }
    }
    if (target == size) {
        padded.assign(packet, packet + size);
        return true;
    }
    // Fill elements of 7 + 8 c bits (c below 15) or 15 + 8 c bits (c from 15 to 269), largest first,
    // until fewer than 7 bits are left, which the alignment takes up.
    const uint64_t targetBits = uint64_t{target} * 8;
    uint64_t left = targetBits - end - 3;
    std::vector<uint32_t> fills;
    while (left >= 7) {
        const uint32_t count = left >= 15 + 8 * 15 ? static_cast<uint32_t>(std::min<uint64_t>(269, (left - 15) / 8))
                                                   : static_cast<uint32_t>(std::min<uint64_t>(14, (left - 7) / 8));
        fills.push_back(count);
        left -= count < 15 ? 7 + 8 * uint64_t{count} : 15 + 8 * uint64_t{count};
    }
    try {
        BitWriter out(padded);
        padded.reserve(target);
        for (uint64_t bit = 0; bit < end; ++bit) {
            out.Write((packet[bit / 8] >> (7 - bit % 8)) & 1U, 1);
        }
        for (const uint32_t count : fills) {
            WriteFill(out, count);
        }
        out.Write(kEnd, 3);
        if (out.Bits() > targetBits || out.Bits() + 8 <= targetBits) {
            return false;
        }
    } catch (const std::bad_alloc&) {
        return false;
    }
    return padded.size() == target;
}

}  // namespace TqovixAacSyntax
