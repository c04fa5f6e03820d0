#pragma once
// Little-endian loads and stores of unsigned 16-, 32- and 64-bit numbers at
// any byte address: the byte order of every wire format and record of this
// project (message frames, queue tokens, the loopback runtime's wire, the
// test pattern's frame numbers). Byte shifts only, so they are constexpr,
// need no alignment and give the same bytes on any host.
//
// `Byte` is any one-byte integer type (std::uint8_t, char, unsigned char).

#include <cstddef>
#include <cstdint>
#include <type_traits>

namespace pm {

namespace little_endian_detail {

template <class Byte>
constexpr void CheckByte() {
  static_assert(sizeof(Byte) == 1 && std::is_integral_v<Byte>, "a one-byte integer type");
}

template <class Value, std::size_t N, class Byte>
constexpr Value Load(const Byte* p) {
  CheckByte<Byte>();
  Value value = 0;
  for (std::size_t i = 0; i < N; ++i) {
    value |= static_cast<Value>(static_cast<std::uint8_t>(p[i])) << (8 * i);
  }
  return value;
}

template <std::size_t N, class Byte, class Value>
constexpr void Store(Byte* p, Value value) {
  CheckByte<Byte>();
  for (std::size_t i = 0; i < N; ++i) {
    p[i] = static_cast<Byte>(static_cast<std::uint8_t>(value >> (8 * i)));
  }
}

}  // namespace little_endian_detail

template <class Byte>
constexpr std::uint16_t LoadLe16(const Byte* p) {
  return little_endian_detail::Load<std::uint16_t, 2>(p);
}
template <class Byte>
constexpr std::uint32_t LoadLe32(const Byte* p) {
  return little_endian_detail::Load<std::uint32_t, 4>(p);
}
template <class Byte>
constexpr std::uint64_t LoadLe64(const Byte* p) {
  return little_endian_detail::Load<std::uint64_t, 8>(p);
}

template <class Byte>
constexpr void StoreLe16(Byte* p, std::uint16_t value) {
  little_endian_detail::Store<2>(p, value);
}
template <class Byte>
constexpr void StoreLe32(Byte* p, std::uint32_t value) {
  little_endian_detail::Store<4>(p, value);
}
template <class Byte>
constexpr void StoreLe64(Byte* p, std::uint64_t value) {
  little_endian_detail::Store<8>(p, value);
}

namespace little_endian_detail {
inline constexpr std::uint8_t kSample[8] = {0x01, 0x02, 0x03, 0x04, 0x05, 0x06, 0x07, 0xF8};
constexpr bool StoresWhatItLoads() {
  std::uint8_t bytes[8] = {};
  StoreLe64(bytes, LoadLe64(kSample));
  for (int i = 0; i < 8; ++i) {
    if (bytes[i] != kSample[i]) return false;
  }
  return true;
}
static_assert(LoadLe16(kSample) == 0x0201);
static_assert(LoadLe32(kSample) == 0x04030201);
static_assert(LoadLe64(kSample) == 0xF807060504030201);
static_assert(StoresWhatItLoads());
}  // namespace little_endian_detail

}  // namespace pm
