#include "ndi-loopback/picture.h"

#include <algorithm>
#include <cmath>
#include <cstring>

#include "ndi/ndi_abi.h"

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

void ProxySize(int xres, int yres, int* width, int* height) {
  constexpr int kSide = 640;
  *width = xres;
  *height = yres;
  if (xres <= kSide && yres <= kSide) return;
  // The longer side becomes 640; the other keeps the shape, rounded down.
  if (static_cast<std::int64_t>(xres) >= yres) {
    *width = kSide;
    *height = static_cast<int>(static_cast<std::int64_t>(yres) * kSide / xres) & ~1;
  } else {
    *height = kSide;
    *width = static_cast<int>(static_cast<std::int64_t>(xres) * kSide / yres) & ~1;
  }
  *width = std::max(*width, 2);
  *height = std::max(*height, 2);
}

namespace {

bool IsRgb(std::uint32_t f) {
  return f == kNdiFourCCBGRA || f == kNdiFourCCBGRX || f == kNdiFourCCRGBA || f == kNdiFourCCRGBX;
}
bool Is420(std::uint32_t f) { return f == kNdiFourCCNV12 || f == kNdiFourCCI420 || f == kNdiFourCCYV12; }

// The planes of a picture: luma (or the packed plane), two chroma planes (or
// NV12's one), alpha.
struct Planes {
  const std::uint8_t* p0 = nullptr;
  const std::uint8_t* u = nullptr;
  const std::uint8_t* v = nullptr;
  const std::uint8_t* a = nullptr;
  int s0 = 0, sc = 0, sa = 0;
};

Planes PlanesOf(std::uint32_t f, int xres, int yres, int stride, const std::uint8_t* data) {
  Planes p;
  p.p0 = data;
  p.s0 = stride;
  const std::size_t luma = static_cast<std::size_t>(stride) * yres;
  if (f == kNdiFourCCUYVA) {
    p.a = data + luma;
    p.sa = xres;
  } else if (f == kNdiFourCCNV12) {
    p.u = data + luma;
    p.v = p.u + 1;
    p.sc = stride;
  } else if (f == kNdiFourCCI420 || f == kNdiFourCCYV12) {
    const std::size_t chroma = static_cast<std::size_t>(stride / 2) * ((yres + 1) / 2);
    p.u = data + luma + (f == kNdiFourCCI420 ? 0 : chroma);
    p.v = data + luma + (f == kNdiFourCCI420 ? chroma : 0);
    p.sc = stride / 2;
  }
  return p;
}

std::uint8_t Clamp(double v) { return static_cast<std::uint8_t>(std::clamp(std::lround(v), 0L, 255L)); }

// One row of any known format as 4:2:2 YUV (U Y V Y per pair) and alpha.
void RowToYuv(std::uint32_t f, const Planes& p, int xres, int y, std::uint8_t* yuv, std::uint8_t* alpha) {
  const std::uint8_t* row = p.p0 + static_cast<std::size_t>(y) * p.s0;
  if (f == kNdiFourCCUYVY || f == kNdiFourCCUYVA) {
    std::memcpy(yuv, row, static_cast<std::size_t>(xres) * 2);
    if (p.a != nullptr) {
      std::memcpy(alpha, p.a + static_cast<std::size_t>(y) * p.sa, static_cast<std::size_t>(xres));
    } else {
      std::memset(alpha, 255, static_cast<std::size_t>(xres));
    }
    return;
  }
  if (Is420(f)) {
    const int step = f == kNdiFourCCNV12 ? 2 : 1;
    const std::uint8_t* u = p.u + static_cast<std::size_t>(y / 2) * p.sc;
    const std::uint8_t* v = p.v + static_cast<std::size_t>(y / 2) * p.sc;
    for (int x = 0; x + 1 < xres; x += 2) {
      yuv[2 * x] = u[(x / 2) * step];
      yuv[2 * x + 1] = row[x];
      yuv[2 * x + 2] = v[(x / 2) * step];
      yuv[2 * x + 3] = row[x + 1];
    }
    std::memset(alpha, 255, static_cast<std::size_t>(xres));
    return;
  }
  const bool bgr = f == kNdiFourCCBGRA || f == kNdiFourCCBGRX;
  const bool has_alpha = f == kNdiFourCCBGRA || f == kNdiFourCCRGBA;
  for (int x = 0; x + 1 < xres; x += 2) {
    double cb = 0, cr = 0;
    for (int k = 0; k < 2; ++k) {
      const std::uint8_t* px = row + 4 * (x + k);
      const double r = bgr ? px[2] : px[0], g = px[1], b = bgr ? px[0] : px[2];
      yuv[2 * (x + k) + 1] = Clamp(16 + (0.2126 * r + 0.7152 * g + 0.0722 * b) * 219.0 / 255.0);
      cb += (-0.1146 * r - 0.3854 * g + 0.5 * b) * 224.0 / 255.0;
      cr += (0.5 * r - 0.4542 * g - 0.0458 * b) * 224.0 / 255.0;
      alpha[x + k] = has_alpha ? px[3] : 255;
    }
    yuv[2 * x] = Clamp(128 + cb / 2);
    yuv[2 * x + 2] = Clamp(128 + cr / 2);
  }
}

// One 4:2:2 YUV row with alpha into a row (and alpha row) of `to`.
void YuvToRow(std::uint32_t to, const std::uint8_t* yuv, const std::uint8_t* alpha, int xres, std::uint8_t* row,
              std::uint8_t* alpha_row) {
  if (to == kNdiFourCCUYVY || to == kNdiFourCCUYVA) {
    std::memcpy(row, yuv, static_cast<std::size_t>(xres) * 2);
    if (alpha_row != nullptr) std::memcpy(alpha_row, alpha, static_cast<std::size_t>(xres));
    return;
  }
  const bool bgr = to == kNdiFourCCBGRA || to == kNdiFourCCBGRX;
  const bool keep_alpha = to == kNdiFourCCBGRA || to == kNdiFourCCRGBA;
  for (int x = 0; x < xres; ++x) {
    const double l = 1.164 * (yuv[2 * x + 1] - 16);
    const double u = yuv[4 * (x / 2)] - 128.0, v = yuv[4 * (x / 2) + 2] - 128.0;
    const std::uint8_t r = Clamp(l + 1.793 * v), g = Clamp(l - 0.213 * u - 0.813 * v), b = Clamp(l + 2.017 * u);
    std::uint8_t* px = row + 4 * x;
    px[0] = bgr ? b : r;
    px[1] = g;
    px[2] = bgr ? r : b;
    px[3] = keep_alpha ? alpha[x] : 255;
  }
}

}  // namespace

bool HasAlpha(std::uint32_t fourcc, int xres, int yres, int stride, const std::uint8_t* data) {
  if (fourcc == kNdiFourCCUYVA) return true;
  if (fourcc != kNdiFourCCBGRA && fourcc != kNdiFourCCRGBA) return false;
  for (int y = 0; y < yres; ++y) {
    const std::uint8_t* row = data + static_cast<std::size_t>(y) * stride;
    for (int x = 0; x < xres; ++x) {
      if (row[4 * x + 3] != 255) return true;
    }
  }
  return false;
}

std::uint32_t DeliveredFourCC(std::int32_t color_format, bool alpha) {
  switch (color_format) {
    case kNdiColorBgrxBgra: return alpha ? kNdiFourCCBGRA : kNdiFourCCBGRX;
    case kNdiColorUyvyBgra: return alpha ? kNdiFourCCBGRA : kNdiFourCCUYVY;
    case kNdiColorRgbxRgba: return alpha ? kNdiFourCCRGBA : kNdiFourCCRGBX;
    case kNdiColorUyvyRgba: return alpha ? kNdiFourCCRGBA : kNdiFourCCUYVY;
    default: return alpha ? kNdiFourCCUYVA : kNdiFourCCUYVY;
  }
}

int DeliveredStride(std::uint32_t fourcc, int xres) { return DefaultStride(fourcc, (xres + 15) & ~15); }

bool ConvertPicture(std::uint32_t from, int xres, int yres, int stride, const std::uint8_t* data, std::uint32_t to,
                    int out_stride, std::uint8_t* out) {
  if (data == nullptr || out == nullptr || PictureBytes(from, xres, yres, stride) == 0 ||
      PictureBytes(to, xres, yres, out_stride) == 0 || Is420(to)) {
    return false;
  }
  if ((IsRgb(from) || Is420(from) || from == kNdiFourCCUYVY || from == kNdiFourCCUYVA) && from != to && xres % 2 != 0) {
    return false;  // 4:2:2 on the way needs pairs
  }
  const Planes in = PlanesOf(from, xres, yres, stride, data);
  std::uint8_t* alpha_out = to == kNdiFourCCUYVA ? out + static_cast<std::size_t>(out_stride) * yres : nullptr;
  if (from == to) {
    for (int y = 0; y < yres; ++y) {
      std::memcpy(out + static_cast<std::size_t>(y) * out_stride, data + static_cast<std::size_t>(y) * stride,
                  static_cast<std::size_t>(DefaultStride(from, xres)));
    }
    if (alpha_out != nullptr) std::memcpy(alpha_out, in.a, static_cast<std::size_t>(xres) * yres);
    return true;
  }
  std::vector<std::uint8_t> yuv(static_cast<std::size_t>(xres) * 2), alpha(static_cast<std::size_t>(xres));
  for (int y = 0; y < yres; ++y) {
    RowToYuv(from, in, xres, y, yuv.data(), alpha.data());
    YuvToRow(to, yuv.data(), alpha.data(), xres, out + static_cast<std::size_t>(y) * out_stride,
             alpha_out != nullptr ? alpha_out + static_cast<std::size_t>(y) * xres : nullptr);
  }
  return true;
}

bool ScalePicture(std::uint32_t fourcc, int xres, int yres, int stride, const std::uint8_t* data, int width,
                  int height, ScaledPicture* out) {
  if (data == nullptr || out == nullptr) return false;
  if (stride == 0) stride = DefaultStride(fourcc, xres);
  if (PictureBytes(fourcc, xres, yres, stride) == 0) return false;
  const bool subsampled = !IsRgb(fourcc);
  if (subsampled) width &= ~1;
  if (Is420(fourcc)) height &= ~1;
  if (width <= 0 || height <= 0 || width > xres || height > yres) return false;
  out->xres = width;
  out->yres = height;
  out->stride = DefaultStride(fourcc, width);
  out->bytes.resize(PictureBytes(fourcc, width, height, out->stride));
  const Planes in = PlanesOf(fourcc, xres, yres, stride, data);
  std::uint8_t* dst = out->bytes.data();
  const int ds = out->stride;
  auto sx = [&](int x) { return static_cast<int>(static_cast<std::int64_t>(x) * xres / width); };
  auto sy = [&](int y) { return static_cast<int>(static_cast<std::int64_t>(y) * yres / height); };
  for (int y = 0; y < height; ++y) {
    const std::uint8_t* row = in.p0 + static_cast<std::size_t>(sy(y)) * in.s0;
    std::uint8_t* d = dst + static_cast<std::size_t>(y) * ds;
    if (fourcc == kNdiFourCCUYVY || fourcc == kNdiFourCCUYVA) {
      for (int x = 0; x < width; x += 2) {
        const int a = sx(x), b = sx(x + 1);
        d[2 * x] = row[4 * (a / 2)];
        d[2 * x + 1] = row[2 * a + 1];
        d[2 * x + 2] = row[4 * (a / 2) + 2];
        d[2 * x + 3] = row[2 * b + 1];
      }
      if (in.a != nullptr) {
        std::uint8_t* da = dst + static_cast<std::size_t>(ds) * height + static_cast<std::size_t>(y) * width;
        for (int x = 0; x < width; ++x) da[x] = in.a[static_cast<std::size_t>(sy(y)) * in.sa + sx(x)];
      }
    } else if (Is420(fourcc)) {
      for (int x = 0; x < width; ++x) d[x] = row[sx(x)];
    } else {
      for (int x = 0; x < width; ++x) std::memcpy(d + 4 * x, row + 4 * sx(x), 4);
    }
  }
  if (Is420(fourcc)) {
    // Chroma rows and columns follow the luma's picks.
    const int step = fourcc == kNdiFourCCNV12 ? 2 : 1;
    const int dcs = fourcc == kNdiFourCCNV12 ? ds : ds / 2;
    std::uint8_t* du = dst + static_cast<std::size_t>(ds) * height;
    std::uint8_t* dv = fourcc == kNdiFourCCNV12 ? du + 1 : du + static_cast<std::size_t>(dcs) * (height / 2);
    if (fourcc == kNdiFourCCYV12) std::swap(du, dv);
    for (int y = 0; y < height / 2; ++y) {
      const std::size_t srow = static_cast<std::size_t>(sy(2 * y) / 2) * in.sc;
      for (int x = 0; x < width / 2; ++x) {
        const int c = sx(2 * x) / 2;
        du[static_cast<std::size_t>(y) * dcs + static_cast<std::size_t>(x) * step] = in.u[srow + static_cast<std::size_t>(c) * step];
        dv[static_cast<std::size_t>(y) * dcs + static_cast<std::size_t>(x) * step] = in.v[srow + static_cast<std::size_t>(c) * step];
      }
    }
  }
  return true;
}

}  // namespace ndilb
