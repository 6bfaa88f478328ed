#include "Sorvik/ipc/registry.h"

#include <gtest/gtest.h>

#include <set>
#include <string>
#include <thread>
#include <vector>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/ipc_test_support.h"

namespace ko::ipc {
namespace {

using testing::deliverNow;
using testing::headerOf;
using testing::LoopbackHost;
using testing::makePacket;
using testing::Watchdog;

class RegistryTest : public ::testing::Test {
 protected:
  void SetUp() override { setLastIdForTesting(0); }
  Watchdog watchdog_;
  LoopbackHost host_;
};

TEST_F(RegistryTest, IdsCountUpWrapAndSkipIdsInUse) {
  auto first = spawn({"./curl", "-f"});
  auto second = spawn({"./curl"});
  EXPECT_EQ(0x3800001u, first->id());
  EXPECT_EQ(0x3800002u, second->id());
  EXPECT_EQ(ClientState::Running, first->state());
  EXPECT_EQ(4321, first->value());

  setLastIdForTesting(0x38FFFFE);
  auto top = spawn({"a"});
  EXPECT_EQ(0x38FFFFFu, top->id());
  auto wrapped = spawn({"b"});
  EXPECT_EQ(0x3800000u, wrapped->id());
  // 0x38FFFFF and 0x3800000..2 are still running: the next free id is 3.
  setLastIdForTesting(0x38FFFFE);
  auto skipped = spawn({"c"});
  EXPECT_EQ(0x3800003u, skipped->id());

  // An id is free again once its child has exited.
  ASSERT_TRUE(deliverNow(makePacket(PacketType::Exited, 0x38FFFFF, 0)));
  setLastIdForTesting(0x38FFFFE);
  EXPECT_EQ(0x38FFFFFu, spawn({"d"})->id());
}

TEST_F(RegistryTest, StartRequestCarriesFlagsAndPayload) {
  SpawnOptions options;
  options.args = {"scripts/update.ps1", "bundle.zip"};
  options.flags = 12;
  auto child = spawn(options);
  ASSERT_EQ(1u, host_.sent().size());
  const std::string packet = host_.sent()[0];
  const PacketHeader header = headerOf(packet);
  EXPECT_EQ(packet.size(), header.total_length);
  EXPECT_EQ(child->id(), header.id);
  EXPECT_EQ(6u, header.type);
  EXPECT_EQ(12u, header.value);
  EXPECT_EQ(std::string("\0scripts/update.ps1\0bundle.zip", 30), packet.substr(16));

  host_.clearSent();
  spawn({"./curl", "-s"}, "http://example.invalid/x");
  ASSERT_EQ(1u, host_.sent().size());
  EXPECT_EQ(2u, headerOf(host_.sent()[0]).value);
  EXPECT_EQ(std::string("./curl\0-s\0http://example.invalid/x", 34), host_.sent()[0].substr(16));
}

TEST_F(RegistryTest, RefusedStartsFailWithoutRegistering) {
  EXPECT_EQ(ClientState::Failed, spawn(std::vector<std::string>{})->state());
  EXPECT_TRUE(host_.sent().empty());

  host_.setAccept(false);
  auto refused = spawn({"./kelp"});
  EXPECT_EQ(ClientState::Failed, refused->state());
  EXPECT_EQ(0, refused->value());
  // Not registered: an answer for its id is dropped.
  EXPECT_FALSE(deliverNow(makePacket(PacketType::Started, refused->id(), 1)));

  host_.setAccept(true);
  host_.setStartAnswer(LoopbackHost::StartAnswer::StartFailed, 2);
  auto failed = spawn({"./kelp"});
  EXPECT_EQ(ClientState::Failed, failed->state());
  EXPECT_EQ(2, failed->wait());
  EXPECT_FALSE(deliverNow(makePacket(PacketType::Started, failed->id(), 1)));

  std::string huge(65521, 'x');
  EXPECT_EQ(ClientState::Failed, spawn({huge})->state());
}

TEST_F(RegistryTest, MalformedAndForeignDeliveriesAreIgnored) {
  auto child = spawn({"./kelp"});
  const uint32_t id = child->id();
  EXPECT_FALSE(receive(nullptr, 16));
  const std::string exited = makePacket(PacketType::Exited, id, 3);
  EXPECT_FALSE(receive(reinterpret_cast<const unsigned char*>(exited.data()), 15));
  EXPECT_FALSE(deliverNow(makePacket(PacketType::Exited, id + 100, 3)));
  EXPECT_FALSE(deliverNow(makePacket(static_cast<PacketType>(9), id, 3)));
  EXPECT_FALSE(deliverNow(makePacket(PacketType::StartRequest, id, 3)));
  EXPECT_EQ(ClientState::Running, child->state());

  // Payload length comes from the delivery, not the header.
  std::string out = makePacket(PacketType::StdoutData, id, 0, "hello\n");
  out[0] = 0x7F;
  EXPECT_TRUE(deliverNow(out));
  std::string line;
  ASSERT_TRUE(child->read_line(line, 0, 0));
  EXPECT_EQ("hello", line);

  EXPECT_TRUE(deliverNow(exited));
  EXPECT_EQ(3, child->wait());
  EXPECT_FALSE(deliverNow(makePacket(PacketType::Started, id, 1)));
  EXPECT_EQ(ClientState::Exited, child->state());
}

TEST_F(RegistryTest, ExitedWithoutStartedEndsTheSpawn) {
  host_.setStartAnswer(LoopbackHost::StartAnswer::Exited, 7);
  auto child = spawn({"./curl"});
  EXPECT_EQ(ClientState::Exited, child->state());
  EXPECT_EQ(7, child->wait());
}

TEST_F(RegistryTest, ShutdownEndsRunningAndPendingChildren) {
  auto running = spawn({"./kelp"});
  ASSERT_EQ(ClientState::Running, running->state());

  host_.setStartAnswer(LoopbackHost::StartAnswer::None);
  std::shared_ptr<client> pending;
  std::thread spawner([&] { pending = spawn({"./curl"}); });
  EXPECT_TRUE(host_.waitSent(2));
  std::thread reader([&] {
    std::string piece;
    EXPECT_FALSE(running->read_until(piece, 1, '\r'));
  });

  shutdown(true);
  spawner.join();
  reader.join();
  EXPECT_EQ(ClientState::Failed, pending->state());
  EXPECT_EQ(0, pending->value());
  EXPECT_EQ(ClientState::Exited, running->state());
  EXPECT_EQ(0, running->wait());
  EXPECT_FALSE(deliverNow(makePacket(PacketType::Exited, running->id(), 1)));

  // Closed: later spawns fail without sending anything.
  host_.setStartAnswer(LoopbackHost::StartAnswer::Started);
  host_.clearSent();
  auto late = spawn({"./kelp"});
  EXPECT_EQ(ClientState::Failed, late->state());
  EXPECT_EQ(0, late->wait());
  EXPECT_TRUE(host_.sent().empty());

  // Reopened for the next case.
  shutdown(false);
  EXPECT_EQ(ClientState::Running, spawn({"./kelp"})->state());
}

TEST_F(RegistryTest, ConcurrentSpawnsAndDeliveriesStayConsistent) {
  constexpr int kThreads = 4;
  constexpr int kChildrenEach = 50;
  std::vector<std::thread> threads;
  std::vector<std::vector<uint32_t>> ids(kThreads);
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([this, t, &ids] {
      for (int i = 0; i < kChildrenEach; ++i) {
        auto child = spawn({"./kelp"});
        ASSERT_EQ(ClientState::Running, child->state());
        ids[t].push_back(child->id());
        host_.deliver(makePacket(PacketType::StdoutData, child->id(), 0, "port " + std::to_string(i) + "\n"));
        host_.deliver(makePacket(PacketType::Exited, child->id(), static_cast<uint32_t>(i)));
        std::string line;
        ASSERT_TRUE(child->read_line(line, 0, 60000));
        EXPECT_EQ("port " + std::to_string(i), line);
        EXPECT_EQ(i, child->wait());
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  std::set<uint32_t> distinct;
  for (const auto& list : ids) distinct.insert(list.begin(), list.end());
  EXPECT_EQ(static_cast<size_t>(kThreads * kChildrenEach), distinct.size());
}

}  // namespace
}  // namespace ko::ipc
