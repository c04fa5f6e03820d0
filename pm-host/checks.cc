#include "pm-host/checks.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <map>
#include <memory>
#include <mutex>
#include <numbers>
#include <vector>

#include "ndi-testsrc/pattern.h"
#include "pm-host/picture.h"
#include "pm-host/record.h"
#include "pm/shm/formats.h"
#include "ndi/ndi_abi.h"

namespace pmhost {

namespace {

// The bars of one size, made once (the reader thread checks every picture).
const std::vector<std::uint8_t>& BarsPicture(int width, int height) {
  static std::mutex lock;  // guards cache
  static std::map<std::pair<int, int>, std::unique_ptr<std::vector<std::uint8_t>>> cache;
  std::lock_guard<std::mutex> guard(lock);
  auto& slot = cache[{width, height}];
  if (!slot) {
    const std::vector<ndits::Plane> planes = ndits::PictureLayout(kNdiFourCCUYVY, width, height);
    // Two pictures whose markers do not overlap: where the first shows its
    // marker, the second shows the bars.
    const ndits::Bars bars(kNdiFourCCUYVY, width, height);
    std::vector<std::uint8_t> first(ndits::PictureSize(planes)), second(first.size());
    bars.Fill(0, first.data());
    const int size = std::max(2, (height / 8) & ~1);
    bars.Fill(size / 8 + 2, second.data());
    static const std::uint8_t kMarker[4] = {128, 235, 128, 235};
    for (std::size_t i = 0; i + 4 <= first.size(); i += 4) {
      if (std::memcmp(first.data() + i, kMarker, 4) == 0) std::memcpy(first.data() + i, second.data() + i, 4);
    }
    slot = std::make_unique<std::vector<std::uint8_t>>(std::move(first));
  }
  return *slot;
}

std::uint32_t SenderFourCC(std::uint32_t code) {
  if (code == pm::kCode2vuy) return kNdiFourCCUYVY;
  if (code == pm::kCodeNV12) return kNdiFourCCNV12;
  if (code == pm::kCodeRgba) return kNdiFourCCBGRA;
  return 0;
}

}  // namespace

std::string CheckBars(const VideoFrame& frame) {
  if (frame.code != pm::kCode2vuy) return "not a '2vuy' picture";
  if (frame.width < 2 || frame.height < 2 || frame.width % 2 != 0) return "odd picture size";
  const std::vector<std::uint8_t>& bars = BarsPicture(frame.width, frame.height);
  const std::size_t rowBytes = static_cast<std::size_t>(frame.width) * 2;
  if (bars.size() < rowBytes * static_cast<std::size_t>(frame.height)) return "no bars of this size";
  const int size = std::max(2, (frame.height / 8) & ~1);
  const int band = ((frame.height - size) / 2) & ~1;
  static const std::uint8_t kMarker[4] = {128, 235, 128, 235};
  for (int y = 0; y < frame.height; ++y) {
    const std::uint8_t* row = frame.data + static_cast<std::size_t>(y) * frame.stride;
    const std::uint8_t* expected = bars.data() + static_cast<std::size_t>(y) * rowBytes;
    if (y < band || y >= band + size) {
      if (std::memcmp(row, expected, rowBytes) != 0) return "row " + std::to_string(y) + " differs from the bars";
      continue;
    }
    for (std::size_t x = 0; x < rowBytes; x += 4) {
      if (std::memcmp(row + x, expected + x, 4) != 0 && std::memcmp(row + x, kMarker, 4) != 0) {
        return "row " + std::to_string(y) + " byte " + std::to_string(x) + " is neither bars nor marker";
      }
    }
  }
  return {};
}

std::string CheckBarsPng(const std::string& path) {
  int width = 0, height = 0;
  std::vector<std::uint8_t> rgb;
  if (!ReadPng(path, &width, &height, &rgb)) return "cannot read " + path;
  if (width < 2 || height < 2 || width % 2 != 0) return "odd picture size";
  const std::vector<std::uint8_t>& bars = BarsPicture(width, height);
  const std::vector<std::uint8_t> expected =
      ToRgb(Picture{pm::kCode2vuy, width, height, static_cast<std::uint32_t>(width) * 2, bars});
  if (expected.size() != rgb.size()) return "no bars of this size";
  const int size = std::max(2, (height / 8) & ~1);
  const int band = ((height - size) / 2) & ~1;
  std::uint8_t marker[3];
  YuvToRgb(235, 128, 128, marker);
  for (int y = 0; y < height; ++y) {
    const bool inBand = y >= band && y < band + size;
    for (int x = 0; x < width; ++x) {
      const std::size_t at = (static_cast<std::size_t>(y) * width + x) * 3;
      if (std::memcmp(&rgb[at], &expected[at], 3) == 0 || (inBand && std::memcmp(&rgb[at], marker, 3) == 0)) continue;
      return "pixel " + std::to_string(x) + "," + std::to_string(y) + " is neither bars nor marker";
    }
  }
  return {};
}

std::string CheckTone(const AudioFrame& frame) {
  if (frame.code != pm::kCodeFl32) return "not 'fl32' sound";
  if (frame.rate <= 0 || frame.channels <= 0 || frame.samples <= 0) return "empty sound";
  const auto* samples = reinterpret_cast<const float*>(frame.data);
  auto tone = [&](std::int64_t t) {
    return static_cast<float>(0.25 * std::sin(2.0 * std::numbers::pi * 1000.0 * static_cast<double>(t) / frame.rate));
  };
  // The tone repeats every rate / gcd(rate, 1000) samples: find this
  // buffer's phase from its first samples, then check every sample.
  std::int64_t a = frame.rate, b = 1000;
  while (b != 0) std::swap(a %= b, b);
  const std::int64_t period = frame.rate / a;
  const int probe = std::min(frame.samples, 16);
  std::int64_t best = 0;
  double bestError = 1e9;
  for (std::int64_t t0 = 0; t0 < period; ++t0) {
    double error = 0;
    for (int k = 0; k < probe; ++k) error += std::fabs(samples[static_cast<std::size_t>(k) * frame.channels] - tone(t0 + k));
    if (error < bestError) {
      bestError = error;
      best = t0;
    }
  }
  for (int k = 0; k < frame.samples; ++k) {
    for (int c = 0; c < frame.channels; ++c) {
      const float got = samples[static_cast<std::size_t>(k) * frame.channels + c];
      if (std::fabs(got - tone(best + k)) > 1e-4f) {
        return "sample " + std::to_string(k) + " channel " + std::to_string(c) + " is " + std::to_string(got) +
               " instead of " + std::to_string(tone(best + k));
      }
    }
  }
  return {};
}

std::string CheckRampPicture(const VideoFrame& frame, std::int64_t* frameNumber) {
  const std::uint32_t fourcc = SenderFourCC(frame.code);
  if (fourcc == 0) return "picture code " + std::to_string(frame.code) + " is not a ramp code";
  return ndits::CheckRamp(fourcc, frame.width, frame.height, static_cast<int>(frame.stride), frame.data, frameNumber);
}

std::string CheckRampSound(const AudioFrame& frame, std::int64_t* firstSample, float tolerance) {
  if (frame.code != pm::kCodeFl32) return "not 'fl32' sound";
  if (frame.channels <= 0 || frame.samples <= 0) return "empty sound";
  const auto* samples = reinterpret_cast<const float*>(frame.data);
  // Channel 0's first sample gives s modulo 1024.
  const std::int64_t s0 = std::llround(samples[0] * 1024.0f);
  *firstSample = s0;
  for (int k = 0; k < frame.samples; ++k) {
    for (int c = 0; c < frame.channels; ++c) {
      const float expected = ndits::AudioRampSample(s0 + k, c);
      const float got = samples[static_cast<std::size_t>(k) * frame.channels + c];
      if (!(std::fabs(got - expected) <= tolerance)) {
        return "sample " + std::to_string(k) + " channel " + std::to_string(c) + " is " + std::to_string(got) +
               " instead of " + std::to_string(expected);
      }
    }
  }
  return {};
}

namespace {

// The average colour of a rectangle, in the picture's own terms: Y, U, V for
// '2vuy' and 'NV12'; R, G, B for 'rgba' (held as B, G, R, A).
struct Average {
  double c[3] = {0, 0, 0};
};

Average AverageOf(const VideoFrame& f, int x0, int y0, int x1, int y1) {
  Average a;
  long count = 0;
  const int step = std::max(1, std::min(x1 - x0, y1 - y0) / 8);
  for (int y = y0; y < y1; y += step) {
    const std::uint8_t* row = f.data + static_cast<std::size_t>(y) * f.stride;
    for (int x = x0; x < x1; x += step) {
      int v[3];
      if (f.code == pm::kCode2vuy) {
        const std::uint8_t* pair = row + 4 * (x / 2);
        v[0] = row[2 * x + 1], v[1] = pair[0], v[2] = pair[2];
      } else if (f.code == pm::kCodeNV12) {
        const std::uint8_t* chroma = f.data + static_cast<std::size_t>(f.height) * f.stride +
                                     static_cast<std::size_t>(y / 2) * f.stride + 2 * (x / 2);
        v[0] = row[x], v[1] = chroma[0], v[2] = chroma[1];
      } else {
        v[0] = row[4 * x + 2], v[1] = row[4 * x + 1], v[2] = row[4 * x];
      }
      for (int k = 0; k < 3; ++k) a.c[k] += v[k];
      ++count;
    }
  }
  for (double& c : a.c) c /= static_cast<double>(std::max(1L, count));
  return a;
}

}  // namespace

BlocksReading ReadBlocks(const VideoFrame& frame, int tolerance) {
  BlocksReading r;
  const bool yuv = frame.code == pm::kCode2vuy || frame.code == pm::kCodeNV12;
  if (!yuv && frame.code != pm::kCodeRgba) {
    r.problem = "picture code " + CodeText(frame.code) + " is not one blocks are read from";
    return r;
  }
  if (tolerance < 0) tolerance = yuv ? 16 : 32;
  const int w = frame.width, h = frame.height;
  const std::uint64_t rows = frame.code == pm::kCodeNV12 ? static_cast<std::uint64_t>(h) * 3 / 2 : h;
  const std::uint64_t rowBytes = static_cast<std::uint64_t>(w) * (frame.code == pm::kCode2vuy ? 2 : frame.code == pm::kCodeNV12 ? 1 : 4);
  if (w < 2 * ndits::kBlockCells || h < 16) {
    r.problem = "a " + std::to_string(w) + "x" + std::to_string(h) + " picture is too small for blocks";
    return r;
  }
  if (frame.data == nullptr || frame.stride < rowBytes || frame.bytes < rows * frame.stride) {
    r.problem = "the picture is shorter than its size and stride";
    return r;
  }
  // Each bar, in the middle half of its width and of the bars' height.
  const int barRows = ndits::BlockBarRows(h);
  for (int i = 0; i < ndits::kBarCount; ++i) {
    const int left = ndits::BarLeft(w, i), right = i + 1 == ndits::kBarCount ? w : ndits::BarLeft(w, i + 1);
    const Average a = AverageOf(frame, left + (right - left) / 4, barRows / 4, right - (right - left) / 4, barRows * 3 / 4);
    const ndits::BarColour& want = ndits::BarColourOf(i);
    const int expected[3] = {yuv ? want.y : want.r, yuv ? want.u : want.g, yuv ? want.v : want.b};
    for (int k = 0; k < 3; ++k) {
      if (std::fabs(a.c[k] - expected[k]) > tolerance) {
        char text[160];
        std::snprintf(text, sizeof text, "bar %d channel %d averages %.1f instead of %d", i, k, a.c[k], expected[k]);
        r.problem = text;
        break;
      }
    }
    if (!r.problem.empty()) break;
  }
  // Each cell, in the middle half of its width and of the cells' height.
  const double threshold = yuv ? (16 + 235) / 2.0 : 255 / 2.0;
  std::uint64_t code = 0;
  for (int i = 0; i < ndits::kBlockCells; ++i) {
    const int left = ndits::CellLeft(w, i), right = i + 1 == ndits::kBlockCells ? w : ndits::CellLeft(w, i + 1);
    const int top = barRows + (h - barRows) / 4, bottom = h - (h - barRows) / 4;
    const Average a = AverageOf(frame, left + (right - left) / 4, top, std::max(left + (right - left) / 4 + 1, right - (right - left) / 4), bottom);
    const double level = yuv ? a.c[0] : (a.c[0] + a.c[1] + a.c[2]) / 3;
    if (level > threshold) code |= std::uint64_t{1} << i;
  }
  r.number = ndits::BlockNumber(code);
  if (r.number < 0 && r.problem.empty()) r.problem = "the number's check bits do not hold";
  return r;
}

}  // namespace pmhost
