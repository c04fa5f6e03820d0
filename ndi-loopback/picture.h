#pragma once
// Picture geometry of the FourCCs the loopback runtime carries, shared by the
// sender (how many bytes a frame has), the wire decoder (whether a frame's
// length matches its header) and the "lowest" bandwidth (half-size pictures).
#include <cstdint>
#include <vector>

namespace ndilb {

// Bytes of one picture with this FourCC, size and line stride (0 = tight), or
// 0 when the values cannot describe a picture (unknown FourCC, sizes out of
// range, a stride shorter than a row). Layouts: UYVY/BGRA/BGRX/RGBA/RGBX one
// plane of `stride` x yres; UYVA the UYVY plane then an alpha plane of xres x
// yres; NV12 the luma plane then (yres+1)/2 rows of interleaved chroma at the
// same stride; I420/YV12 the luma plane then two planes of (yres+1)/2 rows at
// stride/2.
std::uint64_t PictureBytes(std::uint32_t fourcc, int xres, int yres, int stride);

// The stride used when a frame gives 0.
int DefaultStride(std::uint32_t fourcc, int xres);

// Largest picture side accepted anywhere.
inline constexpr int kMaxPictureSide = 16384;

struct HalfPicture {
  int xres = 0;
  int yres = 0;
  int stride = 0;
  std::vector<std::uint8_t> bytes;
};

// Every other pixel of every other row (nearest neighbour), tightly packed.
// Returns false for a FourCC it does not know or a picture too small to halve.
bool HalvePicture(std::uint32_t fourcc, int xres, int yres, int stride, const std::uint8_t* data,
                  HalfPicture* out);

}  // namespace ndilb
