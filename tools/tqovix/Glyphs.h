// A 5×7 bitmap font of our own for the picture's labels: digits, lower-case letters and a
// few signs. Each glyph is seven rows, the leftmost pixel in bit 4.
#pragma once

#include <array>
#include <cstdint>

using Glyph = std::array<uint8_t, 7>;

// The glyph of `c`; a blank for characters the font does not have.
const Glyph& GlyphOf(char c);
