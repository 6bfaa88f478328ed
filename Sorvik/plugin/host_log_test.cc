#include "Sorvik/plugin/host_log.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace ko::core {
namespace {

struct Sent {
  HostMessage message;
  std::string payload;
};

// Callbacks are plain function pointers, so the capture lives in a global.
struct Capture {
  int32_t threshold = 0;
  int queries = 0;
  std::vector<Sent> lines;
} capture;

int32_t recordingCallback(void* raw, uint64_t reserved) {
  EXPECT_EQ(reserved, 0u);
  HostMessage m = copyHostMessage(raw);
  if (m.type() == kTypeLogLevelQuery) {
    ++capture.queries;
    EXPECT_EQ(m.length(), 0u);
    EXPECT_EQ(m.data(), nullptr);
    return capture.threshold;
  }
  capture.lines.push_back({m, std::string(static_cast<const char*>(m.data()), m.length())});
  return 7;
}

class HostLogTest : public ::testing::Test {
 protected:
  void SetUp() override { capture = Capture{}; }
};

TEST_F(HostLogTest, ThresholdIsAskedForEveryLineAndFiltersBelowIt) {
  capture.threshold = 26;
  for (int level : {0, 25, 50, 75, 100}) hostLog(kModuleId, recordingCallback, level, "line %d", level);
  EXPECT_EQ(capture.queries, 5);
  ASSERT_EQ(capture.lines.size(), 3u);
  EXPECT_EQ(capture.lines[0].payload, "line 50");
  EXPECT_EQ(capture.lines[2].payload, "line 100");

  capture = Capture{};
  capture.threshold = -5;
  EXPECT_EQ(hostLog(kModuleId, recordingCallback, 0, "x"), 7);
  EXPECT_EQ(capture.lines.size(), 1u);
}

TEST_F(HostLogTest, LogLineRecordLayout) {
  hostLog(0x380000, recordingCallback, 75, "Invalid platform type (%s)", "x86");
  ASSERT_EQ(capture.lines.size(), 1u);
  const HostMessage& m = capture.lines[0].message;
  EXPECT_EQ(m.size(), 192u);
  EXPECT_EQ(m.version(), 1u);
  EXPECT_EQ(m.source(), 0x380000u);
  EXPECT_EQ(m.target(), 64u);
  EXPECT_EQ(m.type(), 0x1000002u);
  EXPECT_EQ(readU32(m.bytes + 40), 152u);
  EXPECT_EQ(readU32(m.bytes + 44), 1u);
  EXPECT_EQ(m.logLevel(), 75);
  EXPECT_EQ(capture.lines[0].payload, "Invalid platform type (x86)");
  for (size_t i : {12, 28}) EXPECT_EQ(readU32(m.bytes + i), 0u) << i;
  for (size_t i = 52; i < kHostMessageSize; ++i) ASSERT_EQ(m.bytes[i], 0) << i;
}

TEST_F(HostLogTest, LengthRulesAroundTheBuffer) {
  const std::string len2047(2047, 'a'), len2048(2048, 'b'), len3000(3000, 'c');

  for (int level : {0, 25}) {
    capture.lines.clear();
    hostLog(kModuleId, recordingCallback, level, "%s", len2047.c_str());
    ASSERT_EQ(capture.lines.size(), 1u);
    EXPECT_EQ(capture.lines[0].payload, len2047);
  }

  // Cut lines carry the stored text and its terminating NUL.
  capture.lines.clear();
  hostLog(kModuleId, recordingCallback, 25, "%s", len3000.c_str());
  ASSERT_EQ(capture.lines.size(), 1u);
  EXPECT_EQ(capture.lines[0].payload, std::string(2047, 'c') + '\0');

  capture.lines.clear();
  hostLog(kModuleId, recordingCallback, 0, "%s", len2048.c_str());
  ASSERT_EQ(capture.lines.size(), 1u);
  EXPECT_EQ(capture.lines[0].payload, std::string(2047, 'b') + '\0');

  // Level-0 diagnostics travel whole.
  capture.lines.clear();
  hostLog(kModuleId, recordingCallback, 0, "%s", len3000.c_str());
  ASSERT_EQ(capture.lines.size(), 1u);
  EXPECT_EQ(capture.lines[0].payload, len3000);
}

TEST_F(HostLogTest, NothingIsSentForEmptyTextOrMissingCallback) {
  EXPECT_EQ(hostLog(kModuleId, recordingCallback, 50, "%s", ""), 0);
  EXPECT_EQ(capture.queries, 1);
  EXPECT_TRUE(capture.lines.empty());
  EXPECT_EQ(hostLog(kModuleId, nullptr, 50, "text"), 0);
}

}  // namespace
}  // namespace ko::core
