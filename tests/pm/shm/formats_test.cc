#include "pm/shm/formats.h"

#include <gtest/gtest.h>

#include <cstring>

namespace {

pm::VideoFormat Format(std::uint32_t code, int width, int height) {
  pm::VideoFormat f;
  f.code = code;
  f.width = static_cast<std::int16_t>(width);
  f.height = static_cast<std::int16_t>(height);
  return f;
}

TEST(FrameFormats, CodesPackFirstCharacterHigh) {
  EXPECT_EQ(pm::kCodeNV12, 0x4E563132u);
  EXPECT_EQ(pm::kCode2vuy, 0x32767579u);
  EXPECT_EQ(pm::kCodeJpeg, 0x4A504547u);
  EXPECT_EQ(pm::kCodeFl32, 0x666C3332u);
}

TEST(FrameFormats, VideoFormatBytesAreTheRecordLayout) {
  pm::VideoFormat f = Format(pm::kCodeNV12, 1920, 1080);
  f.byteSize = 0x11223344;
  f.field = 7;
  f.scan = pm::kScanProgressive;
  f.extra1 = 0x0102;
  f.extra2 = 0x0304;
  f.extraWidth = 0x0506;
  f.extraHeight = 0x0708;
  const std::uint8_t expected[22] = {0x32, 0x31, 0x56, 0x4E, 0x80, 0x07, 0x38, 0x04, 0x44, 0x33, 0x22,
                                     0x11, 0x07, 0x50, 0x02, 0x01, 0x04, 0x03, 0x06, 0x05, 0x08, 0x07};
  std::uint8_t bytes[22];
  std::memcpy(bytes, &f, sizeof bytes);
  EXPECT_EQ(0, std::memcmp(bytes, expected, sizeof bytes));
}

TEST(FrameFormats, StridesAndSizesOfEveryCode) {
  EXPECT_EQ(pm::DefaultStride(Format(pm::kCodeNV12, 1920, 1080)), 1920);
  EXPECT_EQ(pm::FrameSize(Format(pm::kCodeNV12, 1920, 1080), 0), 3110400);
  EXPECT_EQ(pm::DefaultStride(Format(pm::kCode2vuy, 1920, 1080)), 3840);
  EXPECT_EQ(pm::FrameSize(Format(pm::kCode2vuy, 1920, 1080), 0), 4147200);
  EXPECT_EQ(pm::DefaultStride(Format(pm::kCodeYuvs, 1280, 720)), 2560);
  EXPECT_EQ(pm::DefaultStride(Format(pm::kCodeRgba, 1280, 720)), 5120);
  EXPECT_EQ(pm::FrameSize(Format(pm::kCodeRgba, 1280, 720), 0), 720 * 5120);
  EXPECT_EQ(pm::DefaultStride(Format(pm::kCodeJpeg, 100, 10)), 400);
  // An explicit stride replaces the default one.
  EXPECT_EQ(pm::FrameSize(Format(pm::kCode2vuy, 1920, 1080), 4096), 1080 * 4096);
  EXPECT_EQ(pm::FrameSize(Format(pm::kCodeNV12, 1920, 1080), 2048), 1080 * 2048 * 3 / 2);
}

TEST(FrameFormats, UnknownCodesHaveNoStrideAndNoSize) {
  for (std::uint32_t code : {0u, pm::kCodeI420, pm::kCodeBGRX, pm::kCodeFl32, 0xFFFFFFFFu}) {
    EXPECT_EQ(pm::DefaultStride(Format(code, 1920, 1080)), 0) << code;
    EXPECT_EQ(pm::FrameSize(Format(code, 1920, 1080), 0), 0) << code;
    EXPECT_EQ(pm::FrameSize(Format(code, 1920, 1080), 4096), 0) << code;
  }
}

TEST(FrameFormats, NV12HalvesAfterTheProductAndTruncates) {
  // Odd height: 3 x 5 x 3 / 2 = 22 (halving the rows first would give 20).
  EXPECT_EQ(pm::FrameSize(Format(pm::kCodeNV12, 5, 3), 0), 22);
  // 32767 x 32767: the product 3,221,028,867 overflows 32 bits before the
  // halving, the result 1,610,514,433 does not.
  EXPECT_EQ(pm::FrameSize(Format(pm::kCodeNV12, 32767, 32767), 0), 1610514433);
}

TEST(FrameFormats, SizesBeyond32BitsAndNegativeDimensionsAreZero) {
  const pm::VideoFormat huge = Format(pm::kCodeRgba, 32767, 32767);
  EXPECT_EQ(pm::DefaultStride(huge), 131068);
  EXPECT_EQ(pm::FrameSize(huge, 0), 0);  // 4,294,180,356 bytes do not fit
  EXPECT_EQ(pm::FrameSize(Format(pm::kCode2vuy, 1920, 1080), 0x7FFFFFFF), 0);
  EXPECT_EQ(pm::DefaultStride(Format(pm::kCodeRgba, -4, 10)), 0);
  EXPECT_EQ(pm::FrameSize(Format(pm::kCodeRgba, -4, 10), 0), 0);
  EXPECT_EQ(pm::FrameSize(Format(pm::kCodeRgba, 4, -10), 0), 0);
  EXPECT_EQ(pm::FrameSize(Format(pm::kCodeRgba, 4, 10), -16), 0);
}

TEST(FrameFormats, BytesPerSampleGiveAudioByteSizes) {
  EXPECT_EQ(2 * 480 * pm::BytesPerSample(pm::kCodeFl32), 3840);
  EXPECT_EQ(2 * 480 * pm::BytesPerSample(pm::kCodeSowt), 1920);
  EXPECT_EQ(pm::BytesPerSample(pm::kCodeNV12), 0);
  EXPECT_EQ(pm::BytesPerSample(0), 0);
}

TEST(FrameFormats, LayoutPlanesWithoutBaseIsEmpty) {
  const pm::VideoPlanes planes = pm::LayoutPlanes(Format(pm::kCodeNV12, 16, 8), nullptr, 0);
  EXPECT_EQ(planes.planeCount, 0);
  for (const pm::Plane& p : planes.plane) {
    EXPECT_EQ(p.data, nullptr);
    EXPECT_EQ(p.rows, 0);
    EXPECT_EQ(p.stride, 0);
  }
}

TEST(FrameFormats, LayoutPlanesPutsNV12ChromaAfterTheLumaRows) {
  std::uint8_t base[1];
  const pm::VideoPlanes nv12 = pm::LayoutPlanes(Format(pm::kCodeNV12, 16, 9), base, 0);
  ASSERT_EQ(nv12.planeCount, 2);
  EXPECT_EQ(nv12.plane[0].data, base);
  EXPECT_EQ(nv12.plane[0].rows, 9);
  EXPECT_EQ(nv12.plane[0].stride, 16);  // 0 became the default stride
  EXPECT_EQ(nv12.plane[1].data, base + 9 * 16);
  EXPECT_EQ(nv12.plane[1].rows, 4);
  EXPECT_EQ(nv12.plane[1].stride, 16);

  const pm::VideoPlanes rgba = pm::LayoutPlanes(Format(pm::kCodeRgba, 16, 9), base, 100);
  ASSERT_EQ(rgba.planeCount, 1);
  EXPECT_EQ(rgba.plane[0].stride, 100);
  EXPECT_EQ(rgba.plane[1].data, nullptr);
  // Unknown codes still give one plane (with no default stride).
  EXPECT_EQ(pm::LayoutPlanes(Format(0, 16, 9), base, 0).planeCount, 1);
}

}  // namespace
