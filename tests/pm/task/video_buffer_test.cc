// CopyFrame and ConvertFrame over a video buffer backed by plain memory, and
// the row kernels under ConvertFrame. Every picture and row lives in an
// allocation of exactly its size, so that the sanitizer build catches a
// single byte read or written outside the planes.

#include <gtest/gtest.h>

#include "support/video_format.h"

#include <cstring>
#include <functional>
#include <memory>
#include <utility>
#include <vector>

#include "pm/shm/formats.h"
#include "pm/task/buffers.h"
#include "pm/task/pixel_kernels.h"

namespace {

using pmtest::VideoFormatOf;

constexpr std::uint8_t kUntouched = 0xEE;

// Exactly `n` bytes on the heap: byte i is (i * step + seed), or all
// kUntouched with no step.
struct Bytes {
  explicit Bytes(std::size_t n, int step = 0, int seed = kUntouched) : size(n), data(new std::uint8_t[n == 0 ? 1 : n]) {
    for (std::size_t i = 0; i < n; ++i) data[i] = static_cast<std::uint8_t>(i * step + seed);
  }
  std::size_t size;
  std::unique_ptr<std::uint8_t[]> data;
};

// A video buffer over plain memory that counts its mappings.
class MemoryVideoBuffer : public pm::VideoBuffer {
 public:
  MemoryVideoBuffer(pm::VideoFormat format, std::int32_t stride)
      : format_(format), stride_(stride), bytes_(static_cast<std::size_t>(pm::FrameSize(format, stride))) {}

  pm::VideoPlanes Planes() override {
    ++maps;
    return pm::LayoutPlanes(format_, mapless ? nullptr : bytes_.data.get(), stride_);
  }
  std::pair<std::uint8_t*, std::int32_t> MapData() override {
    ++maps;
    return {bytes_.data.get(), stride_};
  }
  void UnmapData() override { ++unmaps; }
  pm::VideoFormat Format() const override { return format_; }

  std::uint8_t* Row(int plane, int r) {
    const pm::VideoPlanes p = pm::LayoutPlanes(format_, bytes_.data.get(), stride_);
    return p.plane[plane].data + static_cast<std::ptrdiff_t>(r) * p.plane[plane].stride;
  }
  // Every byte of every row of every plane, padding included, is
  // want(plane, row, byte), or anything where that is negative.
  void ExpectBytes(const std::function<int(int, int, int)>& want) {
    const pm::VideoPlanes p = pm::LayoutPlanes(format_, bytes_.data.get(), stride_);
    for (int plane = 0; plane < p.planeCount; ++plane) {
      for (int r = 0; r < p.plane[plane].rows; ++r) {
        for (int c = 0; c < p.plane[plane].stride; ++c) {
          const int expected = want(plane, r, c);
          ASSERT_TRUE(expected < 0 || Row(plane, r)[c] == expected) << plane << " " << r << " " << c;
        }
      }
    }
  }
  bool AllUntouched() const {
    for (std::size_t i = 0; i < bytes_.size; ++i)
      if (bytes_.data[i] != kUntouched) return false;
    return true;
  }

  int maps = 0;
  int unmaps = 0;
  bool mapless = false;  // Planes gives no data, like an unmapped segment

 private:
  pm::VideoFormat format_;
  std::int32_t stride_;
  Bytes bytes_;
};

std::uint8_t Pattern(int plane, int r, int c) { return static_cast<std::uint8_t>(c + 3 * r + 101 * plane); }

// A source picture of `format` at `stride`, every byte (padding included)
// following Pattern with the row counted on through the planes.
Bytes SourcePicture(const pm::VideoFormat& format, std::int32_t stride) {
  Bytes b(static_cast<std::size_t>(pm::FrameSize(format, stride)));
  const pm::VideoPlanes p = pm::LayoutPlanes(format, b.data.get(), stride);
  for (int plane = 0; plane < p.planeCount; ++plane)
    for (int r = 0; r < p.plane[plane].rows; ++r)
      for (int c = 0; c < stride; ++c) p.plane[plane].data[r * stride + c] = Pattern(plane, r, c);
  return b;
}

// Three planes of a w x h I420 picture (luma, then two chroma planes of
// h / 2 rows), each in its own exact allocation.
struct Planar {
  Planar(int h, int lumaStride, int chromaStride)
      : y(static_cast<std::size_t>(lumaStride) * h, 7, 1),
        u(static_cast<std::size_t>(chromaStride) * (h / 2), 5, 2),
        v(static_cast<std::size_t>(chromaStride) * (h / 2), 3, 200) {
    planes.planeCount = 3;
    planes.plane[0] = {y.data.get(), h, lumaStride};
    planes.plane[1] = {u.data.get(), h / 2, chromaStride};
    planes.plane[2] = {v.data.get(), h / 2, chromaStride};
  }
  Bytes y, u, v;
  pm::VideoPlanes planes;
};

// ---------------------------------------------------------------- CopyFrame

// Every row of every plane is copied for its row bytes and the destination's
// padding is left alone; with equal strides a plane goes as one block, padding
// and all; a source stride of 0 means the default stride.
TEST(VideoBufferCopyFrame, CopiesEveryRowOfEveryPlane) {
  struct Case {
    std::uint32_t code;
    int width, height, sourceStride, stride, rowBytes, copiedBytes;
  } cases[] = {
      {pm::kCodeNV12, 1920, 1080, 2048, 1936, 1920, 1920},
      {pm::kCode2vuy, 5, 7, 16, 16, 10, 16},
      {pm::kCodeRgba, 3, 4, 0, 16, 12, 12},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.code);
    const pm::VideoFormat f = VideoFormatOf(c.code, c.width, c.height);
    const Bytes source = SourcePicture(f, c.sourceStride == 0 ? c.rowBytes : c.sourceStride);
    MemoryVideoBuffer buffer(f, c.stride);
    buffer.CopyFrame(source.data.get(), c.sourceStride);
    EXPECT_EQ(std::make_pair(buffer.maps, buffer.unmaps), std::make_pair(1, 1));
    buffer.ExpectBytes([&](int plane, int r, int k) { return k < c.copiedBytes ? Pattern(plane, r, k) : kUntouched; });
  }
}

// ------------------------------------------------------------- ConvertFrame

// I420 and YV12 to NV12 by the byte rule: luma rows copied for w bytes;
// chroma row r, i < w / 2: byte 2i from the first chroma plane (U), byte
// 2i + 1 from the second; nothing else written. Odd widths and widths past
// the vector kernel's steps (the kernels' own test walks every count).
TEST(VideoBufferConvertFrame, I420AndYV12InterleaveByTheByteRule) {
  for (int w : {3, 18, 35}) {
    const int h = 6, stride = w + 5;
    for (std::uint32_t code : {pm::kCodeI420, pm::kCodeYV12}) {
      SCOPED_TRACE(testing::Message() << "width " << w << " code " << code);
      Planar src(h, w + 3, w / 2 + 1);
      MemoryVideoBuffer buffer(VideoFormatOf(pm::kCodeNV12, w, h), stride);
      buffer.ConvertFrame(code, src.planes);
      EXPECT_EQ(std::make_pair(buffer.maps, buffer.unmaps), std::make_pair(1, 1));
      const pm::Plane& a = src.planes.plane[code == pm::kCodeI420 ? 1 : 2];
      const pm::Plane& b = src.planes.plane[code == pm::kCodeI420 ? 2 : 1];
      buffer.ExpectBytes([&](int plane, int r, int c) {
        if (plane == 0) return c < w ? src.y.data[r * (w + 3) + c] : kUntouched;
        return c < (w / 2) * 2 ? (c % 2 == 0 ? a : b).data[r * a.stride + c / 2] : kUntouched;
      });
    }
  }
}

// BGRX copies 4 bytes a pixel, BGR0 widens 3 to 4; both set the fourth byte
// to 0xFF and write nothing past the row, top-down and bottom-up (the first
// picture row last in memory), at widths around the kernels' 4-pixel step.
TEST(VideoBufferConvertFrame, PackedRgbGetsOpaqueAlphaTopDownAndBottomUp) {
  const int h = 5;
  const struct {
    std::uint32_t code;
    int inBytes;   // per pixel
    int padding;   // source bytes after a row
    int dstExtra;  // destination bytes after a row
  } packed[] = {{pm::kCodeBGRX, 4, 4, 0}, {pm::kCodeBGR0, 3, 0, 8}};
  for (const auto& k : packed) {
    for (int w : {1, 4, 7, 8, 19}) {
      for (bool bottomUp : {false, true}) {
        SCOPED_TRACE(testing::Message() << k.code << " width " << w << (bottomUp ? " bottom-up" : " top-down"));
        const int stride = k.inBytes * w + k.padding;
        Bytes pixels(static_cast<std::size_t>(stride) * h, 1, 9);
        pm::VideoPlanes src;
        src.planeCount = 1;
        src.plane[0] = bottomUp ? pm::Plane{pixels.data.get() + (h - 1) * stride, h, -stride}
                                : pm::Plane{pixels.data.get(), h, stride};
        MemoryVideoBuffer buffer(VideoFormatOf(pm::kCodeRgba, w, h), 4 * w + k.dstExtra);
        buffer.ConvertFrame(k.code, src);
        buffer.ExpectBytes([&](int, int r, int c) -> int {
          if (c >= 4 * w) return kUntouched;
          return c % 4 == 3 ? 0xFF : src.plane[0].data[r * src.plane[0].stride + k.inBytes * (c / 4) + c % 4];
        });
      }
    }
  }
}

// ---------------------------------------------------------------- Refusals

// A copy or conversion that would read past its source or write past the
// buffer's planes writes nothing (a planar conversion whose chroma planes do
// not fit has copied the luma plane and leaves the chroma plane alone), and
// what was mapped is unmapped; pairs the buffer does not convert map nothing.
TEST(VideoBuffer, RefusedCopiesAndConversionsWriteNothingPastAPlaneAndUnmap) {
  const int w = 20, h = 4;
  using Spoil = std::function<void(pm::VideoPlanes&)>;
  // ConvertFrame from `from`: I420 planes, or one packed plane of 4w-byte rows.
  const auto convert = [&](std::uint32_t from, Spoil spoil = nullptr) {
    return [=](MemoryVideoBuffer& buffer) {
      Planar src(h, 4 * w, w / 2);
      if (from != pm::kCodeI420) src.planes.planeCount = 1;
      if (spoil) spoil(src.planes);
      buffer.ConvertFrame(from, src.planes);
    };
  };
  // CopyFrame of a 2vuy picture (rows of 2w bytes) from `sourceStride`.
  const auto copy = [&](int sourceStride, bool noSource = false) {
    return [=](MemoryVideoBuffer& buffer) {
      const Bytes source(static_cast<std::size_t>(sourceStride) * h);
      buffer.CopyFrame(noSource ? nullptr : source.data.get(), sourceStride);
    };
  };
  const auto rows = [](int plane, int n) { return [=](pm::VideoPlanes& p) { p.plane[plane].rows = n; }; };
  const auto stride = [](int plane, int n) { return [=](pm::VideoPlanes& p) { p.plane[plane].stride = n; }; };
  enum Written { kNothing, kLumaOnly };
  struct Case {
    std::uint32_t to;
    std::function<void(MemoryVideoBuffer&)> run;
    int dstStride = 0;  // 0: the format's own
    int maps = 1;
    Written written = kNothing;
    bool mapless = false;
  } cases[] = {
      {pm::kCode2vuy, copy(2 * w - 1)},                     // source rows shorter than a row
      {pm::kCode2vuy, copy(2 * w, true)},                   // no source
      {pm::kCode2vuy, copy(4 * w), 2 * w - 2},              // destination rows shorter than a row
      {pm::kCode2vuy, copy(2 * w), 0, 1, kNothing, true},   // no mapping
      {pm::kCodeJpeg, copy(4 * w), 1},                      // a compressed picture is no lines
      {pm::kCodeNV12, convert(pm::kCodeI420, [](pm::VideoPlanes& p) { p.planeCount = 2; })},
      {pm::kCodeNV12, convert(pm::kCodeI420, rows(0, h - 1))},
      {pm::kCodeNV12, convert(pm::kCodeI420, stride(0, w - 1))},
      {pm::kCodeNV12, convert(pm::kCodeI420), w - 2},
      {pm::kCodeNV12, convert(pm::kCodeI420), 0, 1, kNothing, true},
      {pm::kCodeNV12, convert(pm::kCodeI420, rows(1, h / 2 - 1)), 0, 1, kLumaOnly},
      {pm::kCodeNV12, convert(pm::kCodeI420, rows(2, h / 2 + 1)), 0, 1, kLumaOnly},
      {pm::kCodeNV12, convert(pm::kCodeI420, stride(1, w / 2 - 1)), 0, 1, kLumaOnly},
      {pm::kCodeNV12, convert(pm::kCodeI420, stride(2, w / 2 - 1)), 0, 1, kLumaOnly},
      {pm::kCodeNV12, convert(pm::kCodeI420, [](pm::VideoPlanes& p) { p.plane[2].data = nullptr; }), 0, 1, kLumaOnly},
      {pm::kCodeRgba, convert(pm::kCodeBGRX, [](pm::VideoPlanes& p) { p.planeCount = 2; })},
      {pm::kCodeRgba, convert(pm::kCodeBGRX, rows(0, h + 1))},
      {pm::kCodeRgba, convert(pm::kCodeBGRX, stride(0, 4 * w - 1))},
      {pm::kCodeRgba, convert(pm::kCodeBGRX, stride(0, -(4 * w - 1)))},
      {pm::kCodeRgba, convert(pm::kCodeBGRX), 4 * w - 4},
      {pm::kCodeRgba, convert(pm::kCodeBGR0, stride(0, 3 * w - 1))},
      {pm::kCodeRgba, convert(pm::kCodeBGR0, [](pm::VideoPlanes& p) { p.plane[0].data = nullptr; })},
      {pm::kCodeRgba, convert(pm::kCodeI420), 0, 0},
      {pm::kCodeNV12, convert(pm::kCodeBGRX), 0, 0},
      {pm::kCodeNV12, convert(pm::kCodeNV12), 0, 0},
      {pm::kCodeRgba, convert(pm::kCodeRgba), 0, 0},
  };
  for (std::size_t i = 0; i < std::size(cases); ++i) {
    const Case& c = cases[i];
    SCOPED_TRACE(i);
    MemoryVideoBuffer buffer(VideoFormatOf(c.to, w, h), c.dstStride);
    buffer.mapless = c.mapless;
    c.run(buffer);
    EXPECT_EQ(std::make_pair(buffer.maps, buffer.unmaps), std::make_pair(c.maps, c.maps));
    if (c.written == kNothing) {
      EXPECT_TRUE(buffer.AllUntouched());
      continue;
    }
    EXPECT_NE(buffer.Row(0, h - 1)[w - 1], kUntouched);
    buffer.ExpectBytes([](int plane, int, int) { return plane == 1 ? kUntouched : -1; });
  }
}

// ------------------------------------------------------------------ Kernels

using Interleave = void (*)(const std::uint8_t*, const std::uint8_t*, std::uint8_t*, std::int32_t);

// The vector and scalar interleave kernels against the byte rule, at counts
// around every step boundary and at unaligned addresses; each buffer holds
// exactly what the kernel may touch past its offset. (The packed kernels run
// under ConvertFrame above, at widths around their step.)
TEST(PixelKernels, EveryInterleavePathFollowsTheByteRule) {
  const Interleave kernels[] = {pm::pixel::InterleaveUVScalar, pm::pixel::InterleaveUVSse2, pm::pixel::InterleaveUV};
  for (Interleave kernel : kernels) {
    for (int pairs = 0; pairs <= 70; ++pairs) {
      for (int offset = 0; offset < 3; ++offset) {
        Bytes u(pairs + offset, 31, 1);
        Bytes v(pairs + offset, 31, 77);
        Bytes out(2 * pairs + offset, 31, 200);
        kernel(u.data.get() + offset, v.data.get() + offset, out.data.get() + offset, pairs);
        for (int i = 0; i < pairs; ++i) {
          ASSERT_EQ(out.data[offset + 2 * i], u.data[offset + i]) << pairs << " " << i;
          ASSERT_EQ(out.data[offset + 2 * i + 1], v.data[offset + i]) << pairs << " " << i;
        }
        for (int i = 0; i < offset; ++i) ASSERT_EQ(out.data[i], static_cast<std::uint8_t>(i * 31 + 200));
      }
    }
  }
}

}  // namespace
