#pragma once
// JSON text and lenient readers. Reading JSON never fails: Parse logs a bad
// text and yields null; the readers read any JSON value as bool, integer,
// double or string whatever its type.
//
// Nesting: the library parses without recursing, but copying and dumping a
// value recurse once per level of arrays and objects, so a text of a few
// hundred kilobytes nested a quarter of a million levels deep would end the
// process on its stack. Every text that comes from another process is read
// through ParseUntrusted (Parse does), which refuses nesting deeper than
// kMaxNestingDepth before any value is built.

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include <nlohmann/json.hpp>

namespace pmjson {

using Json = nlohmann::json;

// Deepest nesting of arrays and objects taken from a text: far beyond what
// any message, configuration or settings panel needs, far below what the
// stack holds.
inline constexpr std::size_t kMaxNestingDepth = 256;

// True when no array or object in `text` lies deeper than kMaxNestingDepth
// levels ("[[1]]" is 2 deep). One pass over the text; brackets inside strings
// (with their escapes) do not count. Says nothing about the text being JSON.
bool NestsWithinLimit(std::string_view text);

// Parses a text from outside the process without throwing: a discarded value
// when the text is not JSON or nests deeper than kMaxNestingDepth (then
// *tooDeep, when given, is set; it is cleared otherwise).
Json ParseUntrusted(std::string_view text, bool* tooDeep = nullptr);

// Empty text gives null without a log line; a text that is not JSON logs
// "pmjson::Parse failed: <label> '<text>'" and gives null; so does a text
// nested too deep, with a line that says so and quotes its start.
Json Parse(const std::string& text, const char* label);

bool AsBool(const Json& value);
std::int64_t AsInteger(const Json& value);
double AsDouble(const Json& value);
std::string AsString(const Json& value);

// The lenient reading of object[key], or the default when `object` is not an
// object or lacks the key.
std::string FieldAsString(const Json& object, const std::string& key, const std::string& def);
std::int64_t FieldAsInteger(const Json& object, const std::string& key, std::int64_t def);
double FieldAsDouble(const Json& object, const std::string& key, double def);

// Compact text: the library's plain dump (no whitespace). Invalid UTF-8 in
// strings is replaced rather than thrown on, so a dump never fails.
std::string Dump(const Json& value);

}  // namespace pmjson
