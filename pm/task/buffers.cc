// The pixel operations that every video buffer shares: copying a picture of
// the buffer's own format and converting the few foreign layouts the host does
// not take.
//
// Both operations write only inside the planes the buffer lays out and read
// only inside the source planes they are given: a plane of `rows` rows and
// stride s spans rows x |s| bytes from its first row. A source that does not
// fit those bounds (too few rows, a stride smaller than a row, no data) is left
// alone; the rest of the picture then stays unwritten, without a message, as
// the frame thread must not log per frame.

#include "pm/task/buffers.h"

#include <cstddef>
#include <cstdlib>
#include <cstring>

#include "pm/task/pixel_kernels.h"

namespace pm {
namespace {

const std::uint8_t* Row(const Plane& plane, std::int32_t r) {
  return plane.data + static_cast<std::ptrdiff_t>(r) * plane.stride;
}
std::uint8_t* MutableRow(const Plane& plane, std::int32_t r) {
  return plane.data + static_cast<std::ptrdiff_t>(r) * plane.stride;
}

std::int64_t Magnitude(std::int32_t stride) { return std::llabs(static_cast<long long>(stride)); }

// Copies the destination's rows from `source`: one block when the two strides
// are equal, else `rowBytes` bytes per row with each side stepping by its own
// stride. False when the planes cannot hold what the copy would touch.
bool CopyPlane(std::int32_t rowBytes, const Plane& source, const Plane& destination) {
  if (destination.rows <= 0) return true;
  if (source.data == nullptr || destination.data == nullptr) return false;
  if (source.rows < destination.rows) return false;
  if (source.stride == destination.stride && destination.stride > 0) {
    std::memcpy(destination.data, source.data,
                static_cast<std::size_t>(destination.stride) * static_cast<std::size_t>(destination.rows));
    return true;
  }
  if (rowBytes <= 0) return true;
  if (rowBytes > destination.stride || rowBytes > Magnitude(source.stride)) return false;
  for (std::int32_t r = 0; r < destination.rows; ++r) {
    std::memcpy(MutableRow(destination, r), Row(source, r), static_cast<std::size_t>(rowBytes));
  }
  return true;
}

bool Usable(const VideoPlanes& view) {
  return view.planeCount >= 1 && view.planeCount <= 3 && view.plane[0].data != nullptr &&
         view.plane[0].stride > 0;
}

// 'I420'/'YV12' to 'NV12': the luma plane is copied, then the two chroma
// planes are interleaved U first.
void PlanarToNV12(std::int32_t w, const VideoPlanes& source, const Plane& u, const Plane& v,
                  const VideoPlanes& destination) {
  if (source.planeCount != 3 || destination.planeCount != 2 || w < 0) return;
  const Plane& luma = source.plane[0];
  const Plane& outLuma = destination.plane[0];
  if (luma.rows != outLuma.rows || w > luma.stride || w > outLuma.stride) return;
  if (!CopyPlane(w, luma, outLuma)) return;

  const Plane& chroma = destination.plane[1];
  const std::int32_t pairs = w / 2;
  if (u.rows != chroma.rows || v.rows != chroma.rows || w > chroma.stride || pairs > u.stride ||
      pairs > v.stride) {
    return;
  }
  if (chroma.rows <= 0) return;
  if (u.data == nullptr || v.data == nullptr || chroma.data == nullptr) return;
  for (std::int32_t r = 0; r < chroma.rows; ++r) {
    pixel::InterleaveUV(Row(u, r), Row(v, r), MutableRow(chroma, r), pairs);
  }
}

// 'BGRX'/'BGR0' to 'rgba': `bytesIn` bytes per source pixel, four out with
// the last set to 0xFF. The source stride may be negative (bottom-up
// pictures): row r starts at data + r x stride.
void PackedToRgba(std::int32_t w, std::int32_t bytesIn, const VideoPlanes& source,
                  const VideoPlanes& destination) {
  if (source.planeCount != 1 || destination.planeCount != 1 || w < 0) return;
  const Plane& in = source.plane[0];
  const Plane& out = destination.plane[0];
  const std::int64_t inRow = static_cast<std::int64_t>(bytesIn) * w;
  const std::int64_t outRow = std::int64_t{4} * w;
  if (in.rows != out.rows || inRow > Magnitude(in.stride) || outRow > out.stride) return;
  if (out.rows <= 0 || in.data == nullptr || out.data == nullptr) return;
  for (std::int32_t r = 0; r < out.rows; ++r) {
    if (bytesIn == 4) {
      pixel::CopyOpaque4(Row(in, r), MutableRow(out, r), w);
    } else {
      pixel::Widen3To4(Row(in, r), MutableRow(out, r), w);
    }
  }
}

}  // namespace

void VideoBuffer::CopyFrame(const std::uint8_t* source, std::int32_t sourceStride) {
  const VideoFormat format = Format();
  // The source view is only read; LayoutPlanes takes a mutable pointer.
  const VideoPlanes from = LayoutPlanes(format, const_cast<std::uint8_t*>(source), sourceStride);
  const VideoPlanes to = Planes();
  if (Usable(to)) {
    // For 'NV12' the chroma rows are as wide as the luma rows.
    const std::int32_t rowBytes = DefaultStride(format);
    for (std::int32_t p = 0; p < to.planeCount && p < from.planeCount; ++p) {
      CopyPlane(rowBytes, from.plane[p], to.plane[p]);
    }
  }
  UnmapData();
}

void VideoBuffer::ConvertFrame(std::uint32_t sourceCode, const VideoPlanes& source) {
  const VideoFormat format = Format();
  const bool planar = (sourceCode == kCodeI420 || sourceCode == kCodeYV12) && format.code == kCodeNV12;
  const bool packed = (sourceCode == kCodeBGRX || sourceCode == kCodeBGR0) && format.code == kCodeRgba;
  if (!planar && !packed) return;  // any other pair maps nothing

  const VideoPlanes to = Planes();
  if (Usable(to)) {
    const std::int32_t w = format.width;
    if (sourceCode == kCodeI420) {
      PlanarToNV12(w, source, source.plane[1], source.plane[2], to);
    } else if (sourceCode == kCodeYV12) {
      PlanarToNV12(w, source, source.plane[2], source.plane[1], to);
    } else {
      PackedToRgba(w, sourceCode == kCodeBGRX ? 4 : 3, source, to);
    }
  }
  UnmapData();
}

}  // namespace pm
