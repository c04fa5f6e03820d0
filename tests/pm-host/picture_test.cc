// Snapshots: BT.709 limited-range YUV to RGB for '2vuy' and 'NV12', the byte
// order of 'rgba', and pictures whose bytes do not cover their geometry. The
// PNG itself is read back by the demo's check (cli_test).
#include <gtest/gtest.h>

#include <algorithm>

#include "pm-host/picture.h"
#include "pm/shm/formats.h"

namespace {

struct Colour {
  std::uint8_t y, u, v;
  int r, g, b;
};
// The 75% bars of the test sender: BT.709 limited-range values and their RGB.
const Colour kBars[] = {{180, 128, 128, 191, 191, 191}, {168, 44, 136, 191, 191, 0}, {145, 147, 44, 0, 191, 191},
                        {133, 63, 52, 0, 191, 0},       {63, 193, 204, 191, 0, 191}, {51, 109, 212, 191, 0, 0},
                        {28, 212, 120, 0, 0, 191},      {16, 128, 128, 0, 0, 0},     {235, 128, 128, 255, 255, 255}};

void ExpectNear(const std::uint8_t* rgb, const Colour& c) {
  const int want[] = {c.r, c.g, c.b};
  for (int i = 0; i < 3; ++i) EXPECT_NEAR(rgb[i], want[i], 1) << "Y" << +c.y << " U" << +c.u << " V" << +c.v;
}

TEST(Snapshot, BarsIn2vuyAndNV12TurnIntoTheirBT709Colours) {
  const int n = 9;
  pmhost::Picture uyvy{pm::kCode2vuy, 2 * n, 2, 4 * n + 8, std::vector<std::uint8_t>((4 * n + 8) * 2)};
  pmhost::Picture nv12{pm::kCodeNV12, 2 * n, 2, 2 * n + 4, std::vector<std::uint8_t>((2 * n + 4) * 3)};
  // Each bar two pixels wide, on both rows (NV12: one chroma pair for both).
  for (int i = 0; i < n; ++i) {
    const Colour& c = kBars[i];
    const std::uint8_t pair[] = {c.u, c.y, c.v, c.y}, luma[] = {c.y, c.y}, chroma[] = {c.u, c.v};
    for (std::uint32_t row = 0; row < 2; ++row) {
      std::copy_n(pair, 4, uyvy.bytes.begin() + row * uyvy.stride + 4 * i);
      std::copy_n(luma, 2, nv12.bytes.begin() + row * nv12.stride + 2 * i);
    }
    std::copy_n(chroma, 2, nv12.bytes.begin() + 2 * nv12.stride + 2 * i);
  }
  for (const pmhost::Picture* p : {&uyvy, &nv12}) {
    const std::vector<std::uint8_t> rgb = pmhost::ToRgb(*p);
    ASSERT_EQ(rgb.size(), static_cast<std::size_t>(2 * n) * 2 * 3);
    for (std::size_t x = 0; x < 2 * n * 2; ++x) ExpectNear(&rgb[x * 3], kBars[(x % (2 * n)) / 2]);  // both rows
  }
}

TEST(Snapshot, RgbaIsBlueGreenRedAlphaInMemoryAndYuvBeyondTheRangeIsClamped) {
  EXPECT_EQ(pmhost::ToRgb({pm::kCodeRgba, 2, 1, 8, {10, 20, 30, 255, 1, 2, 3, 0}}),
            (std::vector<std::uint8_t>{30, 20, 10, 3, 2, 1}));
  // Below black, above white and beyond the gamut: clamped, not wrapped.
  const Colour clamped[] = {{0, 128, 128, 0, 0, 0}, {255, 128, 128, 255, 255, 255}, {235, 240, 240, 255, 171, 255}};
  for (const Colour& c : clamped) {
    std::uint8_t rgb[3];
    pmhost::YuvToRgb(c.y, c.u, c.v, rgb);
    ExpectNear(rgb, c);
  }
}

// Nothing is read beyond the bytes given.
TEST(Snapshot, PicturesWhoseBytesDoNotCoverThemGiveNothing) {
  EXPECT_TRUE(pmhost::ToRgb({pm::kCode2vuy, 4, 2, 8, std::vector<std::uint8_t>(15)}).empty());
  EXPECT_TRUE(pmhost::ToRgb({pm::kCodeNV12, 4, 2, 4, std::vector<std::uint8_t>(11)}).empty());
  EXPECT_TRUE(pmhost::ToRgb({pm::kCode2vuy, 4, 2, 6, std::vector<std::uint8_t>(64)}).empty());  // stride < row
  EXPECT_TRUE(pmhost::ToRgb({pm::kCode2vuy, 3, 2, 8, std::vector<std::uint8_t>(64)}).empty());  // odd width
  EXPECT_TRUE(pmhost::ToRgb({pm::kCodeJpeg, 4, 2, 16, std::vector<std::uint8_t>(64)}).empty());
  EXPECT_TRUE(pmhost::ToRgb({pm::kCodeRgba, -4, 2, 16, std::vector<std::uint8_t>(64)}).empty());
  // The last row needs only its pixels, not a whole stride.
  EXPECT_FALSE(pmhost::ToRgb({pm::kCode2vuy, 4, 2, 16, std::vector<std::uint8_t>(24)}).empty());
  EXPECT_FALSE(pmhost::WritePng(::testing::TempDir() + "pmhost-snapshot.png", 4, 3, std::vector<std::uint8_t>(24)))
      << "an RGB buffer that is not width x height x 3";
}

}  // namespace
