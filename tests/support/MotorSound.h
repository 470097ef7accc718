// Sounds for judging the motor-noise suppressor, made in double precision so that the clean
// part stays known after mixing: a lens motor while it drives, steady wanted material (a chord,
// broadband ambience), and the measures the suites judge by. Header-only: the unit and the host
// suites link different support libraries.
#pragma once

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <numbers>
#include <vector>

namespace testsupport {

// Deterministic white noise in [-1, 1).
class WhiteNoise {
public:
    explicit WhiteNoise(uint32_t seed) : m_state(seed * 2654435761u + 1u) {}
    double Next()
    {
        m_state = m_state * 1664525u + 1013904223u;
        return static_cast<double>(m_state >> 8) / 8388608.0 - 1.0;
    }

private:
    uint32_t m_state;
};

// A two-pole band-pass of unit peak gain.
class BandPass {
public:
    BandPass(double centreHz, double q, double rateHz)
    {
        const double w = 2.0 * std::numbers::pi * centreHz / rateHz;
        const double alpha = std::sin(w) / (2.0 * q);
        const double a0 = 1.0 + alpha;
        m_b0 = alpha / a0;
        m_a1 = -2.0 * std::cos(w) / a0;
        m_a2 = (1.0 - alpha) / a0;
    }
    double Step(double x)
    {
        const double y = m_b0 * (x - m_x2) - m_a1 * m_y1 - m_a2 * m_y2;
        m_x2 = m_x1;
        m_x1 = x;
        m_y2 = m_y1;
        m_y1 = y;
        return y;
    }

private:
    double m_b0 = 0, m_a1 = 0, m_a2 = 0;
    double m_x1 = 0, m_x2 = 0, m_y1 = 0, m_y2 = 0;
};

// Track frames, end exclusive.
struct MotorSpan {
    uint64_t start = 0;
    uint64_t end = 0;
};

// Interleaved: a lens motor driving over each span and silent elsewhere. A whine of five
// harmonics whose fundamental sweeps from 300 to 1500 Hz over the drive, a short decaying tick
// every 9 ms, and hiss in a band around 3.5 kHz; 3 ms fades at the drive's ends. `level` is
// about the motor's RMS; each channel hears it with its own gain and its own hiss.
inline std::vector<double> MotorNoise(uint64_t frames, unsigned channels, uint32_t rate,
                                      const std::vector<MotorSpan>& spans, double level, uint32_t seed = 1)
{
    std::vector<double> out(frames * channels, 0.0);
    const double harmonics[] = {1.0, 0.6, 0.4, 0.25, 0.15};
    const uint64_t fade = std::max<uint64_t>(1, rate * 3 / 1000);
    const uint64_t tickEvery = rate * 9 / 1000;
    const double tickDecay = std::exp(-1.0 / (0.0006 * rate));
    for (size_t s = 0; s < spans.size(); ++s) {
        const uint64_t start = std::min(spans[s].start, frames);
        const uint64_t end = std::min(spans[s].end, frames);
        if (start >= end) {
            continue;
        }
        const double length = static_cast<double>(end - start);
        for (unsigned c = 0; c < channels; ++c) {
            WhiteNoise noise(seed * 7919u + static_cast<uint32_t>(s) * 131u + c);
            BandPass hiss(3500.0, 1.2, rate);
            const double gain = level * (1.0 - 0.12 * c / std::max(1u, channels));
            double phase = 0.0;
            double tick = 0.0;
            for (uint64_t f = start; f < end; ++f) {
                const uint64_t into = f - start;
                const double fundamental = 300.0 + 1200.0 * static_cast<double>(into) / length;
                phase += 2.0 * std::numbers::pi * fundamental / rate;
                double whine = 0.0;
                for (size_t h = 0; h < std::size(harmonics); ++h) {
                    whine += harmonics[h] * std::sin(static_cast<double>(h + 1) * phase + 0.5 * static_cast<double>(h));
                }
                tick = into % tickEvery == 0 ? 1.0 : tick * tickDecay;
                const double white = noise.Next();
                const double value = 0.8 * whine + 2.5 * tick * white + 1.6 * hiss.Step(white);
                const double edge = std::min({1.0, static_cast<double>(into + 1) / static_cast<double>(fade),
                                              static_cast<double>(end - f) / static_cast<double>(fade)});
                out[f * channels + c] += gain * edge * value;
            }
        }
    }
    return out;
}

// Interleaved broadband ambience: white noise through a gentle low-pass, about `level` RMS.
inline std::vector<double> Ambience(uint64_t frames, unsigned channels, double level, uint32_t seed = 2)
{
    std::vector<double> out(frames * channels);
    for (unsigned c = 0; c < channels; ++c) {
        WhiteNoise noise(seed * 104729u + c);
        double state = 0.0;
        for (uint64_t f = 0; f < frames; ++f) {
            state = 0.6 * state + 0.4 * noise.Next();
            out[f * channels + c] = level * 2.2 * state;
        }
    }
    return out;
}

// Interleaved steady chord of five notes (A major over two octaves), each `level` in
// amplitude, with another phase in every channel.
inline std::vector<double> Chord(uint64_t frames, unsigned channels, uint32_t rate, double level)
{
    const double notes[] = {220.0, 277.18, 329.63, 440.0, 659.26};
    std::vector<double> out(frames * channels);
    for (uint64_t f = 0; f < frames; ++f) {
        const double t = static_cast<double>(f) / rate;
        for (unsigned c = 0; c < channels; ++c) {
            double value = 0.0;
            for (size_t n = 0; n < std::size(notes); ++n) {
                value += std::sin(2.0 * std::numbers::pi * notes[n] * t + 0.9 * static_cast<double>(n) + 0.4 * c);
            }
            out[f * channels + c] = level * value;
        }
    }
    return out;
}

inline std::vector<double> Sum(std::vector<double> a, const std::vector<double>& b)
{
    for (size_t k = 0; k < a.size() && k < b.size(); ++k) {
        a[k] += b[k];
    }
    return a;
}

inline std::vector<int16_t> ToPcm(const std::vector<double>& sound)
{
    std::vector<int16_t> out(sound.size());
    for (size_t k = 0; k < sound.size(); ++k) {
        out[k] = static_cast<int16_t>(std::clamp<long>(std::lrint(sound[k]), -32768, 32767));
    }
    return out;
}

// Sum of squares over frames [from, to) of an interleaved sound.
template <typename T>
double Energy(const std::vector<T>& sound, unsigned channels, uint64_t from, uint64_t to)
{
    double sum = 0.0;
    for (uint64_t k = from * channels; k < to * channels && k < sound.size(); ++k) {
        sum += static_cast<double>(sound[k]) * static_cast<double>(sound[k]);
    }
    return sum;
}

// Energy of a - b over frames [from, to).
template <typename A, typename B>
double DifferenceEnergy(const std::vector<A>& a, const std::vector<B>& b, unsigned channels, uint64_t from,
                        uint64_t to)
{
    double sum = 0.0;
    for (uint64_t k = from * channels; k < to * channels && k < a.size() && k < b.size(); ++k) {
        const double d = static_cast<double>(a[k]) - static_cast<double>(b[k]);
        sum += d * d;
    }
    return sum;
}

// Scale-invariant signal-to-distortion ratio of `estimate` against `reference` over frames
// [from, to), in dB: the part of the estimate along the reference against everything else.
template <typename A, typename B>
double SiSdr(const std::vector<A>& estimate, const std::vector<B>& reference, unsigned channels, uint64_t from,
             uint64_t to)
{
    double dot = 0.0, norm = 0.0;
    for (uint64_t k = from * channels; k < to * channels && k < estimate.size() && k < reference.size(); ++k) {
        dot += static_cast<double>(estimate[k]) * static_cast<double>(reference[k]);
        norm += static_cast<double>(reference[k]) * static_cast<double>(reference[k]);
    }
    const double scale = norm > 0.0 ? dot / norm : 0.0;
    double target = 0.0, distortion = 0.0;
    for (uint64_t k = from * channels; k < to * channels && k < estimate.size() && k < reference.size(); ++k) {
        const double along = scale * static_cast<double>(reference[k]);
        const double rest = static_cast<double>(estimate[k]) - along;
        target += along * along;
        distortion += rest * rest;
    }
    return 10.0 * std::log10(std::max(target, 1e-30) / std::max(distortion, 1e-30));
}

inline double Decibels(double energy, double reference)
{
    return 10.0 * std::log10(std::max(energy, 1e-30) / std::max(reference, 1e-30));
}

}  // namespace testsupport
