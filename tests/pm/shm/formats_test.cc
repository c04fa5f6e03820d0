// Frame formats: default strides, frame sizes and plane layouts of every code,
// including the sizes that do not fit and the dimensions that make no sense.
// (The byte layout of VideoFormat is pinned by static_asserts beside it.)
#include "pm/shm/formats.h"

#include <gtest/gtest.h>

#include "support/video_format.h"

namespace {

constexpr auto Format = pmtest::VideoFormatOf;

TEST(FrameFormats, StridesAndSizesOfEveryCode) {
  struct Row {
    std::uint32_t code;
    int width, height, stride;  // stride 0: the default one
    int defaultStride;
    std::int64_t size;
  };
  const Row rows[] = {
      {pm::kCodeNV12, 1920, 1080, 0, 1920, 3110400},
      {pm::kCodeNV12, 1920, 1080, 2048, 1920, 1080 * 2048 * 3 / 2},
      // Odd height: 3 x 5 x 3 / 2 = 22 (halving the rows first would give 20).
      {pm::kCodeNV12, 5, 3, 0, 5, 22},
      // The product 3,221,028,867 overflows 32 bits before the halving, the
      // result 1,610,514,433 does not.
      {pm::kCodeNV12, 32767, 32767, 0, 32767, 1610514433},
      {pm::kCode2vuy, 1920, 1080, 0, 3840, 4147200},
      {pm::kCode2vuy, 1920, 1080, 4096, 3840, 1080 * 4096},
      {pm::kCode2vuy, 1920, 1080, 0x7FFFFFFF, 3840, 0},  // does not fit
      {pm::kCodeYuvs, 1280, 720, 0, 2560, 720 * 2560},
      {pm::kCodeRgba, 1280, 720, 0, 5120, 720 * 5120},
      {pm::kCodeRgba, 32767, 32767, 0, 131068, 0},  // 4,294,180,356 bytes do not fit
      {pm::kCodeRgba, -4, 10, 0, 0, 0},
      {pm::kCodeRgba, 4, -10, 0, 16, 0},
      {pm::kCodeRgba, 4, 10, -16, 16, 0},
      {pm::kCodeJpeg, 100, 10, 0, 400, 4000},
      // Codes without a frame layout of their own.
      {pm::kCodeI420, 1920, 1080, 4096, 0, 0},
      {0xFFFFFFFFu, 1920, 1080, 0, 0, 0},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(testing::Message() << std::hex << row.code << std::dec << " " << row.width << "x" << row.height
                                    << " stride " << row.stride);
    const pm::VideoFormat format = Format(row.code, row.width, row.height);
    EXPECT_EQ(pm::DefaultStride(format), row.defaultStride);
    EXPECT_EQ(pm::FrameSize(format, row.stride), row.size);
  }
}

TEST(FrameFormats, LayoutPlanesPutsNV12ChromaAfterTheLumaRowsAndNeedsABase) {
  const pm::VideoPlanes none = pm::LayoutPlanes(Format(pm::kCodeNV12, 16, 8), nullptr, 0);
  EXPECT_EQ(none.planeCount, 0);
  for (const pm::Plane& p : none.plane) EXPECT_TRUE(p.data == nullptr && p.rows == 0 && p.stride == 0);

  std::uint8_t base[1];
  const pm::VideoPlanes nv12 = pm::LayoutPlanes(Format(pm::kCodeNV12, 16, 9), base, 0);
  ASSERT_EQ(nv12.planeCount, 2);
  // Stride 0 became the default one.
  EXPECT_TRUE(nv12.plane[0].data == base && nv12.plane[0].rows == 9 && nv12.plane[0].stride == 16);
  EXPECT_TRUE(nv12.plane[1].data == base + 9 * 16 && nv12.plane[1].rows == 4 && nv12.plane[1].stride == 16);

  const pm::VideoPlanes rgba = pm::LayoutPlanes(Format(pm::kCodeRgba, 16, 9), base, 100);
  EXPECT_EQ(std::make_tuple(rgba.planeCount, rgba.plane[0].stride, rgba.plane[1].data), std::make_tuple(1, 100, nullptr));
  // Unknown codes still give one plane (with no default stride).
  EXPECT_EQ(pm::LayoutPlanes(Format(0, 16, 9), base, 0).planeCount, 1);
}

}  // namespace
