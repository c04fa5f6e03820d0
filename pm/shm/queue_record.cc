#include "pm/shm/queue_record.h"

namespace pm {

FletcherSums Fletcher16(const std::uint8_t* bytes, std::size_t length) {
  FletcherSums sums;
  for (std::size_t i = 0; i < length; ++i) {
    sums.sum1 = (sums.sum1 + bytes[i]) % 255;
    sums.sum2 = (sums.sum2 + sums.sum1) % 255;
  }
  return sums;
}

std::array<std::uint8_t, 2> FletcherCheckBytes(const std::uint8_t* bytes, std::size_t length) {
  const FletcherSums sums = Fletcher16(bytes, length);
  const unsigned c0 = 255 - ((sums.sum1 + sums.sum2) % 255);
  const unsigned c1 = 255 - ((sums.sum1 + c0) % 255);
  return {static_cast<std::uint8_t>(c0), static_cast<std::uint8_t>(c1)};
}

void SealQueueRecord(PackedQueueRecord& record) {
  const auto check =
      FletcherCheckBytes(reinterpret_cast<const std::uint8_t*>(&record), offsetof(PackedQueueRecord, check));
  record.check[0] = check[0];
  record.check[1] = check[1];
}

}  // namespace pm
