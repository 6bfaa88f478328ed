#include "Sorvik/ipc/start_payload.h"

#include <gtest/gtest.h>

namespace ko::ipc {
namespace {

TEST(StartPayloadTest, LeadingTextsFollowFlagBits) {
  SpawnOptions options;
  options.args = {"./curl", "-f"};
  options.flags = 2;
  options.text_a = "ignored";
  EXPECT_EQ(std::string("./curl\0-f", 9), encodeStartPayload(options));

  options.flags = 12;
  options.text_a = "";
  EXPECT_EQ(std::string("\0./curl\0-f", 10), encodeStartPayload(options));

  options.flags = 8 | 16;
  options.text_a = "A";
  options.text_b = "BB";
  const std::string both = encodeStartPayload(options);
  EXPECT_EQ(std::string("A\0BB\0./curl\0-f", 14), both);

  SpawnOptions decoded;
  ASSERT_TRUE(decodeStartPayload(both, options.flags, &decoded));
  EXPECT_EQ(options.args, decoded.args);
  EXPECT_EQ("A", decoded.text_a);
  EXPECT_EQ("BB", decoded.text_b);

  // An empty last argument survives the round trip.
  options.flags = 2;
  options.args = {"prog", ""};
  ASSERT_TRUE(decodeStartPayload(encodeStartPayload(options), 2, &decoded));
  EXPECT_EQ(options.args, decoded.args);

  EXPECT_FALSE(decodeStartPayload("no-nul", 8, &decoded));
}

}  // namespace
}  // namespace ko::ipc
