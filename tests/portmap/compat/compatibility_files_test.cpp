// The small files of the UPnP compatibility test, pure: its run file, its
// report and upload document, the database of tested routers.
#include "compat/compatibility_report.h"
#include "compat/compatibility_test.h"
#include "compat/tested_router_db.h"

#include "libzarkportmap.h"

#include <gtest/gtest.h>

#include <cstring>

namespace zark::portmap {
namespace {

TEST(PortTestRunFile, RoundTripAndRefusals) {
  UpnpTestRun run;
  run.runId = "abc123";
  run.pid = 4242;
  run.gateway = "192.168.77.1";
  run.location = "http://192.168.77.1:5000/rootDesc.xml";
  run.client = "192.168.77.2";
  run.ports = {30500, 30501};
  UpnpTestRun parsed;
  std::string why;
  ASSERT_TRUE(ParseUpnpTestRun(SerializeUpnpTestRun(run), parsed, why)) << why;
  EXPECT_EQ(run, parsed);

  for (
      const char *bad : {
          "",
          "{}",
          R"({"version":2,"run_id":"a","pid":1,"gateway":"","location":"","client":"","ports":[]})",
          R"({"version":1,"run_id":"a","pid":1,"gateway":"x","location":"","client":"","ports":[]})",
          R"({"version":1,"run_id":"a","pid":1,"gateway":"","location":"","client":"","ports":[0]})",
          R"({"version":1,"run_id":"a","pid":1,"gateway":"","location":"","client":"","ports":["80"]})",
          R"({"version":1,"run_id":"a","pid":-1,"gateway":"","location":"","client":"","ports":[]})",
      }) {
    EXPECT_FALSE(ParseUpnpTestRun(bad, parsed, why)) << bad;
  }
}

TEST(PortTestReport, RoundTripAndUploadDocument) {
  UpnpTestReport report;
  report.failed = true;
  report.error = ZARK_UPNP_TEST_ERR_STILL_OPEN;
  report.reason = "the deleted mapping tcp 30500 still answers";
  report.date = UtcDateText(0);
  report.mappingsAsked = 60;
  report.mappingsReached = 24;
  report.gateway = "192.168.77.1";
  report.location = "http://192.168.77.1:5000/rootDesc.xml";
  report.brand = "ZarkTest";
  report.model = "TestIGD";
  report.version = "1";
  report.supportUpnp = "yes";
  report.supportNatpmp = "no";
  report.log = {"12:00:00 started", "12:00:01 ended"};
  EXPECT_EQ("1970-01-01T00:00:00Z", report.date);
  UpnpTestReport parsed;
  std::string why;
  ASSERT_TRUE(ParseUpnpTestReport(SerializeUpnpTestReport(report), parsed, why))
      << why;
  EXPECT_EQ(report, parsed);

  const std::string document =
      UploadDocument(report, "upnp_init=success\n", "<root/>", "");
  ASSERT_TRUE(ParseUpnpTestReport(document, parsed, why)) << why;
  EXPECT_EQ(report, parsed);
  EXPECT_NE(std::string::npos, document.find("\"root_description\" : "
                                             "\"<root/>\""));
  EXPECT_NE(std::string::npos,
            document.find("\"progress\" : \"upnp_init=success\\n\""));
  EXPECT_EQ(std::string::npos, document.find("password"));
  EXPECT_NE(std::string::npos,
            UploadDocument(report, "", "", "no description")
                .find("\"root_description_error\" : \"no description\""));
}

TEST(PortTestTestedRouters, RoundTripAndRecords) {
  std::vector<TestedRouter> routers = {
      {"ZarkTest", "TestIGD", "1", 24, "2024-05-01T12:00:00Z"},
      {"Acme", "R1", "", 60, "2024-05-02T12:00:00Z"}};
  std::vector<TestedRouter> parsed;
  std::string why;
  ASSERT_TRUE(ParseTestedRouters(SerializeTestedRouters(routers), parsed, why))
      << why;
  EXPECT_EQ(routers, parsed);
  EXPECT_FALSE(
      ParseTestedRouters(R"({"version":1,"routers":[{}]})", parsed, why));
  EXPECT_FALSE(
      ParseTestedRouters(R"({"version":3,"routers":[]})", parsed, why));

  ZARK_ROUTER_RECORD record{};
  std::strcpy(record.brand, "ZarkTest");
  std::strcpy(record.model, "TestIGD");
  std::strcpy(record.version, "1");
  std::strcpy(record.date, "2024-05-01T12:00:00Z");
  record.max_mappings = 24;
  TestedRouter router;
  ASSERT_TRUE(TestedRouterOfRecord(record, router, why)) << why;
  EXPECT_EQ(routers[0], router);
  record.max_mappings = 0;
  EXPECT_FALSE(TestedRouterOfRecord(record, router, why));
  record.max_mappings = 24;
  std::memset(record.model, 'x', sizeof(record.model));
  EXPECT_FALSE(TestedRouterOfRecord(record, router, why));
  EXPECT_EQ("a text field is not NUL-terminated", why);
}

} // namespace
} // namespace zark::portmap
