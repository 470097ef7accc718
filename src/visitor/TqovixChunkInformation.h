// Records of a track's chunk layout, read from and written back to its sample tables.
#pragma once

#include <cstdint>
#include <vector>

#include "bridge/TqovixErrorCode.h"

// One chunk of a track: where it lies, how many bytes and samples it holds.
struct TqovixChunkInformation {
    uint64_t offset = 0;
    uint32_t size = 0;
    std::vector<uint32_t> sampleSizes;  // empty for tracks with one common sample size
    uint32_t chunkNumber = 0;           // 1-based, as the sample-to-chunk table counts
    uint32_t sampleCount = 0;

    bool operator==(const TqovixChunkInformation&) const = default;
};

// One sample-to-chunk run, without its sample description index.
struct TqovixSampleInfomation {
    uint32_t firstChunk = 0;
    uint32_t samplesPerChunk = 0;
};

// 4359 when a chunk lies past the end of a file of `fileSize` bytes: tables
// that point outside the movie describe a damaged or foreign file.
inline eTqovixErrorCode TqovixCheckChunksInFile(const std::vector<TqovixChunkInformation>& chunks, uint64_t fileSize)
{
    for (const TqovixChunkInformation& chunk : chunks) {
        if (chunk.offset > fileSize || chunk.size > fileSize - chunk.offset) {
            return eTqovixErrorInvalidMovie;
        }
    }
    return eTqovixSuccess;
}
