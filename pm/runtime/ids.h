#pragma once
// Identifiers: random UUIDs as canonical text and a compact 22-character form.
#include <cstdint>
#include <string>

namespace pm {

// A fresh random UUID as 36 characters of lower-case hex in 8-4-4-4-12 groups,
// or the empty string on failure (logged).
std::string NewUuidString();

// A fresh UUID in the 22-character compact form (EncodeShortId).
std::string NewShortId();

// The 22-character form of 16 bytes: base64 over five 3-byte groups with '_'
// in place of '/', then two characters for the last byte; no fill characters.
std::string EncodeShortId(const std::uint8_t (&bytes)[16]);

}  // namespace pm
