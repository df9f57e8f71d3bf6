// Recorded router replies (tests/data/upnp/*.xml) served by the fake IGD:
// the driver must read each one as the .expect file beside it says.
#include "drivers/upnp.h"

#include "fake_igd.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <vector>

namespace zark::portmap {
namespace {

namespace fs = std::filesystem;
using test::FakeIgd;
using test::HttpReply;
using test::IgdVariant;
using test::SoapRequest;

const std::vector<Ipv4Network> kLoopback = {{0x7f000000u, 0xff000000u}};

std::string ReadAll(const fs::path &path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream buffer;
  buffer << in.rdbuf();
  return buffer.str();
}

std::map<std::string, std::string> ReadExpect(const fs::path &path) {
  std::map<std::string, std::string> expect;
  std::istringstream in(ReadAll(path));
  std::string line;
  while (std::getline(in, line)) {
    if (line.empty() || line[0] == '#') {
      continue;
    }
    std::size_t equals = line.find('=');
    if (equals != std::string::npos) {
      expect[line.substr(0, equals)] = line.substr(equals + 1);
    }
  }
  return expect;
}

std::string OutcomeKey(RouterOutcome outcome) {
  switch (outcome) {
  case RouterOutcome::kOk:
    return "ok";
  case RouterOutcome::kNotFound:
    return "not_found";
  case RouterOutcome::kConflict:
    return "conflict";
  case RouterOutcome::kNotHeld:
    return "not_held";
  case RouterOutcome::kRefused:
    return "refused";
  case RouterOutcome::kNoAnswer:
    return "no_answer";
  case RouterOutcome::kBadReply:
    return "bad_reply";
  case RouterOutcome::kUnsupported:
    return "unsupported";
  case RouterOutcome::kNoRouter:
    return "no_router";
  case RouterOutcome::kFailed:
    return "failed";
  }
  return "?";
}

std::vector<std::string> Recordings() {
  std::vector<std::string> names;
  for (const auto &entry :
       fs::directory_iterator(fs::path(ZARK_TEST_DATA_DIR) / "upnp")) {
    if (entry.path().extension() == ".expect") {
      names.push_back(entry.path().stem().string());
    }
  }
  std::sort(names.begin(), names.end());
  return names;
}

UpnpOptions OptionsFor(const FakeIgd &igd) {
  UpnpOptions options;
  options.gateway = "127.0.0.1";
  options.knownRootDescUrls = {igd.RootDescUrl()};
  options.discover = false;
  options.localNetworks = kLoopback;
  return options;
}

class PortMapRouterRecordedReply : public testing::TestWithParam<std::string> {
};

TEST_P(PortMapRouterRecordedReply, IsReadAsExpected) {
  const fs::path folder = fs::path(ZARK_TEST_DATA_DIR) / "upnp";
  const std::string body = ReadAll(folder / (GetParam() + ".xml"));
  std::map<std::string, std::string> expect =
      ReadExpect(folder / (GetParam() + ".expect"));
  ASSERT_FALSE(expect["seen"].empty()) << "every recording says where";
  const std::string operation = expect["operation"];
  const HttpReply canned{std::stoi(expect.at("status")), body};
  auto serve = [canned](const SoapRequest &) {
    return std::optional<HttpReply>(canned);
  };

  RouterResult result;
  if (operation == "open") {
    FakeIgd igd;
    igd.SetRootDescription(body);
    UpnpRouter router(OptionsFor(igd));
    result = router.Open();
    if (expect.count("service_type") != 0) {
      EXPECT_EQ(expect["service_type"], router.ServiceType());
      EXPECT_EQ("http://127.0.0.1:" + std::to_string(igd.Port()) +
                    expect["control_path"],
                router.ControlUrl());
    }
  } else if (operation == "add") {
    FakeIgd igd;
    igd.OnAction("AddPortMapping", serve);
    if (expect["router_holds"] == "yes") {
      igd.PutEntry({"TCP", 8080, "127.0.0.1", 80, 0, "zarkportforward 1"});
    }
    UpnpRouter router(OptionsFor(igd));
    result = router.AddPortMapping(
        {IpProtocol::kTcp, 8080, 80, "127.0.0.1", "zarkportforward 1"});
  } else if (operation == "get_specific") {
    FakeIgd igd;
    igd.OnAction("GetSpecificPortMappingEntry", serve);
    UpnpRouter router(OptionsFor(igd));
    RouterMapping entry;
    result = router.GetSpecificPortMapping(IpProtocol::kTcp, 8080, entry);
    if (result.Ok()) {
      EXPECT_EQ(expect["internal_client"], entry.internalClient);
      EXPECT_EQ(expect["internal_port"], std::to_string(entry.internalPort));
      EXPECT_EQ(expect["lease"], std::to_string(entry.leaseSeconds));
      EXPECT_EQ(expect["description"], entry.description);
    }
  } else if (operation == "delete") {
    FakeIgd igd;
    igd.OnAction("DeletePortMapping", serve);
    UpnpRouter router(OptionsFor(igd));
    result = router.DeletePortMapping(
        {IpProtocol::kTcp, 8080, 80, "127.0.0.1", "zarkportforward 1"});
  } else if (operation == "external_address") {
    FakeIgd igd;
    igd.OnAction("GetExternalIPAddress", serve);
    UpnpRouter router(OptionsFor(igd));
    std::string address;
    result = router.GetExternalAddress(address);
    EXPECT_EQ(expect["address"], address);
  } else if (operation == "list_entry" || operation == "list_end") {
    FakeIgd igd;
    const bool firstOnly = operation == "list_entry";
    igd.OnAction(
        "GetGenericPortMappingEntry",
        [canned,
         firstOnly](const SoapRequest &request) -> std::optional<HttpReply> {
          if (!firstOnly || request.Arg("NewPortMappingIndex") == "0") {
            return canned;
          }
          return std::nullopt; // the built-in table is empty: 713
        });
    UpnpRouter router(OptionsFor(igd));
    std::vector<RouterMapping> entries;
    result = router.ListMappings(entries);
    if (firstOnly) {
      ASSERT_EQ(1u, entries.size());
      EXPECT_EQ(expect["protocol"], ProtocolText(entries[0].protocol));
      EXPECT_EQ(expect["external_port"],
                std::to_string(entries[0].externalPort));
      EXPECT_EQ(expect["internal_client"], entries[0].internalClient);
      EXPECT_EQ(expect["internal_port"],
                std::to_string(entries[0].internalPort));
      EXPECT_EQ(expect["lease"], std::to_string(entries[0].leaseSeconds));
      EXPECT_EQ(expect["description"], entries[0].description);
    } else {
      EXPECT_EQ(expect["entries"], std::to_string(entries.size()));
    }
  } else if (operation == "status_connected") {
    FakeIgd igd(IgdVariant::kIpAndPppV1);
    igd.OnAction("GetStatusInfo", serve);
    UpnpRouter router(OptionsFor(igd));
    result = router.Open();
    EXPECT_EQ(1, igd.Count("GetStatusInfo"));
  } else {
    FAIL() << "unknown operation \"" << operation << "\"";
  }

  EXPECT_EQ(expect["outcome"], OutcomeKey(result.outcome)) << result.message;
  if (expect.count("code") != 0) {
    EXPECT_EQ(expect["code"], std::to_string(result.code)) << result.message;
  }
}

INSTANTIATE_TEST_SUITE_P(Files, PortMapRouterRecordedReply,
                         testing::ValuesIn(Recordings()),
                         [](const testing::TestParamInfo<std::string> &info) {
                           return info.param;
                         });

TEST(PortMapRouterRecordedReplies, AreAllThere) {
  // A missing data folder must not pass as "no cases".
  EXPECT_GE(Recordings().size(), 15u);
}

} // namespace
} // namespace zark::portmap
