#pragma once
// Test pictures and sound of ndi-testsrc, also used by the tests and the
// benchmark to check what arrives. Written against the NDI C structures only.
//
// Pattern "ramp": frame n, row y, byte column c holds (c + 3*y + 7*n) & 0xFF,
// except that the first 8 bytes of row 0 hold n (little-endian 64-bit). Rows
// are numbered on across planes: the chroma rows of NV12, the U then V rows
// of I420 (V then U for YV12) and the alpha rows of UYVA follow the luma rows.
// Audio ramp: sample s (per channel, counted from the start) of channel c is
// ((s + 7*c) % 1024) / 1024.0f.
// Pattern "bars": eight colour bars with a moving white marker; a 1 kHz tone.
#include <cstdint>
#include <string>
#include <vector>

namespace ndits {

struct Plane {
  std::size_t offset = 0;  // from the start of the picture
  int rows = 0;
  int row_bytes = 0;       // bytes of pixels in a row
  int stride = 0;          // bytes from one row to the next
  int first_row = 0;       // number of its first row in the ramp
};

// Planes of a picture with this NDI FourCC (tight strides); empty for a
// FourCC it does not know or a size the format cannot have (odd widths for
// 4:2:2 and 4:2:0, odd heights for 4:2:0).
std::vector<Plane> PictureLayout(std::uint32_t fourcc, int width, int height);
std::size_t PictureSize(const std::vector<Plane>& planes);

// The FourCC for an option value ("uyvy", "nv12", ...); 0 when unknown.
std::uint32_t FourCCFromName(const std::string& name);

inline std::uint8_t RampByte(int c, int row, std::int64_t n) {
  return static_cast<std::uint8_t>((c + 3 * row + 7 * n) & 0xFF);
}

// Writes ramp frame n into `picture` (PictureSize bytes).
void FillRamp(const std::vector<Plane>& planes, std::int64_t n, std::uint8_t* picture);
// Checks a received picture against ramp frame n (n read from its first 8
// bytes when n < 0); `stride` is the received luma stride (0 = tight).
// Returns an empty text when intact, else where it first differs.
std::string CheckRamp(std::uint32_t fourcc, int width, int height, int stride, const std::uint8_t* picture,
                      std::int64_t* frame_number);
// The frame number in the first 8 bytes of a ramp picture.
std::int64_t RampFrameNumber(const std::uint8_t* picture);

// Bars: a picture cached per format and size, and the marker moved per frame.
class Bars {
 public:
  Bars(std::uint32_t fourcc, int width, int height);
  void Fill(std::int64_t n, std::uint8_t* picture) const;

 private:
  void Rect(std::uint8_t* picture, int x0, int y0, int w, int h, int color) const;
  std::uint32_t fourcc_;
  int width_, height_;
  std::vector<Plane> planes_;
  std::vector<std::uint8_t> base_;
};

inline float AudioRampSample(std::int64_t s, int c) {
  return static_cast<float>((s + 7 * c) % 1024) / 1024.0f;
}

}  // namespace ndits
