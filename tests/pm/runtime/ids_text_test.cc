// Identifiers and thread names. (UTF-8 decoding only validates thread names,
// which are literals; the one refusal that matters is below.) Short ids are
// the memory base of a queue's segment names: never a '/'.
#include <gtest/gtest.h>

#include <set>
#include <stdexcept>
#include <thread>

#include "pm/runtime/ids.h"
#include "pm/runtime/thread_name.h"

namespace {

// pthread_setname_np takes 15 bytes; SetThreadDescription (loaded through
// LoadFunction) keeps whole names.
#if defined(_WIN32)
constexpr bool kThreadNamesCutTo15Bytes = false;
#else
constexpr bool kThreadNamesCutTo15Bytes = true;
#endif

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
  std::string accented, cleared;
  std::thread([&] {
    pm::SetThreadName("0123456789abcd\xC3\xA9");  // a cut to 15 bytes falls inside the last character
    accented = pm::CurrentThreadName();
    pm::ClearThreadName();
    cleared = pm::CurrentThreadName();
  }).join();
  EXPECT_EQ(accented, kThreadNamesCutTo15Bytes ? "0123456789abcd" : "0123456789abcd\xC3\xA9");
  EXPECT_EQ(cleared, "");
  EXPECT_THROW(pm::SetThreadName("bad\xC3"), std::range_error);
}

}  // namespace
