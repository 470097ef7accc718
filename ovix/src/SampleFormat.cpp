#include "SampleFormat.h"

#include <algorithm>
#include <bit>
#include <cmath>
#include <cstdint>
#include <cstring>

namespace ovix {
namespace {

static_assert(std::endian::native == std::endian::little, "samples are read and written in host order");

// Far above full scale (floats may pass 1.0), low enough that a window's power stays finite.
constexpr float kLoudest = 32768.0f * 512.0f;

template <typename T>
T Get(const uint8_t* at)
{
    T value;
    std::memcpy(&value, at, sizeof value);
    return value;
}

template <typename T>
void Put(uint8_t* at, T value)
{
    std::memcpy(at, &value, sizeof value);
}

// Non-finite and absurd values are heard as silence or as the loudest sound, never as NaN,
// which would spread through every bin of the window.
float Tamed(double value)
{
    if (value >= -kLoudest && value <= kLoudest) {
        return static_cast<float>(value);
    }
    return value > 0 ? kLoudest : (value < 0 ? -kLoudest : 0.0f);
}

struct S16 {
    static float Level(const uint8_t* at) { return static_cast<float>(Get<int16_t>(at)); }
    // Exactly what the first version wrote: float arithmetic, rounded, held at full scale.
    static void Subtract(uint8_t* at, float removed)
    {
        const long value = std::lrint(static_cast<float>(Get<int16_t>(at)) - removed);
        Put(at, static_cast<int16_t>(std::clamp<long>(value, INT16_MIN, INT16_MAX)));
    }
};

struct S24 {
    static int32_t Value(const uint8_t* at)
    {
        const uint32_t bits = uint32_t{at[0]} | uint32_t{at[1]} << 8 | uint32_t{at[2]} << 16;
        return static_cast<int32_t>(bits << 8) >> 8;
    }
    static float Level(const uint8_t* at) { return static_cast<float>(Value(at)) * (1.0f / 256.0f); }
    static void Subtract(uint8_t* at, float removed)
    {
        constexpr long long kMax = (1 << 23) - 1;
        const long long value = std::llrint(static_cast<double>(Value(at)) - static_cast<double>(removed) * 256.0);
        const auto bits = static_cast<uint32_t>(std::clamp(value, -kMax - 1, kMax));
        at[0] = static_cast<uint8_t>(bits);
        at[1] = static_cast<uint8_t>(bits >> 8);
        at[2] = static_cast<uint8_t>(bits >> 16);
    }
};

struct S32 {
    static float Level(const uint8_t* at) { return static_cast<float>(Get<int32_t>(at)) * (1.0f / 65536.0f); }
    static void Subtract(uint8_t* at, float removed)
    {
        const long long value =
            std::llrint(static_cast<double>(Get<int32_t>(at)) - static_cast<double>(removed) * 65536.0);
        Put(at, static_cast<int32_t>(std::clamp<long long>(value, INT32_MIN, INT32_MAX)));
    }
};

struct F32 {
    static float Level(const uint8_t* at) { return Tamed(static_cast<double>(Get<float>(at)) * 32768.0); }
    static void Subtract(uint8_t* at, float removed)
    {
        Put(at, static_cast<float>(static_cast<double>(Get<float>(at)) - static_cast<double>(removed) / 32768.0));
    }
};

struct F64 {
    static float Level(const uint8_t* at) { return Tamed(Get<double>(at) * 32768.0); }
    static void Subtract(uint8_t* at, float removed)
    {
        Put(at, Get<double>(at) - static_cast<double>(removed) / 32768.0);
    }
};

template <typename Format>
void LoadRun(const uint8_t* first, size_t stride, size_t count, const float* window, float* out)
{
    for (size_t i = 0; i < count; ++i) {
        out[i] = window[i] * Format::Level(first + i * stride);
    }
}

// One 32-bit load a sample: its three bytes and the next sample's first, which lies inside the
// run for every sample but the last. The top 24 bits then hold the sample times 256.
template <>
void LoadRun<S24>(const uint8_t* first, size_t stride, size_t count, const float* window, float* out)
{
    size_t i = 0;
    for (; i + 1 < count; ++i) {
        const uint32_t word = Get<uint32_t>(first + i * stride);
        out[i] = window[i] * (static_cast<float>(static_cast<int32_t>(word << 8)) * (1.0f / 65536.0f));
    }
    for (; i < count; ++i) {
        out[i] = window[i] * S24::Level(first + i * stride);
    }
}

template <typename Format, size_t kBytes>
void SubtractRun(uint8_t* frame, unsigned channels, const float* removed, float weight)
{
    for (unsigned c = 0; c < channels; ++c) {
        // A sample nothing was taken from keeps its bytes, whatever rounding would make of them.
        if (removed[c] != 0.0f) {
            Format::Subtract(frame + c * kBytes, weight * removed[c]);
        }
    }
}

}  // namespace

std::optional<SampleFormat> SampleFormat::Of(unsigned bits, bool floating)
{
    if (floating) {
        switch (bits) {
        case 32: return SampleFormat(bits, true, &LoadRun<F32>, &SubtractRun<F32, 4>);
        case 64: return SampleFormat(bits, true, &LoadRun<F64>, &SubtractRun<F64, 8>);
        default: return std::nullopt;
        }
    }
    switch (bits) {
    case 16: return SampleFormat(bits, false, &LoadRun<S16>, &SubtractRun<S16, 2>);
    case 24: return SampleFormat(bits, false, &LoadRun<S24>, &SubtractRun<S24, 3>);
    case 32: return SampleFormat(bits, false, &LoadRun<S32>, &SubtractRun<S32, 4>);
    default: return std::nullopt;
    }
}

}  // namespace ovix
