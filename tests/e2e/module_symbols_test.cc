// The task module exports pmTask_Factory and nothing else of ours: every other
// defined dynamic symbol must be one the linker or the C/C++ runtime adds.
#include <gtest/gtest.h>

#include <cstdio>
#include <set>
#include <sstream>
#include <string>

namespace {

TEST(TaskModule, ExportsOnlyTheFactory) {
  // What the linker, and the sanitizer and unwinder runtimes, may put into a
  // shared object: these names, and names that begin with one of the "__"
  // ones and an underscore.
  const std::set<std::string> added = {"_init",  "_fini",  "_edata",      "_end",   "__bss_start", "__asan", "__ubsan",
                                       "__tsan", "__lsan", "__sanitizer", "__gcov", "__cxa",       "__gxx"};
  // One line per symbol: name, type, value, size.
  const std::string command = std::string("nm -D --defined-only -P '") + PM_MODULE_PATH + "' 2>&1";
  FILE* pipe = ::popen(command.c_str(), "r");
  ASSERT_NE(pipe, nullptr);
  std::string output;
  char buffer[4096];
  for (std::size_t n; (n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0;) output.append(buffer, n);
  ASSERT_EQ(::pclose(pipe), 0) << output;

  std::istringstream lines(output);
  std::string factoryType;
  for (std::string name, type, rest; lines >> name >> type && std::getline(lines, rest);) {
    if (name == "pmTask_Factory") {
      factoryType = type;
    } else {
      EXPECT_TRUE(added.count(name) + added.count(name.substr(0, name.find('_', 2))) > 0)
          << "exported: " << name << " " << type;
    }
  }
  EXPECT_EQ(factoryType, "T") << output;
}

}  // namespace
