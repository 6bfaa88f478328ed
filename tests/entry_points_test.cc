// Drives the built plug-in library through its exported entry points, the
// way a host does: dlopen, then Load/Open/IOCTL/Write/Close/Unload.

#include <dlfcn.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <future>
#include <set>
#include <string>
#include <thread>

#include "host/fake_host.h"
#include "Sorvik/plugin/host_records.h"

namespace {

using sorvik::testing::FakeHost;
using namespace std::chrono_literals;

using EntryWithArgs = int32_t (*)(void*, void*);
using EntryOneArg = int32_t (*)(void*);
using EntryNoArgs = int32_t (*)();

struct Plugin {
  void* handle = nullptr;
  EntryWithArgs Load = nullptr;
  EntryNoArgs Open = nullptr;
  EntryOneArg IOCTL = nullptr;
  EntryOneArg Write = nullptr;
  EntryNoArgs Close = nullptr;
  EntryNoArgs Unload = nullptr;
};

Plugin openPlugin() {
  Plugin p;
  p.handle = dlopen(SORVIK_PLUGIN_PATH, RTLD_NOW | RTLD_LOCAL);
  EXPECT_NE(p.handle, nullptr) << dlerror();
  p.Load = reinterpret_cast<EntryWithArgs>(dlsym(p.handle, "Load"));
  p.Open = reinterpret_cast<EntryNoArgs>(dlsym(p.handle, "Open"));
  p.IOCTL = reinterpret_cast<EntryOneArg>(dlsym(p.handle, "IOCTL"));
  p.Write = reinterpret_cast<EntryOneArg>(dlsym(p.handle, "Write"));
  p.Close = reinterpret_cast<EntryNoArgs>(dlsym(p.handle, "Close"));
  p.Unload = reinterpret_cast<EntryNoArgs>(dlsym(p.handle, "Unload"));
  return p;
}

std::vector<unsigned char> ioctlRecord(uint32_t code, const void* data, uint32_t length) {
  std::vector<unsigned char> r(48, 0);
  ko::core::writeU32(r.data() + 8, code);
  ko::core::writeU32(r.data() + 24, length);
  ko::core::writePointer(r.data() + 32, data);
  return r;
}

std::vector<unsigned char> writeRecord(const void* data, uint32_t length) {
  std::vector<unsigned char> r(32, 0);
  ko::core::writeU32(r.data() + 16, length);
  ko::core::writePointer(r.data() + 24, data);
  return r;
}

class EntryPointsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    // Close stops agents by name; this run's name matches no real agent.
    ::setenv("SORVIK_AGENT_IMAGE_NAME", ("kelp-entry-test-" + std::to_string(::getpid())).c_str(), 1);
    dir_ = std::filesystem::temp_directory_path() /
           ("sorvik-entry-" + std::to_string(::getpid()) + "-" +
            ::testing::UnitTest::GetInstance()->current_test_info()->name());
    std::filesystem::create_directories(dir_);
    previous_ = std::filesystem::current_path();
    std::filesystem::current_path(dir_);
    plugin_ = openPlugin();
    host_.setSink(FakeHost::ioctlSink(plugin_.IOCTL));
  }
  void TearDown() override {
    if (plugin_.handle != nullptr) dlclose(plugin_.handle);
    std::filesystem::current_path(previous_);
    std::filesystem::remove_all(dir_);
  }

  void load() {
    parmsIn_ = FakeHost::loadParmsIn();
    parmsOut_.assign(64, 0xCD);
    EXPECT_EQ(plugin_.Load(parmsIn_.data(), parmsOut_.data()), 0);
  }

  std::filesystem::path dir_, previous_;
  FakeHost host_;
  Plugin plugin_;
  std::vector<unsigned char> parmsIn_, parmsOut_;
};

TEST(ExportsTest, ExactlyTheSixEntryPointsAreExported) {
  FILE* nm = popen("nm -D --defined-only " SORVIK_PLUGIN_PATH, "r");
  ASSERT_NE(nm, nullptr);
  std::set<std::string> names;
  char line[512];
  while (fgets(line, sizeof line, nm) != nullptr) {
    char address[64], type[8], name[400];
    if (sscanf(line, "%63s %7s %399s", address, type, name) == 3) names.insert(name);
  }
  ASSERT_EQ(pclose(nm), 0);
  EXPECT_EQ(names, (std::set<std::string>{"Load", "Open", "IOCTL", "Write", "Close", "Unload"}));
}

TEST_F(EntryPointsTest, EveryEntryPointIsHarmlessBeforeLoadAndAfterUnload) {
  const char doc[] = "<Qora />";
  auto ioctl = ioctlRecord(2, doc, sizeof doc - 1);
  auto write = writeRecord(doc, sizeof doc - 1);
  for (int round = 0; round < 2; ++round) {
    EXPECT_EQ(plugin_.Unload(), 0);
    EXPECT_EQ(plugin_.IOCTL(ioctl.data()), 0);
    EXPECT_EQ(plugin_.Write(write.data()), 0);
    EXPECT_EQ(plugin_.Close(), 0);
    EXPECT_EQ(plugin_.IOCTL(nullptr), 0);
    EXPECT_EQ(plugin_.Write(nullptr), 0);
    if (round == 0) {
      load();
      plugin_.Close();
      plugin_.Unload();
      host_.clearRecords();
    }
  }
  EXPECT_TRUE(host_.logs().empty());
  EXPECT_TRUE(host_.documents().empty());
}

TEST_F(EntryPointsTest, LoadOpenAnnounceAndTheWorkerStopsOnClose) {
  load();
  EXPECT_EQ(ko::core::readU32(parmsOut_.data() + 8), 0x380000u);
  EXPECT_EQ(ko::core::readU32(parmsOut_.data() + 20), 0x2000010u);
  EXPECT_EQ(parmsOut_[52], 1);
  EXPECT_EQ(parmsOut_[55], 1);
  EXPECT_EQ(parmsOut_[0], 0xCD);
  EXPECT_EQ(parmsOut_[53], 0xCD);

  EXPECT_EQ(plugin_.Open(), 0);
  ASSERT_TRUE(host_.waitForDocument("<Modules>", 1s));
  EXPECT_EQ(host_.documents().front().text,
            "<?xml ?><Qora Delta=\"0\"><Modules><Module Name=\"Sorvik\" ID=\"3670016\" Version=\"" SORVIK_VERSION
            "\" /></Modules></Qora>");
  EXPECT_EQ(host_.documents().front().target, 256u);

  auto worker = ioctlRecord(1, nullptr, 0);
  auto done = std::async(std::launch::async, [&] { return plugin_.IOCTL(worker.data()); });
  ASSERT_TRUE(host_.waitForDocument("FailbackStatus", 10s)) << "worker did not start";

  // Unknown codes, missing data and short packets are ignored while it runs.
  const unsigned char shortPacket[8] = {8, 0, 0, 0, 1, 0, 128, 3};
  for (auto record : {ioctlRecord(0, nullptr, 0), ioctlRecord(5, nullptr, 0), ioctlRecord(2, nullptr, 40),
                      ioctlRecord(4, nullptr, 16), ioctlRecord(4, shortPacket, sizeof shortPacket)}) {
    EXPECT_EQ(plugin_.IOCTL(record.data()), 0);
  }
  auto nullWrite = writeRecord(nullptr, 10);
  EXPECT_EQ(plugin_.Write(nullWrite.data()), 0);

  EXPECT_EQ(plugin_.Close(), 0);
  ASSERT_EQ(done.wait_for(10s), std::future_status::ready) << "IOCTL 1 did not return after Close";
  EXPECT_EQ(done.get(), 0);
  EXPECT_EQ(plugin_.Unload(), 0);
  for (const auto& line : host_.logs()) EXPECT_NE(line.level, 100) << line.text;
}

TEST_F(EntryPointsTest, AReloadAfterCloseCanRunChildrenAgain) {
  for (int round = 0; round < 2; ++round) {
    host_.clearRecords();
    load();
    plugin_.Open();
    auto worker = ioctlRecord(1, nullptr, 0);
    auto done = std::async(std::launch::async, [&] { return plugin_.IOCTL(worker.data()); });
    ASSERT_TRUE(host_.waitForDocument("FailbackStatus", 10s));
    // An update request makes the worker start a download child.
    const std::string command =
        "<?xml ?><Qora><Update ID=\"3670016\" Location=\"http://127.0.0.1:9/b.zip\" Checksum=\"\" /></Qora>";
    auto write = writeRecord(command.data(), static_cast<uint32_t>(command.size()));
    plugin_.Write(write.data());
    EXPECT_TRUE(host_.waitForStart("./curl", 10s)) << "round " << round;
    plugin_.Close();
    ASSERT_EQ(done.wait_for(10s), std::future_status::ready);
    plugin_.Unload();
  }
}

}  // namespace
