// Default strides, frame sizes and plane layouts of the picture codes.
//
// Every size is formed in 64 bits and handed out as a signed 32-bit value. A
// picture whose stride or size would not fit in 32 bits (a 32767 x 32767
// 'rgba' picture is about 4.3 GB), or whose width, height or stride is
// negative, is not a picture a segment can hold: its stride or size is
// reported as 0, which every caller already treats as "no buffer".

#include "pm/shm/formats.h"

#include <cstddef>
#include <limits>

namespace pm {
namespace {

constexpr std::int64_t kMax32 = std::numeric_limits<std::int32_t>::max();

// Bytes per pixel of the default stride; 0 for codes without a stride.
std::int64_t StrideFactor(std::uint32_t code) {
  switch (code) {
    case kCodeRgba:
    case kCodeJpeg:
      return 4;
    case kCode2vuy:
    case kCodeYuvs:
      return 2;
    case kCodeNV12:
      return 1;
    default:
      return 0;
  }
}

std::int32_t Fit32(std::int64_t value) {
  return value < 0 || value > kMax32 ? 0 : static_cast<std::int32_t>(value);
}

}  // namespace

std::int32_t DefaultStride(const VideoFormat& format) {
  return Fit32(static_cast<std::int64_t>(format.width) * StrideFactor(format.code));
}

std::int32_t FrameSize(const VideoFormat& format, std::int32_t stride) {
  if (StrideFactor(format.code) == 0) return 0;
  const std::int64_t s = stride == 0 ? DefaultStride(format) : stride;
  if (s < 0 || format.height < 0) return 0;
  std::int64_t size = static_cast<std::int64_t>(format.height) * s;
  // 'NV12': the chroma plane adds half the luma plane; the product is formed
  // before the halving, and the halving truncates.
  if (format.code == kCodeNV12) size = size * 3 / 2;
  return Fit32(size);
}

std::int32_t BytesPerSample(std::uint32_t sampleCode) {
  switch (sampleCode) {
    case kCodeFl32:
      return 4;
    case kCodeSowt:
      return 2;
    default:
      return 0;
  }
}

VideoPlanes LayoutPlanes(const VideoFormat& format, std::uint8_t* base, std::int32_t stride) {
  VideoPlanes planes;
  if (stride == 0) stride = DefaultStride(format);
  if (base == nullptr) return planes;
  planes.planeCount = 1;
  planes.plane[0] = {base, format.height, stride};
  if (format.code == kCodeNV12) {
    planes.planeCount = 2;
    // The chroma plane starts after `height` luma rows. The offset is only
    // formed, never dereferenced here; copies check rows and strides.
    const std::ptrdiff_t offset = static_cast<std::ptrdiff_t>(format.height) * stride;
    planes.plane[1] = {base + offset, static_cast<std::int32_t>(format.height / 2), stride};
  }
  return planes;
}

}  // namespace pm
