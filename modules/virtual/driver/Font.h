// Letters to write into pictures: digits, capitals and punctuation on a grid of 5 by 7.
#pragma once

#include <array>
#include <cstdint>

namespace virtualcamera {

constexpr int kGlyphWidth = 5;
constexpr int kGlyphHeight = 7;

// Columns from the left; bit 0 is the topmost dot.
using Glyph = std::array<uint8_t, kGlyphWidth>;

// Small letters are shown as capitals, what there is no glyph for as a dash.
const Glyph& glyph(char character);

}  // namespace virtualcamera
