#include "pm/runtime/ids.h"

namespace pm {
namespace {
constexpr char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+_";
}

std::string EncodeShortId(const std::uint8_t (&b)[16]) {
  std::string out;
  out.reserve(22);
  for (int i = 0; i < 15; i += 3) {
    const std::uint32_t v = (std::uint32_t{b[i]} << 16) | (std::uint32_t{b[i + 1]} << 8) | b[i + 2];
    out += kAlphabet[(v >> 18) & 63];
    out += kAlphabet[(v >> 12) & 63];
    out += kAlphabet[(v >> 6) & 63];
    out += kAlphabet[v & 63];
  }
  out += kAlphabet[b[15] >> 2];
  out += kAlphabet[(b[15] & 3) << 4];
  return out;
}

}  // namespace pm
