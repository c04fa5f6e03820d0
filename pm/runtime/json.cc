#include "pm/runtime/json.h"

#include <cmath>
#include <cstdlib>
#include <sstream>

#include "pm/runtime/log.h"

namespace pmjson {

namespace {
constexpr int kQuoteBytes = 200;  // of a refused text quoted in a log line
}  // namespace

bool NestsWithinLimit(std::string_view text) {
  std::size_t depth = 0;
  bool inString = false;
  for (std::size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (inString) {
      if (c == '\\') {
        ++i;  // the escaped character, a quote or a backslash included
      } else if (c == '"') {
        inString = false;
      }
    } else if (c == '"') {
      inString = true;
    } else if (c == '[' || c == '{') {
      if (++depth > kMaxNestingDepth) return false;
    } else if ((c == ']' || c == '}') && depth > 0) {
      --depth;
    }
  }
  return true;
}

Json ParseUntrusted(std::string_view text, bool* tooDeep) {
  const bool deep = !NestsWithinLimit(text);
  if (tooDeep != nullptr) *tooDeep = deep;
  if (deep) return Json(Json::value_t::discarded);
  return Json::parse(text.begin(), text.end(), nullptr, /*allow_exceptions=*/false);
}

Json Parse(const std::string& text, const char* label) {
  if (text.empty()) return nullptr;
  bool tooDeep = false;
  Json result = ParseUntrusted(text, &tooDeep);
  if (tooDeep) {
    // The text may be half a megabyte of brackets: its start says enough.
    pm::Log(pm::LogType::Normal, "", "pmjson::Parse failed: %s nests deeper than %zu levels '%.*s'\n",
            label ? label : "", kMaxNestingDepth, kQuoteBytes, text.c_str());
    return nullptr;
  }
  if (result.is_discarded()) {
    pm::Log(pm::LogType::Normal, "", "pmjson::Parse failed: %s '%s'\n", label ? label : "",
            text.c_str());
    return nullptr;
  }
  return result;
}

bool AsBool(const Json& v) {
  switch (v.type()) {
    case Json::value_t::string: {
      const auto& s = v.get_ref<const std::string&>();
      return s == "1" || s == "yes" || s == "Yes" || s == "YES" || s == "true" || s == "True" ||
             s == "TRUE";
    }
    case Json::value_t::number_integer:
      return v.get<std::int64_t>() != 0;
    case Json::value_t::number_unsigned:
      return v.get<std::uint64_t>() != 0;
    case Json::value_t::number_float: {
      const double d = v.get<double>();
      return std::isnan(d) || d != 0.0;
    }
    case Json::value_t::boolean:
      return v.get<bool>();
    default:
      return false;
  }
}

std::int64_t AsInteger(const Json& v) {
  switch (v.type()) {
    case Json::value_t::string:
      // strtoll reads like atoll but clamps out-of-range values instead of
      // leaving them undefined.
      return std::strtoll(v.get_ref<const std::string&>().c_str(), nullptr, 10);
    case Json::value_t::number_integer:
      return v.get<std::int64_t>();
    case Json::value_t::number_unsigned:
      return static_cast<std::int64_t>(v.get<std::uint64_t>());
    case Json::value_t::number_float: {
      // Truncate toward zero; values outside the range (and NaN) have no
      // integer reading and give 0 instead of undefined behaviour.
      const double d = v.get<double>();
      if (!(d > -9223372036854775808.0 && d < 9223372036854775808.0)) return 0;
      return static_cast<std::int64_t>(d);
    }
    case Json::value_t::boolean:
      return v.get<bool>() ? 1 : 0;
    default:
      return 0;
  }
}

double AsDouble(const Json& v) {
  switch (v.type()) {
    case Json::value_t::string:
      return std::strtod(v.get_ref<const std::string&>().c_str(), nullptr);
    case Json::value_t::number_integer:
      return static_cast<double>(v.get<std::int64_t>());
    case Json::value_t::number_unsigned:
      return static_cast<double>(v.get<std::uint64_t>());
    case Json::value_t::number_float:
      return v.get<double>();
    case Json::value_t::boolean:
      return v.get<bool>() ? 1.0 : 0.0;
    default:
      return 0.0;
  }
}

std::string AsString(const Json& v) {
  switch (v.type()) {
    case Json::value_t::string:
      return v.get<std::string>();
    case Json::value_t::number_integer:
      return std::to_string(v.get<std::int64_t>());
    case Json::value_t::number_unsigned:
      return std::to_string(v.get<std::uint64_t>());
    case Json::value_t::number_float: {
      std::ostringstream out;
      out << v.get<double>();
      return out.str();
    }
    case Json::value_t::boolean:
      return v.get<bool>() ? "1" : "0";
    default:
      return {};
  }
}

namespace {
const Json* Field(const Json& object, const std::string& key) {
  if (!object.is_object()) return nullptr;
  auto it = object.find(key);
  return it == object.end() ? nullptr : &*it;
}
}  // namespace

std::string FieldAsString(const Json& object, const std::string& key, const std::string& def) {
  const Json* f = Field(object, key);
  return f ? AsString(*f) : def;
}

std::int64_t FieldAsInteger(const Json& object, const std::string& key, std::int64_t def) {
  const Json* f = Field(object, key);
  return f ? AsInteger(*f) : def;
}

double FieldAsDouble(const Json& object, const std::string& key, double def) {
  const Json* f = Field(object, key);
  return f ? AsDouble(*f) : def;
}

std::string Dump(const Json& value) {
  return value.dump(-1, ' ', false, Json::error_handler_t::replace);
}

}  // namespace pmjson
