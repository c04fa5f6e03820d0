// Identifiers, UTF-8 decoding and thread names.
#include <gtest/gtest.h>

#include <cctype>
#include <set>
#include <stdexcept>
#include <thread>

#include "pm/runtime/ids.h"
#include "pm/runtime/text.h"
#include "pm/runtime/thread_name.h"
#include "support/platform.h"

namespace {

TEST(ShortId, EncodesTheReferenceVectors) {
  std::uint8_t zeros[16] = {};
  EXPECT_EQ(pm::EncodeShortId(zeros), std::string(22, 'A'));
  std::uint8_t ones[16];
  std::fill(std::begin(ones), std::end(ones), 0xFF);
  EXPECT_EQ(pm::EncodeShortId(ones), std::string(21, '_') + "w");
  std::uint8_t counting[16];
  for (int i = 0; i < 16; ++i) counting[i] = static_cast<std::uint8_t>(i * 17);
  // 00 11 22 -> AB Ei; the last byte 0xFF -> "_w".
  const std::string text = pm::EncodeShortId(counting);
  EXPECT_EQ(text.substr(0, 4), "ABEi");
  EXPECT_EQ(text.substr(20), "_w");
}

bool ShortIdShape(const std::string& id) {
  if (id.size() != 22) return false;
  for (char c : id.substr(0, 21)) {
    if (!std::isalnum(static_cast<unsigned char>(c)) && c != '+' && c != '_') return false;
  }
  // The last character carries only the low 2 bits of the last byte.
  return std::string("AQgw").find(id[21]) != std::string::npos;
}

TEST(ShortId, FreshIdsAre22CharactersOfTheAlphabetAndDiffer) {
  std::set<std::string> seen;
  for (int i = 0; i < 200; ++i) {
    const std::string id = pm::NewShortId();
    EXPECT_TRUE(ShortIdShape(id)) << id;
    seen.insert(id);
  }
  EXPECT_EQ(seen.size(), 200u);
}

TEST(UuidString, HasTheCanonicalLowerCaseShape) {
  const std::string a = pm::NewUuidString();
  const std::string b = pm::NewUuidString();
  ASSERT_EQ(a.size(), 36u);
  for (std::size_t i = 0; i < a.size(); ++i) {
    if (i == 8 || i == 13 || i == 18 || i == 23) {
      EXPECT_EQ(a[i], '-') << a;
    } else {
      EXPECT_TRUE(std::isxdigit(static_cast<unsigned char>(a[i])) && !std::isupper(static_cast<unsigned char>(a[i]))) << a;
    }
  }
  EXPECT_NE(a, b);
}

TEST(Utf8ToUtf16, DecodesAsciiBmpAndAstralCharacters) {
  EXPECT_EQ(pm::Utf8ToUtf16(""), u"");
  EXPECT_EQ(pm::Utf8ToUtf16("Cam 1"), u"Cam 1");
  EXPECT_EQ(pm::Utf8ToUtf16("\xC3\xA9\xE2\x82\xAC"), u"\u00E9\u20AC");
  EXPECT_EQ(pm::Utf8ToUtf16("\xF0\x9F\x8E\xA5"), u"\U0001F3A5");
  EXPECT_EQ(pm::Utf8ToUtf16("\xF0\x9F\x8E\xA5").size(), 2u);  // a surrogate pair
  EXPECT_EQ(pm::Utf8ToUtf16("\xF4\x8F\xBF\xBF"), u"\U0010FFFF");
}

TEST(Utf8ToUtf16, RefusesEveryInvalidForm) {
  const char* invalid[] = {
      "\x80",              // stray continuation
      "\xC3",              // truncated
      "\xE2\x82",          // truncated
      "\xC3\x28",          // bad continuation
      "\xC0\xAF",          // overlong '/'
      "\xE0\x80\xAF",      // overlong
      "\xF0\x80\x80\xAF",  // overlong
      "\xED\xA0\x80",      // surrogate U+D800
      "\xED\xBF\xBF",      // surrogate U+DFFF
      "\xF4\x90\x80\x80",  // above U+10FFFF
      "\xF8\x88\x80\x80\x80",
      "\xFF",
  };
  for (const char* text : invalid) {
    try {
      pm::Utf8ToUtf16(text);
      ADD_FAILURE() << "accepted invalid UTF-8";
    } catch (const std::range_error& e) {
      EXPECT_STREQ(e.what(), "bad conversion");
    }
  }
}

TEST(ThreadName, IsSetCutWhereTheSystemCutsAndCleared) {
  std::string seen, cleared, accented;
  std::thread([&] {
    pm::SetThreadName("pm::Ipc Listener");
    seen = pm::CurrentThreadName();
    pm::SetThreadName("0123456789abcd\xC3\xA9");  // the cut falls inside the last character
    accented = pm::CurrentThreadName();
    pm::ClearThreadName();
    cleared = pm::CurrentThreadName();
  }).join();
  if (pmtest::kThreadNamesCutTo15Bytes) {
    EXPECT_EQ(seen, "pm::Ipc Listene");
    EXPECT_EQ(accented, "0123456789abcd");
  } else {
    EXPECT_EQ(seen, "pm::Ipc Listener");
    EXPECT_EQ(accented, "0123456789abcd\xC3\xA9");
  }
  EXPECT_EQ(cleared, "");
}

TEST(ThreadName, InvalidUtf8PropagatesTheRangeError) {
  EXPECT_THROW(pm::SetThreadName("bad\xC3"), std::range_error);
}

}  // namespace
