// Kills a process that keeps saving the state file at random moments and
// checks that every load afterwards gives one of the two documents it
// alternates between, never a broken or missing one.

#include <signal.h>
#include <sys/prctl.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <random>
#include <string>
#include <thread>

#include <boost/filesystem.hpp>
#include <gtest/gtest.h>

#include "Sorvik/service/state_file.h"

namespace sorvik {
namespace {

constexpr int kKills = 520;

// Large enough that a kill can land in the middle of writing one.
TiXmlDocument makeDocument(char fill, size_t length) {
  TiXmlDocument doc;
  doc.LinkEndChild(new TiXmlDeclaration("", "", ""));
  auto* root = new TiXmlElement("Qora");
  doc.LinkEndChild(root);
  auto* update = new TiXmlElement("Update");
  update->SetAttribute("ID", 3670016);
  update->SetAttribute("DownloadDir", std::string(length, fill));
  root->LinkEndChild(update);
  return doc;
}

std::string downloadDirOf(const TiXmlDocument& doc) {
  const TiXmlElement* root = doc.RootElement();
  const TiXmlElement* update = root ? root->FirstChildElement("Update") : nullptr;
  const char* dir = update ? update->Attribute("DownloadDir") : nullptr;
  return dir ? dir : "";
}

[[noreturn]] void saveForever() {
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);  // never outlive the test
  TiXmlDocument a = makeDocument('a', 6000);
  TiXmlDocument b = makeDocument('b', 13000);
  for (long i = 0; i < 1000000; ++i) saveDocument(i % 2 == 0 ? b : a, "update.xml");
  ::_exit(0);
}

// Runs the test in a fresh directory and removes it however the test ends.
class ScratchDirectory {
 public:
  ScratchDirectory()
      : previous_(boost::filesystem::current_path()),
        dir_(boost::filesystem::temp_directory_path() / boost::filesystem::unique_path("sorvik-crash-%%%%-%%%%")) {
    boost::filesystem::create_directories(dir_);
    boost::filesystem::current_path(dir_);
  }
  ~ScratchDirectory() {
    boost::system::error_code ignored;
    boost::filesystem::current_path(previous_, ignored);
    boost::filesystem::remove_all(dir_, ignored);
  }

 private:
  const boost::filesystem::path previous_;
  const boost::filesystem::path dir_;
};

TEST(StateFileCrashTest, KilledSaverNeverLeavesBrokenState) {
  ScratchDirectory scratch;

  const std::string expectedA(6000, 'a');
  const std::string expectedB(13000, 'b');
  TiXmlDocument initial = makeDocument('a', 6000);
  ASSERT_TRUE(saveDocument(initial, "update.xml"));

  const unsigned seed = std::random_device{}();
  std::mt19937 random(seed);
  std::uniform_int_distribution<int> delayMicros(0, 3000);
  int sawA = 0;
  int sawB = 0;
  for (int kill = 0; kill < kKills; ++kill) {
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) saveForever();
    std::this_thread::sleep_for(std::chrono::microseconds(delayMicros(random)));
    ASSERT_EQ(::kill(child, SIGKILL), 0);
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);

    TiXmlDocument loaded;
    ASSERT_TRUE(loadDocument(loaded, "update.xml")) << "kill " << kill << ", seed " << seed;
    const std::string got = downloadDirOf(loaded);
    if (got == expectedA) {
      ++sawA;
    } else if (got == expectedB) {
      ++sawB;
    } else {
      FAIL() << "broken state after kill " << kill << " (" << got.size() << " bytes), seed " << seed;
    }
  }
  // Both documents must have been seen, or the kills never hit the saver's loop.
  EXPECT_GT(sawA, 0);
  EXPECT_GT(sawB, 0);
}

}  // namespace
}  // namespace sorvik
