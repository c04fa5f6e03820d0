// GetContext in a process that exports the context, as the runner does: every
// module that asks finds the exported block.
#include <gtest/gtest.h>

#include "pm/runtime/context.h"
#include "pm/runtime/export.h"

namespace {
pm::Context g_exported;
int g_calls = 0;
}  // namespace

extern "C" PM_EXPORT pm::Context* QFProcessManagementGlobals() {
  ++g_calls;
  return &g_exported;
}

namespace {

TEST(ContextWithExport, IsTheExportedBlockMarkedFromHost) {
  pm::Context* context = pm::GetContext();
  EXPECT_EQ(context, &g_exported);
  EXPECT_TRUE(context->fromHost);
  EXPECT_EQ(pm::GetContext(), context);
  EXPECT_EQ(g_calls, 1);  // looked up once, then cached
}

}  // namespace
