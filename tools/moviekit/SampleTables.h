// The sample description and sample tables of the two tracks ("stsd", "stts", "stsc",
// "stsz", "stco"/"co64"), as a camera writes them.
#pragma once

#include "MoviePlan.h"

namespace moviekit {

Bytes Stts(uint32_t count, uint32_t duration);
// One entry per run of chunks with the same sample count.
Bytes Stsc(const std::vector<ChunkLayout>& chunks);
// `commonSize` 0 lists the chunks' sample sizes one by one.
Bytes Stsz(const std::vector<ChunkLayout>& chunks, uint32_t commonSize, uint64_t sampleCount);
Bytes ChunkOffsets(const std::vector<ChunkLayout>& chunks, bool co64);
Bytes VideoDescription(const VideoRecipe& video);
Bytes SoundDescription(const SoundRecipe& sound, const MoviePlan& plan);

}  // namespace moviekit
