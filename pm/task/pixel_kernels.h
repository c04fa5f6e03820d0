#pragma once
// Row kernels of the picture conversions. Each touches exactly the bytes its
// counts name: no reads or writes past the last pixel of a row, so callers may
// pass rows of exact-size allocations.

#include <cstdint>

namespace pm::pixel {

// dst[2i] = u[i], dst[2i + 1] = v[i] for i < pairs. Dispatches to the SSE2
// kernel on x86-64 and to the scalar one elsewhere; both give the same bytes.
void InterleaveUV(const std::uint8_t* u, const std::uint8_t* v, std::uint8_t* dst, std::int32_t pairs);

// The plain byte loop; also the tail of the vector kernel.
void InterleaveUVScalar(const std::uint8_t* u, const std::uint8_t* v, std::uint8_t* dst,
                        std::int32_t pairs);

// True when InterleaveUVSse2 exists in this build.
bool HaveSse2();
// 8 pixel pairs (16 output bytes) per step, scalar tail. Exists only when
// HaveSse2(); elsewhere it is the scalar kernel.
void InterleaveUVSse2(const std::uint8_t* u, const std::uint8_t* v, std::uint8_t* dst,
                      std::int32_t pairs);

// 4-byte pixels copied with the fourth byte set to 0xFF.
void CopyOpaque4(const std::uint8_t* src, std::uint8_t* dst, std::int32_t pixels);
// 3-byte pixels b0 b1 b2 widened to b0 b1 b2 0xFF.
void Widen3To4(const std::uint8_t* src, std::uint8_t* dst, std::int32_t pixels);

}  // namespace pm::pixel
