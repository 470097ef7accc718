#include "atom/TqovixSoundEntry.h"

#include <cstdio>
#include <cstring>
#include <initializer_list>
#include <string_view>

#include "atom/TqovixByteReader.h"

namespace TqovixSoundEntry {

namespace {

constexpr uint8_t kESDescrTag = 3;
constexpr uint8_t kDecoderConfigDescrTag = 4;
constexpr uint8_t kDecSpecificInfoTag = 5;
constexpr eTqovixAtomType kEsds = TqovixMakeAtomType("esds");
constexpr eTqovixAtomType kEnda = TqovixMakeAtomType("enda");
constexpr eTqovixAtomType kWave = TqovixMakeAtomType("wave");
constexpr eTqovixAtomType kLpcm = TqovixMakeAtomType("lpcm");
constexpr eTqovixAtomType kSowt = TqovixMakeAtomType("sowt");
constexpr eTqovixAtomType kIn24 = TqovixMakeAtomType("in24");
constexpr eTqovixAtomType kIn32 = TqovixMakeAtomType("in32");
constexpr eTqovixAtomType kFl32 = TqovixMakeAtomType("fl32");
constexpr eTqovixAtomType kFl64 = TqovixMakeAtomType("fl64");

// The version-2 linear PCM flags.
constexpr uint32_t kFlagFloat = 1;
constexpr uint32_t kFlagBigEndian = 2;
constexpr uint32_t kFlagSignedInteger = 4;
constexpr uint32_t kFlagNonInterleaved = 0x20;
// A "wave" holds a handful of small atoms; nesting deeper than this is not a sound description.
constexpr int kMaxWaveDepth = 2;

// Seven bits a byte, the high bit saying another follows; writers pad to any width up to four.
constexpr int kMaxDescriptorSizeBytes = 4;

bool ReadDescriptorSize(TqovixByteReader& reader, uint32_t& size)
{
    size = 0;
    for (int k = 0; k < kMaxDescriptorSizeBytes; ++k) {
        uint8_t byte = 0;
        if (!reader.U8(byte)) {
            return false;
        }
        size = (size << 7) | (byte & 0x7F);
        if ((byte & 0x80) == 0) {
            return true;
        }
    }
    return false;  // a fifth byte: no writer makes one, and 28 bits already pass any atom here
}

// One tag-size-body descriptor; the body must fit what holds it.
bool ReadDescriptor(TqovixByteReader& reader, uint8_t& tag, std::span<const uint8_t>& body)
{
    uint32_t size = 0;
    return reader.U8(tag) && ReadDescriptorSize(reader, size) && reader.Bytes(size, body);
}

std::optional<DecoderConfig> ParseDecoderConfig(std::span<const uint8_t> body)
{
    TqovixByteReader reader(body);
    DecoderConfig config;
    uint32_t maxBitRate = 0;
    uint8_t tag = 0;
    std::span<const uint8_t> info;
    if (!reader.U8(config.objectType) || !reader.Skip(4) || !reader.U32(maxBitRate) ||
        !reader.U32(config.averageBitRate) || !ReadDescriptor(reader, tag, info) || tag != kDecSpecificInfoTag) {
        return std::nullopt;
    }
    // Anything after the decoder-specific information (a profile descriptor) is not understood.
    if (reader.Remaining() != 0) {
        return std::nullopt;
    }
    config.audioSpecificConfig.assign(info.begin(), info.end());
    return config;
}

std::optional<DecoderConfig> ParseEsDescriptor(std::span<const uint8_t> body)
{
    TqovixByteReader reader(body);
    uint8_t flags = 0;
    if (!reader.Skip(2) || !reader.U8(flags)) {
        return std::nullopt;
    }
    if ((flags & 0x80) != 0 && !reader.Skip(2)) {
        return std::nullopt;
    }
    if ((flags & 0x40) != 0) {
        uint8_t urlLength = 0;
        if (!reader.U8(urlLength) || !reader.Skip(urlLength)) {
            return std::nullopt;
        }
    }
    if ((flags & 0x20) != 0 && !reader.Skip(2)) {
        return std::nullopt;
    }
    std::optional<DecoderConfig> config;
    while (reader.Remaining() > 0) {
        uint8_t tag = 0;
        std::span<const uint8_t> inner;
        if (!ReadDescriptor(reader, tag, inner)) {
            return std::nullopt;
        }
        if (tag == kDecoderConfigDescrTag) {
            config = ParseDecoderConfig(inner);
            if (!config) {
                return std::nullopt;
            }
        }
    }
    return config;
}

std::optional<std::span<const uint8_t>> FindChildAt(std::span<const uint8_t> children, eTqovixAtomType wanted,
                                                    int depth)
{
    TqovixByteReader reader(children);
    // Trailing bytes too short for an atom (QuickTime's 4-byte terminator) end the list.
    while (reader.Remaining() >= 8) {
        uint32_t size = 0;
        std::span<const uint8_t> typeBytes;
        reader.U32(size);
        reader.Bytes(4, typeBytes);
        std::span<const uint8_t> payload;
        if (size < 8 || !reader.Bytes(size - 8, payload)) {
            return std::nullopt;
        }
        eTqovixAtomType type;
        std::memcpy(&type, typeBytes.data(), 4);
        if (type == wanted) {
            return payload;
        }
        if (type == kWave && depth < kMaxWaveDepth) {
            const auto inner = FindChildAt(payload, wanted, depth + 1);
            if (inner) {
                return inner;
            }
        }
    }
    return std::nullopt;
}

// Whether the version-2 flags describe the samples: only "lpcm" carries them.
bool FlagsDescribe(const Entry& entry) { return entry.version == 2 && entry.format == kLpcm; }

// Formats whose byte order an "enda" sets; "twos" is big-endian and "sowt" little whatever follows.
bool EndaTurns(const Entry& entry)
{
    return entry.format == kIn24 || entry.format == kIn32 || entry.format == kFl32 || entry.format == kFl64 ||
           (entry.format == kLpcm && !FlagsDescribe(entry));
}

// Words are appended piece by piece: `"text" + std::string` trips a false -Werror=restrict in
// some optimising compilers.
std::string Words(std::initializer_list<std::string_view> pieces)
{
    std::string text;
    for (std::string_view piece : pieces) {
        text.append(piece);
    }
    return text;
}

}  // namespace

std::optional<Entry> Parse(std::span<const uint8_t> stsd)
{
    TqovixByteReader table(stsd);
    uint32_t versionAndFlags = 0;
    uint32_t count = 0;
    uint32_t size = 0;
    std::span<const uint8_t> body;
    if (!table.U32(versionAndFlags) || !table.U32(count) || count == 0 || !table.U32(size) || size < 8 ||
        !table.Bytes(size - 4, body)) {
        return std::nullopt;
    }
    TqovixByteReader reader(body);
    Entry entry;
    std::span<const uint8_t> format;
    uint16_t channels = 0;
    uint16_t bits = 0;
    uint32_t rate = 0;
    reader.Bytes(4, format);
    std::memcpy(&entry.format, format.data(), 4);
    if (!reader.Skip(8) || !reader.U16(entry.version) || !reader.Skip(6) || !reader.U16(channels) ||
        !reader.U16(bits) || !reader.Skip(4) || !reader.U32(rate)) {
        return std::nullopt;
    }
    entry.channels = channels;
    entry.bitsPerChannel = bits;
    entry.sampleRateHz = rate >> 16;
    if (entry.version == 1) {
        uint32_t bytesPerSample = 0;
        if (!reader.U32(entry.samplesPerPacket) || !reader.U32(entry.bytesPerPacket) ||
            !reader.U32(entry.bytesPerFrame) || !reader.U32(bytesPerSample)) {
            return std::nullopt;
        }
    } else if (entry.version == 2) {
        uint32_t structSize = 0;
        uint64_t rateBits = 0;
        uint32_t marker = 0;
        uint32_t framesPerPacket = 0;
        if (!reader.U32(structSize) || !reader.U64(rateBits) || !reader.U32(entry.channels) || !reader.U32(marker) ||
            !reader.U32(entry.bitsPerChannel) || !reader.U32(entry.formatFlags) || !reader.U32(entry.bytesPerPacket) ||
            !reader.U32(framesPerPacket)) {
            return std::nullopt;
        }
        double hz = 0;
        std::memcpy(&hz, &rateBits, sizeof hz);
        // Rounded: a rate written as 44099.99999 is 44100 Hz. NaN fails both tests.
        entry.sampleRateHz = hz >= 0.5 && hz < 4294967295.0 ? static_cast<uint32_t>(hz + 0.5) : 0;
        entry.samplesPerPacket = framesPerPacket;
        entry.bytesPerFrame = framesPerPacket == 1 ? entry.bytesPerPacket : 0;
    } else if (entry.version != 0) {
        return std::nullopt;
    }
    entry.children = reader.Rest();
    if (const auto enda = FindChildAt(entry.children, kEnda, 0); enda && enda->size() >= 2) {
        // The flag is the low byte of a 16-bit field: 1 for little-endian.
        entry.littleEndianAtom = (*enda)[1] != 0;
    }
    // QuickTime keeps 16 in the sample size field of versions 0 and 1 whatever the samples are:
    // the format, or the bytes a frame takes, say what they really are.
    if (entry.version != 2 && IsPcmFormat(entry)) {
        const eTqovixAtomType format = entry.format;
        if (format == TqovixMakeAtomType("in24")) {
            entry.bitsPerChannel = 24;
        } else if (format == TqovixMakeAtomType("in32") || format == TqovixMakeAtomType("fl32")) {
            entry.bitsPerChannel = 32;
        } else if (format == TqovixMakeAtomType("fl64")) {
            entry.bitsPerChannel = 64;
        } else if (entry.version == 1 && entry.channels != 0 && entry.bytesPerFrame % entry.channels == 0 &&
                   entry.bytesPerFrame != 0) {
            entry.bitsPerChannel = 8 * (entry.bytesPerFrame / entry.channels);
        }
    }
    return entry;
}

uint32_t FrameBytes(const Entry& entry)
{
    if (entry.version != 0 && entry.bytesPerFrame != 0) {
        return entry.bytesPerFrame;
    }
    return entry.channels * (entry.bitsPerChannel / 8);
}

bool IsPcmFormat(const Entry& entry)
{
    static constexpr eTqovixAtomType kPcm[] = {TqovixMakeAtomType("twos"), TqovixMakeAtomType("sowt"),
                                               TqovixMakeAtomType("lpcm"), TqovixMakeAtomType("in24"),
                                               TqovixMakeAtomType("in32"), TqovixMakeAtomType("fl32"),
                                               TqovixMakeAtomType("fl64"), TqovixMakeAtomType("raw "),
                                               TqovixMakeAtomType("NONE")};
    for (eTqovixAtomType type : kPcm) {
        if (entry.format == type) {
            return true;
        }
    }
    return false;
}

bool IsLittleEndianPcm(const Entry& entry)
{
    if (FlagsDescribe(entry)) {
        return (entry.formatFlags & kFlagBigEndian) == 0;
    }
    return entry.format == kSowt || (EndaTurns(entry) && entry.littleEndianAtom.value_or(false));
}

std::optional<PcmLayout> ReadPcmLayout(const Entry& entry, std::string& why)
{
    PcmLayout layout;
    layout.bits = entry.bitsPerChannel;
    layout.littleEndian = IsLittleEndianPcm(entry);
    layout.floating = entry.format == kFl32 || entry.format == kFl64;
    const std::string name = Words({"'", TqovixAtomTypeName(entry.format), "'"});
    const std::string_view processed = "; 16, 24 and 32-bit integer and 32 and 64-bit float PCM are processed";
    if (FlagsDescribe(entry)) {
        const uint32_t flags = entry.formatFlags;
        layout.floating = (flags & kFlagFloat) != 0;
        const bool signedInteger = (flags & kFlagSignedInteger) != 0;
        if ((flags & kFlagNonInterleaved) != 0) {
            why = Words({"sound ", name, " keeps each channel apart (non-interleaved PCM); only interleaved PCM is processed"});
            return std::nullopt;
        }
        if (layout.floating == signedInteger) {
            char hex[16];
            std::snprintf(hex, sizeof hex, "0x%X", flags);
            why = Words({"sound ", name, " has flags ", hex, layout.floating ? ", both float and integer" : ", unsigned integers",
                         processed});
            return std::nullopt;
        }
    }
    const bool width = layout.floating ? (layout.bits == 32 || layout.bits == 64)
                                       : (layout.bits == 16 || layout.bits == 24 || layout.bits == 32);
    if (!width) {
        why = Words({"sound ", name, " is ", std::to_string(layout.bits), layout.floating ? "-bit float PCM" : "-bit PCM",
                     processed});
        return std::nullopt;
    }
    const uint32_t frame = FrameBytes(entry);
    if (entry.channels != 0 && frame != uint64_t{entry.channels} * layout.SampleBytes()) {
        why = Words({"the sound description's frame of ", std::to_string(frame), " bytes does not hold ",
                     std::to_string(entry.channels), " samples of ", std::to_string(layout.bits), " bits"});
        return std::nullopt;
    }
    return layout;
}

bool IsAac(const Entry& entry) { return entry.format == TqovixMakeAtomType("mp4a"); }

std::optional<std::span<const uint8_t>> FindEsds(std::span<const uint8_t> children)
{
    return FindChildAt(children, kEsds, 0);
}

std::optional<DecoderConfig> ParseEsds(std::span<const uint8_t> esds)
{
    TqovixByteReader reader(esds);
    if (!reader.Skip(4)) {
        return std::nullopt;
    }
    std::optional<DecoderConfig> config;
    while (reader.Remaining() > 0) {
        uint8_t tag = 0;
        std::span<const uint8_t> body;
        if (!ReadDescriptor(reader, tag, body)) {
            return std::nullopt;
        }
        if (tag == kESDescrTag) {
            config = ParseEsDescriptor(body);
        }
    }
    return config;
}

}  // namespace TqovixSoundEntry
