// pmjson::Parse and the lenient readers.
#include <gtest/gtest.h>

#include <cmath>

#include "pm/runtime/json.h"
#include "support/log_capture.h"

namespace {

using pmjson::Json;

// Text that is not JSON is null with one line naming the label and the text;
// empty text is null without a line. (Garbage of every kind is the fuzzer's.)
TEST(Parse, BadTextIsNullWithOneLineAndEmptyTextWithNone) {
  pmtest::LogCapture capture;
  EXPECT_TRUE(pmjson::Parse("", "label").is_null());
  EXPECT_TRUE(pmjson::Parse("{\"a\":", "validate_gui").is_null());
  EXPECT_TRUE(pmjson::Parse("\"\xC3\x28\"", "utf8").is_null());  // invalid UTF-8 in a string
  EXPECT_EQ(capture.Lines(), (std::vector<std::string>{"pmjson::Parse failed: validate_gui '{\"a\":'\n",
                                                       "pmjson::Parse failed: utf8 '\"\xC3\x28\"'\n"}));
}

// Nesting beyond the limit is refused before a value is built (copying or
// dumping one would recurse once per level); brackets inside strings, behind
// escaped quotes or after escaped backslashes, do not count.
TEST(Parse, NestingDeeperThanTheLimitIsRefusedWithOneLine) {
  constexpr std::size_t kLimit = pmjson::kMaxNestingDepth;
  const auto arrays = [](std::size_t depth, const std::string& inner) {
    return std::string(depth, '[') + inner + std::string(depth, ']');
  };
  const auto objects = [](std::size_t depth) {
    std::string text;
    for (std::size_t i = 0; i < depth; ++i) text += "{\"k\":";
    return text + "1" + std::string(depth, '}');
  };
  const std::string brackets(2 * kLimit, '[');
  const struct {
    const char* label;
    std::string text;
    bool parses;
  } cases[] = {
      {"arrays_at_limit", arrays(kLimit, "1"), true},
      {"arrays_over", arrays(kLimit + 1, "1"), false},
      {"objects_at_limit", objects(kLimit), true},
      {"objects_over", objects(kLimit + 1), false},
      {"mixed_over", "{\"a\":" + arrays(kLimit, "{}") + "}", false},
      {"brackets_in_string", arrays(kLimit, "\"" + brackets + "\""), true},
      {"escaped_quote", arrays(kLimit, "\"\\\"" + brackets + "\""), true},
      {"escaped_backslash_at_limit", arrays(kLimit - 1, "\"\\\\\",[1]"), true},
      {"escaped_backslash_over", arrays(kLimit, "\"\\\\\",[1]"), false},
      {"quarter_million", arrays(250000, "1"), false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.label);
    pmtest::LogCapture capture;
    const Json value = pmjson::Parse(c.text, c.label);
    EXPECT_EQ(value.is_null(), !c.parses);
    if (c.parses) {
      EXPECT_TRUE(capture.Lines().empty());
      EXPECT_EQ(pmjson::Dump(Json(value)).size(), c.text.size());  // copied and printed whole
    } else {
      ASSERT_EQ(capture.Count(std::string(c.label) + " nests deeper than 256 levels"), 1);
      EXPECT_LT(capture.Lines()[0].size(), 400u);  // not the whole text
    }
  }
}

// Names from the network need not be UTF-8.
TEST(Dump, PrintsTextThatIsNotUtf8) { EXPECT_NO_THROW(pmjson::Dump(Json(std::string("a\xFF")))); }

// Every type read leniently, as a field of an object too; a missing key or a
// value that is not an object gives the field's default.
TEST(LenientReaders, ReadEveryJsonType) {
  const struct {
    Json value;
    bool asBool;
    std::int64_t asInteger;
    double asDouble;
    std::string asString;
  } rows[] = {
      {"Yes", true, 0, 0.0, "Yes"},
      {"yes please", false, 0, 0.0, "yes please"},
      {"1", true, 1, 1.0, "1"},
      {"42abc", false, 42, 42.0, "42abc"},
      {" -7.5x", false, -7, -7.5, " -7.5x"},
      {"", false, 0, 0.0, ""},
      {12, true, 12, 12.0, "12"},
      {0, false, 0, 0.0, "0"},
      {18446744073709551615u, true, -1, 18446744073709551615.0, "18446744073709551615"},
      {2.9, true, 2, 2.9, "2.9"},
      {-2.9, true, -2, -2.9, "-2.9"},
      {0.5, true, 0, 0.5, "0.5"},
      {1234567.0, true, 1234567, 1234567.0, "1.23457e+06"},
      {1e300, true, 0, 1e300, "1e+300"},
      {"99999999999999999999999", false, INT64_MAX, 1e23, "99999999999999999999999"},
      {true, true, 1, 1.0, "1"},
      {nullptr, false, 0, 0.0, ""},
      {Json::array({1, 2}), false, 0, 0.0, ""},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.value.dump());
    EXPECT_EQ(pmjson::AsBool(row.value), row.asBool);
    EXPECT_EQ(pmjson::AsInteger(row.value), row.asInteger);
    EXPECT_DOUBLE_EQ(pmjson::AsDouble(row.value), row.asDouble);
    EXPECT_EQ(pmjson::AsString(row.value), row.asString);
    const Json object = {{"k", row.value}};
    EXPECT_EQ(pmjson::FieldAsString(object, "k", "d"), row.asString);
    EXPECT_EQ(pmjson::FieldAsInteger(object, "k", 7), row.asInteger);
    EXPECT_DOUBLE_EQ(pmjson::FieldAsDouble(object, "k", 0.5), row.asDouble);
    EXPECT_EQ(pmjson::FieldAsInteger(object, "x", 7) + pmjson::FieldAsInteger(row.value, "k", 7), 14);
  }
  EXPECT_EQ(pmjson::AsInteger(Json(std::nan(""))), 0);
  EXPECT_TRUE(pmjson::AsBool(Json(std::nan(""))));
}

}  // namespace
