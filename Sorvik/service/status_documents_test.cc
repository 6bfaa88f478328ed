#include "Sorvik/service/status_documents.h"

#include <ctime>

#include <gtest/gtest.h>

#include "Sorvik/platform/platform.h"
#include "Sorvik/plugin/xml_envelope.h"
#include "Sorvik/service/service_test_support.h"

namespace sorvik {
namespace {

using testing::readFile;

struct InstalledHost : testing::FakeHost {
  InstalledHost() { install(); }
};


TEST(StatusDocumentsTest, FixedDocumentsHaveExactAttributeOrder) {
  const TimeStamp when{1700000000, 42};
  TiXmlDocument doc;
  buildFailoverStatusDocument(doc, -102, when);
  EXPECT_EQ(ko::core::printCompact(doc),
            "<?xml ?><Qora><Update ID=\"3670016\" FailoverStatus=\"-102\" Time=\"1700000000\" Milliseconds=\"42\" "
            "/></Qora>");
  buildFailbackStatusDocument(doc, 202, when, 7066);
  EXPECT_EQ(ko::core::printCompact(doc),
            "<?xml ?><Qora Delta=\"0\"><Update ID=\"3670016\" FailbackStatus=\"202\" Port=\"7066\" "
            "Time=\"1700000000\" Milliseconds=\"42\" /></Qora>");
  buildFailbackStatusDocument(doc, 204, when, 7066);
  EXPECT_EQ(ko::core::printCompact(doc),
            "<?xml ?><Qora Delta=\"0\"><Update ID=\"3670016\" FailbackStatus=\"204\" Time=\"1700000000\" "
            "Milliseconds=\"42\" /></Qora>");
  // Past 2038 the seconds stay unsigned.
  buildSpareResetStatusDocument(doc, 205, TimeStamp{3000000000u, 999});
  EXPECT_EQ(ko::core::printCompact(doc),
            "<?xml ?><Qora Delta=\"0\"><Update ID=\"3670016\" SpareResetStatus=\"205\" Time=\"3000000000\" "
            "Milliseconds=\"999\" /></Qora>");
}

class ServiceDocumentsTest : public ::testing::Test {
 protected:
  testing::ScopedTempCwd cwd_;
  InstalledHost host_;
  UpdateService service_{nullptr};
};

TEST_F(ServiceDocumentsTest, UpdateStatusCarriesProgressOnlyWhileDownloading) {
  {
    MutexLock lock(&service_.stateMutex);
    service_.Progress = 57;
    service_.FailoverReport.FailoverStatus = 105;
  }
  const uint32_t now = static_cast<uint32_t>(std::time(nullptr));
  service_.emitUpdateStatus(ko::core::BUNDLE_DOWNLOAD);
  service_.emitUpdateStatus(ko::core::CHECKSUM_FAILED);
  const auto docs = testing::documentTexts(host_, 4);
  ASSERT_EQ(docs.size(), 2u);
  const std::string prefix = "<?xml ?><Qora><Update ID=\"3670016\" ";
  EXPECT_EQ(docs[0].substr(0, docs[0].find(" Time=")), prefix + "Status=\"1\" Progress=\"57\" FailoverStatus=\"105\"");
  EXPECT_EQ(docs[1].substr(0, docs[1].find(" Time=")), prefix + "Status=\"-4\" FailoverStatus=\"105\"");
  EXPECT_EQ(testing::logTexts(host_),
            (std::vector<std::string>{"Emit update status: (BUNDLE_DOWNLOAD)", "Emit update status: (CHECKSUM_FAILED)"}));
  MutexLock lock(&service_.stateMutex);
  EXPECT_EQ(service_.Status, -4);
  EXPECT_GE(service_.Time, now);
}

TEST_F(ServiceDocumentsTest, StateDocumentIsSavedWithoutAndSentWithPackageType) {
  {
    MutexLock lock(&service_.stateMutex);
    service_.DownloadDir = "dl";
    service_.Status = ko::core::PENDING_UPDATE;
    service_.FailoverReport.FailoverStatus = ko::core::DECOMMISSION_PENDING;
  }
  service_.emitState();
  const std::string attributes =
      "<Update ID=\"3670016\" HasFailover=\"1\" FailoverState=\"100\" HasFailback=\"1\" DownloadDir=\"dl\" "
      "Timeout=\"600\" PendingUpdate=\"1\"";
  EXPECT_EQ(readFile("update.xml"), "<?xml ?>\n<Qora Delta=\"0\">\n    " + attributes + " />\n</Qora>\n");
  const auto docs = testing::documentTexts(host_, 256);
  ASSERT_EQ(docs.size(), 1u);
  EXPECT_EQ(docs[0], "<?xml ?><Qora Delta=\"0\">" + attributes + " PackageType=\"" + platform::packageTypeName() +
                         "\" /></Qora>");
}

TEST_F(ServiceDocumentsTest, EmitOperationsLogNamesAndReportsKeepOrRefreshTime) {
  service_.emitFailoverStatus(-103, TimeStamp{5, 6});
  service_.emitFailbackStatus(201, TimeStamp{5, 6}, 0);
  service_.emitSpareResetStatus(7);
  EXPECT_EQ(testing::logTexts(host_),
            (std::vector<std::string>{"Emit failover status: DECOMMISSION_ERROR (-103)",
                                      "Emit Failback status: PENDING (201)", "Emit Spare Reset status: NONE (7)"}));

  // An unchanged report keeps the time of its last change.
  {
    MutexLock lock(&service_.stateMutex);
    service_.FailoverReport.Time = 11;
    service_.FailoverReport.Milliseconds = 12;
  }
  emitFailoverReportUnchanged(service_);
  EXPECT_TRUE(host_.waitForDocument("FailoverStatus=\"100\" Time=\"11\" Milliseconds=\"12\"", testing::kTestDeadline));
  emitFailoverReportRestamped(service_);
  {
    MutexLock lock(&service_.stateMutex);
    EXPECT_GT(service_.FailoverReport.Time, 11u);
  }
  emitFailbackReportUnchanged(service_);  // never stamped: stamped now
  {
    MutexLock lock(&service_.stateMutex);
    EXPECT_NE(service_.FailbackReport.Time, 0u);
  }
}

}  // namespace
}  // namespace sorvik
