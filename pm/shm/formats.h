#pragma once
// Frame formats: the records with which a source asks for a buffer and which
// the queue record carries to the host byte for byte, the picture and sample
// codes, and the default strides and frame sizes.
//
// Four-character codes pack the FIRST character in the MOST significant byte
// ('NV12' is 0x4E563132), the opposite of NDI FourCCs.

#include <cstdint>

namespace pm {

constexpr std::uint32_t FourCC(char a, char b, char c, char d) {
  return static_cast<std::uint32_t>(static_cast<unsigned char>(a)) << 24 |
         static_cast<std::uint32_t>(static_cast<unsigned char>(b)) << 16 |
         static_cast<std::uint32_t>(static_cast<unsigned char>(c)) << 8 |
         static_cast<std::uint32_t>(static_cast<unsigned char>(d));
}

// Picture codes the host takes.
inline constexpr std::uint32_t kCode2vuy = FourCC('2', 'v', 'u', 'y');  // 0x32767579, packed 4:2:2
inline constexpr std::uint32_t kCodeYuvs = FourCC('y', 'u', 'v', 's');  // 0x79757673, packed 4:2:2
inline constexpr std::uint32_t kCodeNV12 = FourCC('N', 'V', '1', '2');  // 0x4E563132
inline constexpr std::uint32_t kCodeRgba = FourCC('r', 'g', 'b', 'a');  // 0x72676261
inline constexpr std::uint32_t kCodeJpeg = FourCC('J', 'P', 'E', 'G');  // 0x4A504547
// Source picture codes only the conversion accepts.
inline constexpr std::uint32_t kCodeI420 = FourCC('I', '4', '2', '0');  // 0x49343230
inline constexpr std::uint32_t kCodeYV12 = FourCC('Y', 'V', '1', '2');  // 0x59563132
inline constexpr std::uint32_t kCodeBGRX = FourCC('B', 'G', 'R', 'X');  // 0x42475258
inline constexpr std::uint32_t kCodeBGR0 = FourCC('B', 'G', 'R', '0');  // 0x42475230
// Sample codes.
inline constexpr std::uint32_t kCodeFl32 = FourCC('f', 'l', '3', '2');  // 0x666C3332, float32
inline constexpr std::uint32_t kCodeSowt = FourCC('s', 'o', 'w', 't');  // 0x736F7774, int16 LE

inline constexpr std::uint8_t kScanProgressive = 'P';  // 0x50
inline constexpr std::uint8_t kScanOther = 'U';        // 0x55

#pragma pack(push, 1)
// 22 bytes, little-endian, copied byte for byte into the video record.
struct VideoFormat {
  std::uint32_t code = 0;
  std::int16_t width = 0;
  std::int16_t height = 0;
  std::uint32_t byteSize = 0;   // size of a compressed picture, 0 otherwise
  std::uint8_t field = 0;       // carried unchanged
  std::uint8_t scan = 0;        // 'P' progressive, 'U' otherwise
  std::uint16_t extra1 = 0;     // carried unchanged
  std::uint16_t extra2 = 0;     // carried unchanged
  std::int16_t extraWidth = 0;  // carried unchanged; 0 counts as width for GPU matching
  std::int16_t extraHeight = 0; // carried unchanged; 0 counts as height for GPU matching
};
#pragma pack(pop)
static_assert(sizeof(VideoFormat) == 22);

struct AudioFormat {
  std::uint32_t code = 0;
  std::uint32_t sampleRate = 0;
  std::uint8_t channels = 0;  // read as a signed 8-bit number wherever a size is computed
};

// Default line stride of a picture code (0 for unknown codes).
std::int32_t DefaultStride(const VideoFormat& format);
// Frame size at `stride` (0 stands for the default stride); 0 for unknown codes.
std::int32_t FrameSize(const VideoFormat& format, std::int32_t stride);
// Bytes per sample of a sample code: 4 for 'fl32', 2 for 'sowt', else 0.
std::int32_t BytesPerSample(std::uint32_t sampleCode);

struct Plane {
  std::uint8_t* data = nullptr;
  std::int32_t rows = 0;
  std::int32_t stride = 0;  // bytes from one row to the next; may be negative for a source view
};

struct VideoPlanes {
  std::int32_t planeCount = 0;
  Plane plane[3];
};

// The plane layout of a picture of `format` at `base` with `stride` (0 = the
// default stride). No base pointer gives planeCount 0.
VideoPlanes LayoutPlanes(const VideoFormat& format, std::uint8_t* base, std::int32_t stride);

}  // namespace pm
