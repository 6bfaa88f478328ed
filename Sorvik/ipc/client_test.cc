#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <string>
#include <vector>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/ipc_test_support.h"
#include "Sorvik/ipc/output_buffer.h"
#include "Sorvik/plugin/host_callback.h"
#include "Sorvik/plugin/module.h"

namespace ko::ipc {
namespace {

using testing::deliverNow;
using testing::headerOf;
using testing::LoopbackHost;
using testing::makePacket;
using testing::Watchdog;

class ClientTest : public ::testing::Test {
 protected:
  std::shared_ptr<client> start(const std::string& program, uint32_t flags = kSpawnPiped) {
    SpawnOptions options;
    options.args = {program};
    options.flags = flags;
    auto child = spawn(options);
    EXPECT_EQ(ClientState::Running, child->state());
    return child;
  }
  bool stdoutData(const client& c, const std::string& bytes) {
    return deliverNow(makePacket(PacketType::StdoutData, c.id(), 0, bytes));
  }
  bool stderrData(const client& c, const std::string& bytes) {
    return deliverNow(makePacket(PacketType::StderrData, c.id(), 0, bytes));
  }
  bool exited(const client& c, int32_t code) {
    return deliverNow(makePacket(PacketType::Exited, c.id(), static_cast<uint32_t>(code)));
  }
  std::vector<std::string> stdinPackets() {
    std::vector<std::string> found;
    for (const std::string& packet : host_.sent()) {
      if (headerOf(packet).type == 0) found.push_back(packet);
    }
    return found;
  }

  Watchdog watchdog_;
  LoopbackHost host_;
};

TEST_F(ClientTest, StdoutLosesCarriageReturnsStderrKeepsThem) {
  auto child = start("./kelp");
  ASSERT_TRUE(stdoutData(*child, "a\r\nb\r"));
  std::string line;
  ASSERT_TRUE(child->read_line(line, 0, 0));
  EXPECT_EQ("a", line);
  EXPECT_FALSE(child->read_line(line, 0, 0));  // "b" has no newline yet
  EXPECT_EQ("a", line);

  ASSERT_TRUE(stderrData(*child, "10\r20\r"));
  ASSERT_TRUE(stdoutData(*child, "10\r20\r"));
  std::string piece;
  ASSERT_TRUE(child->read_until(piece, 1, '\r'));
  EXPECT_EQ("10", piece);
  ASSERT_TRUE(child->read_until(piece, 1, '\r'));
  EXPECT_EQ("20", piece);

  // A CR before LF on stderr is cut from the line, others are kept.
  ASSERT_TRUE(stderrData(*child, "x\ry\r\n"));
  ASSERT_TRUE(child->read_line(line, 1, 0));
  EXPECT_EQ("x\ry", line);

  ASSERT_TRUE(exited(*child, 0));
  ASSERT_TRUE(child->read_line(line, 0, 0));
  EXPECT_EQ("b1020", line);
  EXPECT_FALSE(child->read_line(line, 0, 0));
  EXPECT_FALSE(child->read_until(piece, 1, '\r'));
  EXPECT_EQ("b1020", line);
  EXPECT_FALSE(child->read_line(line, 2, 0));
}

TEST_F(ClientTest, ReadUntilBlocksForTheDelimiterOrTheEnd) {
  auto child = start("./curl");
  host_.deliver(makePacket(PacketType::StderrData, child->id(), 0, " 5"));
  host_.deliver(makePacket(PacketType::StderrData, child->id(), 0, "0\rtail"));
  host_.deliver(makePacket(PacketType::Exited, child->id(), 0));
  std::string piece;
  ASSERT_TRUE(child->read_until(piece, 1, '\r'));
  EXPECT_EQ(" 50", piece);
  ASSERT_TRUE(child->read_until(piece, 1, '\r'));
  EXPECT_EQ("tail", piece);
  EXPECT_FALSE(child->read_until(piece, 1, '\r'));
}

TEST_F(ClientTest, DeadlinesAreKeptAndHugeOnesSaturate) {
  auto child = start("./kelp");
  std::string line = "untouched";
  EXPECT_FALSE(child->read_line(line, 0, 0));
  EXPECT_FALSE(child->read_line(line, 0, -5));
  EXPECT_FALSE(child->read_line(line, 0, 20));
  EXPECT_EQ("untouched", line);
  EXPECT_FALSE(child->wait_for(0));
  EXPECT_FALSE(child->wait_for(-1));

  host_.deliver(makePacket(PacketType::StdoutData, child->id(), 0, "4000"));
  host_.deliver(makePacket(PacketType::StdoutData, child->id(), 0, "1\n"));
  ASSERT_TRUE(child->read_line(line, 0, std::numeric_limits<int64_t>::max()));
  EXPECT_EQ("40001", line);

  // Output first, then the exit: wait_for returns on the exit, not the limit.
  host_.deliver(makePacket(PacketType::StdoutData, child->id(), 0, "more\n"));
  host_.deliver(makePacket(PacketType::Exited, child->id(), 9));
  EXPECT_TRUE(child->wait_for(std::numeric_limits<int64_t>::max()));
  EXPECT_EQ(9, child->wait());
  EXPECT_TRUE(child->wait_for(0));
}

TEST_F(ClientTest, ScriptStdinIsClosedOnFirstWaitOnly) {
  auto script = start("scripts/failover.ps1");
  EXPECT_TRUE(stdinPackets().empty());
  EXPECT_FALSE(script->wait_for(0));
  std::vector<std::string> stdinSent = stdinPackets();
  ASSERT_EQ(1u, stdinSent.size());
  EXPECT_EQ(16u, stdinSent[0].size());
  EXPECT_EQ(script->id(), headerOf(stdinSent[0]).id);
  EXPECT_EQ(kStdinClose, headerOf(stdinSent[0]).value);
  EXPECT_FALSE(script->wait_for(0));
  EXPECT_EQ(1u, stdinPackets().size());

  // An explicit close beforehand makes the wait send nothing more.
  host_.clearSent();
  auto written = start("scripts/update.ps1");
  written->write("data", kStdinClose);
  EXPECT_FALSE(written->wait_for(0));
  ASSERT_EQ(1u, stdinPackets().size());
  EXPECT_EQ(std::string("data"), stdinPackets()[0].substr(16));

  // Flag bit 2, other names and a bare suffix get no automatic close.
  host_.clearSent();
  for (auto child : {start("scripts/update.ps1", 12), start("scripts/update.PS1"), start(".ps1")}) {
    EXPECT_FALSE(child->wait_for(0));
  }
  EXPECT_TRUE(stdinPackets().empty());

  host_.deliver(makePacket(PacketType::Exited, script->id(), 3));
  EXPECT_EQ(3, script->wait());
  EXPECT_TRUE(stdinPackets().empty());
}

std::vector<std::string>* gLogLines = nullptr;

int32_t captureLogs(void* message, uint64_t) {
  const ko::core::HostMessage copy = ko::core::copyHostMessage(message);
  if (copy.type() == ko::core::kTypeLogLine && gLogLines != nullptr) {
    gLogLines->emplace_back(static_cast<const char*>(copy.data()), copy.length());
  }
  return 0;
}

TEST_F(ClientTest, UnreadOutputIsBoundedAndReportedOnce) {
  std::vector<std::string> lines;
  gLogLines = &lines;
  ko::core::setHostCallback(&captureLogs);
  auto child = start("./kelp");
  const size_t limit = OutputBuffer::kDefaultLimit;
  const std::string chunk(kMaxPacketPayload, 'o');
  size_t delivered = 0;
  while (delivered <= limit + kMaxPacketPayload) {
    ASSERT_TRUE(stdoutData(*child, chunk));
    delivered += chunk.size();
  }
  ASSERT_TRUE(stdoutData(*child, "\nlast\n"));
  ko::core::setHostCallback(nullptr);
  gLogLines = nullptr;
  ASSERT_EQ(1u, lines.size());
  EXPECT_NE(std::string::npos, lines[0].find("dropping the oldest"));

  std::string line;
  ASSERT_TRUE(child->read_line(line, 0, 0));
  EXPECT_EQ(limit - 6, line.size());
  ASSERT_TRUE(child->read_line(line, 0, 0));
  EXPECT_EQ("last", line);
}

}  // namespace
}  // namespace ko::ipc
