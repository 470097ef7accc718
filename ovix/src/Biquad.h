// Second-order filter sections (transposed direct form II) and the two designs the
// suppressor needs, from the standard audio-EQ biquad formulas.
#pragma once

#include <cmath>
#include <numbers>

namespace ovix {

struct BiquadCoefficients {
    double b0 = 1.0, b1 = 0.0, b2 = 0.0, a1 = 0.0, a2 = 0.0;  // a0 normalised to 1
};

struct BiquadState {
    double z1 = 0.0, z2 = 0.0;

    // Long silences would otherwise decay the state into denormals, which are slow.
    void Flush()
    {
        constexpr double kTiny = 1e-30;
        if (std::fabs(z1) < kTiny) z1 = 0.0;
        if (std::fabs(z2) < kTiny) z2 = 0.0;
    }
};

inline double RunBiquad(const BiquadCoefficients& c, BiquadState& s, double x)
{
    const double y = c.b0 * x + s.z1;
    s.z1 = c.b1 * x - c.a1 * y + s.z2;
    s.z2 = c.b2 * x - c.a2 * y;
    return y;
}

inline BiquadCoefficients Normalised(double b0, double b1, double b2, double a0, double a1, double a2)
{
    return {b0 / a0, b1 / a0, b2 / a0, a1 / a0, a2 / a0};
}

inline BiquadCoefficients DesignHighPass(double rateHz, double cornerHz, double q)
{
    const double w = 2.0 * std::numbers::pi * cornerHz / rateHz;
    const double cosW = std::cos(w);
    const double alpha = std::sin(w) / (2.0 * q);
    return Normalised((1.0 + cosW) / 2.0, -(1.0 + cosW), (1.0 + cosW) / 2.0, 1.0 + alpha, -2.0 * cosW, 1.0 - alpha);
}

// Shelf slope 1: the steepest shelf without overshoot.
inline BiquadCoefficients DesignLowShelf(double rateHz, double cornerHz, double gainDb)
{
    const double a = std::pow(10.0, gainDb / 40.0);
    const double w = 2.0 * std::numbers::pi * cornerHz / rateHz;
    const double cosW = std::cos(w);
    const double twoSqrtAAlpha = 2.0 * std::sqrt(a) * std::sin(w) / 2.0 * std::numbers::sqrt2;
    return Normalised(a * ((a + 1.0) - (a - 1.0) * cosW + twoSqrtAAlpha), 2.0 * a * ((a - 1.0) - (a + 1.0) * cosW),
                      a * ((a + 1.0) - (a - 1.0) * cosW - twoSqrtAAlpha), (a + 1.0) + (a - 1.0) * cosW + twoSqrtAAlpha,
                      -2.0 * ((a - 1.0) + (a + 1.0) * cosW), (a + 1.0) + (a - 1.0) * cosW - twoSqrtAAlpha);
}

}  // namespace ovix
