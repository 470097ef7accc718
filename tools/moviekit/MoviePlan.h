// Everything about a movie that follows from its description before a byte is written:
// resolved defaults, the chunks of both tracks, and their order in the "mdat" atoms.
#pragma once

#include "Movie.h"
#include "Pattern.h"

#include <cstdint>
#include <string>
#include <vector>

namespace moviekit {

struct ChunkSlot {
    bool sound = false;
    uint32_t index = 0;
};

struct MoviePlan {
    bool aac = false;
    bool littleEndianPcm = false;
    std::string soundFormat;
    uint32_t bytesPerFrame = 0;  // PCM
    uint32_t sampleBytes = 2;  // PCM
    bool deepPcm = false;  // anything but 16-bit integers
    bool version2Lpcm = false;
    uint64_t soundSamples = 0;   // PCM frames or AAC packets
    uint64_t soundFrames = 0;    // audio frames either way
    uint32_t soundMediaTime = 0;
    uint32_t videoFrameSize = 0;
    Bytes audioSpecificConfig;
    Bytes esdsPayload;
    std::vector<uint32_t> aacPacketSizes;
    std::vector<uint32_t> aacFillBytes;  // generated packets only
    Bytes afPayload;
    Bytes audioLevelPayload;
    Bytes tagPayload;
    std::vector<ChunkLayout> soundChunks;  // offsets filled by AssignOffsets
    std::vector<ChunkLayout> videoChunks;
    std::vector<std::vector<ChunkSlot>> mdats;  // the chunks of each "mdat" in file order
};

bool PlanMovie(const MovieRecipe& recipe, MoviePlan* plan, std::string* error);
// The maker payloads (AF information, audio level, tags) of `recipe`; needs plan.soundFrames.
void ResolveMaker(const MovieRecipe& recipe, MoviePlan& plan);
std::vector<uint64_t> MdatPayloadSizes(const MoviePlan& plan);
void AssignOffsets(MoviePlan& plan, const std::vector<uint64_t>& mdatPayloadOffsets);

// Shared by the planners.
using Wide = unsigned __int128;
bool PlanFail(std::string* error, const std::string& reason);
uint64_t DivCeil(uint64_t a, uint64_t b);
// Audio frames that cover `videoFrames` frames of video.
uint64_t FramesForVideo(const VideoRecipe& video, uint64_t videoFrames, uint32_t rate);
std::vector<uint32_t> SplitIntoChunks(uint64_t total, uint32_t perChunk);

}  // namespace moviekit
