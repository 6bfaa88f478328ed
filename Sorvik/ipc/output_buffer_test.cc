#include "Sorvik/ipc/output_buffer.h"

#include <gtest/gtest.h>

#include <string>

namespace ko::ipc {
namespace {

TEST(OutputBufferTest, CarriageReturnsAreDroppedOnlyFromNewBytesWhenAsked) {
  OutputBuffer out;
  out.append("a\r\nb\r", 5, true);
  EXPECT_EQ(3u, out.size());
  std::string piece;
  ASSERT_TRUE(out.takeUntil('\n', &piece));
  EXPECT_EQ("a", piece);

  OutputBuffer err;
  err.append("10\r20\r", 6, false);
  EXPECT_EQ(6u, err.size());
  ASSERT_TRUE(err.takeUntil('\r', &piece));
  EXPECT_EQ("10", piece);
  ASSERT_TRUE(err.takeUntil('\r', &piece));
  EXPECT_EQ("20", piece);
  EXPECT_TRUE(err.empty());
}

TEST(OutputBufferTest, PiecesSplitAcrossAppendsAndDelimiterChanges) {
  OutputBuffer buffer;
  std::string piece = "unchanged";
  buffer.append("ab", 2, false);
  EXPECT_FALSE(buffer.takeUntil('\n', &piece));
  EXPECT_EQ("unchanged", piece);
  buffer.append("c\rd", 3, false);
  // The earlier search for LF must not hide a CR it passed over.
  ASSERT_TRUE(buffer.takeUntil('\r', &piece));
  EXPECT_EQ("abc", piece);
  buffer.append("e\nf", 3, false);
  ASSERT_TRUE(buffer.takeUntil('\n', &piece));
  EXPECT_EQ("de", piece);
  buffer.takeAll(&piece);
  EXPECT_EQ("f", piece);
  EXPECT_TRUE(buffer.empty());
}

TEST(OutputBufferTest, ManyLinesSurviveCompaction) {
  OutputBuffer buffer;
  std::string chunk;
  for (int i = 0; i < 2000; ++i) chunk += "line " + std::to_string(i) + "\n";
  std::string piece;
  int expected = 0;
  for (int round = 0; round < 20; ++round) {
    buffer.append(chunk.data(), chunk.size(), true);
    while (buffer.takeUntil('\n', &piece)) {
      ASSERT_EQ("line " + std::to_string(expected % 2000), piece);
      ++expected;
    }
  }
  EXPECT_EQ(40000, expected);
  EXPECT_TRUE(buffer.empty());
}

TEST(OutputBufferTest, OldestBytesAreDroppedBeyondTheLimit) {
  OutputBuffer buffer(10);
  EXPECT_EQ(0u, buffer.append("0123456", 7, false));
  EXPECT_EQ(3u, buffer.append("789abc", 6, false));
  EXPECT_EQ(10u, buffer.size());
  std::string all;
  buffer.takeAll(&all);
  EXPECT_EQ("3456789abc", all);

  // One append larger than the limit keeps its newest bytes.
  EXPECT_EQ(5u, buffer.append("ABCDEFGHIJKLMNO", 15, false));
  buffer.takeAll(&all);
  EXPECT_EQ("FGHIJKLMNO", all);

  // A line whose start was dropped comes out truncated, not corrupted.
  buffer.append("xxxxxxxx", 8, false);
  std::string piece;
  EXPECT_FALSE(buffer.takeUntil('\n', &piece));
  buffer.append("yy\nz", 4, false);
  ASSERT_TRUE(buffer.takeUntil('\n', &piece));
  EXPECT_EQ("xxxxxxyy", piece);
}

}  // namespace
}  // namespace ko::ipc
