#include "atom/TqovixTrackAtoms.h"

#include <cstring>

#include "atom/TqovixByteReader.h"
#include "atom/TqovixEndian.h"

namespace TqovixTrackAtoms {

namespace {

// Version and flags, then an entry count whose entries of `width` bytes must fit what is left.
std::optional<uint32_t> ReadTableHeader(TqovixByteReader& reader, uint64_t width, uint8_t* version = nullptr)
{
    uint32_t versionAndFlags = 0;
    uint32_t count = 0;
    if (!reader.U32(versionAndFlags) || !reader.U32(count) || count > kMaxTableEntries ||
        uint64_t{count} * width > reader.Remaining()) {
        return std::nullopt;
    }
    if (version != nullptr) {
        *version = static_cast<uint8_t>(versionAndFlags >> 24);
    }
    return count;
}

eTqovixAtomType TypeAt(const uint8_t* bytes)
{
    eTqovixAtomType type;
    std::memcpy(&type, bytes, 4);
    return type;
}

}  // namespace

std::optional<Handler> ParseHandler(TqovixPayload payload)
{
    TqovixByteReader reader(payload);
    TqovixPayload types;
    if (!reader.Skip(4) || !reader.Bytes(8, types)) {
        return std::nullopt;
    }
    return Handler{TypeAt(types.data()), TypeAt(types.data() + 4)};
}

bool IsMediaHandler(const Handler& handler, const char (&subtype)[5])
{
    return (handler.componentType == TqovixMakeAtomType("mhlr") || handler.componentType == eTqovixAtomType{}) &&
           handler.subtype == TqovixMakeAtomType(subtype);
}

std::optional<uint32_t> ParseMediaTimeScale(TqovixPayload mdhd)
{
    TqovixByteReader reader(mdhd);
    uint8_t version = 0;
    uint32_t timeScale = 0;
    if (!reader.U8(version) || !reader.Skip(3) || !reader.Skip(version == 1 ? 16 : 8) || !reader.U32(timeScale)) {
        return std::nullopt;
    }
    return timeScale;
}

std::optional<std::vector<Edit>> ParseEditList(TqovixPayload elst)
{
    TqovixByteReader reader(elst);
    uint8_t version = 0;
    const uint64_t width = 12;  // the smaller entry form, checked again per entry below
    const std::optional<uint32_t> count = ReadTableHeader(reader, width, &version);
    if (!count || version > 1) {
        return std::nullopt;
    }
    std::vector<Edit> edits;
    edits.reserve(*count);
    for (uint32_t i = 0; i < *count; ++i) {
        Edit edit;
        if (version == 1) {
            uint64_t mediaTime = 0;
            if (!reader.U64(edit.duration) || !reader.U64(mediaTime)) {
                return std::nullopt;
            }
            edit.mediaTime = static_cast<int64_t>(mediaTime);
        } else {
            uint32_t duration = 0;
            uint32_t mediaTime = 0;
            if (!reader.U32(duration) || !reader.U32(mediaTime)) {
                return std::nullopt;
            }
            edit.duration = duration;
            edit.mediaTime = static_cast<int32_t>(mediaTime);
        }
        if (!reader.Skip(4)) {  // media rate
            return std::nullopt;
        }
        edits.push_back(edit);
    }
    return edits;
}

int64_t FirstMediaTime(const std::vector<Edit>& edits)
{
    for (const Edit& edit : edits) {
        if (edit.mediaTime >= 0) {
            return edit.mediaTime;
        }
    }
    return 0;
}

std::optional<bool> ParseDataInFile(TqovixPayload dref)
{
    TqovixByteReader reader(dref);
    const std::optional<uint32_t> count = ReadTableHeader(reader, 12);
    if (!count) {
        return std::nullopt;
    }
    bool inFile = true;
    for (uint32_t i = 0; i < *count; ++i) {
        uint32_t size = 0;
        uint32_t type = 0;
        uint32_t versionAndFlags = 0;
        if (!reader.U32(size) || !reader.U32(type) || !reader.U32(versionAndFlags) || size < 12 ||
            !reader.Skip(size - 12)) {
            return std::nullopt;
        }
        inFile = inFile && (versionAndFlags & 1) != 0;
    }
    return inFile;
}

std::optional<uint64_t> ParseSampleTotal(TqovixPayload stts)
{
    TqovixByteReader reader(stts);
    const std::optional<uint32_t> count = ReadTableHeader(reader, 8);
    if (!count) {
        return std::nullopt;
    }
    uint64_t total = 0;
    for (uint32_t i = 0; i < *count; ++i) {
        uint32_t samples = 0;
        uint32_t duration = 0;
        reader.U32(samples);
        reader.U32(duration);
        total += samples;
    }
    return total;
}

std::optional<std::vector<ChunkRun>> ParseSampleToChunk(TqovixPayload stsc)
{
    TqovixByteReader reader(stsc);
    const std::optional<uint32_t> count = ReadTableHeader(reader, 12);
    if (!count) {
        return std::nullopt;
    }
    std::vector<ChunkRun> runs(*count);
    for (ChunkRun& run : runs) {
        uint32_t description = 0;
        reader.U32(run.firstChunk);
        reader.U32(run.samplesPerChunk);
        reader.U32(description);
    }
    return runs;
}

std::optional<SampleSizes> ParseSampleSizes(TqovixPayload stsz)
{
    TqovixByteReader reader(stsz);
    SampleSizes sizes;
    if (!reader.Skip(4) || !reader.U32(sizes.common) || !reader.U32(sizes.count)) {
        return std::nullopt;
    }
    if (sizes.common != 0) {
        return sizes;
    }
    if (sizes.count > kMaxTableEntries || uint64_t{sizes.count} * 4 > reader.Remaining()) {
        return std::nullopt;
    }
    sizes.sizes.resize(sizes.count);
    for (uint32_t& size : sizes.sizes) {
        reader.U32(size);
    }
    return sizes;
}

std::vector<uint8_t> WriteSampleSizes(const SampleSizes& sizes)
{
    std::vector<uint8_t> payload(12 + (sizes.common == 0 ? 4 * sizes.sizes.size() : 0), 0);
    TqovixWriteBE32(payload.data() + 4, sizes.common);
    TqovixWriteBE32(payload.data() + 8, sizes.common == 0 ? static_cast<uint32_t>(sizes.sizes.size()) : sizes.count);
    if (sizes.common == 0) {
        for (size_t j = 0; j < sizes.sizes.size(); ++j) {
            TqovixWriteBE32(payload.data() + 12 + 4 * j, sizes.sizes[j]);
        }
    }
    return payload;
}

std::optional<std::vector<uint64_t>> ParseChunkOffsets(TqovixPayload payload, bool wide)
{
    TqovixByteReader reader(payload);
    const std::optional<uint32_t> count = ReadTableHeader(reader, wide ? 8 : 4);
    if (!count) {
        return std::nullopt;
    }
    std::vector<uint64_t> offsets(*count);
    for (uint64_t& offset : offsets) {
        if (wide) {
            reader.U64(offset);
        } else {
            uint32_t narrow = 0;
            reader.U32(narrow);
            offset = narrow;
        }
    }
    return offsets;
}

std::vector<uint8_t> WriteChunkOffsets(const std::vector<uint64_t>& offsets, bool wide)
{
    const size_t width = wide ? 8 : 4;
    std::vector<uint8_t> payload(8 + width * offsets.size(), 0);
    TqovixWriteBE32(payload.data() + 4, static_cast<uint32_t>(offsets.size()));
    for (size_t j = 0; j < offsets.size(); ++j) {
        uint8_t* entry = payload.data() + 8 + width * j;
        if (wide) {
            TqovixWriteBE64(entry, offsets[j]);
        } else {
            TqovixWriteBE32(entry, static_cast<uint32_t>(offsets[j]));
        }
    }
    return payload;
}

}  // namespace TqovixTrackAtoms
