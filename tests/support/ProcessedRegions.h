// Where processing changed a sound, judged against the AF intervals it was given: every change
// lies within an interval widened by the 10 ms ramp, and the changes reach into the outermost
// tenth of the ramp at both ends of that widened interval. Plus a sound on which that is decidable: loud motor-like
// rumble over each interval, so that even the ramp's first, tiny weights change samples.
// Header-only: the unit and the host suites link different support libraries.
#pragma once

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <numbers>
#include <sstream>
#include <string>
#include <vector>

namespace testsupport {

// Track frames, end exclusive.
struct FrameSpan {
    uint64_t start = 0;
    uint64_t end = 0;
};

// Interleaved 16-bit sound: quiet broadband ambience everywhere, and over each span (and two
// ramps either side, so that the rumble has settled when a ramp begins) a rumble of low partials
// and low-passed noise near full scale (times `loudness`), with another phase in every channel.
inline std::vector<int16_t> MotorOverSpans(uint64_t frames, unsigned channels, uint32_t rate,
                                           const std::vector<FrameSpan>& spans, double loudness = 1.0,
                                           double ambience = 1200.0)
{
    const uint64_t lead = 2 * (rate / 100);
    std::vector<int16_t> out(frames * channels);
    uint32_t seed = 12345;
    std::vector<double> rumble(channels, 0.0);
    for (uint64_t f = 0; f < frames; ++f) {
        const bool motor = std::ranges::any_of(spans, [&](const FrameSpan& s) {
            return f + lead >= s.start && f < s.end + lead;
        });
        const double t = static_cast<double>(f) / rate;
        for (unsigned c = 0; c < channels; ++c) {
            seed = seed * 1664525u + 1013904223u;
            const double white = static_cast<double>(seed >> 16) / 32768.0 - 1.0;
            rumble[c] = 0.97 * rumble[c] + 0.03 * white;  // a one-pole low-pass: the motor's hiss
            double value = ambience * white;
            if (motor) {
                for (int k = 0; k < 4; ++k) {
                    value += loudness * 5000.0 *
                             std::sin(2.0 * std::numbers::pi * (47.0 + 31.0 * k) * t + 1.3 * k + 0.7 * c);
                }
                value += loudness * 30000.0 * rumble[c];
            }
            out[f * channels + c] = static_cast<int16_t>(std::clamp(std::lrint(value), -32767l, 32767l));
        }
    }
    return out;
}

// Empty when the changes from `before` to `after` keep to the spans as described above; else
// what is wrong. A span whose widened form leaves the sound is judged only where it lies inside.
inline std::string CheckProcessedRegions(const std::vector<int16_t>& before, const std::vector<int16_t>& after,
                                         unsigned channels, const std::vector<FrameSpan>& spans, uint64_t ramp)
{
    std::ostringstream problems;
    if (before.size() != after.size() || before.size() % channels != 0) {
        return "the sound changed its length";
    }
    const uint64_t frames = before.size() / channels;
    const auto changed = [&](uint64_t f) {
        return !std::equal(before.begin() + static_cast<std::ptrdiff_t>(f * channels),
                           before.begin() + static_cast<std::ptrdiff_t>((f + 1) * channels),
                           after.begin() + static_cast<std::ptrdiff_t>(f * channels));
    };
    // Widened spans, merged where their ramps meet.
    std::vector<FrameSpan> regions;
    for (const FrameSpan& s : spans) {
        const FrameSpan wide{s.start > ramp ? s.start - ramp : 0, std::min(s.end + ramp, frames)};
        if (!regions.empty() && wide.start <= regions.back().end) {
            regions.back().end = std::max(regions.back().end, wide.end);
        } else {
            regions.push_back(wide);
        }
    }
    size_t next = 0;
    uint64_t strays = 0;
    uint64_t firstStray = 0;
    for (uint64_t f = 0; f < frames; ++f) {
        while (next < regions.size() && regions[next].end <= f) {
            ++next;
        }
        const bool inside = next < regions.size() && f >= regions[next].start;
        if (!inside && changed(f)) {
            firstStray = strays++ == 0 ? f : firstStray;
        }
    }
    if (strays != 0) {
        problems << strays << " frames changed outside the intervals and their ramps, the first at " << firstStray
                 << "; ";
    }
    for (const FrameSpan& region : regions) {
        uint64_t first = region.start;
        while (first < region.end && !changed(first)) {
            ++first;
        }
        if (first == region.end) {
            problems << "nothing changed in [" << region.start << ", " << region.end << "); ";
            continue;
        }
        uint64_t last = region.end - 1;
        while (!changed(last)) {
            --last;
        }
        // The ramp's outermost tenth weighs under 2.5 %: a removal that small may round away there.
        const uint64_t slack = ramp / 10 + 1;
        if (region.start != 0 && first > region.start + slack) {
            problems << "processing begins at " << first << ", not at " << region.start << "; ";
        }
        if (region.end != frames && last + 1 + slack < region.end) {
            problems << "processing ends at " << last + 1 << ", not at " << region.end << "; ";
        }
    }
    return problems.str();
}

}  // namespace testsupport
