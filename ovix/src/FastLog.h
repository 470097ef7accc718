// A logarithm to a few hundredths, for spectra judged in decibels: far cheaper than the
// library's, which dominates loops that take one per bin and frame.
#pragma once

#include <algorithm>
#include <bit>
#include <cstdint>

namespace ovix {

inline float FastLog2(float x)
{
    const auto bits = std::bit_cast<uint32_t>(std::max(x, 1e-30f));
    const float exponent = static_cast<float>(static_cast<int>(bits >> 23) - 127);
    const float m = std::bit_cast<float>((bits & 0x007fffffu) | 0x3f800000u) - 1.0f;
    return exponent + m * (1.4425449f + m * (-0.7181452f + m * 0.2742f));
}

}  // namespace ovix
