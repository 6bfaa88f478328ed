#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/ipc_test_support.h"
#include "Sorvik/ipc/packet.h"

namespace ko::ipc {
namespace {

using testing::headerOf;
using testing::LoopbackHost;

TEST(PacketHeaderTest, FieldsAreLittleEndianAtFixedOffsets) {
  PacketHeader header;
  header.total_length = 0x00010000;
  header.id = 0x03800001;
  header.type = 6;
  header.value = 0xA1B2C3D4;
  unsigned char bytes[16];
  encodePacketHeader(header, bytes);
  const unsigned char expected[16] = {0x00, 0x00, 0x01, 0x00, 0x01, 0x00, 0x80, 0x03,
                                      0x06, 0x00, 0x00, 0x00, 0xD4, 0xC3, 0xB2, 0xA1};
  EXPECT_EQ(0, memcmp(expected, bytes, 16));

  PacketHeader decoded;
  ASSERT_TRUE(decodePacketHeader(bytes, 16, &decoded));
  EXPECT_EQ(header.total_length, decoded.total_length);
  EXPECT_EQ(header.id, decoded.id);
  EXPECT_EQ(header.type, decoded.type);
  EXPECT_EQ(header.value, decoded.value);
  EXPECT_FALSE(decodePacketHeader(bytes, 15, &decoded));
  EXPECT_FALSE(decodePacketHeader(nullptr, 16, &decoded));
}

TEST(PacketSendTest, NothingIsSentWithoutATransport) {
  set_transport(testing::kIdBase, nullptr);
  EXPECT_FALSE(send(1, 0, 0, "x", 1));
}

TEST(PacketSendTest, StdinIsSplitIntoFullChunksWithoutAnEmptyTail) {
  LoopbackHost host;
  const uint32_t kId = 0x3800007;

  ASSERT_TRUE(send(kId, 0, 1, nullptr, 0));
  ASSERT_EQ(1u, host.sent().size());
  EXPECT_EQ(16u, host.sent()[0].size());
  EXPECT_EQ(16u, headerOf(host.sent()[0]).total_length);
  EXPECT_EQ(1u, headerOf(host.sent()[0]).value);

  // 65521 bytes: one full packet and one with a single byte.
  host.clearSent();
  std::string data(65521, '\0');
  for (size_t i = 0; i < data.size(); ++i) data[i] = static_cast<char>(i * 7);
  ASSERT_TRUE(send(kId, 0, 1, data.data(), data.size()));
  std::vector<std::string> sent = host.sent();
  ASSERT_EQ(2u, sent.size());
  EXPECT_EQ(65536u, sent[0].size());
  EXPECT_EQ(17u, sent[1].size());
  std::string joined;
  for (const std::string& packet : sent) {
    const PacketHeader header = headerOf(packet);
    EXPECT_EQ(packet.size(), header.total_length);
    EXPECT_EQ(kId, header.id);
    EXPECT_EQ(0u, header.type);
    EXPECT_EQ(1u, header.value);
    joined += packet.substr(16);
  }
  EXPECT_EQ(data, joined);

  // An exact multiple of the chunk payload ends with a full chunk.
  host.clearSent();
  std::string twoChunks(2 * 65520, 'z');
  ASSERT_TRUE(send(kId, 0, 0, twoChunks.data(), twoChunks.size()));
  sent = host.sent();
  ASSERT_EQ(2u, sent.size());
  EXPECT_EQ(65536u, sent[0].size());
  EXPECT_EQ(65536u, sent[1].size());
}

TEST(PacketSendTest, OversizedNonStdinPacketIsRefusedWhole) {
  LoopbackHost host;
  std::string payload(65521, 'a');
  EXPECT_FALSE(send(5, 6, 2, payload.data(), payload.size()));
  EXPECT_TRUE(host.sent().empty());
  payload.pop_back();
  EXPECT_TRUE(send(5, 6, 2, payload.data(), payload.size()));
  ASSERT_EQ(1u, host.sent().size());
  EXPECT_EQ(65536u, host.sent()[0].size());
}

TEST(PacketSendTest, RefusedChunkStopsTheSend) {
  LoopbackHost host;
  host.setAccept(false);
  std::string data(3 * 65520, 'q');
  EXPECT_FALSE(send(5, 0, 0, data.data(), data.size()));
  EXPECT_EQ(1u, host.sent().size());
}

}  // namespace
}  // namespace ko::ipc
