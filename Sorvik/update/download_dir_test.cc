#include "Sorvik/update/download_dir.h"

#include <gtest/gtest.h>

#include <boost/filesystem.hpp>

#include "Sorvik/platform/platform.h"
#include "Sorvik/update/update_test_env.h"

namespace sorvik {
namespace {

namespace fs = boost::filesystem;

using DownloadDirTest = testing::UpdateStepTest;

TEST_F(DownloadDirTest, ProtectsRootsTheCurrentDirectoryAndItsAncestors) {
  fs::create_symlink(dir(), dir() / "downloads" / "link");
  for (const std::string& path : {std::string("."), std::string(), dir().string() + "/", dir().parent_path().string(),
                                  std::string("/"), std::string("downloads/.."), (dir() / "downloads/link").string()}) {
    EXPECT_TRUE(isProtectedDirectory(path)) << path;
  }
  for (const std::string& path : {std::string("downloads"), (dir() / "downloads").string(), std::string("missing")}) {
    EXPECT_FALSE(isProtectedDirectory(path)) << path;
  }
}

TEST(JoinBundlePathTest, AddsASeparatorOnlyWhenMissing) {
  const std::string sep = platform::pathSeparator();
  EXPECT_EQ(joinBundlePath("d", "f.zip"), "d" + sep + "f.zip");
  EXPECT_EQ(joinBundlePath("d" + sep, "f.zip"), "d" + sep + "f.zip");
}

}  // namespace
}  // namespace sorvik
