#include "ndi-loopback/picture.h"

#include <cstring>

#include "taskndisource/ndi_abi.h"

namespace ndilb {

int DefaultStride(std::uint32_t fourcc, int xres) {
  if (fourcc == kNdiFourCCUYVY || fourcc == kNdiFourCCUYVA) return xres * 2;
  if (fourcc == kNdiFourCCNV12 || fourcc == kNdiFourCCI420 || fourcc == kNdiFourCCYV12) return xres;
  return xres * 4;
}

namespace {
// Bytes of one row's pixels (without padding).
std::int64_t RowBytes(std::uint32_t fourcc, int xres) {
  return DefaultStride(fourcc, xres);
}
bool Known(std::uint32_t fourcc) {
  return fourcc == kNdiFourCCUYVY || fourcc == kNdiFourCCUYVA || fourcc == kNdiFourCCNV12 ||
         fourcc == kNdiFourCCI420 || fourcc == kNdiFourCCYV12 || fourcc == kNdiFourCCBGRA ||
         fourcc == kNdiFourCCBGRX || fourcc == kNdiFourCCRGBA || fourcc == kNdiFourCCRGBX;
}
}  // namespace

std::uint64_t PictureBytes(std::uint32_t fourcc, int xres, int yres, int stride) {
  if (!Known(fourcc) || xres <= 0 || yres <= 0 || xres > kMaxPictureSide || yres > kMaxPictureSide) return 0;
  if (stride < RowBytes(fourcc, xres) || stride > kMaxPictureSide * 8) return 0;
  const std::uint64_t s = static_cast<std::uint64_t>(stride);
  const std::uint64_t h = static_cast<std::uint64_t>(yres);
  const std::uint64_t chroma_rows = (h + 1) / 2;
  if (fourcc == kNdiFourCCUYVA) return s * h + static_cast<std::uint64_t>(xres) * h;
  if (fourcc == kNdiFourCCNV12) return s * h + s * chroma_rows;
  if (fourcc == kNdiFourCCI420 || fourcc == kNdiFourCCYV12) return s * h + 2 * (s / 2) * chroma_rows;
  return s * h;
}

namespace {
// Copies every other row of a plane, picking `unit`-byte groups by `pick`.
template <class Pick>
void HalvePlane(const std::uint8_t* src, int src_stride, int rows_out, std::uint8_t* dst, int dst_stride,
                Pick pick) {
  for (int y = 0; y < rows_out; ++y) {
    pick(src + static_cast<std::size_t>(2 * y) * src_stride, dst + static_cast<std::size_t>(y) * dst_stride);
  }
}
}  // namespace

bool HalvePicture(std::uint32_t fourcc, int xres, int yres, int stride, const std::uint8_t* data,
                  HalfPicture* out) {
  if (data == nullptr || out == nullptr) return false;
  if (stride == 0) stride = DefaultStride(fourcc, xres);
  if (PictureBytes(fourcc, xres, yres, stride) == 0) return false;
  const bool subsampled = fourcc == kNdiFourCCUYVY || fourcc == kNdiFourCCUYVA || fourcc == kNdiFourCCNV12 ||
                          fourcc == kNdiFourCCI420 || fourcc == kNdiFourCCYV12;
  int w = xres / 2;
  int h = yres / 2;
  if (subsampled) w &= ~1;
  if (fourcc == kNdiFourCCNV12 || fourcc == kNdiFourCCI420 || fourcc == kNdiFourCCYV12) h &= ~1;
  if (w <= 0 || h <= 0) return false;
  out->xres = w;
  out->yres = h;
  out->stride = DefaultStride(fourcc, w);
  out->bytes.resize(PictureBytes(fourcc, w, h, out->stride));
  std::uint8_t* dst = out->bytes.data();
  const int ds = out->stride;
  if (fourcc == kNdiFourCCUYVY || fourcc == kNdiFourCCUYVA) {
    HalvePlane(data, stride, h, dst, ds, [w](const std::uint8_t* s, std::uint8_t* d) {
      for (int j = 0; j < w / 2; ++j) {  // output pixels 2j, 2j+1 are input pixels 4j, 4j+2
        d[4 * j + 0] = s[8 * j + 0];
        d[4 * j + 1] = s[8 * j + 1];
        d[4 * j + 2] = s[8 * j + 2];
        d[4 * j + 3] = s[8 * j + 5];
      }
    });
    if (fourcc == kNdiFourCCUYVA) {
      const std::uint8_t* alpha = data + static_cast<std::size_t>(stride) * yres;
      HalvePlane(alpha, xres, h, dst + static_cast<std::size_t>(ds) * h, w,
                 [w](const std::uint8_t* s, std::uint8_t* d) {
                   for (int x = 0; x < w; ++x) d[x] = s[2 * x];
                 });
    }
    return true;
  }
  if (fourcc == kNdiFourCCNV12 || fourcc == kNdiFourCCI420 || fourcc == kNdiFourCCYV12) {
    auto luma = [w](const std::uint8_t* s, std::uint8_t* d) {
      for (int x = 0; x < w; ++x) d[x] = s[2 * x];
    };
    HalvePlane(data, stride, h, dst, ds, luma);
    const std::uint8_t* chroma = data + static_cast<std::size_t>(stride) * yres;
    std::uint8_t* dchroma = dst + static_cast<std::size_t>(ds) * h;
    if (fourcc == kNdiFourCCNV12) {
      HalvePlane(chroma, stride, h / 2, dchroma, ds, [w](const std::uint8_t* s, std::uint8_t* d) {
        for (int j = 0; j < w / 2; ++j) {
          d[2 * j] = s[4 * j];
          d[2 * j + 1] = s[4 * j + 1];
        }
      });
    } else {
      const int cs = stride / 2;
      const std::size_t src_plane = static_cast<std::size_t>(cs) * ((yres + 1) / 2);
      const std::size_t dst_plane = static_cast<std::size_t>(ds / 2) * (h / 2);
      auto pick = [w](const std::uint8_t* s, std::uint8_t* d) {
        for (int x = 0; x < w / 2; ++x) d[x] = s[2 * x];
      };
      HalvePlane(chroma, cs, h / 2, dchroma, ds / 2, pick);
      HalvePlane(chroma + src_plane, cs, h / 2, dchroma + dst_plane, ds / 2, pick);
    }
    return true;
  }
  HalvePlane(data, stride, h, dst, ds, [w](const std::uint8_t* s, std::uint8_t* d) {
    for (int x = 0; x < w; ++x) std::memcpy(d + 4 * x, s + 8 * x, 4);
  });
  return true;
}

}  // namespace ndilb
