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
// Pattern "blocks" (survives lossy compression and the "lowest" proxy): the
// eight bars over the top three quarters of the picture; in the bottom
// quarter, on black, frame n as kBlockCells white or black cells side by side
// across the whole width: cell i is white when bit i of BlockCode(n) is set.
// Every position is a fraction of the picture's size, so a scaled copy reads
// the same. Its sound is the audio ramp.
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

// The colours of the bars (75 %, BT.709 limited range), then black and white.
struct BarColour {
  std::uint8_t y, u, v, r, g, b;
};
inline constexpr int kBarCount = 8;
const BarColour& BarColourOf(int index);  // 0..7 the bars, 7 black, 8 white

// "blocks": 32 bits of the frame number, then 8 check bits (the four bytes
// of the number added up, exclusive-or 0x5A).
inline constexpr int kBlockCells = 40;
std::uint64_t BlockCode(std::uint32_t n);
// The number of a code whose check bits hold; -1 otherwise.
std::int64_t BlockNumber(std::uint64_t code);
// Where the parts of a "blocks" picture of this size lie: the bars fill rows
// [0, BlockBarRows), the cells rows [BlockBarRows, height); cell i (and bar i)
// spans columns [CellLeft(i), CellLeft(i + 1)).
inline int BlockBarRows(int height) { return (height * 3 / 4) & ~1; }
inline int CellLeft(int width, int i) { return (width * i / kBlockCells) & ~1; }
inline int BarLeft(int width, int i) { return (width * i / kBarCount) & ~1; }

// Bars (and blocks): a picture cached per format and size; per frame the
// marker moves (bars) or the number's cells are drawn (blocks).
class Bars {
 public:
  Bars(std::uint32_t fourcc, int width, int height, bool blocks = false);
  void Fill(std::int64_t n, std::uint8_t* picture) const;

 private:
  void Rect(std::uint8_t* picture, int x0, int y0, int w, int h, int color) const;
  std::uint32_t fourcc_;
  int width_, height_;
  bool blocks_;
  std::vector<Plane> planes_;
  std::vector<std::uint8_t> base_;
};

inline float AudioRampSample(std::int64_t s, int c) {
  return static_cast<float>((s + 7 * c) % 1024) / 1024.0f;
}

}  // namespace ndits
