// How a session's samples are stored (little-endian, 16, 24 or 32-bit signed integers, or
// 32 or 64-bit floats) and the two conversions the suppressor makes: a run of one channel's
// samples into floats for analysis, and a frame back into its own bytes less what was removed.
// Floats carry the 16-bit scale (full scale 32768) whatever the format, so that every level
// the estimator judges by means the same in every format. The routines are picked once, when
// the format is made, so the loops over samples never ask which format they serve.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>

namespace ovix {

class SampleFormat {
public:
    // nullopt for any other width, for floats other than 32 and 64 bits.
    static std::optional<SampleFormat> Of(unsigned bits, bool floating);
    static SampleFormat Int16() { return *Of(16, false); }

    unsigned Bytes() const { return m_bytes; }
    unsigned Bits() const { return m_bits; }
    bool Floating() const { return m_floating; }

    // out[i] = window[i] × sample i, the samples `stride` bytes apart from `first`.
    void LoadWindowed(const uint8_t* first, size_t stride, size_t count, const float* window, float* out) const
    {
        m_load(first, stride, count, window, out);
    }
    // Each of a frame's `channels` samples less weight × removed[c] where removed[c] is not 0:
    // integers rounded to nearest and held at full scale, floats never clipped.
    void SubtractFromFrame(uint8_t* frame, unsigned channels, const float* removed, float weight) const
    {
        m_subtract(frame, channels, removed, weight);
    }

private:
    using Load = void (*)(const uint8_t*, size_t, size_t, const float*, float*);
    using Subtract = void (*)(uint8_t*, unsigned, const float*, float);

    SampleFormat(unsigned bits, bool floating, Load load, Subtract subtract)
        : m_bits(bits), m_bytes(bits / 8), m_floating(floating), m_load(load), m_subtract(subtract)
    {
    }

    unsigned m_bits;
    unsigned m_bytes;
    bool m_floating;
    Load m_load;
    Subtract m_subtract;
};

}  // namespace ovix
