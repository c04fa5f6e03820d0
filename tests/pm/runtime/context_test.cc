// The context's singleton registry. (The test log capture takes the context
// before main, so a first call racing here could not be seen. LoadFunction's
// one user, the Windows thread names, is tested under Wine in ids_text_test.)
#include <gtest/gtest.h>

#include "pm/runtime/context.h"

namespace {

struct Thing : pm::Context::SingletonBase {};

TEST(ContextRegistry, CreatesOnceAndKeepsEmptyEntriesEmpty) {
  int created = 0;
  auto make = [&] {
    ++created;
    return std::make_shared<Thing>();
  };
  auto a = pm::FindSingleton("registry-test", make);
  EXPECT_EQ(pm::FindSingleton("registry-test", make), a);
  EXPECT_EQ(created, 1);
  EXPECT_TRUE(std::dynamic_pointer_cast<Thing>(a));

  auto none = pm::FindSingleton("registry-empty", [] { return nullptr; });
  EXPECT_EQ(none, nullptr);
  EXPECT_EQ(pm::GetContext()->registry.count("registry-empty"), 1u);
}

}  // namespace
