// Typed readers and writers of the track atoms the visitors use: handler, media
// header, edit list, data references and the sample tables. Each takes an atom's
// payload and gives its value, or nothing when the payload cannot hold what it claims.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <vector>

#include "atom/TqovixAtomType.h"

using TqovixPayload = std::span<const uint8_t>;

namespace TqovixTrackAtoms {

// Tables beyond this many entries are refused rather than held in memory.
inline constexpr uint64_t kMaxTableEntries = 1ULL << 24;

struct Handler {
    eTqovixAtomType componentType{};  // "mhlr" in QuickTime media handlers, zero in ISO files
    eTqovixAtomType subtype{};        // "soun", "vide", "tmcd", ...
};
std::optional<Handler> ParseHandler(TqovixPayload payload);
// The handler of a track's media ("mdia"), as either family of files writes it.
bool IsMediaHandler(const Handler& handler, const char (&subtype)[5]);

std::optional<uint32_t> ParseMediaTimeScale(TqovixPayload mdhd);

struct Edit {
    uint64_t duration = 0;
    int64_t mediaTime = 0;  // -1: an empty edit
};
std::optional<std::vector<Edit>> ParseEditList(TqovixPayload elst);
// Media time of the first edit that shows media; 0 when there is none.
int64_t FirstMediaTime(const std::vector<Edit>& edits);

// Whether every data reference says "in this file" (flag 1); a track without
// references counts as self-contained.
std::optional<bool> ParseDataInFile(TqovixPayload dref);

// Sum of the sample counts of every time-to-sample entry.
std::optional<uint64_t> ParseSampleTotal(TqovixPayload stts);

struct ChunkRun {
    uint32_t firstChunk = 0;
    uint32_t samplesPerChunk = 0;
};
std::optional<std::vector<ChunkRun>> ParseSampleToChunk(TqovixPayload stsc);

struct SampleSizes {
    uint32_t common = 0;         // non-zero: every sample has this size
    uint32_t count = 0;          // samples the table declares
    std::vector<uint32_t> sizes; // one per sample when `common` is 0
};
std::optional<SampleSizes> ParseSampleSizes(TqovixPayload stsz);
std::vector<uint8_t> WriteSampleSizes(const SampleSizes& sizes);

// "stco" (`wide` false) or "co64".
std::optional<std::vector<uint64_t>> ParseChunkOffsets(TqovixPayload payload, bool wide);
std::vector<uint8_t> WriteChunkOffsets(const std::vector<uint64_t>& offsets, bool wide);

}  // namespace TqovixTrackAtoms
