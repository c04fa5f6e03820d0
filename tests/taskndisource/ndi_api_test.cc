// Loading the runtime table by name: every entry from a complete library (the
// loopback runtime). A library that is missing or lacks a symbol is the task
// factory's case, in tests/e2e, on the stand-in library built here.

#include <gtest/gtest.h>

#include <cstring>

#include "taskndisource/ndi_api.h"

namespace {

using TaskNDISource::LoadNdiApi;
using TaskNDISource::NdiApi;

TEST(LoadNdiApi, CompleteLibraryFillsEveryEntry) {
  NdiApi api;
  std::string missing;
  ASSERT_TRUE(LoadNdiApi(COMPLETE_RUNTIME_PATH, &api, &missing)) << missing;
  EXPECT_TRUE(missing.empty());
  // Every member of the table is a function pointer; none may stay null.
  static_assert(sizeof(NdiApi) % sizeof(void*) == 0);
  void* entries[sizeof(NdiApi) / sizeof(void*)];
  std::memcpy(entries, &api, sizeof api);
  for (std::size_t i = 0; i < sizeof(NdiApi) / sizeof(void*); ++i) EXPECT_NE(entries[i], nullptr) << i;
  EXPECT_STREQ(api.version(), "ndi-loopback 1.0");
}

}  // namespace
