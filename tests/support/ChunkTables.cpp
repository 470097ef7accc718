#include "support/ChunkTables.h"

namespace testsupport {

std::vector<TqovixChunkInformation> ChunkTableOf(const std::vector<moviekit::ChunkLayout>& chunks, bool withSampleSizes)
{
    std::vector<TqovixChunkInformation> table;
    uint32_t number = 1;
    for (const moviekit::ChunkLayout& chunk : chunks) {
        TqovixChunkInformation info;
        info.offset = chunk.offset;
        info.size = static_cast<uint32_t>(chunk.size);
        if (withSampleSizes) {
            info.sampleSizes = chunk.sampleSizes;
        }
        info.chunkNumber = number++;
        info.sampleCount = chunk.sampleCount;
        table.push_back(info);
    }
    return table;
}

}  // namespace testsupport
