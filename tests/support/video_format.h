#pragma once
// A video format of a code and a picture size, the rest left at its defaults:
// what most buffer and record tests start from.
#include <cstdint>

#include "pm/shm/formats.h"

namespace pmtest {

inline pm::VideoFormat VideoFormatOf(std::uint32_t code, int width, int height) {
  pm::VideoFormat format;
  format.code = code;
  format.width = static_cast<std::int16_t>(width);
  format.height = static_cast<std::int16_t>(height);
  return format;
}

}  // namespace pmtest
