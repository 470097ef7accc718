#include "SoundPlan.h"

#include <algorithm>

namespace moviekit {

namespace {

bool ResolveSoundSamples(const MovieRecipe& recipe, MoviePlan& plan, std::vector<uint32_t>& counts,
                         std::string* error)
{
    const SoundRecipe& sound = recipe.sound;
    const VideoRecipe& video = recipe.video;
    uint64_t samples = sound.sampleCount;
    if (plan.aac && !sound.aacPackets.empty()) {
        if (samples != 0 && samples != sound.aacPackets.size()) {
            return PlanFail(error, "sampleCount differs from the number of AAC packets given");
        }
        samples = sound.aacPackets.size();
    } else if (!plan.aac && (!sound.pcm.empty() || !sound.widePcm.empty())) {
        const size_t given = sound.widePcm.empty() ? sound.pcm.size() : sound.widePcm.size();
        if (given % sound.channels != 0) {
            return PlanFail(error, "PCM sample count is not a multiple of the channel count");
        }
        if (samples != 0 && samples != given / sound.channels) {
            return PlanFail(error, "sampleCount differs from the PCM frames given");
        }
        samples = given / sound.channels;
    }
    if (!sound.chunkSampleCounts.empty()) {
        uint64_t sum = 0;
        for (uint32_t count : sound.chunkSampleCounts) {
            if (count == 0) {
                return PlanFail(error, "a sound chunk without samples");
            }
            sum += count;
        }
        if (samples != 0 && samples != sum) {
            return PlanFail(error, "chunkSampleCounts do not add up to the sample count");
        }
        samples = sum;
    }
    if (samples == 0) {
        const uint64_t frames =
            video.present ? FramesForVideo(video, video.frameCount, sound.sampleRate) : sound.sampleRate;
        samples = plan.aac ? DivCeil(frames, kAacFramesPerPacket) : frames;
    }
    if (samples == 0 || samples > UINT32_MAX) {
        return PlanFail(error, "sound sample count out of range");
    }
    plan.soundSamples = samples;
    plan.soundFrames = plan.aac ? samples * kAacFramesPerPacket : samples;

    counts = sound.chunkSampleCounts;
    if (counts.empty()) {
        uint64_t perChunk = sound.samplesPerChunk;
        if (perChunk == 0) {
            const uint64_t frames = video.present ? FramesForVideo(video, video.framesPerChunk, sound.sampleRate)
                                                  : sound.sampleRate / 2;
            perChunk = plan.aac ? DivCeil(frames, kAacFramesPerPacket) : frames;
        }
        counts = SplitIntoChunks(samples, static_cast<uint32_t>(std::clamp<uint64_t>(perChunk, 1, UINT32_MAX)));
    }
    return true;
}

void BuildSoundChunks(MoviePlan& plan, const std::vector<uint32_t>& counts)
{
    uint64_t first = 0;
    for (uint32_t count : counts) {
        ChunkLayout chunk;
        chunk.firstSample = first;
        chunk.sampleCount = count;
        if (plan.aac) {
            for (uint32_t i = 0; i < count; ++i) {
                chunk.sampleSizes.push_back(plan.aacPacketSizes[first + i]);
                chunk.size += plan.aacPacketSizes[first + i];
            }
        } else {
            chunk.size = uint64_t{count} * plan.bytesPerFrame;
        }
        first += count;
        plan.soundChunks.push_back(std::move(chunk));
    }
}

void ResolveAac(const MovieRecipe& recipe, MoviePlan& plan)
{
    const SoundRecipe& sound = recipe.sound;
    uint64_t totalBytes = 0;
    uint32_t largest = 0;
    for (uint64_t i = 0; i < plan.soundSamples; ++i) {
        uint32_t size = 0;
        if (!sound.aacPackets.empty()) {
            size = static_cast<uint32_t>(sound.aacPackets[i].size());
        } else {
            // Sizes wander like an encoder's around 128 kbit/s stereo.
            const uint32_t fill = 120 + static_cast<uint32_t>(SplitMix64(i) % 150);
            plan.aacFillBytes.push_back(fill);
            size = SilentAacPacketSize(sound.channels, fill);
        }
        plan.aacPacketSizes.push_back(size);
        totalBytes += size;
        largest = std::max(largest, size);
    }
    plan.audioSpecificConfig = sound.esds.audioSpecificConfig
                                   ? *sound.esds.audioSpecificConfig
                                   : MakeAudioSpecificConfig(sound.sampleRate, sound.channels);
    const uint64_t seconds1024 = plan.soundSamples * kAacFramesPerPacket;
    const uint32_t average =
        static_cast<uint32_t>(Wide{totalBytes} * 8 * sound.sampleRate / std::max<uint64_t>(seconds1024, 1));
    const uint32_t peak = static_cast<uint32_t>(uint64_t{largest} * 8 * sound.sampleRate / kAacFramesPerPacket);
    plan.esdsPayload = MakeEsdsPayload(sound.esds, plan.audioSpecificConfig,
                                       sound.esds.maxBitRate.value_or(peak),
                                       sound.esds.averageBitRate.value_or(average));
}

}  // namespace

bool PlanSound(const MovieRecipe& recipe, MoviePlan& plan, std::string* error)
{
    const SoundRecipe& sound = recipe.sound;
    plan.aac = sound.codec == SoundCodec::Aac;
    if (sound.channels == 0 || sound.sampleRate == 0 || sound.sampleRate > (plan.aac ? 0xFFFF : 768000)) {
        return PlanFail(error, "sound needs 1 or more channels and a rate of 1 to 65535 Hz (768 kHz for PCM)");
    }
    const bool widthKnown = sound.floatingPoint ? (sound.bits == 32 || sound.bits == 64)
                                                : (sound.bits == 16 || sound.bits == 24 || sound.bits == 32);
    if (!plan.aac && !widthKnown) {
        return PlanFail(error, "PCM samples are 16, 24 or 32-bit integers or 32 or 64-bit floats");
    }
    plan.littleEndianPcm = sound.codec == SoundCodec::Sowt;
    plan.deepPcm = !plan.aac && (sound.bits != 16 || sound.floatingPoint);
    plan.version2Lpcm = !plan.aac && (sound.version2Lpcm || sound.sampleRate > 0xFFFF);
    plan.sampleBytes = plan.aac ? 2 : sound.bits / 8U;
    const char* deep = sound.floatingPoint ? (sound.bits == 32 ? "fl32" : "fl64") : (sound.bits == 24 ? "in24" : "in32");
    plan.soundFormat = plan.aac                ? "mp4a"
                       : plan.version2Lpcm     ? "lpcm"
                       : plan.deepPcm          ? deep
                       : plan.littleEndianPcm ? "sowt"
                                               : "twos";
    if (!sound.formatOverride.empty()) {
        plan.soundFormat = sound.formatOverride;
    }
    plan.bytesPerFrame = plan.sampleBytes * sound.channels;
    if (plan.aac && sound.aacPackets.empty() && sound.channels > 2) {
        return PlanFail(error, "generated AAC packets are mono or stereo; give packets for more channels");
    }
    std::vector<uint32_t> counts;
    if (!ResolveSoundSamples(recipe, plan, counts, error)) {
        return false;
    }
    if (plan.aac) {
        ResolveAac(recipe, plan);
    }
    BuildSoundChunks(plan, counts);
    // Only AAC carries priming; PCM starts at its first frame.
    plan.soundMediaTime = sound.mediaTime.value_or(plan.aac ? kAacFramesPerPacket : 0);
    return true;
}

}  // namespace moviekit
