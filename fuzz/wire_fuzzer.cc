// The loopback runtime's wire decoder (ndilb::Decoder) on either end's
// limits, fed in pieces chosen by the input through Feed or the
// WritableSpan/Commit path, with every complete message popped and its
// payload handed back to the pool.
//
// Input: 8 chunk-size bytes (the first one's low bit picks the end: 0 the
// sender, which reads Hello/Tally/Metadata; 1 the receiver, which reads
// metadata, Ready, video and audio), then the byte stream.

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "fuzz_support.h"
#include "ndi-loopback/wire.h"

namespace {

// The receiver accepts payloads of up to 1 GiB (a 16384 x 16384 picture);
// the fuzzer keeps each input's memory small with a lower ceiling, which
// leaves every check of the header in play.
constexpr std::uint64_t kFuzzMaxPayload = std::uint64_t{16} << 20;

using pmfuzz::Check;

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  pmfuzz::QuietLog();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const bool receiverEnd = size > 0 && (data[0] & 1u) != 0;
  ndilb::DecoderLimits limits = receiverEnd ? ndilb::ReceiverSideLimits() : ndilb::SenderSideLimits();
  if (limits.max_payload > kFuzzMaxPayload) limits.max_payload = kFuzzMaxPayload;
  auto pool = std::make_shared<ndilb::BufferPool>(2);
  ndilb::Decoder decoder(limits, pool);

  pmfuzz::Chunker chunker(data, size);
  const std::uint8_t* piece = nullptr;
  std::size_t length = 0;
  std::uint8_t selector = 0;
  while (!decoder.failed() && chunker.Next(&piece, &length, &selector)) {
    if (selector & 0x80u) {
      std::size_t done = 0;
      while (done < length) {
        std::span<std::uint8_t> span = decoder.WritableSpan();
        if (span.empty()) break;
        const std::size_t n = span.size() < length - done ? span.size() : length - done;
        std::memcpy(span.data(), piece + done, n);
        if (!decoder.Commit(n)) break;
        done += n;
      }
    } else {
      decoder.Feed(piece, length);
    }
    while (auto message = decoder.Pop()) {
      const std::uint32_t bit = ndilb::TypeBit(message->type);
      Check((limits.allowed_types & bit) != 0, "a message of a type this end refuses");
      Check(message->text.size() <= limits.max_text, "text over the limit");
      if (message->payload) {
        Check(message->payload.size() <= limits.max_payload, "payload over the limit");
        // Touch every byte: the payload must be as long as it says.
        std::uint8_t sum = 0;
        for (std::size_t i = 0; i < message->payload.size(); ++i) sum ^= message->payload.data()[i];
        (void)sum;
        pool->Release(std::move(message->payload));
      }
    }
  }
  if (decoder.failed()) {
    Check(!decoder.error().empty(), "failed without a reason");
    Check(decoder.WritableSpan().empty(), "a failed decoder still takes bytes");
  }
  return 0;
}
