// Where pm-host finds the runner, the module and the sender: in an installed
// tree and in a build tree, laid out as files in a temporary folder.
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
  std::string programFolder;       // where pm-host lies, relative to the tree
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
  const std::string folder = tree + "/" + c.programFolder + "/";
  const auto found = [&](Companion companion) {
    const std::string path = pmhost::LocateIn(companion, folder);
    return path.empty() ? path : fs::relative(path, tree).string();
  };
  EXPECT_EQ(found(Companion::Runner), c.runner);
  EXPECT_EQ(found(Companion::Module), c.module);
  EXPECT_EQ(found(Companion::Sender), c.sender);
  fs::remove_all(tree);
}

const std::vector<std::string> kInstalled{"bin/pm-host", "bin/pm-runner", "bin/ndi-testsrc",
                                          "lib/pm-ndisource/libtaskndisource.so"};
const std::vector<std::string> kBuilt{"pm-host/pm-host", "pm-runner/pm-runner", "ndi-testsrc/ndi-testsrc",
                                      "lib/libtaskndisource.so"};

// An installed tree with what a build tree would have beside bin/.
std::vector<std::string> Both() {
  std::vector<std::string> files = kInstalled;
  for (const char* f : {"pm-runner/pm-runner", "ndi-testsrc/ndi-testsrc", "lib/libtaskndisource.so"}) {
    files.push_back(f);
  }
  return files;
}

void PrintTo(const Layout& layout, std::ostream* os) { *os << layout.name; }

INSTANTIATE_TEST_SUITE_P(
    Layouts, Locate,
    ::testing::Values(
        Layout{"Installed", kInstalled, "bin", "bin/pm-runner", "lib/pm-ndisource/libtaskndisource.so",
               "bin/ndi-testsrc"},
        Layout{"BuildTree", kBuilt, "pm-host", "pm-runner/pm-runner", "lib/libtaskndisource.so",
               "ndi-testsrc/ndi-testsrc"},
        // An installed tree wins over build-tree leftovers beside it.
        Layout{"InstalledFirst", Both(), "bin", "bin/pm-runner", "lib/pm-ndisource/libtaskndisource.so",
               "bin/ndi-testsrc"},
        // A folder is not a program.
        Layout{"FoldersAreNotFiles", {"bin/pm-runner/x", "lib/pm-ndisource/libtaskndisource.so/x"}, "bin", "", "",
               ""},
        Layout{"Nothing", {"bin/pm-host"}, "bin", "", "", ""}),
    [](const ::testing::TestParamInfo<Layout>& info) { return std::string(info.param.name); });

}  // namespace
