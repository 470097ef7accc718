// Attenuates the band where lens motor noise lives, inside the AF drive spans only: a high-pass
// and a low-shelf section run through each span from a warm-up before it, and their output is
// mixed in by strength x ramp.
// Frames outside the spans and their ramps leave bit-exact.
#pragma once

#include "AfInformation.h"
#include "Biquad.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace ovix {

class NoiseSuppressor {
public:
    static constexpr unsigned kMaxChannels = 8;
    static constexpr size_t kBlockFrames = 1024;

    // Allocates everything the blocks need; channels 1..kMaxChannels.
    NoiseSuppressor(uint64_t rateHz, unsigned channels);

    // Sorted spans as AfInformation::Spans gives them; call before the first block.
    void SetSpans(std::vector<DriveSpan> spans);
    // Interleaved 16-bit frames; blocks must arrive in order. Allocation-free.
    void Process(int16_t* samples, uint64_t firstFrame, size_t frames);

    size_t RampFrames() const { return m_ramp.size(); }
    // Frames filtered before each ramp so that the filters have settled when it begins;
    // elsewhere outside the spans nothing is computed. The default (100 ms) is far past the
    // filters' decay; UINT64_MAX filters every frame (what tests compare with).
    void SetWarmUpFrames(uint64_t frames) { m_warmUp = frames; }

private:
    // Fills m_mix for one block; false when no frame of it is touched.
    bool FillMix(uint64_t firstFrame, size_t frames);
    // Whether a block lies within a span, its ramps or the warm-up before them.
    bool NeedsFilter(uint64_t firstFrame, size_t frames) const;
    void ProcessBlock(int16_t* samples, uint64_t firstFrame, size_t frames);
    template <unsigned Channels>
    void Filter(int16_t* samples, size_t frames, bool mixAny);

    unsigned m_channels;
    std::vector<float> m_ramp;  // rising half of a raised cosine, strictly between 0 and 1
    std::vector<float> m_mix;
    std::vector<DriveSpan> m_spans;
    size_t m_cursor = 0;  // first span whose ramp-out may still reach the next block
    uint64_t m_warmUp;
    bool m_bSettled = true;  // the filter states follow the sound (false after skipped blocks)
    BiquadCoefficients m_highPass;
    BiquadCoefficients m_lowShelf;
    std::array<BiquadState, kMaxChannels> m_highPassState{};
    std::array<BiquadState, kMaxChannels> m_lowShelfState{};
};

}  // namespace ovix
