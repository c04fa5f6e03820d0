// Identifiers and thread names. (UTF-8 decoding only validates thread names,
// which are literals; the one refusal that matters is below.) Short ids are
// the memory base of a queue's segment names: never a '/'.
#include <gtest/gtest.h>

#include <regex>
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
  const std::regex shortId("[A-Za-z0-9+_]{21}[AQgw]");
  const std::regex uuid("[0-9a-f]{8}-[0-9a-f]{4}-[0-9a-f]{4}-[0-9a-f]{4}-[0-9a-f]{12}");
  std::set<std::string> seen;
  for (int i = 0; i < 200; ++i) {
    const std::string a = pm::NewShortId(), b = pm::NewUuidString();
    EXPECT_TRUE(std::regex_match(a, shortId)) << a;
    EXPECT_TRUE(std::regex_match(b, uuid)) << b;
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
