#include "pm/task/pixel_kernels.h"

#include <cstring>

#if defined(__SSE2__)
#include <emmintrin.h>
#endif

namespace pm::pixel {

void InterleaveUVScalar(const std::uint8_t* u, const std::uint8_t* v, std::uint8_t* dst,
                        std::int32_t pairs) {
  for (std::int32_t i = 0; i < pairs; ++i) {
    dst[2 * i] = u[i];
    dst[2 * i + 1] = v[i];
  }
}

#if defined(__SSE2__)

bool HaveSse2() { return true; }

void InterleaveUVSse2(const std::uint8_t* u, const std::uint8_t* v, std::uint8_t* dst,
                      std::int32_t pairs) {
  std::int32_t i = 0;
  // Two steps of 8 pairs per round: 16 U and 16 V bytes in, 32 bytes out.
  for (; i + 16 <= pairs; i += 16) {
    const __m128i uu = _mm_loadu_si128(reinterpret_cast<const __m128i*>(u + i));
    const __m128i vv = _mm_loadu_si128(reinterpret_cast<const __m128i*>(v + i));
    _mm_storeu_si128(reinterpret_cast<__m128i*>(dst + 2 * i), _mm_unpacklo_epi8(uu, vv));
    _mm_storeu_si128(reinterpret_cast<__m128i*>(dst + 2 * i + 16), _mm_unpackhi_epi8(uu, vv));
  }
  // One step of 8 pairs: 8-byte loads, so nothing past the row is read.
  for (; i + 8 <= pairs; i += 8) {
    const __m128i uu = _mm_loadl_epi64(reinterpret_cast<const __m128i*>(u + i));
    const __m128i vv = _mm_loadl_epi64(reinterpret_cast<const __m128i*>(v + i));
    _mm_storeu_si128(reinterpret_cast<__m128i*>(dst + 2 * i), _mm_unpacklo_epi8(uu, vv));
  }
  InterleaveUVScalar(u + i, v + i, dst + 2 * i, pairs - i);
}

void InterleaveUV(const std::uint8_t* u, const std::uint8_t* v, std::uint8_t* dst, std::int32_t pairs) {
  InterleaveUVSse2(u, v, dst, pairs);
}

void CopyOpaque4(const std::uint8_t* src, std::uint8_t* dst, std::int32_t pixels) {
  // Little-endian 32-bit lanes: the fourth byte of a pixel is the top byte.
  const __m128i alpha = _mm_set1_epi32(static_cast<int>(0xFF000000u));
  std::int32_t i = 0;
  for (; i + 4 <= pixels; i += 4) {
    const __m128i p = _mm_loadu_si128(reinterpret_cast<const __m128i*>(src + 4 * i));
    _mm_storeu_si128(reinterpret_cast<__m128i*>(dst + 4 * i), _mm_or_si128(p, alpha));
  }
  for (; i < pixels; ++i) {
    std::memcpy(dst + 4 * i, src + 4 * i, 3);
    dst[4 * i + 3] = 0xFF;
  }
}

#else

bool HaveSse2() { return false; }

void InterleaveUVSse2(const std::uint8_t* u, const std::uint8_t* v, std::uint8_t* dst,
                      std::int32_t pairs) {
  InterleaveUVScalar(u, v, dst, pairs);
}

void InterleaveUV(const std::uint8_t* u, const std::uint8_t* v, std::uint8_t* dst, std::int32_t pairs) {
  InterleaveUVScalar(u, v, dst, pairs);
}

void CopyOpaque4(const std::uint8_t* src, std::uint8_t* dst, std::int32_t pixels) {
  for (std::int32_t i = 0; i < pixels; ++i) {
    std::memcpy(dst + 4 * i, src + 4 * i, 3);
    dst[4 * i + 3] = 0xFF;
  }
}

#endif

void Widen3To4(const std::uint8_t* src, std::uint8_t* dst, std::int32_t pixels) {
  for (std::int32_t i = 0; i < pixels; ++i) {
    dst[4 * i] = src[3 * i];
    dst[4 * i + 1] = src[3 * i + 1];
    dst[4 * i + 2] = src[3 * i + 2];
    dst[4 * i + 3] = 0xFF;
  }
}

}  // namespace pm::pixel
