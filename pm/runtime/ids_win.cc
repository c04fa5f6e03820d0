#include <rpc.h>

#include <cstring>

#include "pm/runtime/ids.h"
#include "pm/runtime/log.h"

namespace pm {
namespace {
// UuidCreate's status when the UUID is unique only on this computer: good
// enough for names that never leave it.
constexpr RPC_STATUS kUuidLocalOnly = 1824;
}  // namespace

std::string NewUuidString() {
  UUID uuid;
  const RPC_STATUS created = ::UuidCreate(&uuid);
  if (created != RPC_S_OK && created != kUuidLocalOnly) {
    LogText("", "pm::SharedMemory : Failed to create UUID.\n");
    return {};
  }
  RPC_CSTR text = nullptr;
  if (::UuidToStringA(&uuid, &text) != RPC_S_OK || text == nullptr) {
    LogText("", "pm::SharedMemory : Failed to allocate UUID.\n");
    return {};
  }
  std::string copy(reinterpret_cast<const char*>(text));
  ::RpcStringFreeA(&text);
  return copy;
}

std::string NewShortId() {
  UUID uuid;
  ::UuidCreate(&uuid);  // status ignored: any 16 bytes make a name
  std::uint8_t bytes[16];
  static_assert(sizeof uuid == sizeof bytes);
  std::memcpy(bytes, &uuid, sizeof bytes);  // the fields as they lie in memory
  return EncodeShortId(bytes);
}

}  // namespace pm
