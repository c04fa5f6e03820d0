// The runner's message path: bytes of a connection in pieces chosen by the
// input go through pm::ipc::FrameReader (alternating Feed and the zero-copy
// Wanted/WritePointer/Commit path), and every complete message is routed by a
// pm::RpcDispatcher without a connection: requests reach an echo handler, a
// handler that throws and one that leaves a non-object response; replies meet
// two pending requests, one of whose callbacks throws.
//
// Input: 8 chunk-size bytes, then the byte stream (4-byte little-endian
// length + message text, repeated).

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <stdexcept>
#include <string>
#include <utility>

#include "fuzz_support.h"
#include "pm/ipc/dispatcher.h"
#include "pm/ipc/framing.h"
#include "support/manual_clock.h"

namespace pm {
struct RpcDispatcherTestAccess {
  static void Handle(RpcDispatcher& dispatcher, const std::string& text) { dispatcher.HandleMessage(text); }
};
}  // namespace pm

namespace {

using pmfuzz::Check;

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  pmfuzz::QuietLog();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  // Stop's grace period is for replies still being written; there are none,
  // and on the tests' manual clock it takes no time.
  pm::RpcDispatcher dispatcher(nullptr, std::make_shared<pmtest::ManualClock>());
  dispatcher.RegisterHandler("echo", [](const nlohmann::json& request, nlohmann::json& response) {
    response["echo"] = request;
  });
  dispatcher.RegisterHandler("throw", [](const nlohmann::json& request, nlohmann::json&) {
    throw std::runtime_error("handler failed on " + request.dump().substr(0, 32));
  });
  dispatcher.RegisterHandler("scalar", [](const nlohmann::json&, nlohmann::json& response) { response = 5; });
  // Pending requests 1 and 2 (not sent: there is no connection).
  nlohmann::json first = nlohmann::json::object();
  dispatcher.RpcRequest("ping", first, 60000, [](const nlohmann::json& reply) {
    (void)reply.value("pm::error", std::string());
  });
  nlohmann::json second = nlohmann::json::object();
  dispatcher.RpcRequest("ping", second, 60000,
                        [](const nlohmann::json&) { throw std::runtime_error("callback failed"); });

  pm::ipc::FrameReader reader;
  pmfuzz::Chunker chunker(data, size);
  const std::uint8_t* piece = nullptr;
  std::size_t length = 0;
  std::uint8_t selector = 0;
  std::string message;
  while (!reader.Oversize() && chunker.Next(&piece, &length, &selector)) {
    if (selector & 0x80u) {
      // As the socket loop reads: never more than Wanted() at a time.
      std::size_t done = 0;
      while (done < length && !reader.Oversize()) {
        const std::size_t wanted = reader.Wanted();
        Check(wanted > 0, "Wanted() is 0 while not oversize");
        const std::size_t n = wanted < length - done ? wanted : length - done;
        std::memcpy(reader.WritePointer(), piece + done, n);
        reader.Commit(n);
        done += n;
      }
    } else {
      const std::size_t taken = reader.Feed(piece, length);
      Check(taken <= length, "Feed took more than it was given");
      Check(taken == length || reader.Oversize(), "Feed stopped short without being oversize");
    }
    while (reader.Next(&message)) {
      Check(message.size() <= pm::ipc::kMaxFrameBytes, "message over the frame limit");
      pm::RpcDispatcherTestAccess::Handle(dispatcher, message);
    }
  }
  if (reader.Oversize()) Check(reader.OversizeLength() > pm::ipc::kMaxFrameBytes, "oversize length");
  dispatcher.Stop();
  return 0;
}
