#include <tinyxml.h>

#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "host/sorvik_host_display.h"
#include "host/sorvik_host_documents.h"
#include "host/sorvik_host_events.h"
#include "host/sorvik_host_script.h"

namespace sorvik::host {
namespace {

using Clock = std::chrono::steady_clock;

const TiXmlElement* updateOf(TiXmlDocument* doc, const std::string& text) {
  doc->Clear();
  doc->Parse(text.c_str());
  if (doc->Error() || doc->RootElement() == nullptr) return nullptr;
  EXPECT_STREQ(doc->RootElement()->Value(), "Qora");
  return doc->RootElement()->FirstChildElement("Update");
}

Event log(const std::string& text) {
  Event e;
  e.kind = EventKind::Log;
  e.text = text;
  return e;
}

TEST(HostDocumentsTest, ShorthandsBuildTheDocumentsThePlugInReads) {
  TiXmlDocument doc;
  const TiXmlElement* u = updateOf(&doc, updateRequestDocument("https://h/x?a=1&b=\"2\"", "abc"));
  ASSERT_NE(u, nullptr);
  EXPECT_STREQ(u->Attribute("ID"), "3670016");
  EXPECT_STREQ(u->Attribute("Location"), "https://h/x?a=1&b=\"2\"");
  EXPECT_STREQ(u->Attribute("Checksum"), "abc");

  u = updateOf(&doc, agentStartDocument(1700000000, 1700003600, "t<k", "7066"));
  ASSERT_NE(u, nullptr);
  EXPECT_STREQ(u->Attribute("FailbackAgentRun"), "1");
  EXPECT_STREQ(u->Attribute("FailoverStart"), "1700000000");
  EXPECT_STREQ(u->Attribute("FailoverEnd"), "1700003600");
  EXPECT_STREQ(u->Attribute("PasswordToken"), "t<k");
  EXPECT_STREQ(u->Attribute("Port"), "7066");
  EXPECT_EQ(u->Attribute("SpareReset"), nullptr);

  u = updateOf(&doc, agentResetDocument(1, 2, ""));
  ASSERT_NE(u, nullptr);
  EXPECT_STREQ(u->Attribute("SpareReset"), "1");
  EXPECT_EQ(u->Attribute("PasswordToken"), nullptr);
  u = updateOf(&doc, agentStopDocument());
  ASSERT_NE(u, nullptr);
  EXPECT_STREQ(u->Attribute("FailbackAgentRun"), "0");

  int32_t state = 0;
  ASSERT_TRUE(parseFailoverState("RESERVE_SPARE", &state));
  u = updateOf(&doc, failoverStateDocument(state));
  ASSERT_NE(u, nullptr);
  EXPECT_STREQ(u->Attribute("FailoverState"), "105");
  EXPECT_FALSE(parseFailoverState("SPARE", &state));

  doc.Clear();
  doc.Parse(storageDrivesDocument({"C:\\", "/srv/rec"}).c_str());
  const TiXmlElement* storage = doc.RootElement()->FirstChildElement("Storage");
  ASSERT_NE(storage, nullptr);
  EXPECT_STREQ(storage->Attribute("ID"), "327680");
  const TiXmlElement* drive = storage->FirstChildElement("Drive");
  ASSERT_NE(drive, nullptr);
  EXPECT_STREQ(drive->Attribute("Name"), "C:\\");
  EXPECT_STREQ(drive->Attribute("Enabled"), "1");
  EXPECT_STREQ(drive->NextSiblingElement("Drive")->Attribute("Name"), "/srv/rec");
}

TEST(HostDocumentsTest, TimesWordsAndSecretsAreParsedAndMasked) {
  int64_t t = 0;
  EXPECT_TRUE(parseUtcTime("now-60", 1000, &t) && t == 940);
  EXPECT_TRUE(parseUtcTime("now+5", 1000, &t) && t == 1005);
  EXPECT_TRUE(parseUtcTime("2023-11-14T22:13:20Z", 0, &t) && t == 1700000000);
  EXPECT_TRUE(parseUtcTime("12", 0, &t) && t == 12);
  EXPECT_FALSE(parseUtcTime("yesterday", 0, &t));

  std::vector<std::string> words;
  ASSERT_TRUE(splitWords("drives \"D:\\\\rec 1\" /srv", &words));
  EXPECT_EQ(words, (std::vector<std::string>{"drives", "D:\\rec 1", "/srv"}));
  EXPECT_FALSE(splitWords("update \"open", &words));

  EXPECT_EQ(maskInstruction("agent-start now-60 now s3cret 7066"), "agent-start now-60 now *** 7066");
  EXPECT_EQ(maskInstruction("write <Update PasswordToken=\"s3cret\" Port=\"1\" />"),
            "write <Update PasswordToken=\"***\" Port=\"1\" />");
  EXPECT_EQ(maskSecrets("PasswordToken='a' PasswordToken=\"b"), "PasswordToken='***' PasswordToken=\"***");
  EXPECT_EQ(maskInstruction("update ftp://me:p@ss@h:21/b.zip abc"), "update ftp://me:***@h:21/b.zip abc");
  EXPECT_EQ(maskSecrets("<Update Location=\"https://u:pw@h/x\" />"), "<Update Location=\"https://u:***@h/x\" />");
  EXPECT_EQ(maskInstruction("update https://h:8443/a@b"), "update https://h:8443/a@b");

  int percent = 0;
  EXPECT_TRUE(parseDownloadProgress("<?xml ?><Qora><Update ID=\"3670016\" Status=\"1\" Progress=\"42\" /></Qora>",
                                    &percent));
  EXPECT_EQ(percent, 42);
  EXPECT_FALSE(parseDownloadProgress("<?xml ?><Qora><Update ID=\"3670016\" Status=\"2\" /></Qora>", &percent));
  int32_t level = 0;
  EXPECT_TRUE(parseLogLevel("REJECTED", &level) && level == 75);
  EXPECT_TRUE(parseLogLevel("26", &level) && level == 26);
  EXPECT_FALSE(parseLogLevel("loud", &level));
}

TEST(HostEventLogTest, AWaitSeesEventsSinceThePreviousMatchAndConsumesThem) {
  EventLog events;
  events.add(log("first"));
  events.add(log("second"));
  const auto soon = [] { return Clock::now() + std::chrono::milliseconds(50); };
  // Arrived before the wait started: still found.
  EXPECT_EQ(events.waitFor(EventPattern::substring("second"), soon(), nullptr), WaitResult::Matched);
  // Consumed, together with everything before it.
  EXPECT_EQ(events.waitFor(EventPattern::substring("first"), soon(), nullptr), WaitResult::TimedOut);

  EventPattern regex;
  std::string error;
  ASSERT_TRUE(EventPattern::regex("port=[0-9]+", &regex, &error));
  EXPECT_FALSE(EventPattern::regex("(", &regex, &error));
  ASSERT_TRUE(EventPattern::regex("port=[0-9]+", &regex, &error));
  std::thread producer([&] { events.add(log("agent port=7066")); });
  Event matched;
  EXPECT_EQ(events.waitFor(regex, Clock::now() + std::chrono::seconds(10), &matched), WaitResult::Matched);
  producer.join();
  EXPECT_EQ(matched.text, "agent port=7066");

  std::thread quitter([&] { events.interrupt(); });
  EXPECT_EQ(events.waitFor(EventPattern::substring("never"), Clock::now() + std::chrono::seconds(10), nullptr),
            WaitResult::Interrupted);
  quitter.join();
}

}  // namespace
}  // namespace sorvik::host
