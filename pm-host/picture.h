#pragma once
// Pictures as the host receives them, turned into 8-bit RGB for snapshots.
//
// Byte layouts of the host picture codes:
//   '2vuy'  U0 Y0 V0 Y1 per pair of pixels          (packed 4:2:2)
//   'yuvs'  Y0 U0 Y1 V0 per pair of pixels          (packed 4:2:2)
//   'NV12'  luma rows, then rows of interleaved U V at half height, same stride
//   'rgba'  B G R A per pixel: every producer of this code (the NDI BGRA
//           intake, the BGRX/BGR0 conversions) copies the bytes unchanged.
// YUV codes are BT.709 with limited range (Y 16..235, U/V 16..240).

#include <cstdint>
#include <string>
#include <vector>

namespace pmhost {

// A picture copied out of its segment.
struct Picture {
  std::uint32_t code = 0;
  int width = 0;
  int height = 0;
  std::uint32_t stride = 0;
  std::vector<std::uint8_t> bytes;  // height rows (x 1.5 for NV12) at stride
};

// One BT.709 limited-range pixel to RGB (rounded, clamped).
void YuvToRgb(int y, int u, int v, std::uint8_t rgb[3]);

// width x height x 3 bytes of RGB; empty when the code is not one of the
// above or the bytes are too few for the geometry.
std::vector<std::uint8_t> ToRgb(const Picture& picture);

// Writes an 8-bit RGB PNG. False (logged) on failure.
bool WritePng(const std::string& path, int width, int height, const std::vector<std::uint8_t>& rgb);

// Reads a PNG as 8-bit RGB (libpng converts other formats). False (logged)
// when it cannot be read.
bool ReadPng(const std::string& path, int* width, int* height, std::vector<std::uint8_t>* rgb);

}  // namespace pmhost
