#pragma once
// Picture geometry of the FourCCs the loopback runtime carries, shared by the
// sender (how many bytes a frame has), the wire decoder (whether a frame's
// length matches its header) and the "lowest" bandwidth (proxy pictures);
// and what a receiver gets: the FourCC and stride the vendor runtime
// delivers for the receiver's colour format.
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

struct ScaledPicture {
  int xres = 0;
  int yres = 0;
  int stride = 0;
  std::vector<std::uint8_t> bytes;
};

// The size of the "lowest" bandwidth's proxy picture, as the vendor runtime
// makes it: a picture that fits in 640x640 keeps its size; a larger one is
// scaled to fit, keeping its shape, each side rounded down to even (1920x1080
// and 3840x2160 become 640x360, 1440x1080 640x480, 1080x1920 360x640).
void ProxySize(int xres, int yres, int* width, int* height);

// A nearest-neighbour copy of a picture at another size (even sides for the
// subsampled formats), tightly packed. False for a FourCC it does not know.
bool ScalePicture(std::uint32_t fourcc, int xres, int yres, int stride, const std::uint8_t* data, int width,
                  int height, ScaledPicture* out);

// What the vendor runtime delivers to a receiver: pictures with alpha (UYVA
// always; BGRA and RGBA with any alpha byte below 255) as the alpha choice of
// the receiver's colour format, all others as its plain choice:
//   BGRX_BGRA: BGRX / BGRA      UYVY_BGRA: UYVY / BGRA      RGBX_RGBA: RGBX / RGBA
//   UYVY_RGBA: UYVY / RGBA      fastest (and any other):  UYVY / UYVA
bool HasAlpha(std::uint32_t fourcc, int xres, int yres, int stride, const std::uint8_t* data);
std::uint32_t DeliveredFourCC(std::int32_t color_format, bool alpha);
// Its line stride: the width rounded up to 16 pixels (UYVA's alpha plane
// follows at the width).
int DeliveredStride(std::uint32_t fourcc, int xres);

// Converts a picture into `to` at `out_stride` (PictureBytes(to, xres, yres,
// out_stride) bytes at `out`), through 4:2:2 YUV with alpha: RGB to YUV with
// BT.709 limited range, YUV to RGB as the vendor runtime does it (measured on
// the 75% bars: R and the luma scale of BT.709, the blue of BT.601, green
// with BT.709's U and BT.601's V weight). Same FourCC: a copy row by row.
// False for a FourCC it does not know.
bool ConvertPicture(std::uint32_t from, int xres, int yres, int stride, const std::uint8_t* data, std::uint32_t to,
                    int out_stride, std::uint8_t* out);

}  // namespace ndilb
