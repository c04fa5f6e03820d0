#include "pm-host/picture.h"

#include <png.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstdio>

#include "pm/runtime/log.h"
#include "pm/runtime/syscall.h"
#include "pm/shm/formats.h"

namespace pmhost {

namespace {

std::uint8_t Clamp(double value) { return static_cast<std::uint8_t>(std::clamp(std::lround(value), 0L, 255L)); }

std::uint64_t NeededBytes(const Picture& p, std::uint64_t rowBytes) {
  const std::uint64_t rows = p.code == pm::kCodeNV12 ? static_cast<std::uint64_t>(p.height) * 3 / 2 : p.height;
  if (p.stride < rowBytes) return UINT64_MAX;
  return rows == 0 ? 0 : (rows - 1) * p.stride + rowBytes;
}

}  // namespace

void YuvToRgb(int y, int u, int v, std::uint8_t rgb[3]) {
  const double luma = 1.164383 * (y - 16);
  const double cb = u - 128;
  const double cr = v - 128;
  rgb[0] = Clamp(luma + 1.792741 * cr);
  rgb[1] = Clamp(luma - 0.213249 * cb - 0.532909 * cr);
  rgb[2] = Clamp(luma + 2.112402 * cb);
}

std::vector<std::uint8_t> ToRgb(const Picture& p) {
  std::vector<std::uint8_t> rgb;
  if (p.width <= 0 || p.height <= 0) return rgb;
  const auto w = static_cast<std::size_t>(p.width);
  const auto h = static_cast<std::size_t>(p.height);
  std::uint64_t rowBytes = 0;
  if (p.code == pm::kCode2vuy || p.code == pm::kCodeYuvs) {
    if (p.width % 2 != 0) return rgb;
    rowBytes = w * 2;
  } else if (p.code == pm::kCodeNV12) {
    if (p.width % 2 != 0 || p.height % 2 != 0) return rgb;
    rowBytes = w;
  } else if (p.code == pm::kCodeRgba) {
    rowBytes = w * 4;
  } else {
    return rgb;
  }
  if (NeededBytes(p, rowBytes) > p.bytes.size()) return rgb;
  rgb.resize(w * h * 3);
  for (std::size_t y = 0; y < h; ++y) {
    const std::uint8_t* row = p.bytes.data() + y * p.stride;
    std::uint8_t* out = rgb.data() + y * w * 3;
    for (std::size_t x = 0; x < w; ++x) {
      if (p.code == pm::kCode2vuy) {
        const std::uint8_t* pair = row + (x & ~std::size_t{1}) * 2;
        YuvToRgb(row[2 * x + 1], pair[0], pair[2], out + 3 * x);
      } else if (p.code == pm::kCodeYuvs) {
        const std::uint8_t* pair = row + (x & ~std::size_t{1}) * 2;
        YuvToRgb(row[2 * x], pair[1], pair[3], out + 3 * x);
      } else if (p.code == pm::kCodeNV12) {
        const std::uint8_t* chroma = p.bytes.data() + (h + y / 2) * p.stride + (x & ~std::size_t{1});
        YuvToRgb(row[x], chroma[0], chroma[1], out + 3 * x);
      } else {
        out[3 * x] = row[4 * x + 2];
        out[3 * x + 1] = row[4 * x + 1];
        out[3 * x + 2] = row[4 * x];
      }
    }
  }
  return rgb;
}

bool WritePng(const std::string& path, int width, int height, const std::vector<std::uint8_t>& rgb) {
  if (width <= 0 || height <= 0 || rgb.size() != static_cast<std::size_t>(width) * height * 3) {
    pm::Log(pm::LogType::Normal, "", "WritePng: no picture for '%s'\n", path.c_str());
    return false;
  }
  png_image image{};
  image.version = PNG_IMAGE_VERSION;
  image.width = static_cast<png_uint_32>(width);
  image.height = static_cast<png_uint_32>(height);
  image.format = PNG_FORMAT_RGB;
  if (png_image_write_to_file(&image, path.c_str(), 0, rgb.data(), width * 3, nullptr) == 0) {
    pm::Log(pm::LogType::Normal, "", "WritePng: cannot write '%s': %s\n", path.c_str(), image.message);
    png_image_free(&image);
    return false;
  }
  return true;
}

bool ReadPng(const std::string& path, int* width, int* height, std::vector<std::uint8_t>* rgb) {
  png_image image{};
  image.version = PNG_IMAGE_VERSION;
  if (png_image_begin_read_from_file(&image, path.c_str()) == 0) {
    pm::Log(pm::LogType::Normal, "", "ReadPng: cannot read '%s': %s\n", path.c_str(), image.message);
    png_image_free(&image);
    return false;
  }
  image.format = PNG_FORMAT_RGB;
  std::vector<std::uint8_t> pixels(PNG_IMAGE_SIZE(image));
  if (png_image_finish_read(&image, nullptr, pixels.data(), 0, nullptr) == 0) {
    pm::Log(pm::LogType::Normal, "", "ReadPng: cannot decode '%s': %s\n", path.c_str(), image.message);
    png_image_free(&image);
    return false;
  }
  *width = static_cast<int>(image.width);
  *height = static_cast<int>(image.height);
  *rgb = std::move(pixels);
  return true;
}

}  // namespace pmhost
