#pragma once
// The host's reading of one queue record (token + 60 bytes, laid out in
// pm/shm/queue_record.h). Pure functions over bytes:
// nothing here touches a socket or a segment, so tests feed it any bytes.
//
// A record is accepted only when
//   - its Fletcher-16 sums over the 60 bytes are both 0;
//   - the descriptor names a CPU segment ('CPU.') of 1 byte .. kMaxSegmentBytes;
//   - the payload's code is a picture code this host reads ('2vuy', 'yuvs',
//     'NV12', 'rgba') or a sample code ('fl32', 'sowt');
//   - a picture has a positive width and height, a stride (the descriptor's,
//     or the code's default when it is 0) of at least one row of pixels, and
//     its frame size at that stride fits the descriptor's size;
//   - a sound buffer has a positive rate, sample count and channel count and
//     its bytes fit the descriptor's size.
// Everything else is refused with a reason (the caller logs it and still
// returns the token).

#include <cstddef>
#include <cstdint>
#include <string>

#include "pm/shm/formats.h"
#include "pm/shm/queue_record.h"
#include "pm/shm/shared_memory.h"

namespace pmhost {

// Larger segments are refused rather than mapped (a 16K RGBA picture is 2 GiB).
inline constexpr std::uint64_t kMaxSegmentBytes = std::uint64_t{4} << 30;

enum class RecordKind { Video, Audio };

struct QueueRecord {
  std::uint32_t token = 0;
  RecordKind kind = RecordKind::Video;
  pm::BufferDescriptor descriptor;
  std::int64_t mediaTime = 0;  // ticks of 1/705,600,000 s
  // Video:
  pm::VideoFormat video;
  std::uint32_t stride = 0;      // effective line stride
  std::uint64_t frameBytes = 0;  // bytes of the picture (or audio) in the segment
  // Audio:
  pm::AudioFormat audio;
  std::int32_t samples = 0;  // per channel
};

// Reads `wire` (pm::kQueueWireRecordBytes: the 4-byte token, then the record). True
// with `out` filled when the record is sound; false with `reason` set
// otherwise (out->token is filled whenever the token bytes were there, so the
// caller can return it).
bool ParseRecord(const std::uint8_t* wire, std::size_t length, QueueRecord* out, std::string* reason);

// A four-character code as text ("2vuy"; bytes outside printable ASCII as '?').
std::string CodeText(std::uint32_t code);

}  // namespace pmhost
