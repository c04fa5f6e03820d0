#pragma once
// JSON text and lenient readers. Reading JSON never fails: Parse logs a bad
// text and yields null; the readers read any JSON value as bool, integer,
// double or string whatever its type.

#include <cstdint>
#include <string>

#include <nlohmann/json.hpp>

namespace pmjson {

using Json = nlohmann::json;

// Empty text gives null without a log line; a text that is not JSON logs
// "pmjson::Parse failed: <label> '<text>'" and gives null.
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
