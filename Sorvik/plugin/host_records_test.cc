#include "Sorvik/plugin/host_records.h"

#include <gtest/gtest.h>

#include <vector>

namespace ko::core {
namespace {

int32_t someCallback(void*, uint64_t) { return 0; }

TEST(HostRecordsTest, LoadParmsAreReadAndWrittenAtTheirOffsetsOnly) {
  std::vector<unsigned char> in(64, 0xEE);
  writePointer(in.data() + 16, reinterpret_cast<const void*>(&someCallback));
  EXPECT_EQ(readHostCallback(in.data()), &someCallback);

  std::vector<unsigned char> out(64, 0xAB);
  writeLoadParmsOut(out.data());
  EXPECT_EQ(readU32(out.data() + 8), 0x380000u);
  EXPECT_EQ(readU32(out.data() + 20), 0x2000010u);
  EXPECT_EQ(out[52], 1);
  EXPECT_EQ(out[55], 1);
  for (size_t i = 0; i < out.size(); ++i) {
    const bool written = (i >= 8 && i < 12) || (i >= 20 && i < 24) || i == 52 || i == 55;
    if (!written) {
      EXPECT_EQ(out[i], 0xAB) << "byte " << i << " must stay as the host left it";
    }
  }
}

TEST(HostRecordsTest, IoctlAndWriteRecordsAreLittleEndian) {
  const char payload[] = "doc";
  std::vector<unsigned char> ioctl(48, 0x55);
  writeU32(ioctl.data() + 8, 0x04030201);
  writeU32(ioctl.data() + 24, 3);
  writePointer(ioctl.data() + 32, payload);
  EXPECT_EQ(ioctl[8], 0x01);
  EXPECT_EQ(ioctl[11], 0x04);
  IoctlRequest r = readIoctlRecord(ioctl.data());
  EXPECT_EQ(r.code, 0x04030201u);
  EXPECT_EQ(r.length, 3u);
  EXPECT_EQ(static_cast<const void*>(r.data), payload);

  std::vector<unsigned char> write(40, 0x55);
  writeU32(write.data() + 16, 9);
  writePointer(write.data() + 24, payload);
  WriteRequest w = readWriteRecord(write.data());
  EXPECT_EQ(w.length, 9u);
  EXPECT_EQ(static_cast<const void*>(w.data), payload);
  EXPECT_EQ(readIoctlRecord(nullptr).data, nullptr);
}

TEST(HostRecordsTest, HostMessageFields) {
  const char text[] = "abc";
  HostMessage m = HostMessage::make(0x380000, 8192, 0, text, 0x1'0000'0003ull);
  EXPECT_EQ(m.size(), 192u);
  EXPECT_EQ(m.version(), 1u);
  EXPECT_EQ(m.length(), 3u) << "the count is truncated to 32 bits";
  EXPECT_EQ(m.data(), text);
  EXPECT_EQ(m.source(), 0x380000u);
  EXPECT_EQ(m.target(), 8192u);
  EXPECT_EQ(m.bytes[32], 0x00);
  EXPECT_EQ(m.bytes[33], 0x20);
  for (size_t i = 40; i < kHostMessageSize; ++i) ASSERT_EQ(m.bytes[i], 0);
}

}  // namespace
}  // namespace ko::core
