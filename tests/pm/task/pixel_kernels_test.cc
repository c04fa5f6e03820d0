// The vector and scalar row kernels against the byte rule, at counts around
// every step boundary and at unaligned addresses, in exact-size allocations.

#include "pm/task/pixel_kernels.h"

#include <gtest/gtest.h>

#include <memory>

namespace {

std::unique_ptr<std::uint8_t[]> Filled(std::size_t n, int seed) {
  std::unique_ptr<std::uint8_t[]> b(new std::uint8_t[n == 0 ? 1 : n]);
  for (std::size_t i = 0; i < n; ++i) b[i] = static_cast<std::uint8_t>(i * 31 + seed);
  return b;
}

using Interleave = void (*)(const std::uint8_t*, const std::uint8_t*, std::uint8_t*, std::int32_t);

TEST(PixelKernels, EveryInterleavePathFollowsTheByteRule) {
  if (!pm::pixel::HaveSse2()) GTEST_LOG_(INFO) << "no SSE2 kernel in this build; scalar only";
  const Interleave kernels[] = {pm::pixel::InterleaveUVScalar, pm::pixel::InterleaveUVSse2, pm::pixel::InterleaveUV};
  for (Interleave kernel : kernels) {
    for (int pairs = 0; pairs <= 70; ++pairs) {
      for (int offset = 0; offset < 3; ++offset) {
        // Each buffer holds exactly what the kernel may touch past `offset`.
        auto u = Filled(pairs + offset, 1);
        auto v = Filled(pairs + offset, 77);
        auto out = Filled(2 * pairs + offset, 200);
        kernel(u.get() + offset, v.get() + offset, out.get() + offset, pairs);
        for (int i = 0; i < pairs; ++i) {
          ASSERT_EQ(out[offset + 2 * i], u[offset + i]) << pairs << " " << i;
          ASSERT_EQ(out[offset + 2 * i + 1], v[offset + i]) << pairs << " " << i;
        }
        for (int i = 0; i < offset; ++i) ASSERT_EQ(out[i], static_cast<std::uint8_t>(i * 31 + 200));
      }
    }
  }
}

TEST(PixelKernels, OpaqueCopyAndWideningSetOnlyTheFourthByte) {
  for (int pixels = 0; pixels <= 19; ++pixels) {
    auto in4 = Filled(4 * pixels, 3);
    auto out4 = Filled(4 * pixels, 9);
    pm::pixel::CopyOpaque4(in4.get(), out4.get(), pixels);
    for (int i = 0; i < 4 * pixels; ++i) ASSERT_EQ(out4[i], i % 4 == 3 ? 0xFF : in4[i]) << pixels;

    auto in3 = Filled(3 * pixels, 5);
    auto out3 = Filled(4 * pixels, 9);
    pm::pixel::Widen3To4(in3.get(), out3.get(), pixels);
    for (int p = 0; p < pixels; ++p) {
      for (int k = 0; k < 3; ++k) ASSERT_EQ(out3[4 * p + k], in3[3 * p + k]);
      ASSERT_EQ(out3[4 * p + 3], 0xFF);
    }
  }
}

}  // namespace
