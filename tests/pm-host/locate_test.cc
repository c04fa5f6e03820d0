// Where pm-host finds the runner, the module and the sender in an installed
// tree, laid out as files in a temporary folder. (In a build tree: `pm-host
// demo` finds them there in cli_test.)
#include <gtest/gtest.h>

#include <stdlib.h>

#include <filesystem>
#include <fstream>

#include "pm-host/locate.h"

namespace {

namespace fs = std::filesystem;
using pmhost::Companion;

struct Layout {
  const char* name;
  std::vector<std::string> files;  // relative to the tree
  std::string runner, module, sender;  // expected, relative to the tree; "" none
};

class Locate : public ::testing::TestWithParam<Layout> {};

TEST_P(Locate, FindsEachCompanionWhereTheLayoutPutsIt) {
  const Layout& c = GetParam();
  std::string tree = ::testing::TempDir() + "pm-locate-XXXXXX";
  ASSERT_NE(::mkdtemp(tree.data()), nullptr);
  for (const std::string& file : c.files) {
    fs::create_directories(fs::path(tree + "/" + file).parent_path());
    std::ofstream(tree + "/" + file) << "x";
  }
  const std::string folder = tree + "/bin/";  // where pm-host lies
  const auto found = [&](Companion companion) {
    const std::string path = pmhost::LocateIn(companion, folder);
    return path.empty() ? path : fs::relative(path, tree).string();
  };
  EXPECT_EQ(std::vector<std::string>({found(Companion::Runner), found(Companion::Module), found(Companion::Sender)}),
            std::vector<std::string>({c.runner, c.module, c.sender}));
  fs::remove_all(tree);
}

const std::vector<std::string> kInstalled{"bin/pm-host", "bin/pm-runner", "bin/ndi-testsrc",
                                          "lib/pm-ndisource/libtaskndisource.so"};

INSTANTIATE_TEST_SUITE_P(
    Layouts, Locate,
    ::testing::Values(
        Layout{"Installed", kInstalled, "bin/pm-runner", "lib/pm-ndisource/libtaskndisource.so", "bin/ndi-testsrc"},
        // A folder is not a program.
        Layout{"FoldersAreNotFiles", {"bin/pm-runner/x", "lib/pm-ndisource/libtaskndisource.so/x"}, "", "", ""},
        Layout{"Nothing", {"bin/pm-host"}, "", "", ""}),
    [](const ::testing::TestParamInfo<Layout>& info) { return std::string(info.param.name); });

}  // namespace
