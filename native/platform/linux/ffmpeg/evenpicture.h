// libx264 takes 4:2:0 pictures only, whose width and height must be even: a camera or display of
// an odd size is recorded at the next even size, its last column and last row repeated into the
// added ones.
#pragma once

#include <cstddef>
#include <cstdint>

namespace platform::evenpicture {

// The size rounded up to the next even number.
int evenSize(int size);

// Copies a 4-byte-per-pixel picture of width x height (rows of width * 4 bytes) into dst, whose
// rows are evenSize(width) * 4 bytes and which has evenSize(height) rows.
void pad(const uint8_t* source, int width, int height, uint8_t* dst);

// Repeats the last column and row of a plane of width x height one-byte samples into the added
// ones of its even size, in place.
void repeatEdges(uint8_t* plane, ptrdiff_t stride, int width, int height);

}  // namespace platform::evenpicture
