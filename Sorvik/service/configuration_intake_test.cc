#include "Sorvik/service/configuration_intake.h"

#include <unistd.h>

#include <memory>
#include <string>

#include <boost/filesystem.hpp>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <tinyxml.h>

#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/service/update_service.h"
#include "host/fake_host.h"
#include "host/test_temp_dir.h"

namespace sorvik {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;
using sorvik::testing::DocumentRecord;
using sorvik::testing::FakeHost;
using sorvik::testing::LogRecord;

std::string configuration(const std::string& children, const std::string& rootAttributes = "") {
  return "<?xml ?><Qora" + rootAttributes + ">" + children + "</Qora>";
}

std::string failoverRequest(const std::string& state) {
  return configuration("<Update ID=\"3670016\" FailoverState=\"" + state + "\" />");
}

class ConfigurationIntakeTest : public ::testing::Test {
 protected:
  void SetUp() override {
    host_.install();
    service_ = std::make_unique<UpdateService>(nullptr);
  }
  void TearDown() override {
    service_.reset();
  }

  void feed(const std::string& text) {
    service_->processConfiguration(reinterpret_cast<const unsigned char*>(text.data()), text.size());
  }
  void setReport(int32_t state, int32_t status, uint32_t time, bool hasFailover) {
    MutexLock lock(&service_->stateMutex);
    service_->FailoverReport = {state, status, time, 5};
    service_->HasFailover = hasFailover;
    service_->decommissionRequested = false;
    service_->postedAction = action_none;
  }
  FailoverReportRecord report() {
    MutexLock lock(&service_->stateMutex);
    return service_->FailoverReport;
  }
  std::string drives() {
    MutexLock lock(&service_->stateMutex);
    return service_->storageDrives;
  }
  bool hasFailover() {
    MutexLock lock(&service_->stateMutex);
    return service_->HasFailover;
  }
  std::vector<LogRecord> logsWith(const std::string& text) const {
    std::vector<LogRecord> found;
    for (const LogRecord& r : host_.logs()) {
      if (r.text.find(text) != std::string::npos) found.push_back(r);
    }
    return found;
  }

  FakeHost host_;
  std::unique_ptr<UpdateService> service_;

 private:
  sorvik::testing::ScopedTempCwd cwd_;
};

enum class Outcome { Same, Decommission, Transition, Refuse };

// The allowed role changes; every pair not listed is refused.
Outcome expectedOutcome(int32_t current, int32_t requested, bool hasFailover) {
  using namespace ko::core;
  if (current == requested) return Outcome::Same;
  struct Allowed {
    int32_t from, to;
    Outcome outcome;
  };
  const Allowed allowed[] = {
      {PROTECTED, DECOMMISSION_FAILOVER, Outcome::Decommission},
      {PROTECTED, DECOMMISSION_ACTIVE, Outcome::Decommission},
      {DECOMMISSION_FAILOVER, PROTECTED, Outcome::Transition},
      {DECOMMISSION_FAILOVER, COMMISSIONED, Outcome::Transition},
      {DECOMMISSION_ACTIVE, PROTECTED, Outcome::Transition},
      {COMMISSIONED, PROTECTED, Outcome::Transition},
      {COMMISSIONED, DECOMMISSION_FAILOVER, Outcome::Decommission},
      {COMMISSIONED, RESERVE_SPARE, hasFailover ? Outcome::Decommission : Outcome::Refuse},
      {RESERVE_SPARE, DECOMMISSION_FAILOVER, Outcome::Transition},
      {RESERVE_SPARE, COMMISSIONED, Outcome::Transition},
  };
  for (const Allowed& a : allowed) {
    if (a.from == current && a.to == requested) return a.outcome;
  }
  return Outcome::Refuse;
}

std::string named(int32_t code) {
  return std::string(ko::core::statusCodeName(code)) + " (" + std::to_string(code) + ")";
}

TEST_F(ConfigurationIntakeTest, EveryRoleChangeIsCarriedOutOrRefusedAsTheTableSays) {
  const int32_t currents[] = {100, 101, 102, 103, 104, 105, -1, 0, 106, -102};
  const int32_t requests[] = {100, 101, 102, 103, 104, 105, 106, -103, 0};
  constexpr uint32_t kOldTime = 1234;
  for (const bool failover : {true, false}) {
    for (const int32_t current : currents) {
      for (const int32_t requested : requests) {
        SCOPED_TRACE(::testing::Message() << current << " -> " << requested << (failover ? "" : " no failover"));
        setReport(current, 7, kOldTime, failover);
        host_.clearRecords();
        const uint32_t before = stampTime().seconds;

        feed(failoverRequest(std::to_string(requested)));

        const FailoverReportRecord after = report();
        const std::vector<DocumentRecord> docs = host_.documents();
        bool posted = false;
        int32_t action = action_none;
        {
          MutexLock lock(&service_->stateMutex);
          posted = service_->decommissionRequested;
          action = service_->postedAction;
        }
        switch (expectedOutcome(current, requested, failover)) {
          case Outcome::Same:
            EXPECT_EQ(after.FailoverState, current);
            EXPECT_EQ(after.FailoverStatus, 7);
            EXPECT_EQ(after.Time, kOldTime);
            ASSERT_EQ(docs.size(), 1u);
            EXPECT_EQ(docs[0].target, 4u);
            EXPECT_THAT(docs[0].text, HasSubstr("FailoverStatus=\"" + std::to_string(current) + "\""));
            EXPECT_THAT(docs[0].text, HasSubstr("Time=\"1234\""));
            EXPECT_TRUE(host_.hasLog("Ignoring request to change state " + std::to_string(requested) +
                                     ", current state=" + std::to_string(current)));
            break;
          case Outcome::Decommission:
            EXPECT_EQ(after.FailoverState, requested);
            EXPECT_EQ(after.FailoverStatus, 7);
            EXPECT_EQ(after.Time, kOldTime);
            EXPECT_TRUE(posted);
            EXPECT_EQ(action, action_decommission);
            EXPECT_TRUE(docs.empty());
            EXPECT_TRUE(host_.hasLog("Received decommissioning request with status " + named(requested)));
            EXPECT_EQ(host_.hasLog("Received request to reserve spare"), requested == ko::core::RESERVE_SPARE);
            break;
          case Outcome::Transition:
            EXPECT_EQ(after.FailoverState, requested);
            EXPECT_EQ(after.FailoverStatus, requested);
            EXPECT_GE(after.Time, before);
            EXPECT_FALSE(posted);
            ASSERT_EQ(docs.size(), 2u);
            EXPECT_EQ(docs[0].target, 256u);
            if (failover) {
              EXPECT_THAT(docs[0].text, HasSubstr("FailoverState=\"" + std::to_string(requested) + "\""));
            }
            EXPECT_EQ(docs[1].target, 4u);
            EXPECT_THAT(docs[1].text, HasSubstr("FailoverStatus=\"" + std::to_string(requested) + "\""));
            EXPECT_THAT(docs[1].text, HasSubstr("Time=\"" + std::to_string(after.Time) + "\""));
            EXPECT_TRUE(host_.hasLog("Failover State transition from " + named(current) + " to " + named(requested)));
            break;
          case Outcome::Refuse:
            EXPECT_EQ(after.FailoverState, current);
            EXPECT_EQ(after.FailoverStatus, 7);
            EXPECT_EQ(after.Time, kOldTime);
            EXPECT_FALSE(posted);
            ASSERT_EQ(docs.size(), 1u);
            EXPECT_EQ(docs[0].target, 4u);
            EXPECT_THAT(docs[0].text, HasSubstr("FailoverStatus=\"-102\""));
            EXPECT_TRUE(host_.hasLog("State transition from " + named(current) + " to " + named(requested) +
                                     " not possible"));
            break;
        }
      }
    }
  }
}

TEST_F(ConfigurationIntakeTest, RepeatedStateResendsTheTimeOfTheLastRealChange) {
  setReport(ko::core::COMMISSIONED, ko::core::COMMISSIONED, 0, true);
  feed(failoverRequest("104"));
  const uint32_t stamped = report().Time;
  EXPECT_NE(stamped, 0u);  // never stamped before: stamped now

  feed(failoverRequest("101"));  // refused; must not touch the report
  host_.clearRecords();
  feed(failoverRequest("104"));
  ASSERT_EQ(host_.documents().size(), 1u);
  EXPECT_THAT(host_.documents()[0].text, HasSubstr("Time=\"" + std::to_string(stamped) + "\""));
  EXPECT_EQ(report().Time, stamped);
}

TEST_F(ConfigurationIntakeTest, NetworkStorageDisablesFailoverOnceAndIgnoresTheRest) {
  setReport(ko::core::COMMISSIONED, ko::core::COMMISSIONED, 1, true);
  const std::string text = configuration(
      "<NetworkStorage /><Storage ID=\"327680\"><Drive Name=\"C:\\\" Enabled=\"1\" /></Storage>"
      "<Update ID=\"3670016\" FailoverState=\"100\" />");
  feed(text);
  EXPECT_FALSE(hasFailover());
  EXPECT_EQ(report().FailoverState, ko::core::COMMISSIONED);
  EXPECT_EQ(drives(), "");
  ASSERT_EQ(host_.documents().size(), 1u);
  EXPECT_EQ(host_.documents()[0].target, 256u);
  EXPECT_THAT(host_.documents()[0].text, HasSubstr("HasFailover=\"0\""));
  EXPECT_THAT(host_.documents()[0].text, HasSubstr("HasFailback=\"0\""));
  EXPECT_THAT(host_.documents()[0].text, Not(HasSubstr("FailoverState")));

  host_.clearRecords();
  feed(text);
  EXPECT_TRUE(host_.documents().empty());
  EXPECT_TRUE(host_.logs().empty());

  // Without failover a spare cannot be reserved; other changes still work.
  feed(failoverRequest("105"));
  EXPECT_THAT(host_.documents().back().text, HasSubstr("FailoverStatus=\"-102\""));
  feed(failoverRequest("102"));
  EXPECT_EQ(report().FailoverState, ko::core::DECOMMISSION_FAILOVER);
}

TEST_F(ConfigurationIntakeTest, StorageDrivesAreSortedUniqueAndBackslashesDoubled) {
  feed(configuration(
      "<Storage ID=\"327680\"><Drive Name=\"D:\\\" Enabled=\"1\" /><Drive Name=\"C:\\\" Enabled=\"1\" />"
      "<Drive Name=\"C:\\\" Enabled=\"1\" /><Drive Name=\"E:\\\" Enabled=\"true\" />"
      "<Drive Name=\"F:\\\" Enabled=\"2\" /><Drive Enabled=\"1\" /><Drive Name=\"G:\\\" /></Storage>"));
  EXPECT_EQ(drives(), "C:\\\\,D:\\\\");
  EXPECT_TRUE(host_.hasLog("Found mounts: (C:\\,D:\\)"));
  const auto processed = logsWith("Processed Storage config, new drives=(C:\\\\,D:\\\\)");
  ASSERT_EQ(processed.size(), 1u);
  EXPECT_EQ(processed[0].level, 25);

  // A partial configuration leaves the drives alone but still moves the role.
  setReport(ko::core::PROTECTED, ko::core::PROTECTED, 1, true);
  feed(configuration("<Storage ID=\"327680\" /><Update ID=\"3670016\" FailoverState=\"102\" />", " Delta=\"1\""));
  EXPECT_EQ(drives(), "C:\\\\,D:\\\\");
  EXPECT_EQ(report().FailoverState, ko::core::DECOMMISSION_FAILOVER);

  // A non-numeric Delta counts as a full configuration; every Storage
  // sibling contributes, and runs of backslashes become exactly two.
  feed(configuration("<Storage ID=\"327680\"><Drive Name=\"\\\\\\srv\\\\share\" Enabled=\"1\" /></Storage>"
                     "<Other /><Storage ID=\"327680\"><Drive Name=\"A:\" Enabled=\" 1\" /></Storage>",
                     " Delta=\"x\""));
  EXPECT_EQ(drives(), "A:,\\\\srv\\\\share");

  // One Storage with a foreign ID spoils the whole list.
  feed(configuration("<Storage ID=\"327680\"><Drive Name=\"H:\" Enabled=\"1\" /></Storage>"
                     "<Storage ID=\"1\"><Drive Name=\"I:\" Enabled=\"1\" /></Storage>"));
  EXPECT_EQ(drives(), "A:,\\\\srv\\\\share");

  // An empty name sorts first; alone it yields an empty list.
  feed(configuration("<Storage ID=\"327680\"><Drive Name=\"\" Enabled=\"1\" /><Drive Name=\"B:\" Enabled=\"1\" />"
                     "</Storage>"));
  EXPECT_EQ(drives(), ",B:");
  feed(configuration("<Storage ID=\"327680\"><Drive Name=\"\" Enabled=\"1\" /></Storage>"));
  EXPECT_EQ(drives(), "");
}

TEST_F(ConfigurationIntakeTest, MalformedOrForeignDocumentsChangeNothing) {
  setReport(ko::core::PROTECTED, ko::core::PROTECTED, 1, true);
  service_->processConfiguration(nullptr, 10);
  service_->processConfiguration(reinterpret_cast<const unsigned char*>("<Qora>"), 0);
  feed("<Qora><Update ID=\"3670016\" FailoverState=\"102\"");                      // does not parse
  feed("<?xml ?><Other><Update ID=\"3670016\" FailoverState=\"102\" /></Other>");  // no Qora
  feed(configuration("<Update ID=\"3670017\" FailoverState=\"102\" />"));
  feed(configuration("<Update FailoverState=\"102\" />"));
  EXPECT_TRUE(host_.logs().empty());
  EXPECT_TRUE(host_.documents().empty());

  feed(configuration("<Update ID=\"3670016\" FailoverState=\"abc\" />"));
  feed(configuration("<Update ID=\"3670016\" />"));
  EXPECT_EQ(logsWith("Ignoring request to update config: could not extract FailoverState").size(), 2u);

  // Only the first Update element is read.
  feed(configuration("<Update ID=\"1\" FailoverState=\"102\" /><Update ID=\"3670016\" FailoverState=\"102\" />"));
  EXPECT_EQ(report().FailoverState, ko::core::PROTECTED);
  EXPECT_TRUE(host_.documents().empty());
  bool posted = true;
  {
    MutexLock lock(&service_->stateMutex);
    posted = service_->decommissionRequested;
  }
  EXPECT_FALSE(posted);
}

std::string nested(int depth, const std::string& innermost) {
  std::string text;
  for (int i = 0; i < depth; ++i) text += "<n>";
  text += innermost;
  for (int i = 0; i < depth; ++i) text += "</n>";
  return text;
}

TEST_F(ConfigurationIntakeTest, DeeplyNestedDocumentsAreRefusedBeforeParsing) {
  // Qora is level 1, so 99 more levels are the most a document may have.
  feed(configuration("<NetworkStorage />" + nested(99, "")));
  EXPECT_FALSE(hasFailover());

  setReport(ko::core::PROTECTED, ko::core::PROTECTED, 1, true);
  host_.clearRecords();
  feed(configuration("<NetworkStorage />" + nested(100, "")));
  EXPECT_TRUE(hasFailover());
  // Deep enough to exhaust the stack of a recursive parser.
  feed(configuration("<NetworkStorage />" + nested(200000, "")));
  EXPECT_TRUE(hasFailover());
  EXPECT_TRUE(host_.documents().empty());
}

}  // namespace
}  // namespace sorvik
