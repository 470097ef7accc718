// The chunk list a track's tables should give, from what moviekit wrote.
#pragma once

#include <vector>

#include "Movie.h"
#include "visitor/TqovixChunkInformation.h"

namespace testsupport {

std::vector<TqovixChunkInformation> ChunkTableOf(const std::vector<moviekit::ChunkLayout>& chunks, bool withSampleSizes);

}  // namespace testsupport
