// The host's record reader (pmhost::ParseRecord) on any bytes. Random bytes
// rarely pass the Fletcher-16 check, so when the input's first byte is odd
// the target writes the two check bytes itself and the rest of the record is
// checked in earnest.
//
// Input: one mode byte, then the record as it comes off the wire (a 4-byte
// token and 60 bytes, or any other length).

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "fuzz_support.h"
#include "pm-host/record.h"

namespace {

using pmfuzz::Check;

// Check bytes for the last two of the record's 60 bytes so that both running
// sums over all 60 come out 0 (mod 255).
void SealRecord(std::uint8_t* record) {
  const auto check = pm::FletcherCheckBytes(record, pm::kQueueRecordBytes - 2);
  record[pm::kQueueRecordBytes - 2] = check[0];
  record[pm::kQueueRecordBytes - 1] = check[1];
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  pmfuzz::QuietLog();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size < 1) return 0;
  const bool seal = (data[0] & 1u) != 0;
  const std::size_t length = size - 1;
  // Exactly `length` bytes, so that a read past the record is caught.
  std::unique_ptr<std::uint8_t[]> wire(new std::uint8_t[length == 0 ? 1 : length]);
  if (length > 0) std::memcpy(wire.get(), data + 1, length);
  if (seal && length == pm::kQueueWireRecordBytes) {
    SealRecord(wire.get() + 4);
    const pm::FletcherSums sums = pm::Fletcher16(wire.get() + 4, pm::kQueueRecordBytes);
    Check(sums.sum1 == 0 && sums.sum2 == 0, "sealed record does not sum to 0");
  }

  pmhost::QueueRecord record;
  std::string reason;
  const bool ok = pmhost::ParseRecord(length == 0 ? nullptr : wire.get(), length, &record, &reason);
  if (ok) {
    Check(length == pm::kQueueWireRecordBytes, "accepted a record of the wrong length");
    Check(record.descriptor.size > 0 && record.descriptor.size <= pmhost::kMaxSegmentBytes, "segment size");
    Check(record.frameBytes <= record.descriptor.size, "frame larger than its segment");
    if (record.kind == pmhost::RecordKind::Video) {
      Check(record.video.width > 0 && record.video.height > 0, "picture size");
    } else {
      Check(record.samples > 0 && record.audio.sampleRate > 0, "sound");
      Check(static_cast<std::int8_t>(record.audio.channels) > 0, "channel count");
    }
  } else {
    Check(!reason.empty(), "refused without a reason");
  }
  (void)pmhost::CodeText(record.video.code);
  return 0;
}
