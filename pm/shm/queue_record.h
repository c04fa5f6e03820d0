#pragma once
// The queue record: for every frame a source puts into a shared-memory
// segment, the task sends the host the segment's 4-byte token (the queue
// producer's, pm/ipc/queue_producer.h) and then this 60-byte record, from
// which the host learns which segment holds what. The task writes it
// (SharedMemoryQueueProducer::SendBuffer, with the payload the source's
// callbacks fill) and the host reads it (pm-host/record.h), both through the
// structures below. Numbers are little-endian, fields follow each other
// without gaps.
//
// On the wire (64 bytes):
//
//   0        4                        28                                   62  64
//   | token  | BufferDescriptor (24)  | payload: video or audio (34)       | c0 c1 |
//
// Record offsets (the token not counted):
//
//   descriptor   0 type   4 reserved   12 size   20 stride                 (24 bytes)
//   payload     24                                                         (34 bytes)
//   check       58 c0    59 c1                                             ( 2 bytes)
//
// Payload offsets (within the 34 bytes; add 24 for the record):
//
//   video   0 media time (signed, ticks of 1/705,600,000 s)   8 code
//          12 width   14 height   16 byteSize   20 field   21 scan ('P'/'U')
//          22 extra1  24 extra2   26 extra width   28 extra height   30 zero (4)
//   audio   0 media time   8 sample code   12 sample count (signed)
//          16 sample rate   20 channel count   21 zero (13)
//
// Both payloads begin with the media time and the code (PayloadHead); the
// code tells which of the two the payload is.
//
// Check bytes: the Fletcher-16 sums over bytes 0..57 (sum1 and sum2 from 0;
// per byte b, sum1 = (sum1 + b) mod 255, then sum2 = (sum2 + sum1) mod 255)
// give c0 = 255 - (sum1 + sum2) mod 255 and c1 = 255 - (sum1 + c0) mod 255.
// With them in place both sums over all 60 bytes are 0, which is how the host
// checks a record.

#include <array>
#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <type_traits>

#include "pm/shm/formats.h"
#include "pm/shm/shared_memory.h"

namespace pm {

// The structures hold the wire's little-endian numbers as they are.
static_assert(std::endian::native == std::endian::little, "the queue record is little-endian");

inline constexpr std::size_t kQueueTokenBytes = 4;
inline constexpr std::size_t kQueuePayloadBytes = 34;
inline constexpr std::size_t kQueueRecordBytes = 60;
inline constexpr std::size_t kQueueWireRecordBytes = kQueueTokenBytes + kQueueRecordBytes;

#pragma pack(push, 1)
// What both payloads begin with.
struct PayloadHead {
  std::int64_t mediaTime = 0;
  std::uint32_t code = 0;
};

struct VideoPayload {
  std::int64_t mediaTime = 0;  // ticks of 1/705,600,000 s
  VideoFormat format;          // its code first
  std::uint32_t zero = 0;
};

struct AudioPayload {
  std::int64_t mediaTime = 0;  // ticks of 1/705,600,000 s
  std::uint32_t code = 0;      // 'fl32' or 'sowt'
  std::int32_t samples = 0;    // per channel
  std::uint32_t sampleRate = 0;
  std::uint8_t channels = 0;   // read as a signed 8-bit number wherever a size is computed
  std::uint8_t zero[13] = {};
};

struct PackedQueueRecord {
  BufferDescriptor descriptor;
  std::uint8_t payload[kQueuePayloadBytes] = {};  // a VideoPayload or an AudioPayload
  std::uint8_t check[2] = {};
};
#pragma pack(pop)

static_assert(sizeof(BufferDescriptor) == 24);
static_assert(offsetof(BufferDescriptor, type) == 0);
static_assert(offsetof(BufferDescriptor, reserved) == 4);
static_assert(offsetof(BufferDescriptor, size) == 12);
static_assert(offsetof(BufferDescriptor, stride) == 20);

static_assert(sizeof(PayloadHead) == 12);
static_assert(offsetof(PayloadHead, mediaTime) == 0);
static_assert(offsetof(PayloadHead, code) == 8);

static_assert(sizeof(VideoFormat) == 22);
static_assert(offsetof(VideoFormat, code) == 0);
static_assert(offsetof(VideoFormat, width) == 4);
static_assert(offsetof(VideoFormat, height) == 6);
static_assert(offsetof(VideoFormat, byteSize) == 8);
static_assert(offsetof(VideoFormat, field) == 12);
static_assert(offsetof(VideoFormat, scan) == 13);
static_assert(offsetof(VideoFormat, extra1) == 14);
static_assert(offsetof(VideoFormat, extra2) == 16);
static_assert(offsetof(VideoFormat, extraWidth) == 18);
static_assert(offsetof(VideoFormat, extraHeight) == 20);

static_assert(sizeof(VideoPayload) == kQueuePayloadBytes);
static_assert(offsetof(VideoPayload, mediaTime) == 0);
static_assert(offsetof(VideoPayload, format) == 8);  // its code at 8, width at 12 ... extra height at 28
static_assert(offsetof(VideoPayload, zero) == 30);

static_assert(sizeof(AudioPayload) == kQueuePayloadBytes);
static_assert(offsetof(AudioPayload, mediaTime) == 0);
static_assert(offsetof(AudioPayload, code) == 8);
static_assert(offsetof(AudioPayload, samples) == 12);
static_assert(offsetof(AudioPayload, sampleRate) == 16);
static_assert(offsetof(AudioPayload, channels) == 20);
static_assert(offsetof(AudioPayload, zero) == 21);

static_assert(sizeof(PackedQueueRecord) == kQueueRecordBytes);
static_assert(offsetof(PackedQueueRecord, descriptor) == 0);
static_assert(offsetof(PackedQueueRecord, payload) == 24);
static_assert(offsetof(PackedQueueRecord, check) == 58);

static_assert(std::is_trivially_copyable_v<PackedQueueRecord> && std::is_trivially_copyable_v<VideoPayload> &&
              std::is_trivially_copyable_v<AudioPayload>);

// The payload bytes of `record` read as a PayloadHead, VideoPayload or
// AudioPayload.
template <class Payload>
Payload PayloadAs(const PackedQueueRecord& record) {
  static_assert(sizeof(Payload) <= kQueuePayloadBytes && std::is_trivially_copyable_v<Payload>);
  Payload payload;
  std::memcpy(&payload, record.payload, sizeof payload);
  return payload;
}

// The Fletcher-16 running sums (sum1, sum2) over `length` bytes.
struct FletcherSums {
  unsigned sum1 = 0;
  unsigned sum2 = 0;
};
FletcherSums Fletcher16(const std::uint8_t* bytes, std::size_t length);

// The two check bytes that, written after bytes[0, length), make both sums
// over the whole 0.
std::array<std::uint8_t, 2> FletcherCheckBytes(const std::uint8_t* bytes, std::size_t length);

// Writes the record's check bytes over its first 58 bytes.
void SealQueueRecord(PackedQueueRecord& record);

}  // namespace pm
