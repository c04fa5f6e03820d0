#pragma once
// The buffer interfaces a source writes frames into. Declaration order is the
// virtual slot order; keep it.
//
// Which thread calls this: the source's frame thread requests, fills and sends
// a buffer; the last reference may be dropped on any thread.

#include <cstdint>
#include <functional>
#include <utility>

#include "pm/shm/formats.h"

namespace pm {

class VideoBuffer {
 public:
  virtual ~VideoBuffer() = default;
  // Maps the segment and lays the picture out over it; pair with UnmapData.
  virtual VideoPlanes Planes() = 0;
  // Maps the segment: (data pointer, stride); pair with UnmapData.
  virtual std::pair<std::uint8_t*, std::int32_t> MapData() = 0;
  virtual void UnmapData() = 0;
  virtual VideoFormat Format() const = 0;
  // Copies a picture of the buffer's own format from `source` with
  // `sourceStride` bytes per line; maps and unmaps itself.
  virtual void CopyFrame(const std::uint8_t* source, std::int32_t sourceStride);
  // Converts I420/YV12 to NV12 and BGRX/BGR0 to rgba; other pairs do nothing.
  virtual void ConvertFrame(std::uint32_t sourceCode, const VideoPlanes& source);
};

class AudioBuffer {
 public:
  virtual ~AudioBuffer() = default;
  virtual AudioFormat Format() const = 0;
  virtual std::int32_t SampleCount() const = 0;
  // Maps the segment, calls `fill(data, ByteSize())` once, unmaps.
  virtual void Fill(std::function<void(void*, std::int64_t)> fill) = 0;
  // channels x samples x bytes per sample.
  virtual std::int64_t ByteSize() const = 0;
};

}  // namespace pm
