#include "ndi-testsrc/pattern.h"

#include <algorithm>
#include <cstring>

#include "pm/runtime/little_endian.h"
#include "ndi/ndi_abi.h"

namespace ndits {

std::uint32_t FourCCFromName(const std::string& name) {
  if (name == "uyvy") return kNdiFourCCUYVY;
  if (name == "uyva") return kNdiFourCCUYVA;
  if (name == "nv12") return kNdiFourCCNV12;
  if (name == "i420") return kNdiFourCCI420;
  if (name == "yv12") return kNdiFourCCYV12;
  if (name == "bgra") return kNdiFourCCBGRA;
  if (name == "bgrx") return kNdiFourCCBGRX;
  if (name == "rgba") return kNdiFourCCRGBA;
  if (name == "rgbx") return kNdiFourCCRGBX;
  return 0;
}

std::vector<Plane> PictureLayout(std::uint32_t fourcc, int width, int height) {
  std::vector<Plane> planes;
  if (width <= 0 || height <= 0) return planes;
  const bool yuv422 = fourcc == kNdiFourCCUYVY || fourcc == kNdiFourCCUYVA;
  const bool yuv420 = fourcc == kNdiFourCCNV12 || fourcc == kNdiFourCCI420 || fourcc == kNdiFourCCYV12;
  const bool rgb = fourcc == kNdiFourCCBGRA || fourcc == kNdiFourCCBGRX || fourcc == kNdiFourCCRGBA ||
                   fourcc == kNdiFourCCRGBX;
  if (!yuv422 && !yuv420 && !rgb) return planes;
  if ((yuv422 || yuv420) && width % 2 != 0) return planes;
  if (yuv420 && height % 2 != 0) return planes;
  auto add = [&](int rows, int row_bytes) {
    Plane p;
    p.offset = planes.empty() ? 0 : planes.back().offset + static_cast<std::size_t>(planes.back().stride) * planes.back().rows;
    p.first_row = planes.empty() ? 0 : planes.back().first_row + planes.back().rows;
    p.rows = rows;
    p.row_bytes = row_bytes;
    p.stride = row_bytes;
    planes.push_back(p);
  };
  if (yuv422) {
    add(height, width * 2);
    if (fourcc == kNdiFourCCUYVA) add(height, width);
  } else if (fourcc == kNdiFourCCNV12) {
    add(height, width);
    add(height / 2, width);
  } else if (yuv420) {
    add(height, width);
    add(height / 2, width / 2);
    add(height / 2, width / 2);
  } else {
    add(height, width * 4);
  }
  return planes;
}

std::size_t PictureSize(const std::vector<Plane>& planes) {
  if (planes.empty()) return 0;
  return planes.back().offset + static_cast<std::size_t>(planes.back().stride) * planes.back().rows;
}

void FillRamp(const std::vector<Plane>& planes, std::int64_t n, std::uint8_t* picture) {
  int widest = 0;
  for (const Plane& p : planes) widest = std::max(widest, p.row_bytes);
  // Every row is a window into one long ramp 0, 1, 2, ... 255, 0, 1, ...
  static thread_local std::vector<std::uint8_t> ramp;
  if (ramp.size() < static_cast<std::size_t>(widest) + 256) {
    ramp.resize(static_cast<std::size_t>(widest) + 256);
    for (std::size_t i = 0; i < ramp.size(); ++i) ramp[i] = static_cast<std::uint8_t>(i & 0xFF);
  }
  for (const Plane& p : planes) {
    for (int y = 0; y < p.rows; ++y) {
      const int row = p.first_row + y;
      const std::size_t start = static_cast<std::size_t>((3 * row + 7 * n) & 0xFF);
      std::memcpy(picture + p.offset + static_cast<std::size_t>(y) * p.stride, ramp.data() + start,
                  static_cast<std::size_t>(p.row_bytes));
    }
  }
  if (!planes.empty() && planes[0].row_bytes >= 8) {
    pm::StoreLe64(picture, static_cast<std::uint64_t>(n));
  }
}

std::int64_t RampFrameNumber(const std::uint8_t* picture) {
  return static_cast<std::int64_t>(pm::LoadLe64(picture));
}

std::string CheckRamp(std::uint32_t fourcc, int width, int height, int stride, const std::uint8_t* picture,
                      std::int64_t* frame_number) {
  std::vector<Plane> planes = PictureLayout(fourcc, width, height);
  if (planes.empty()) return "unknown layout";
  if (picture == nullptr) return "no data";
  // A luma stride other than the tight one scales every plane's stride alike.
  if (stride > 0 && stride != planes[0].stride) {
    const int tight = planes[0].stride;
    std::size_t offset = 0;
    for (Plane& p : planes) {
      if (fourcc == kNdiFourCCUYVA && &p != &planes[0]) {
        p.stride = p.row_bytes;  // the alpha plane stays tight
      } else {
        p.stride = p.stride * stride / tight;
      }
      p.offset = offset;
      offset += static_cast<std::size_t>(p.stride) * p.rows;
    }
  }
  const std::int64_t n = RampFrameNumber(picture);
  if (frame_number != nullptr) *frame_number = n;
  for (const Plane& p : planes) {
    for (int y = 0; y < p.rows; ++y) {
      const std::uint8_t* row = picture + p.offset + static_cast<std::size_t>(y) * p.stride;
      const int row_no = p.first_row + y;
      for (int c = (row_no == 0 ? 8 : 0); c < p.row_bytes; ++c) {
        if (row[c] != RampByte(c, row_no, n)) {
          return "frame " + std::to_string(n) + " row " + std::to_string(row_no) + " column " + std::to_string(c) +
                 ": " + std::to_string(row[c]) + " instead of " + std::to_string(RampByte(c, row_no, n));
        }
      }
    }
  }
  return {};
}

namespace {
// 75% bars, then black and the marker's white.
constexpr BarColour kColours[9] = {
    {180, 128, 128, 191, 191, 191}, {168, 44, 136, 191, 191, 0}, {145, 147, 44, 0, 191, 191},
    {133, 63, 52, 0, 191, 0},       {63, 193, 204, 191, 0, 191}, {51, 109, 212, 191, 0, 0},
    {28, 212, 120, 0, 0, 191},      {16, 128, 128, 0, 0, 0},     {235, 128, 128, 255, 255, 255},
};
constexpr int kBlack = 7;
constexpr int kWhite = 8;
}  // namespace

const BarColour& BarColourOf(int index) { return kColours[index < 0 || index > kWhite ? kBlack : index]; }

std::uint64_t BlockCode(std::uint32_t n) {
  const std::uint32_t sum = (n & 0xFF) + ((n >> 8) & 0xFF) + ((n >> 16) & 0xFF) + (n >> 24);
  return static_cast<std::uint64_t>(n) | static_cast<std::uint64_t>((sum & 0xFF) ^ 0x5A) << 32;
}

std::int64_t BlockNumber(std::uint64_t code) {
  const auto n = static_cast<std::uint32_t>(code & 0xFFFFFFFFu);
  return BlockCode(n) == code ? static_cast<std::int64_t>(n) : -1;
}

Bars::Bars(std::uint32_t fourcc, int width, int height, bool blocks)
    : fourcc_(fourcc), width_(width), height_(height), blocks_(blocks), planes_(PictureLayout(fourcc, width, height)) {
  base_.assign(PictureSize(planes_), 0);
  if (base_.empty()) return;
  const int rows = blocks_ ? BlockBarRows(height_) : height_;
  for (int i = 0; i < kBarCount; ++i) {
    const int x0 = BarLeft(width_, i);
    const int x1 = i == kBarCount - 1 ? width_ : BarLeft(width_, i + 1);
    Rect(base_.data(), x0, 0, x1 - x0, rows, i);
  }
  if (blocks_) Rect(base_.data(), 0, rows, width_, height_ - rows, kBlack);
}

void Bars::Fill(std::int64_t n, std::uint8_t* picture) const {
  if (base_.empty()) return;
  std::memcpy(picture, base_.data(), base_.size());
  if (blocks_) {
    const std::uint64_t code = BlockCode(static_cast<std::uint32_t>(n));
    const int top = BlockBarRows(height_);
    for (int i = 0; i < kBlockCells; ++i) {
      if ((code >> i & 1) == 0) continue;
      const int x0 = CellLeft(width_, i);
      const int x1 = i == kBlockCells - 1 ? width_ : CellLeft(width_, i + 1);
      Rect(picture, x0, top, x1 - x0, height_ - top, kWhite);
    }
    return;
  }
  const int size = std::max(2, (height_ / 8) & ~1);
  const int span = std::max(1, width_ - size);
  const int x = static_cast<int>((n * 8) % span) & ~1;
  const int y = ((height_ - size) / 2) & ~1;
  Rect(picture, x, std::max(0, y), std::min(size, width_), std::min(size, height_), kWhite);
}

void Bars::Rect(std::uint8_t* picture, int x0, int y0, int w, int h, int colour) const {
  const BarColour& k = kColours[colour];
  const Plane& p0 = planes_[0];
  for (int y = y0; y < y0 + h; ++y) {
    std::uint8_t* row = picture + p0.offset + static_cast<std::size_t>(y) * p0.stride;
    for (int x = x0; x < x0 + w; ++x) {
      if (fourcc_ == kNdiFourCCUYVY || fourcc_ == kNdiFourCCUYVA) {
        row[2 * x + 1] = k.y;
        row[2 * x - 2 * (x & 1)] = k.u;
        row[2 * x - 2 * (x & 1) + 2] = k.v;
        if (fourcc_ == kNdiFourCCUYVA) {
          picture[planes_[1].offset + static_cast<std::size_t>(y) * planes_[1].stride + x] = 255;
        }
      } else if (fourcc_ == kNdiFourCCNV12 || fourcc_ == kNdiFourCCI420 || fourcc_ == kNdiFourCCYV12) {
        row[x] = k.y;
        if ((x & 1) == 0 && (y & 1) == 0) {
          if (fourcc_ == kNdiFourCCNV12) {
            std::uint8_t* c = picture + planes_[1].offset + static_cast<std::size_t>(y / 2) * planes_[1].stride;
            c[x] = k.u;
            c[x + 1] = k.v;
          } else {
            const Plane& pu = planes_[fourcc_ == kNdiFourCCI420 ? 1 : 2];
            const Plane& pv = planes_[fourcc_ == kNdiFourCCI420 ? 2 : 1];
            picture[pu.offset + static_cast<std::size_t>(y / 2) * pu.stride + x / 2] = k.u;
            picture[pv.offset + static_cast<std::size_t>(y / 2) * pv.stride + x / 2] = k.v;
          }
        }
      } else {
        std::uint8_t* px = row + 4 * x;
        const bool bgr = fourcc_ == kNdiFourCCBGRA || fourcc_ == kNdiFourCCBGRX;
        px[0] = bgr ? k.b : k.r;
        px[1] = k.g;
        px[2] = bgr ? k.r : k.b;
        px[3] = 255;
      }
    }
  }
}

}  // namespace ndits
