// Uploading a failed test's report (KLibUploadTestUpnpCompatibilityFailResult)
// to an HTTP server on 127.0.0.1 (cpp-httplib), with the router's
// description from the fake router. HERMETIC: /etc/portforward, /tmp.
#include "compat/compatibility_report.h"

#include "base/library_config.h"
#include "compat/compatibility_test.h"
#include "fake_igd.h"
#include "hermetic.h"
#include "porttest_support.h"
#include "syslog_capture.h"

#include <httplib.h>
#include <json/json.h>

#include <gtest/gtest.h>

#include <mutex>
#include <thread>

namespace zark::portmap {
namespace {

using porttest::SetLibraryConfig;
const std::string kReportKey(config_key::kReportAddress);

// Collects what is POSTed to /report; answers with status.
class ReportServer {
public:
  explicit ReportServer(int status = 200) {
    mServer.Post("/report", [this, status](const httplib::Request &request,
                                           httplib::Response &response) {
      std::lock_guard<std::mutex> lock(mMutex);
      mBodies.push_back(request.body);
      mTypes.push_back(request.get_header_value("Content-Type"));
      response.status = status;
    });
    mPort = mServer.bind_to_any_port("127.0.0.1");
    mThread = std::thread([this] { mServer.listen_after_bind(); });
    // Stop() only stops a server that runs: wait (bounded) until it does.
    for (int i = 0; i < 1000 && !mServer.is_running(); ++i) {
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
  }
  ~ReportServer() {
    mServer.stop();
    mThread.join();
  }
  std::string Url() const {
    return "http://127.0.0.1:" + std::to_string(mPort) + "/report";
  }
  std::vector<std::string> Bodies() {
    std::lock_guard<std::mutex> lock(mMutex);
    return mBodies;
  }
  std::vector<std::string> Types() {
    std::lock_guard<std::mutex> lock(mMutex);
    return mTypes;
  }

private:
  httplib::Server mServer;
  int mPort = 0;
  std::thread mThread;
  std::mutex mMutex;
  std::vector<std::string> mBodies;
  std::vector<std::string> mTypes;
};

UpnpTestReport FailedReport(const std::string &location) {
  UpnpTestReport report;
  report.failed = true;
  report.error = ZARK_UPNP_TEST_ERR_NOT_OPEN;
  report.reason = "the re-added mapping tcp 30500 does not answer";
  report.date = "2024-05-01T12:00:00Z";
  report.mappingsAsked = 60;
  report.mappingsReached = 24;
  report.gateway = "127.0.0.1";
  report.location = location;
  report.brand = "ZarkTest";
  report.model = "TestIGD";
  report.log = {"12:00:00 started"};
  return report;
}

Json::Value Parse(const std::string &text) {
  Json::Value value;
  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  std::string errors;
  EXPECT_TRUE(
      reader->parse(text.data(), text.data() + text.size(), &value, &errors))
      << errors;
  return value;
}

class PortTestUpload : public testing::Test {
protected:
  void SetUp() override {
    test::ResetFixedPaths();
    test::ClearLogs();
  }
};

TEST_F(PortTestUpload, SendsTheReportProgressAndDescription) {
  test::FakeIgd igd;
  ReportServer server;
  SetLibraryConfig(kReportKey, server.Url());
  test::WriteFile(kUpnpTestReportPath,
                  SerializeUpnpTestReport(FailedReport(igd.RootDescUrl())));
  test::WriteFile(ZARK_PORTMAP_UPNP_TEST_PROGRESS,
                  "upnp_init=success\nupnp_connection_success=failed\n");

  ASSERT_EQ(0, KLibUploadTestUpnpCompatibilityFailResult());
  ASSERT_EQ(1u, server.Bodies().size());
  EXPECT_EQ("application/json", server.Types()[0]);
  Json::Value sent = Parse(server.Bodies()[0]);
  EXPECT_EQ("failed", sent["result"].asString());
  EXPECT_EQ(ZARK_UPNP_TEST_ERR_NOT_OPEN, sent["error"].asInt());
  EXPECT_EQ(24, sent["mappings_reached"].asInt());
  EXPECT_EQ("ZarkTest", sent["router"]["brand"].asString());
  EXPECT_EQ("upnp_init=success\nupnp_connection_success=failed\n",
            sent["progress"].asString());
  EXPECT_NE(std::string::npos,
            sent["root_description"].asString().find("InternetGatewayDevice"));
  EXPECT_EQ("12:00:00 started", sent["log"][0].asString());
  EXPECT_EQ(1, igd.Count("GET"));
}

TEST_F(PortTestUpload, WithoutADescriptionSaysWhy) {
  ReportServer server;
  SetLibraryConfig(kReportKey, server.Url());
  test::WriteFile(kUpnpTestReportPath,
                  SerializeUpnpTestReport(FailedReport("")));
  ASSERT_EQ(0, KLibUploadTestUpnpCompatibilityFailResult());
  ASSERT_EQ(1u, server.Bodies().size());
  Json::Value sent = Parse(server.Bodies()[0]);
  EXPECT_EQ("the test found no UPnP description",
            sent["root_description_error"].asString());
  EXPECT_FALSE(sent.isMember("root_description"));
  EXPECT_EQ("", sent["progress"].asString());
}

TEST_F(PortTestUpload, NoReportAddressConfigured) {
  test::WriteFile(kUpnpTestReportPath,
                  SerializeUpnpTestReport(FailedReport("")));
  EXPECT_EQ(-1, KLibUploadTestUpnpCompatibilityFailResult());
  EXPECT_TRUE(test::HasLogContaining("no report address is configured"));
}

TEST_F(PortTestUpload, ReportAddressThatIsNotAUrl) {
  SetLibraryConfig(kReportKey, "ftp://127.0.0.1/report");
  test::WriteFile(kUpnpTestReportPath,
                  SerializeUpnpTestReport(FailedReport("")));
  EXPECT_EQ(-1, KLibUploadTestUpnpCompatibilityFailResult());
  EXPECT_TRUE(test::HasLogContaining("is not an http:// or https:// URL"));
}

TEST_F(PortTestUpload, NothingToUpload) {
  ReportServer server;
  SetLibraryConfig(kReportKey, server.Url());
  EXPECT_EQ(-1, KLibUploadTestUpnpCompatibilityFailResult());
  EXPECT_TRUE(
      test::HasLogContaining("no UPnP compatibility test has been run"));
  UpnpTestReport passed = FailedReport("");
  passed.failed = false;
  test::WriteFile(kUpnpTestReportPath, SerializeUpnpTestReport(passed));
  EXPECT_EQ(-1, KLibUploadTestUpnpCompatibilityFailResult());
  EXPECT_TRUE(test::HasLogContaining("the last UPnP compatibility test "
                                     "succeeded"));
  EXPECT_TRUE(server.Bodies().empty());
}

TEST_F(PortTestUpload, TheServerRefuses) {
  ReportServer server(500);
  SetLibraryConfig(kReportKey, server.Url());
  test::WriteFile(kUpnpTestReportPath,
                  SerializeUpnpTestReport(FailedReport("")));
  EXPECT_EQ(-1, KLibUploadTestUpnpCompatibilityFailResult());
  EXPECT_TRUE(test::HasLogContaining("HTTP 500"));
}

TEST_F(PortTestUpload, NobodyListens) {
  SetLibraryConfig(kReportKey,
                   "http://127.0.0.1:" + std::to_string(porttest::FreePort()) +
                       "/report");
  test::WriteFile(kUpnpTestReportPath,
                  SerializeUpnpTestReport(FailedReport("")));
  EXPECT_EQ(-1, KLibUploadTestUpnpCompatibilityFailResult());
  EXPECT_TRUE(test::HasLogContaining("uploading the test report"));
}

} // namespace
} // namespace zark::portmap
