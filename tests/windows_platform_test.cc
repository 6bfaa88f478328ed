// The Win32 side of the platform seam against the real system: durable
// saves with their error texts and numbers, and process lookup and
// termination of real child processes.

#include <windows.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <algorithm>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include <tinyxml.h>

#include "Sorvik/platform/platform.h"
#include "Sorvik/platform/windows/win32_errno.h"
#include "Sorvik/service/state_file.h"
#include "tests/windows_test_process.h"

namespace {

namespace fs = std::filesystem;
using sorvik::platform::native;

std::string readFile(const fs::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream out;
  out << in.rdbuf();
  return out.str();
}

void writeFile(const fs::path& path, const std::string& text) {
  std::ofstream(path, std::ios::binary) << text;
}

// An open handle on `path` that shares reading and writing but not deletion,
// as an editor or a virus scanner may hold it.
class HeldOpen {
 public:
  explicit HeldOpen(const fs::path& path)
      : h_(::CreateFileA(path.string().c_str(), GENERIC_READ, FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr,
                         OPEN_EXISTING, FILE_ATTRIBUTE_NORMAL, nullptr)) {}
  ~HeldOpen() {
    if (ok()) ::CloseHandle(h_);
  }
  bool ok() const { return h_ != INVALID_HANDLE_VALUE; }

 private:
  HANDLE h_;
};

class WindowsPlatformTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = fs::temp_directory_path() / ("sorvik-win-" + std::to_string(::GetCurrentProcessId()) + "-" +
                                        ::testing::UnitTest::GetInstance()->current_test_info()->name());
    fs::remove_all(dir_);
    fs::create_directories(dir_);
  }
  void TearDown() override {
    std::error_code ignored;
    fs::remove_all(dir_, ignored);
  }
  std::string at(const std::string& name) const { return (dir_ / name).string(); }

  fs::path dir_;
};

TEST_F(WindowsPlatformTest, WriteThroughCreatesAndTruncatesAndReportsCreateErrors) {
  auto& os = native();
  EXPECT_EQ(os.writeFileThrough(at("a.xml"), "a much longer first text\n"), "");
  EXPECT_EQ(os.writeFileThrough(at("a.xml"), "short\n"), "");
  EXPECT_EQ(readFile(at("a.xml")), "short\n");
  EXPECT_EQ(os.writeFileThrough(at("empty.xml"), ""), "");
  EXPECT_TRUE(fs::exists(at("empty.xml")));

  EXPECT_EQ(os.writeFileThrough(at("missing\\a.xml"), "x"), "create error 3");  // ERROR_PATH_NOT_FOUND
  {
    HeldOpen reader(at("a.xml"));
    ASSERT_TRUE(reader.ok());
    EXPECT_EQ(os.writeFileThrough(at("a.xml"), "x"), "create error 32");  // ERROR_SHARING_VIOLATION
  }
  EXPECT_EQ(readFile(at("a.xml")), "short\n");
  EXPECT_TRUE(os.removeFile(at("a.xml")));
  EXPECT_FALSE(os.removeFile(at("a.xml")));
}

TEST_F(WindowsPlatformTest, ReplaceFileReturnsCRuntimeErrorNumbers) {
  auto& os = native();
  writeFile(at("new"), "new");
  writeFile(at("old"), "old");
  EXPECT_EQ(os.replaceFile(at("new"), at("old")), 0);
  EXPECT_EQ(readFile(at("old")), "new");
  EXPECT_FALSE(fs::exists(at("new")));

  EXPECT_EQ(os.replaceFile(at("new"), at("old")), ENOENT);
  writeFile(at("new"), "newer");
  {
    HeldOpen reader(at("old"));
    ASSERT_TRUE(reader.ok());
    EXPECT_EQ(os.replaceFile(at("new"), at("old")), EACCES);
  }
  EXPECT_EQ(readFile(at("new")), "newer");
  EXPECT_EQ(readFile(at("old")), "new");
}

TEST(Win32ErrnoTest, MapsLikeTheRuntimeAndNeverToZero) {
  using sorvik::platform::errnoFromWin32Error;
  EXPECT_EQ(errnoFromWin32Error(ERROR_FILE_NOT_FOUND), ENOENT);
  EXPECT_EQ(errnoFromWin32Error(ERROR_PATH_NOT_FOUND), ENOENT);
  EXPECT_EQ(errnoFromWin32Error(ERROR_ACCESS_DENIED), EACCES);
  EXPECT_EQ(errnoFromWin32Error(ERROR_SHARING_VIOLATION), EACCES);
  EXPECT_EQ(errnoFromWin32Error(ERROR_NOT_SAME_DEVICE), EXDEV);
  EXPECT_EQ(errnoFromWin32Error(ERROR_DISK_FULL), ENOSPC);
  EXPECT_EQ(errnoFromWin32Error(ERROR_WRITE_PROTECT), EROFS);
  for (uint32_t unknown : {0u, 1234u, 0xFFFFFFFFu}) EXPECT_EQ(errnoFromWin32Error(unknown), EIO) << unknown;
}

// The state file's atomic save on top of the seam: a destination held open
// without delete sharing makes the rename fail with the runtime's text, the
// pending file stays, and the next load promotes it.
TEST_F(WindowsPlatformTest, StateFileSaveSurvivesAHeldDestination) {
  const std::string path = at("update.xml");
  TiXmlDocument first;
  first.Parse("<Qora Delta=\"0\"><Update ID=\"3670016\" Timeout=\"600\" /></Qora>");
  ASSERT_FALSE(first.Error());
  ASSERT_TRUE(sorvik::saveDocument(first, path));
  EXPECT_EQ(readFile(path),
            "<Qora Delta=\"0\">\n    <Update ID=\"3670016\" Timeout=\"600\" />\n</Qora>\n");

  TiXmlDocument second;
  second.Parse("<Qora Delta=\"0\"><Update ID=\"3670016\" Timeout=\"900\" /></Qora>");
  std::string error;
  {
    HeldOpen reader(path);
    ASSERT_TRUE(reader.ok());
    EXPECT_FALSE(sorvik::saveDocument(second, path, &error));
  }
  EXPECT_EQ(error, "Failed to rename .xml.pending to .xml file 13 - Permission denied");
  EXPECT_EQ(second.ErrorId(), TiXmlBase::TIXML_ERROR_OPENING_FILE);
  EXPECT_TRUE(fs::exists(path + ".pending"));

  TiXmlDocument loaded;
  ASSERT_TRUE(sorvik::loadDocument(loaded, path));
  EXPECT_STREQ(loaded.RootElement()->FirstChildElement("Update")->Attribute("Timeout"), "900");
  EXPECT_FALSE(fs::exists(path + ".pending"));
  EXPECT_NE(readFile(path).find("Timeout=\"900\""), std::string::npos);

  // A directory in the way of the pending file: the create fails, nothing is left behind.
  fs::create_directories(path + ".pending");
  EXPECT_FALSE(sorvik::saveDocument(second, path, &error));
  EXPECT_EQ(error.rfind("create error ", 0), 0u) << error;
}

TEST(WindowsNamesTest, PlatformNames) {
  const char* override = std::getenv("SORVIK_AGENT_IMAGE_NAME");
  const std::string saved = override != nullptr ? override : "";
  ::_putenv_s("SORVIK_AGENT_IMAGE_NAME", "");
  EXPECT_EQ(native().agentImageName(), "kelp.exe");
  ::_putenv_s("SORVIK_AGENT_IMAGE_NAME", "kelp-of-this-run.exe");
  EXPECT_EQ(native().agentImageName(), "kelp-of-this-run.exe");
  ::_putenv_s("SORVIK_AGENT_IMAGE_NAME", saved.c_str());
  EXPECT_STREQ(sorvik::platform::packageTypeName(), "windows-x64");
  EXPECT_STREQ(sorvik::platform::pathSeparator(), "\\");
}

fs::path besideThisExecutable(const char* name) {
  char self[MAX_PATH];
  const DWORD n = ::GetModuleFileNameA(nullptr, self, sizeof self);
  return fs::path(std::string(self, n)).parent_path() / name;
}

// A running copy of the test child under a chosen file name.
class Child : public sorvik::testing::OwnedProcess {
 public:
  Child(const fs::path& dir, const std::string& imageName)
      : sorvik::testing::OwnedProcess(copyOfTestChild(dir, imageName)) {}

 private:
  static fs::path copyOfTestChild(const fs::path& dir, const std::string& imageName) {
    fs::create_directories(dir);
    const fs::path image = dir / imageName;
    fs::copy_file(besideThisExecutable(SORVIK_TEST_CHILD), image, fs::copy_options::overwrite_existing);
    return image;
  }
};

bool contains(const std::vector<uint32_t>& ids, uint32_t id) {
  return std::find(ids.begin(), ids.end(), id) != ids.end();
}

TEST_F(WindowsPlatformTest, FindsProcessesByExactImageNameAndTerminatesWithACode) {
  auto& os = native();
  Child agent(dir_ / "a", "kelp.exe");
  Child otherCase(dir_ / "b", "Kelp.exe");
  Child other(dir_ / "c", "kelpx.exe");
  ASSERT_TRUE(agent.ok() && otherCase.ok() && other.ok());

  std::vector<uint32_t> ids;
  ASSERT_TRUE(os.findProcessesByName({"kelp.exe", "nothing-like-this.exe"}, &ids));
  EXPECT_TRUE(contains(ids, agent.pid()));
  EXPECT_FALSE(contains(ids, otherCase.pid()));
  EXPECT_FALSE(contains(ids, other.pid()));
  EXPECT_FALSE(contains(ids, ::GetCurrentProcessId()));

  std::vector<uint32_t> none;
  ASSERT_TRUE(os.findProcessesByName({}, &none));
  EXPECT_TRUE(none.empty());

  EXPECT_TRUE(os.terminateProcess(agent.pid(), 15));
  EXPECT_EQ(agent.exitCode(), 15);
  // A second termination does not change how it ended. (Windows refuses it;
  // Wine reports success.)
  os.terminateProcess(agent.pid(), 9);
  EXPECT_EQ(agent.exitCode(), 15);
  EXPECT_FALSE(os.terminateProcess(0, 15));

  EXPECT_TRUE(os.terminateProcess(otherCase.pid(), 9));
  EXPECT_EQ(otherCase.exitCode(), 9);
}

}  // namespace
