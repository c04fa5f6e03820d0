// The context's singleton registry. (The test log capture takes the context
// before main, so a first call racing here could not be seen. LoadFunction's
// one user, the Windows thread names, is tested under Wine in ids_text_test.)
#include <gtest/gtest.h>

#include "pm/runtime/context.h"

namespace {

struct Thing : pm::Context::SingletonBase {
  int value = 0;
};

TEST(ContextRegistry, CreatesOnceAndKeepsEmptyEntriesEmpty) {
  int created = 0;
  auto make = [&] {
    ++created;
    auto t = std::make_shared<Thing>();
    t->value = 9;
    return std::shared_ptr<pm::Context::SingletonBase>(t);
  };
  auto a = pm::FindSingleton("registry-test", make);
  auto b = pm::FindSingleton("registry-test", make);
  EXPECT_EQ(a, b);
  EXPECT_EQ(created, 1);
  EXPECT_EQ(std::dynamic_pointer_cast<Thing>(a)->value, 9);

  auto none = pm::FindSingleton("registry-empty", [] { return nullptr; });
  EXPECT_EQ(none, nullptr);
  EXPECT_EQ(pm::GetContext()->registry.count("registry-empty"), 1u);
}

}  // namespace
