// The media bytes of a planned movie, produced on demand so that large movies never sit
// in memory: video frames from a pattern seeded by the frame index, PCM as given or as a
// tone, AAC packets as given or silent.
#pragma once

#include "MoviePlan.h"
#include "MovieWriter.h"

namespace moviekit {

class MediaSource {
public:
    MediaSource(const MovieRecipe& recipe, const MoviePlan& plan) : m_recipe(recipe), m_plan(plan) {}

    // Replaces `out` with the frame's bytes.
    void VideoFrame(uint64_t index, Bytes& out) const;
    // Replaces `out` with `frames` PCM frames from `firstFrame` on, as stored in the track.
    void PcmFrames(uint64_t firstFrame, uint32_t frames, Bytes& out) const;
    // Replaces `out` with the packet as stored.
    void AacPacket(uint64_t index, Bytes& out) const;
    // Streams one chunk; sound bytes are also appended to `soundBytes` when it is given.
    bool WriteChunk(const ChunkSlot& slot, Sink& sink, Bytes* soundBytes);

private:
    int16_t ToneSample(uint64_t frame, uint32_t channel) const;

    const MovieRecipe& m_recipe;
    const MoviePlan& m_plan;
    Bytes m_buffer;  // reused from piece to piece
};

}  // namespace moviekit
