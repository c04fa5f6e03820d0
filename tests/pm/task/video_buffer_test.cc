// CopyFrame and ConvertFrame over a video buffer backed by plain memory. Every
// picture lives in an allocation of exactly its size, so that the sanitizer
// build catches a single byte read or written outside the planes.

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <memory>
#include <vector>

#include "pm/shm/formats.h"
#include "pm/task/buffers.h"

namespace {

constexpr std::uint8_t kUntouched = 0xEE;

// Exactly `size` bytes on the heap, all kUntouched.
struct Bytes {
  explicit Bytes(std::size_t n) : size(n), data(new std::uint8_t[n == 0 ? 1 : n]) {
    std::memset(data.get(), kUntouched, size);
  }
  std::size_t size;
  std::unique_ptr<std::uint8_t[]> data;
};

pm::VideoFormat Format(std::uint32_t code, int width, int height) {
  pm::VideoFormat f;
  f.code = code;
  f.width = static_cast<std::int16_t>(width);
  f.height = static_cast<std::int16_t>(height);
  return f;
}

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
    const pm::VideoFormat f = Format(c.code, c.width, c.height);
    const Bytes source = SourcePicture(f, c.sourceStride == 0 ? c.rowBytes : c.sourceStride);
    MemoryVideoBuffer buffer(f, c.stride);
    buffer.CopyFrame(source.data.get(), c.sourceStride);
    EXPECT_EQ(buffer.maps, 1);
    EXPECT_EQ(buffer.unmaps, 1);
    const pm::VideoPlanes planes = pm::LayoutPlanes(f, source.data.get(), c.stride);
    for (int plane = 0; plane < planes.planeCount; ++plane) {
      for (int r = 0; r < planes.plane[plane].rows; ++r) {
        const std::uint8_t* row = buffer.Row(plane, r);
        for (int k = 0; k < c.stride; ++k) {
          ASSERT_EQ(row[k], k < c.copiedBytes ? Pattern(plane, r, k) : kUntouched) << plane << " " << r << " " << k;
        }
      }
    }
  }
}

TEST(VideoBufferCopyFrame, UnusableSourcesWriteNothingAndStillUnmap) {
  struct Case {
    const char* what;
    std::uint32_t code;
    int sourceStride, stride;
    bool noSource, mapless;
  } cases[] = {
      {"a source stride smaller than a row would read past the source", pm::kCode2vuy, 8, 16, false, false},
      {"no source at all", pm::kCode2vuy, 16, 16, true, false},
      {"a destination stride smaller than a row would write past the segment", pm::kCode2vuy, 32, 8, false, false},
      {"a buffer that cannot be mapped", pm::kCode2vuy, 16, 16, false, true},
      // A 'JPEG' segment has stride 1: copying lines of width x 4 bytes would
      // run far past its 4 bytes.
      {"a compressed picture is not copied as lines", pm::kCodeJpeg, 256, 1, false, false},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    const pm::VideoFormat f = Format(c.code, 8, 4);
    const Bytes source(static_cast<std::size_t>(c.sourceStride) * 4);
    MemoryVideoBuffer buffer(f, c.stride);
    buffer.mapless = c.mapless;
    buffer.CopyFrame(c.noSource ? nullptr : source.data.get(), c.sourceStride);
    EXPECT_TRUE(buffer.AllUntouched());
    EXPECT_EQ(buffer.maps, buffer.unmaps);
  }
}

// ------------------------------------------------------------- ConvertFrame

struct Planar {
  Planar(int w, int h, int lumaStride, int chromaStride, int chromaRows)
      : y(static_cast<std::size_t>(lumaStride) * h),
        u(static_cast<std::size_t>(chromaStride) * chromaRows),
        v(static_cast<std::size_t>(chromaStride) * chromaRows) {
    for (std::size_t i = 0; i < y.size; ++i) y.data[i] = static_cast<std::uint8_t>(i * 7 + 1);
    for (std::size_t i = 0; i < u.size; ++i) u.data[i] = static_cast<std::uint8_t>(i * 5 + 2);
    for (std::size_t i = 0; i < v.size; ++i) v.data[i] = static_cast<std::uint8_t>(i * 3 + 200);
    planes.planeCount = 3;
    planes.plane[0] = {y.data.get(), h, lumaStride};
    planes.plane[1] = {u.data.get(), chromaRows, chromaStride};
    planes.plane[2] = {v.data.get(), chromaRows, chromaStride};
    (void)w;
  }
  Bytes y, u, v;
  pm::VideoPlanes planes;
};

// The byte rule: luma rows copied for w bytes; chroma row r, i < w / 2:
// byte 2i = first[r][i], byte 2i + 1 = second[r][i]; nothing else written.
void ExpectNV12(MemoryVideoBuffer& buffer, const pm::VideoPlanes& src, int firstChroma, int w, int h,
                int stride) {
  for (int r = 0; r < h; ++r) {
    for (int c = 0; c < stride; ++c) {
      const std::uint8_t want = c < w ? src.plane[0].data[r * src.plane[0].stride + c] : kUntouched;
      ASSERT_EQ(buffer.Row(0, r)[c], want) << "luma " << r << " " << c;
    }
  }
  const pm::Plane& a = src.plane[firstChroma];
  const pm::Plane& b = src.plane[3 - firstChroma];
  for (int r = 0; r < h / 2; ++r) {
    for (int c = 0; c < stride; ++c) {
      std::uint8_t want = kUntouched;
      if (c < (w / 2) * 2) want = (c % 2 == 0 ? a : b).data[r * a.stride + c / 2];
      ASSERT_EQ(buffer.Row(1, r)[c], want) << "chroma " << r << " " << c;
    }
  }
}

TEST(VideoBufferConvertFrame, I420AndYV12InterleaveByTheByteRuleAtAnyWidth) {
  // Widths around the 8- and 16-pair steps of the vector kernel, odd ones too.
  for (int w : {2, 3, 14, 16, 17, 18, 30, 32, 34, 46, 50, 66}) {
    const int h = 6;
    const int dstStride = w + 5;
    for (std::uint32_t code : {pm::kCodeI420, pm::kCodeYV12}) {
      SCOPED_TRACE(testing::Message() << "width " << w << " code " << code);
      Planar src(w, h, w + 3, w / 2 + 1, h / 2);
      MemoryVideoBuffer buffer(Format(pm::kCodeNV12, w, h), dstStride);
      buffer.ConvertFrame(code, src.planes);
      EXPECT_EQ(buffer.maps, 1);
      EXPECT_EQ(buffer.unmaps, 1);
      ExpectNV12(buffer, src.planes, code == pm::kCodeI420 ? 1 : 2, w, h, dstStride);
    }
  }
}

TEST(VideoBufferConvertFrame, PlanarRefusalsStopBeforeWritingPastAnyPlane) {
  const int w = 20, h = 4;
  const pm::VideoFormat f = Format(pm::kCodeNV12, w, h);
  auto convertTo = [&](const std::function<void(pm::VideoPlanes&)>& spoil, std::int32_t dstStride) {
    Planar src(w, h, w, w / 2, h / 2);
    spoil(src.planes);
    auto buffer = std::make_unique<MemoryVideoBuffer>(f, dstStride);
    buffer->ConvertFrame(pm::kCodeI420, src.planes);
    EXPECT_EQ(buffer->maps, 1);
    EXPECT_EQ(buffer->unmaps, 1);
    return buffer;
  };
  auto convert = [&](const std::function<void(pm::VideoPlanes&)>& spoil) { return convertTo(spoil, w); };
  auto chromaUntouched = [&](MemoryVideoBuffer& b) {
    for (int r = 0; r < h / 2; ++r)
      for (int c = 0; c < w; ++c)
        if (b.Row(1, r)[c] != kUntouched) return false;
    return true;
  };
  auto lumaCopied = [&](MemoryVideoBuffer& b) { return b.Row(0, h - 1)[w - 1] != kUntouched; };

  // Refused before the luma plane.
  EXPECT_TRUE(convert([](pm::VideoPlanes& p) { p.planeCount = 2; })->AllUntouched());
  EXPECT_TRUE(convert([](pm::VideoPlanes& p) { p.plane[0].rows = h - 1; })->AllUntouched());
  EXPECT_TRUE(convert([](pm::VideoPlanes& p) { p.plane[0].stride = w - 1; })->AllUntouched());
  EXPECT_TRUE(convertTo([](pm::VideoPlanes&) {}, w - 2)->AllUntouched());
  // Refused after the luma plane: the chroma plane stays unwritten.
  for (auto spoil : std::vector<std::function<void(pm::VideoPlanes&)>>{
           [](pm::VideoPlanes& p) { p.plane[1].rows = h / 2 - 1; },
           [](pm::VideoPlanes& p) { p.plane[2].rows = h / 2 + 1; },
           [](pm::VideoPlanes& p) { p.plane[1].stride = w / 2 - 1; },
           [](pm::VideoPlanes& p) { p.plane[2].stride = w / 2 - 1; },
           [](pm::VideoPlanes& p) { p.plane[2].data = nullptr; }}) {
    auto buffer = convert(spoil);
    EXPECT_TRUE(lumaCopied(*buffer));
    EXPECT_TRUE(chromaUntouched(*buffer));
  }
}

// BGRX copies 4 bytes a pixel, BGR0 widens 3 to 4; both set the fourth byte
// to 0xFF and write nothing past the row, top-down and bottom-up (the first
// picture row last in memory). 7 pixels: one 4-pixel vector step and a tail.
struct Packed {
  std::uint32_t code;
  int inBytes;    // per pixel
  int padding;    // source bytes after a row
  int dstExtra;   // destination bytes after a row
};
constexpr Packed kPacked[] = {{pm::kCodeBGRX, 4, 4, 0}, {pm::kCodeBGR0, 3, 0, 8}};

pm::VideoPlanes PackedSource(Bytes& pixels, int h, int stride, bool bottomUp) {
  pm::VideoPlanes src;
  src.planeCount = 1;
  src.plane[0] = bottomUp ? pm::Plane{pixels.data.get() + (h - 1) * stride, h, -stride}
                          : pm::Plane{pixels.data.get(), h, stride};
  return src;
}

TEST(VideoBufferConvertFrame, PackedRgbGetsOpaqueAlphaTopDownAndBottomUp) {
  const int w = 7, h = 5;
  for (const Packed& k : kPacked) {
    for (bool bottomUp : {false, true}) {
      SCOPED_TRACE(testing::Message() << k.code << (bottomUp ? " bottom-up" : " top-down"));
      const int stride = k.inBytes * w + k.padding;
      Bytes pixels(static_cast<std::size_t>(stride) * h);
      for (std::size_t i = 0; i < pixels.size; ++i) pixels.data[i] = static_cast<std::uint8_t>(i + 9);
      const pm::VideoPlanes src = PackedSource(pixels, h, stride, bottomUp);
      MemoryVideoBuffer buffer(Format(pm::kCodeRgba, w, h), 4 * w + k.dstExtra);
      buffer.ConvertFrame(k.code, src);
      for (int r = 0; r < h; ++r) {
        const std::uint8_t* in = src.plane[0].data + r * src.plane[0].stride;
        for (int p = 0; p < w; ++p) {
          for (int b = 0; b < 3; ++b) ASSERT_EQ(buffer.Row(0, r)[4 * p + b], in[k.inBytes * p + b]) << r << " " << p;
          ASSERT_EQ(buffer.Row(0, r)[4 * p + 3], 0xFF);
        }
        for (int c = 4 * w; c < 4 * w + k.dstExtra; ++c) ASSERT_EQ(buffer.Row(0, r)[c], kUntouched);
      }
    }
  }
}

TEST(VideoBufferConvertFrame, PackedRefusalsWriteNothing) {
  const int w = 6, h = 3;
  Bytes pixels(static_cast<std::size_t>(4 * w) * h);
  struct Case {
    std::uint32_t code;
    int planeCount, rows, stride;
    bool noData;
    int dstStride;
  } cases[] = {
      {pm::kCodeBGRX, 2, h, 4 * w, false, 4 * w},
      {pm::kCodeBGRX, 1, h + 1, 4 * w, false, 4 * w},
      {pm::kCodeBGRX, 1, h, 4 * w - 1, false, 4 * w},
      {pm::kCodeBGRX, 1, h, -(4 * w - 1), false, 4 * w},
      {pm::kCodeBGRX, 1, h, 4 * w, false, 4 * w - 4},  // destination too narrow
      {pm::kCodeBGR0, 1, h, 3 * w - 1, false, 4 * w},
      {pm::kCodeBGR0, 1, h, 4 * w, true, 4 * w},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(testing::Message() << c.code << " rows " << c.rows << " stride " << c.stride << " to " << c.dstStride);
    pm::VideoPlanes src;
    src.planeCount = c.planeCount;
    src.plane[0] = {c.noData ? nullptr : pixels.data.get(), c.rows, c.stride};
    MemoryVideoBuffer buffer(Format(pm::kCodeRgba, w, h), c.dstStride);
    buffer.ConvertFrame(c.code, src);
    EXPECT_TRUE(buffer.AllUntouched());
    EXPECT_EQ(buffer.maps, 1);
    EXPECT_EQ(buffer.unmaps, 1);
  }
}

TEST(VideoBufferConvertFrame, UnlistedPairsMapNothing) {
  Planar src(16, 4, 16, 8, 2);
  const std::pair<std::uint32_t, std::uint32_t> pairs[] = {
      {pm::kCodeI420, pm::kCodeRgba}, {pm::kCodeYV12, pm::kCode2vuy}, {pm::kCodeBGRX, pm::kCodeNV12},
      {pm::kCodeBGR0, pm::kCodeYuvs}, {pm::kCodeNV12, pm::kCodeNV12}, {0, pm::kCodeNV12},
      {pm::kCodeRgba, pm::kCodeRgba}};
  for (const auto& [from, to] : pairs) {
    MemoryVideoBuffer buffer(Format(to, 16, 4), 0);
    buffer.ConvertFrame(from, src.planes);
    EXPECT_EQ(buffer.maps, 0) << from << " -> " << to;
    EXPECT_EQ(buffer.unmaps, 0);
    EXPECT_TRUE(buffer.AllUntouched());
  }
}

TEST(VideoBufferConvertFrame, UnmappableDestinationIsUnmappedAgain) {
  Planar src(16, 4, 16, 8, 2);
  MemoryVideoBuffer buffer(Format(pm::kCodeNV12, 16, 4), 0);
  buffer.mapless = true;
  buffer.ConvertFrame(pm::kCodeI420, src.planes);
  EXPECT_EQ(buffer.maps, 1);
  EXPECT_EQ(buffer.unmaps, 1);
  EXPECT_TRUE(buffer.AllUntouched());
}

}  // namespace
