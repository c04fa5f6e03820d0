#include <uuid/uuid.h>

#include "pm/runtime/ids.h"

namespace pm {

std::string NewUuidString() {
  uuid_t uuid;
  uuid_generate_random(uuid);
  char text[37];
  uuid_unparse_lower(uuid, text);
  return std::string(text, 36);
}

std::string NewShortId() {
  uuid_t uuid;
  uuid_generate_random(uuid);
  std::uint8_t bytes[16];
  for (int i = 0; i < 16; ++i) bytes[i] = uuid[i];
  return EncodeShortId(bytes);
}

}  // namespace pm
