#include "visitor/TqovixTrackTables.h"

#include <new>

namespace {

eTqovixErrorCode Build(const TqovixTrackTables& tables, uint32_t frameBytes, std::vector<TqovixChunkInformation>& out)
{
    if (TqovixFailed(tables.failure)) {
        return tables.failure;
    }
    if (!tables.runs || !tables.sizes || !tables.offsets) {
        return eTqovixErrorInvalidMovie;
    }
    const std::vector<TqovixTrackAtoms::ChunkRun>& runs = *tables.runs;
    const TqovixTrackAtoms::SampleSizes& sizes = *tables.sizes;
    const uint64_t chunkCount = tables.offsets->size();
    if (chunkCount == 0) {
        return runs.empty() && (sizes.common != 0 || sizes.sizes.empty()) ? eTqovixSuccess : eTqovixErrorInvalidMovie;
    }
    uint64_t sampleBytes = sizes.common;
    if (sizes.common != 0 && frameBytes != 0) {
        if (sizes.common != 1 && sizes.common != frameBytes) {
            return eTqovixErrorInvalidMovie;
        }
        sampleBytes = frameBytes;
    }
    try {
        out.resize(chunkCount);
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    uint64_t position = 0;
    uint64_t sample = 0;
    for (size_t r = 0; r < runs.size(); ++r) {
        const uint64_t first = runs[r].firstChunk;
        const uint64_t next = r + 1 < runs.size() ? runs[r + 1].firstChunk : chunkCount + 1;
        const uint32_t samplesPerChunk = runs[r].samplesPerChunk;
        // Runs start at chunk 1, rise strictly and name only chunks the offset table has.
        if (first != position + 1 || next <= first || next > chunkCount + 1) {
            return eTqovixErrorInvalidMovie;
        }
        for (uint64_t k = first; k < next; ++k, ++position) {
            TqovixChunkInformation& record = out[position];
            uint64_t bytes = 0;
            if (sizes.common == 0) {
                if (samplesPerChunk > sizes.sizes.size() - sample) {
                    return eTqovixErrorInvalidMovie;  // the size table runs out
                }
                const auto begin = sizes.sizes.begin() + static_cast<std::ptrdiff_t>(sample);
                record.sampleSizes.assign(begin, begin + samplesPerChunk);
                for (uint32_t size : record.sampleSizes) {
                    bytes += size;
                }
                sample += samplesPerChunk;
            } else {
                // Both factors are below 2^32, so the product cannot wrap in 64 bits.
                bytes = samplesPerChunk * sampleBytes;
            }
            if (bytes > UINT32_MAX) {
                return eTqovixErrorInvalidMovie;
            }
            record.offset = (*tables.offsets)[position];
            record.size = static_cast<uint32_t>(bytes);
            record.chunkNumber = static_cast<uint32_t>(k);
            record.sampleCount = samplesPerChunk;
        }
    }
    // Every chunk belongs to a run, and a size table holds no sample nobody uses.
    if (position != chunkCount || (sizes.common == 0 && sample != sizes.sizes.size())) {
        return eTqovixErrorInvalidMovie;
    }
    return eTqovixSuccess;
}

}  // namespace

eTqovixErrorCode TqovixBuildChunkList(const TqovixTrackTables& tables, uint32_t frameBytes,
                                      std::vector<TqovixChunkInformation>& out)
{
    std::vector<TqovixChunkInformation> list;
    const eTqovixErrorCode result = Build(tables, frameBytes, list);
    out.swap(list);
    if (TqovixFailed(result)) {
        out.clear();
    }
    return result;
}
