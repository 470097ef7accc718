#include "MoviePlan.h"

#include "SoundPlan.h"

#include <algorithm>

namespace moviekit {

bool PlanFail(std::string* error, const std::string& reason)
{
    if (error != nullptr) {
        *error = reason;
    }
    return false;
}

uint64_t DivCeil(uint64_t a, uint64_t b) { return a / b + (a % b != 0 ? 1 : 0); }

uint64_t FramesForVideo(const VideoRecipe& video, uint64_t videoFrames, uint32_t rate)
{
    return static_cast<uint64_t>(Wide{videoFrames} * video.frameDuration * rate / video.timeScale);
}

std::vector<uint32_t> SplitIntoChunks(uint64_t total, uint32_t perChunk)
{
    std::vector<uint32_t> counts;
    for (uint64_t done = 0; done < total; done += perChunk) {
        counts.push_back(static_cast<uint32_t>(std::min<uint64_t>(perChunk, total - done)));
    }
    return counts;
}

void ResolveMaker(const MovieRecipe& recipe, MoviePlan& plan)
{
    const MakerRecipe& maker = recipe.maker;
    if (maker.afPayload) {
        plan.afPayload = *maker.afPayload;
    } else {
        const uint64_t n = plan.soundFrames;
        const std::vector<AfInterval> defaults = {{n / 4, n / 4 + n / 10, 800}, {n / 2, n / 2 + n / 8, 500}};
        plan.afPayload = MakeAfInformation(recipe.sound.sampleRate, maker.afIntervals.value_or(defaults),
                                           maker.afProcessed);
    }
    plan.audioLevelPayload = maker.audioLevelPayload.value_or(MakeAudioLevel(maker.levelDb100));
    if (maker.tagPayload) {
        plan.tagPayload = *maker.tagPayload;
    } else if (maker.tags) {
        plan.tagPayload = SerializeTags(*maker.tags);
    } else {
        const bool video = recipe.video.present;
        std::vector<Tag> tags = {MakeAsciiTag(0, kSoftwareNameTag, maker.softwareName)};
        for (Tag& tag : MakeTrimTags(maker.removedFrameForward, maker.removedFrameBackward,
                                     video ? recipe.video.timeScale : 30, video ? recipe.video.frameDuration : 1)) {
            tags.push_back(std::move(tag));
        }
        plan.tagPayload = SerializeTags(tags);
    }
}

namespace {

bool PlanVideo(const VideoRecipe& video, MoviePlan& plan, std::string* error)
{
    if (!video.present) {
        return true;
    }
    if (video.frameCount == 0 || video.framesPerChunk == 0 || video.timeScale == 0 || video.frameDuration == 0) {
        return PlanFail(error, "video needs frames, frames per chunk, a time scale and a frame duration");
    }
    const uint64_t natural = uint64_t{video.width} * video.height * 3;
    if (video.frameSize == 0 && natural > UINT32_MAX) {
        return PlanFail(error, "video frames too large");
    }
    plan.videoFrameSize = video.frameSize != 0 ? video.frameSize : static_cast<uint32_t>(natural);
    if (plan.videoFrameSize == 0) {
        return PlanFail(error, "video frames of 0 bytes");
    }
    uint64_t first = 0;
    for (uint32_t count : SplitIntoChunks(video.frameCount, video.framesPerChunk)) {
        ChunkLayout chunk;
        chunk.firstSample = first;
        chunk.sampleCount = count;
        chunk.size = uint64_t{count} * plan.videoFrameSize;
        if (video.perSampleSizes) {
            chunk.sampleSizes.assign(count, plan.videoFrameSize);
        }
        first += count;
        plan.videoChunks.push_back(std::move(chunk));
    }
    return true;
}

// Sound chunks go with the video chunk period in which they start.
void Interleave(const MovieRecipe& recipe, MoviePlan& plan)
{
    std::vector<ChunkSlot> order;
    const size_t videoCount = plan.videoChunks.size();
    std::vector<std::vector<uint32_t>> soundByPeriod(std::max<size_t>(videoCount, 1));
    for (uint32_t s = 0; s < plan.soundChunks.size(); ++s) {
        size_t period = 0;
        if (videoCount > 0) {
            const VideoRecipe& video = recipe.video;
            const uint64_t startFrame = plan.soundChunks[s].firstSample * (plan.aac ? kAacFramesPerPacket : 1);
            const Wide periodLength = Wide{video.framesPerChunk} * video.frameDuration * recipe.sound.sampleRate;
            const Wide index = Wide{startFrame} * video.timeScale / periodLength;
            period = static_cast<size_t>(std::min<Wide>(index, videoCount - 1));
        }
        soundByPeriod[period].push_back(s);
    }
    for (size_t period = 0; period < soundByPeriod.size(); ++period) {
        const bool haveVideo = period < videoCount;
        if (haveVideo && !recipe.soundFirstInPeriod) {
            order.push_back({false, static_cast<uint32_t>(period)});
        }
        for (uint32_t s : soundByPeriod[period]) {
            order.push_back({true, s});
        }
        if (haveVideo && recipe.soundFirstInPeriod) {
            order.push_back({false, static_cast<uint32_t>(period)});
        }
    }
    const size_t groups = std::max<uint32_t>(recipe.mdatCount, 1);
    plan.mdats.assign(groups, {});
    for (size_t g = 0; g < groups; ++g) {
        const size_t begin = g * order.size() / groups;
        const size_t end = (g + 1) * order.size() / groups;
        plan.mdats[g].assign(order.begin() + static_cast<std::ptrdiff_t>(begin),
                             order.begin() + static_cast<std::ptrdiff_t>(end));
    }
}

}  // namespace

bool PlanMovie(const MovieRecipe& recipe, MoviePlan* plan, std::string* error)
{
    *plan = MoviePlan{};
    if (!PlanVideo(recipe.video, *plan, error)) {
        return false;
    }
    if (recipe.sound.present && !PlanSound(recipe, *plan, error)) {
        return false;
    }
    ResolveMaker(recipe, *plan);
    Interleave(recipe, *plan);
    return true;
}

std::vector<uint64_t> MdatPayloadSizes(const MoviePlan& plan)
{
    std::vector<uint64_t> sizes;
    for (const std::vector<ChunkSlot>& slots : plan.mdats) {
        uint64_t size = 0;
        for (const ChunkSlot& slot : slots) {
            size += slot.sound ? plan.soundChunks[slot.index].size : plan.videoChunks[slot.index].size;
        }
        sizes.push_back(size);
    }
    return sizes;
}

void AssignOffsets(MoviePlan& plan, const std::vector<uint64_t>& mdatPayloadOffsets)
{
    for (size_t g = 0; g < plan.mdats.size(); ++g) {
        uint64_t offset = mdatPayloadOffsets[g];
        for (const ChunkSlot& slot : plan.mdats[g]) {
            ChunkLayout& chunk = slot.sound ? plan.soundChunks[slot.index] : plan.videoChunks[slot.index];
            chunk.offset = offset;
            offset += chunk.size;
        }
    }
}

}  // namespace moviekit
