// The "blocks" pattern read back by the host's checker: the number and the
// bars in each host code and size (the 640x360 proxy too), picture numbers
// beyond 32 bits, and the faults the checker exists to catch.
#include <gtest/gtest.h>

#include "ndi-testsrc/pattern.h"
#include "pm-host/checks.h"
#include "pm/shm/formats.h"
#include "ndi/ndi_abi.h"

namespace {

struct Case {
  std::uint32_t fourcc;
  std::uint32_t code;
  int width, height;
  std::int64_t n;
  int damage;  // 0 none, 1 a cell turned over, 2 the bars shifted in brightness
  std::int64_t number;  // expected reading (-1: unreadable)
};

void PrintTo(const Case& c, std::ostream* os) { *os << c.width << "x" << c.height << " n=" << c.n << " damage " << c.damage; }

class Blocks : public ::testing::TestWithParam<Case> {};

TEST_P(Blocks, ReadBackAsTheyWereDrawn) {
  const Case c = GetParam();
  const std::vector<ndits::Plane> planes = ndits::PictureLayout(c.fourcc, c.width, c.height);
  std::vector<std::uint8_t> bytes(ndits::PictureSize(planes));
  ndits::Bars(c.fourcc, c.width, c.height, true).Fill(c.n, bytes.data());
  const int stride = planes[0].stride;
  const int bpp = stride / c.width;  // bytes per pixel of the first plane (1 for NV12's luma)
  // Damage 1: cell 5 drawn the other way round in the first plane; 2: the
  // bars above the cells 40 brighter.
  const int barRows = ndits::BlockBarRows(c.height);
  const int cellFrom = ndits::CellLeft(c.width, 5) * bpp, cellTo = ndits::CellLeft(c.width, 6) * bpp;
  for (int y = 0; y < c.height; ++y) {
    for (int x = 0; x < stride; ++x) {
      std::uint8_t& b = bytes[static_cast<std::size_t>(y) * stride + x];
      if (c.damage == 1 && y >= barRows && x >= cellFrom && x < cellTo) b = static_cast<std::uint8_t>(255 - b);
      if (c.damage == 2 && y < barRows) b = static_cast<std::uint8_t>(std::min(255, b + 40));
    }
  }
  const pmhost::VideoFrame frame{0, c.code, c.width, c.height, static_cast<std::uint32_t>(stride), 0, bytes.data(),
                                 bytes.size()};
  const pmhost::BlocksReading r = pmhost::ReadBlocks(frame);
  EXPECT_EQ(r.number, c.number) << r.problem;
  EXPECT_EQ(r.problem.empty(), c.damage == 0) << r.problem;
}

INSTANTIATE_TEST_SUITE_P(
    Codes, Blocks,
    ::testing::Values(Case{kNdiFourCCUYVY, pm::kCode2vuy, 1920, 1080, 123456789, 0, 123456789},
                      Case{kNdiFourCCUYVY, pm::kCode2vuy, 640, 360, 0, 0, 0},
                      Case{kNdiFourCCUYVY, pm::kCode2vuy, 640, 358, 0xFFFFFFFFLL, 0, 0xFFFFFFFFLL},
                      Case{kNdiFourCCNV12, pm::kCodeNV12, 1280, 720, (1LL << 32) + 7, 0, 7},
                      Case{kNdiFourCCBGRA, pm::kCodeRgba, 854, 480, 4242, 0, 4242},
                      Case{kNdiFourCCUYVY, pm::kCode2vuy, 1920, 1080, 1, 1, -1},
                      Case{kNdiFourCCBGRA, pm::kCodeRgba, 640, 360, 99, 1, -1},
                      Case{kNdiFourCCUYVY, pm::kCode2vuy, 640, 360, 77, 2, 77},
                      Case{kNdiFourCCBGRA, pm::kCodeRgba, 640, 360, 77, 2, 77}));

TEST(Blocks, OtherPicturesAreNotRead) {
  std::vector<std::uint8_t> bytes(64 * 16 * 2, 128);
  pmhost::VideoFrame frame{0, pm::kCode2vuy, 64, 16, 128, 0, bytes.data(), bytes.size()};
  EXPECT_EQ(pmhost::ReadBlocks(frame).number, -1);  // too small for 40 cells
  frame.code = pm::kCodeFl32;
  EXPECT_NE(pmhost::ReadBlocks(frame).problem, "");
  std::vector<std::uint8_t> big(640 * 360 * 2, 128);
  frame = {0, pm::kCode2vuy, 640, 360, 1280, 0, big.data(), big.size() - 1};
  EXPECT_EQ(pmhost::ReadBlocks(frame).problem, "the picture is shorter than its size and stride");
}

}  // namespace
