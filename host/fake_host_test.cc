#include "host/fake_host.h"

#include <gtest/gtest.h>

#include <string>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/ipc_test_support.h"
#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/xml_envelope.h"

namespace sorvik::testing {
namespace {

using ko::ipc::ClientState;
using std::chrono::seconds;

TEST(FakeHostTest, RecordsLogsDocumentsAndAnswersThresholds) {
  ko::ipc::testing::Watchdog watchdog;
  FakeHost host;
  host.install();
  host.setThreshold(26);
  ko::core::log(25, "quiet %d", 1);
  ko::core::log(50, "loud %d", 2);
  ko::core::sendXmlToHost(4, std::string("<Qora />"));
  ASSERT_EQ(1u, host.logs().size());
  EXPECT_EQ(50, host.logs()[0].level);
  EXPECT_EQ("loud 2", host.logs()[0].text);
  EXPECT_TRUE(host.waitForLog("loud", seconds(1)));
  EXPECT_FALSE(host.waitForLog("quiet", std::chrono::milliseconds(1)));
  EXPECT_TRUE(host.waitForDocument("<Qora", seconds(1)));
  EXPECT_EQ(4u, host.documents()[0].target);
}

TEST(FakeHostTest, ScriptedChildrenRunFromTheRunnerThread) {
  ko::ipc::testing::Watchdog watchdog;
  FakeHost host;
  host.install();
  host.setScript("./curl", ChildScript::exitsOnStdinClose(0, "out\n", "50\r100\r"));
  host.setScript("missing", ChildScript::failsToStart(13));

  ko::ipc::SpawnOptions options;
  options.args = {"./curl", "-K", "-"};
  options.flags = 8;
  options.text_a = "dir";
  auto curl = ko::ipc::spawn(options);
  ASSERT_EQ(ClientState::Running, curl->state());
  StartRecord start;
  ASSERT_TRUE(host.waitForStart("./curl", seconds(1), &start));
  EXPECT_EQ(curl->id(), start.id);
  EXPECT_EQ(8u, start.flags);
  EXPECT_EQ("dir", start.text_a);
  EXPECT_EQ((std::vector<std::string>{"./curl", "-K", "-"}), start.args);

  curl->write("config\n", ko::ipc::kStdinClose);
  std::string piece;
  ASSERT_TRUE(curl->read_until(piece, 1, '\r'));
  EXPECT_EQ("50", piece);
  EXPECT_EQ(0, curl->wait());
  EXPECT_EQ("config\n", host.stdinOf(curl->id()));
  EXPECT_TRUE(host.stdinClosed(curl->id()));

  auto missing = ko::ipc::spawn({"missing"});
  EXPECT_EQ(ClientState::Failed, missing->state());
  EXPECT_EQ(13, missing->wait());
  EXPECT_EQ(ClientState::Failed, ko::ipc::spawn({"unscripted"})->state());
}

TEST(FakeHostTest, StdinHandlerAndTestDrivenExit) {
  ko::ipc::testing::Watchdog watchdog;
  FakeHost host;
  host.install();
  ChildScript agent = ChildScript::runsUntilTold();
  // Answers once, when the first line feed arrives, however the line is split.
  agent.onStdin = [](FakeHost& h, const StdinEvent& event) {
    const size_t firstLineFeed = event.all.find('\n');
    if (firstLineFeed != std::string::npos && firstLineFeed >= event.all.size() - event.chunk.size()) {
      h.sendOutput(event.id, 0, "40123\r\n");
    }
  };
  host.setScript("./kelp", agent);
  auto kelp = ko::ipc::spawn({"./kelp"});
  ASSERT_EQ(ClientState::Running, kelp->state());
  EXPECT_EQ(5000, kelp->value());
  ko::ipc::send(kelp->id(), 0, 0, "tok", 3);
  ko::ipc::send(kelp->id(), 0, 0, "en\nmore\n", 8);
  ko::ipc::send(kelp->id(), 0, 0, "again\n", 6);
  std::string line;
  ASSERT_TRUE(kelp->read_line(line, 0, 5000));
  EXPECT_EQ("40123", line);
  ASSERT_TRUE(host.waitIdle(seconds(5)));
  EXPECT_FALSE(kelp->read_line(line, 0, 0));
  EXPECT_EQ("token\nmore\nagain\n", host.stdinOf(kelp->id()));
  EXPECT_FALSE(host.stdinClosed(kelp->id()));

  host.exitChild(kelp->id(), 15);
  EXPECT_EQ(15, kelp->wait());
}

TEST(FakeHostTest, UnansweredStartEndsAtShutdown) {
  ko::ipc::testing::Watchdog watchdog;
  FakeHost host;
  host.install();
  host.setScript("scripts/update.ps1", ChildScript::neverAnswers());
  std::shared_ptr<ko::ipc::client> pending;
  std::thread spawner([&] { pending = ko::ipc::spawn({"scripts/update.ps1"}); });
  EXPECT_TRUE(host.waitForStart("scripts/update.ps1", seconds(5)));
  ko::ipc::shutdown(true);
  spawner.join();
  EXPECT_EQ(ClientState::Failed, pending->state());
}

int32_t gIoctlCode = 0;
std::string gIoctlData;

int32_t recordIoctl(void* record) {
  const ko::core::IoctlRequest request = ko::core::readIoctlRecord(record);
  gIoctlCode = static_cast<int32_t>(request.code);
  gIoctlData.assign(reinterpret_cast<const char*>(request.data), request.length);
  return 0;
}

TEST(FakeHostTest, IoctlSinkWrapsEachPacketInARecord) {
  FakeHost::Sink sink = FakeHost::ioctlSink(&recordIoctl);
  const std::string packet = ko::ipc::testing::makePacket(ko::ipc::PacketType::Exited, 0x3800009, 4);
  sink(reinterpret_cast<const unsigned char*>(packet.data()), packet.size());
  EXPECT_EQ(4, gIoctlCode);
  EXPECT_EQ(packet, gIoctlData);

  const std::vector<unsigned char> parms = FakeHost::loadParmsIn();
  EXPECT_EQ(&FakeHost::callback, ko::core::readHostCallback(parms.data()));
}

}  // namespace
}  // namespace sorvik::testing
