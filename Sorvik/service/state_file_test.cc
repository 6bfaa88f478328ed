#include "Sorvik/service/state_file.h"

#include <atomic>
#include <cerrno>
#include <thread>

#include <gtest/gtest.h>

#include "Sorvik/platform/platform.h"
#include "Sorvik/service/service_test_support.h"

namespace sorvik {
namespace {

using testing::readFile;
using testing::writeFile;

constexpr char kOld[] = "<?xml ?>\n<Qora Delta=\"0\">\n    <Update ID=\"3670016\" Timeout=\"300\" />\n</Qora>\n";
constexpr char kNew[] = "<?xml ?>\n<Qora Delta=\"0\">\n    <Update ID=\"3670016\" Timeout=\"900\" />\n</Qora>\n";

std::string timeoutOf(const TiXmlDocument& doc) {
  const TiXmlElement* root = doc.RootElement();
  const TiXmlElement* update = root ? root->FirstChildElement("Update") : nullptr;
  const char* t = update ? update->Attribute("Timeout") : nullptr;
  return t ? t : "";
}

// Wraps the real platform and makes chosen operations fail.
class FaultyPlatform : public platform::Platform {
 public:
  FaultyPlatform() : real_(platform::native()) { previous_ = platform::setForTesting(this); }
  ~FaultyPlatform() override { platform::setForTesting(previous_); }

  std::string writeFileThrough(const std::string& path, const std::string& bytes) override {
    const int inside = ++writers_;
    if (inside > 1) overlapped = true;
    std::string result = writeError.empty() ? real_.writeFileThrough(path, bytes) : writeError;
    --writers_;
    return result;
  }
  int replaceFile(const std::string& from, const std::string& to) override {
    return renameError != 0 ? renameError : real_.replaceFile(from, to);
  }
  bool removeFile(const std::string& path) override {
    ++removals;
    return real_.removeFile(path);
  }
  bool findProcessesByName(const std::set<std::string>& names, std::vector<uint32_t>* ids) override {
    return real_.findProcessesByName(names, ids);
  }
  bool terminateProcess(uint32_t, uint32_t) override { return false; }
  std::string agentImageName() override { return real_.agentImageName(); }

  std::string writeError;
  int renameError = 0;
  std::atomic<int> removals{0};
  std::atomic<bool> overlapped{false};

 private:
  platform::Platform& real_;
  platform::Platform* previous_ = nullptr;
  std::atomic<int> writers_{0};
};

TiXmlDocument documentWithTimeout(const char* timeout) {
  TiXmlDocument doc;
  doc.Parse(("<?xml ?><Qora Delta=\"0\"><Update ID=\"3670016\" Timeout=\"" + std::string(timeout) +
             "\" /></Qora>").c_str());
  return doc;
}

TEST(StateFileTest, SaveWritesPrettyTextAndLoadReadsItBack) {
  testing::ScopedTempCwd cwd;
  TiXmlDocument doc = documentWithTimeout("900");
  ASSERT_TRUE(saveDocument(doc, "update.xml"));
  EXPECT_EQ(readFile("update.xml"), kNew);
  EXPECT_FALSE(boost::filesystem::exists("update.xml.pending"));

  TiXmlDocument loaded;
  ASSERT_TRUE(loadDocument(loaded, "update.xml"));
  EXPECT_EQ(timeoutOf(loaded), "900");

  TiXmlDocument missing;
  EXPECT_FALSE(loadDocument(missing, "absent.xml"));
  EXPECT_EQ(missing.ErrorId(), TiXmlBase::TIXML_ERROR_OPENING_FILE);
}

TEST(StateFileTest, CompletePendingFileIsPromotedAndPartialOneIgnored) {
  testing::ScopedTempCwd cwd;
  writeFile("update.xml", kOld);

  // Cut short at every length: the old document must survive each time.
  const std::string full = kNew;
  for (size_t cut = 0; cut < full.size() - 8; ++cut) {
    writeFile("update.xml.pending", full.substr(0, cut));
    TiXmlDocument doc;
    ASSERT_TRUE(loadDocument(doc, "update.xml")) << cut;
    EXPECT_EQ(timeoutOf(doc), "300") << "pending cut at " << cut;
    EXPECT_EQ(readFile("update.xml"), kOld);
  }

  writeFile("update.xml.pending", kNew);
  TiXmlDocument doc;
  ASSERT_TRUE(loadDocument(doc, "update.xml"));
  EXPECT_EQ(timeoutOf(doc), "900");
  EXPECT_EQ(readFile("update.xml"), kNew);
  EXPECT_FALSE(boost::filesystem::exists("update.xml.pending"));
}

TEST(StateFileTest, DeeplyNestedFileIsRefusedWithoutParsing) {
  testing::ScopedTempCwd cwd;
  std::string deep = "<?xml ?>";
  for (int i = 0; i < 100000; ++i) deep += "<a>";
  writeFile("update.xml", deep);
  TiXmlDocument doc;
  EXPECT_FALSE(loadDocument(doc, "update.xml"));
}

TEST(StateFileTest, FailedWriteRemovesPendingFileAndKeepsOldState) {
  testing::ScopedTempCwd cwd;
  writeFile("update.xml", kOld);
  FaultyPlatform faulty;
  for (const char* text : {"create error 13", "write error 28", "close error 5", "only wrote 3 of 91 bytes"}) {
    faulty.writeError = text;
    TiXmlDocument doc = documentWithTimeout("900");
    std::string error;
    EXPECT_FALSE(saveDocument(doc, "update.xml", &error));
    EXPECT_EQ(error, text);
    EXPECT_EQ(doc.ErrorId(), TiXmlBase::TIXML_ERROR_OPENING_FILE);
  }
  EXPECT_EQ(faulty.removals.load(), 4);
  EXPECT_EQ(readFile("update.xml"), kOld);
}

TEST(StateFileTest, FailedRenameNamesErrnoAndLeavesPendingFile) {
  testing::ScopedTempCwd cwd;
  writeFile("update.xml", kOld);
  FaultyPlatform faulty;
  faulty.renameError = EACCES;

  TiXmlDocument doc = documentWithTimeout("900");
  std::string error;
  EXPECT_FALSE(saveDocument(doc, "update.xml", &error));
  EXPECT_EQ(error, "Failed to rename .xml.pending to .xml file 13 - Permission denied");
  EXPECT_EQ(doc.ErrorId(), TiXmlBase::TIXML_ERROR_OPENING_FILE);
  EXPECT_EQ(readFile("update.xml.pending"), kNew);
  EXPECT_EQ(readFile("update.xml"), kOld);
}

TEST(StateFileTest, UncreatableFileReportsCreateError) {
  testing::ScopedTempCwd cwd;
  TiXmlDocument doc = documentWithTimeout("900");
  std::string error;
  EXPECT_FALSE(saveDocument(doc, "no-such-dir/update.xml", &error));
  // The system's own number for a missing directory (ENOENT here, 3 on Windows).
  const std::string prefix = "create error ";
  ASSERT_EQ(error.compare(0, prefix.size(), prefix), 0) << error;
  const std::string number = error.substr(prefix.size());
  EXPECT_TRUE(!number.empty() && number.find_first_not_of("0123456789") == std::string::npos) << error;
  EXPECT_NE(number, "0");
}

TEST(StateFileTest, ConcurrentSavesOfOnePathNeverOverlap) {
  testing::ScopedTempCwd cwd;
  FaultyPlatform faulty;
  auto saver = [](const char* timeout) {
    for (int i = 0; i < 40; ++i) {
      TiXmlDocument doc = documentWithTimeout(timeout);
      EXPECT_TRUE(saveDocument(doc, "update.xml"));
    }
  };
  std::thread a(saver, "300");
  std::thread b(saver, "900");
  a.join();
  b.join();
  EXPECT_FALSE(faulty.overlapped.load());
  const std::string last = readFile("update.xml");
  EXPECT_TRUE(last == kOld || last == kNew);
}

}  // namespace
}  // namespace sorvik
