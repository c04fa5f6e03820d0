// Identifiers and thread names. (UTF-8 decoding only validates thread names,
// which are literals; the one refusal that matters is below.)
#include <gtest/gtest.h>

#include <set>
#include <stdexcept>
#include <thread>

#include "pm/runtime/ids.h"
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

// Fresh short ids are 22 characters of the URL alphabet (the last carries only
// the low 2 bits of the last byte), UUIDs canonical lower case; no two alike.
TEST(FreshIds, HaveTheirShapeAndDiffer) {
  const std::string alphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+_";
  std::set<std::string> seen;
  for (int i = 0; i < 200; ++i) {
    const std::string a = pm::NewShortId(), b = pm::NewUuidString();
    EXPECT_TRUE(a.size() == 22 && a.find_first_not_of(alphabet) == std::string::npos &&
                std::string("AQgw").find(a.back()) != std::string::npos) << a;
    std::string digits = b;
    for (std::size_t at : {8, 13, 18, 23}) digits[at] = b.at(at) == '-' ? '0' : 'X';
    EXPECT_TRUE(b.size() == 36 && digits.find_first_not_of("0123456789abcdef") == std::string::npos) << b;
    seen.insert({a, b});
  }
  EXPECT_EQ(seen.size(), 400u);
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
  EXPECT_THROW(pm::SetThreadName("bad\xC3"), std::range_error);
}

}  // namespace
