// The UPnP driver against the fake IGD on loopback: choosing the service,
// lease refusals, conflicts, routers that drop or garble what they were
// asked, control URLs off the network, a router that stops answering.
#include "drivers/upnp.h"

#include "fake_igd.h"
#include "syslog_capture.h"
#include "upnp_driver_options.h"

#include <gtest/gtest.h>

#include <syslog.h>

#include <algorithm>
#include <string>
#include <vector>

namespace zark::portmap {
namespace {

using test::FakeIgd;
using test::HttpReply;
using test::IgdVariant;
using test::SoapFault;
using test::SoapRequest;

using test::kLoopback;
using test::OptionsFor;
using test::Tcp;

int LogLinesContaining(const std::string &text) {
  std::vector<std::string> messages = test::CapturedMessages();
  return static_cast<int>(
      std::count_if(messages.begin(), messages.end(), [&](const auto &line) {
        return line.find(text) != std::string::npos;
      }));
}

TEST(PortMapRouterUpnp, AddsOnIgdV1AndConfirmsWithOneLookup) {
  FakeIgd igd(IgdVariant::kIpV1);
  UpnpRouter router(OptionsFor(igd));

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  ASSERT_EQ(RouterOutcome::kOk, added.outcome) << added.message;
  EXPECT_EQ(0u, added.leaseSeconds);
  EXPECT_EQ("urn:schemas-upnp-org:service:WANIPConnection:1",
            router.ServiceType());
  EXPECT_EQ(igd.RootDescUrl(), router.Location());
  EXPECT_EQ((std::map<std::string, int>{{"GET", 1},
                                        {"AddPortMapping", 1},
                                        {"GetSpecificPortMappingEntry", 1}}),
            igd.Counts());
  EXPECT_EQ((std::vector<FakeIgd::Entry>{
                {"TCP", 8080, "127.0.0.1", 80, 0, "zarkportforward test"}}),
            igd.Table());
  std::vector<SoapRequest> requests = igd.SoapRequests();
  ASSERT_EQ(2u, requests.size());
  EXPECT_EQ("0", requests[0].Arg("NewLeaseDuration"));
  EXPECT_EQ("/ctl/IPConn", requests[0].path);
}

TEST(PortMapRouterUpnp, ControlUrlIsKeptForTheLifeOfTheDriver) {
  FakeIgd igd;
  UpnpRouter router(OptionsFor(igd));
  ASSERT_TRUE(router.AddPortMapping(Tcp(8080, 80)).Ok());
  ASSERT_TRUE(router.AddPortMapping(Tcp(8081, 81)).Ok());
  PortMapping gone = Tcp(8080, 80);
  ASSERT_TRUE(router.DeletePortMapping(gone).Ok());
  EXPECT_EQ(1, igd.Count("GET"));
  EXPECT_EQ(5, igd.TotalRequests() - igd.Count("GET"));
}

TEST(PortMapRouterUpnp, LeaseZeroRefusedWith725IsRetriedFiniteAndRemembered) {
  FakeIgd igd;
  igd.OnAction("AddPortMapping",
               [](const SoapRequest &request) -> std::optional<HttpReply> {
                 if (request.Arg("NewLeaseDuration") == "0") {
                   return SoapFault(725, "OnlyPermanentLeasesSupported");
                 }
                 return std::nullopt;
               });
  UpnpRouter router(OptionsFor(igd));

  RouterResult first = router.AddPortMapping(Tcp(8080, 80));
  RouterResult second = router.AddPortMapping(Tcp(8081, 81));

  ASSERT_TRUE(first.Ok()) << first.message;
  ASSERT_TRUE(second.Ok()) << second.message;
  EXPECT_EQ(3600u, first.leaseSeconds);
  EXPECT_EQ(3600u, second.leaseSeconds);
  EXPECT_TRUE(router.FiniteLeases());
  // 0 refused, 3600 taken; the second mapping goes straight to 3600.
  std::vector<std::string> leases;
  for (const SoapRequest &request : igd.SoapRequests()) {
    if (request.action == "AddPortMapping") {
      leases.push_back(request.Arg("NewLeaseDuration"));
    }
  }
  EXPECT_EQ((std::vector<std::string>{"0", "3600", "3600"}), leases);
  EXPECT_EQ(2, igd.Count("GetSpecificPortMappingEntry"));
}

TEST(PortMapRouterUpnp, LeaseRefusedWith402GetsTheOtherKind) {
  FakeIgd igd;
  igd.OnAction("AddPortMapping",
               [](const SoapRequest &request) -> std::optional<HttpReply> {
                 if (request.Arg("NewLeaseDuration") == "0") {
                   return SoapFault(402, "Invalid Args");
                 }
                 return std::nullopt;
               });
  UpnpRouter router(OptionsFor(igd));

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  ASSERT_TRUE(added.Ok()) << added.message;
  EXPECT_EQ(3600u, added.leaseSeconds);
  EXPECT_EQ(2, igd.Count("AddPortMapping"));
}

TEST(PortMapRouterUpnp, FiniteLeaseRefusedWith725GoesPermanent) {
  FakeIgd igd;
  igd.OnAction("AddPortMapping",
               [](const SoapRequest &request) -> std::optional<HttpReply> {
                 if (request.Arg("NewLeaseDuration") != "0") {
                   return SoapFault(725, "OnlyPermanentLeasesSupported");
                 }
                 return std::nullopt;
               });
  UpnpOptions options = OptionsFor(igd);
  options.firstLease = LeaseKind::kFinite;
  UpnpRouter router(options);

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  ASSERT_TRUE(added.Ok()) << added.message;
  EXPECT_EQ(0u, added.leaseSeconds);
  EXPECT_FALSE(router.FiniteLeases());
  EXPECT_EQ(2, igd.Count("AddPortMapping"));
}

TEST(PortMapRouterUpnp, LeaseRefusedBothWaysFailsAfterTwoTries) {
  FakeIgd igd;
  igd.OnAction("AddPortMapping", [](const SoapRequest &) {
    return std::optional<HttpReply>(SoapFault(725, "OnlyPermanentLeases"));
  });
  UpnpRouter router(OptionsFor(igd));

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kRefused, added.outcome);
  EXPECT_EQ(725, added.code);
  EXPECT_EQ(2, igd.Count("AddPortMapping"));
  EXPECT_EQ(0, igd.Count("GetSpecificPortMappingEntry"));
}

TEST(PortMapRouterUpnp, ConflictIsReportedWithItsPortAndNeverMovedElsewhere) {
  FakeIgd igd;
  igd.PutEntry({"TCP", 8080, "127.0.0.9", 80, 0, "someone else"});
  UpnpRouter router(OptionsFor(igd));
  test::ClearLogs();

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kConflict, added.outcome);
  EXPECT_EQ(kUpnpConflictInMappingEntry, added.code);
  EXPECT_NE(std::string::npos, added.message.find("TCP 8080"));
  EXPECT_EQ(1, igd.Count("AddPortMapping"));
  EXPECT_EQ(0, igd.Count("GetSpecificPortMappingEntry"));
  for (const SoapRequest &request : igd.SoapRequests()) {
    EXPECT_EQ("8080", request.Arg("NewExternalPort"));
  }
  EXPECT_EQ("127.0.0.9", igd.Table().at(0).client);
  EXPECT_EQ(1, LogLinesContaining("UPNP_AddPortMapping failed: rc=718 "
                                  "(ConflictInMappingEntry) TCP "
                                  "8080->127.0.0.1:80 lease 0"));
}

TEST(PortMapRouterUpnp, FullTableThatAnswersSuccessIsCaughtByTheLookup) {
  FakeIgd igd;
  igd.SetTableCapacity(0);
  UpnpRouter router(OptionsFor(igd));

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kNotHeld, added.outcome);
  EXPECT_EQ(1, igd.Count("AddPortMapping"));
  EXPECT_EQ(1, igd.Count("GetSpecificPortMappingEntry"));
  EXPECT_TRUE(igd.Table().empty());
}

TEST(PortMapRouterUpnp, WanPppConnectionOnlyRouter) {
  FakeIgd igd(IgdVariant::kPppOnlyV1);
  UpnpRouter router(OptionsFor(igd));

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  ASSERT_TRUE(added.Ok()) << added.message;
  EXPECT_EQ("urn:schemas-upnp-org:service:WANPPPConnection:1",
            router.ServiceType());
  for (const SoapRequest &request : igd.SoapRequests()) {
    EXPECT_EQ("/ctl/PPPConn", request.path);
    EXPECT_EQ("urn:schemas-upnp-org:service:WANPPPConnection:1",
              request.serviceType);
  }
  EXPECT_EQ(0, igd.Count("GetStatusInfo"));
}

TEST(PortMapRouterUpnp, IgdV2OnlyRouterTurnsPermanentIntoAWeek) {
  FakeIgd igd(IgdVariant::kIpV2Only);
  UpnpRouter router(OptionsFor(igd));

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  ASSERT_TRUE(added.Ok()) << added.message;
  EXPECT_EQ("urn:schemas-upnp-org:service:WANIPConnection:2",
            router.ServiceType());
  EXPECT_EQ(604800u, added.leaseSeconds);
  for (const SoapRequest &request : igd.SoapRequests()) {
    EXPECT_EQ("urn:schemas-upnp-org:service:WANIPConnection:2",
              request.serviceType);
  }
}

TEST(PortMapRouterUpnp, OfTwoServicesTheConnectedOneIsUsed) {
  FakeIgd igd(IgdVariant::kIpAndPppV1);
  igd.SetConnectionStatus("WANPPPConnection", "Disconnected");
  UpnpRouter router(OptionsFor(igd));

  ASSERT_TRUE(router.Open().Ok());

  EXPECT_EQ("urn:schemas-upnp-org:service:WANIPConnection:1",
            router.ServiceType());
  EXPECT_EQ(2, igd.Count("GetStatusInfo"));
}

TEST(PortMapRouterUpnp, OfTwoConnectedServicesTheFirstListedIsUsed) {
  FakeIgd igd(IgdVariant::kIpAndPppV1);
  UpnpRouter router(OptionsFor(igd));

  ASSERT_TRUE(router.Open().Ok());

  EXPECT_EQ("urn:schemas-upnp-org:service:WANPPPConnection:1",
            router.ServiceType());
  EXPECT_EQ(1, igd.Count("GetStatusInfo"));
}

TEST(PortMapRouterUpnp, Http500WithoutBodyIsNoAnswer) {
  FakeIgd igd;
  igd.OnAction("AddPortMapping", [](const SoapRequest &) {
    return std::optional<HttpReply>(HttpReply{500, ""});
  });
  UpnpRouter router(OptionsFor(igd));

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kNoAnswer, added.outcome);
  EXPECT_EQ(-3, added.code); // UPNPCOMMAND_HTTP_ERROR
  EXPECT_EQ(0, igd.Count("GetSpecificPortMappingEntry"));
}

TEST(PortMapRouterUpnp, TruncatedSuccessReplyIsCheckedAndFound) {
  // miniupnpc reads a reply without an error code as success; the lookup
  // tells whether the router really did it. Here it did.
  FakeIgd igd;
  igd.OnAction("AddPortMapping", [&igd](const SoapRequest &request) {
    igd.PutEntry({"TCP", 8080, request.Arg("NewInternalClient"), 80, 0, ""});
    return std::optional<HttpReply>(
        HttpReply{200, "<?xml version=\"1.0\"?>\r\n<s:Envelope xmlns:s=\"ht"});
  });
  UpnpRouter router(OptionsFor(igd));

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kOk, added.outcome) << added.message;
  EXPECT_EQ(1, igd.Count("GetSpecificPortMappingEntry"));
}

TEST(PortMapRouterUpnp, TruncatedSuccessReplyOfADroppedAddIsNotHeld) {
  FakeIgd igd;
  igd.OnAction("AddPortMapping", [](const SoapRequest &) {
    return std::optional<HttpReply>(
        HttpReply{200, "<?xml version=\"1.0\"?>\r\n<s:Envelope xmlns:s=\"ht"});
  });
  UpnpRouter router(OptionsFor(igd));

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kNotHeld, added.outcome);
}

TEST(PortMapRouterUpnp, TruncatedLookupReplyIsBadReply) {
  FakeIgd igd;
  igd.OnAction("GetSpecificPortMappingEntry", [](const SoapRequest &) {
    return std::optional<HttpReply>(HttpReply{
        200, "<?xml version=\"1.0\"?><s:Envelope><s:Body>"
             "<u:GetSpecificPortMappingEntryResponse><NewInternalPort>80"});
  });
  UpnpRouter router(OptionsFor(igd));

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kBadReply, added.outcome) << added.message;
}

TEST(PortMapRouterUpnp, LookupRefusedAfterAnAddIsNeitherHeldNorNot) {
  FakeIgd igd;
  igd.OnAction("GetSpecificPortMappingEntry", [](const SoapRequest &) {
    return std::optional<HttpReply>(SoapFault(606, "Action not authorized"));
  });
  UpnpRouter router(OptionsFor(igd));

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kBadReply, added.outcome);
  EXPECT_EQ(606, added.code);
  EXPECT_EQ(1u, igd.Table().size());
}

TEST(PortMapRouterUpnp, ControlUrlOffTheLocalNetworkIsRefusedUnused) {
  FakeIgd igd;
  igd.SetControlUrl("http://203.0.113.5:5000/ctl/IPConn");
  UpnpRouter router(OptionsFor(igd));
  test::ClearLogs();

  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kNoRouter, added.outcome);
  EXPECT_EQ((std::map<std::string, int>{{"GET", 1}}), igd.Counts());
  EXPECT_TRUE(test::HasLogContaining(
      "refusing control URL http://203.0.113.5:5000/ctl/IPConn of the UPnP "
      "device at " +
      igd.RootDescUrl() + ": host 203.0.113.5 is not on the local network"));
}

TEST(PortMapRouterUpnp, ControlUrlOnTheServerItselfIsRefusedOutsideTests) {
  // With the machine's own networks (loopback left out), a description on
  // 127.0.0.1 is not on the local network.
  FakeIgd igd;
  UpnpOptions options = OptionsFor(igd);
  options.localNetworks = std::vector<Ipv4Network>{{0xc0a80100u, 0xffffff00u}};
  options.gateway = "192.168.1.1";
  UpnpRouter router(options);

  EXPECT_EQ(RouterOutcome::kNoRouter, router.Open().outcome);
  EXPECT_EQ(0, igd.TotalRequests());
}

TEST(PortMapRouterUpnp, ChoosesTheFirstUsableOfSeveralDevices) {
  FakeIgd broken;
  broken.SetRootDescription("<?xml version=\"1.0\"?><root><device>"
                            "<deviceType>urn:schemas-upnp-org:device:"
                            "MediaServer:1</deviceType></device></root>");
  FakeIgd good(IgdVariant::kIpV2Only);
  UpnpOptions options = OptionsFor(good);
  options.knownRootDescUrls = {"http://203.0.113.9:5000/rootDesc.xml",
                               broken.RootDescUrl(), good.RootDescUrl()};
  UpnpRouter router(options);

  ASSERT_TRUE(router.Open().Ok());

  EXPECT_EQ(good.RootDescUrl(), router.Location());
  EXPECT_EQ(1, broken.Count("GET"));
  EXPECT_EQ(1, good.Count("GET"));
}

TEST(PortMapRouterUpnp, RouterThatStopsAnsweringFailsTheCall) {
  FakeIgd igd;
  UpnpRouter router(OptionsFor(igd));
  ASSERT_TRUE(router.AddPortMapping(Tcp(8080, 80)).Ok());
  igd.StopAnswering();

  RouterResult added = router.AddPortMapping(Tcp(8081, 81));

  EXPECT_EQ(RouterOutcome::kNoAnswer, added.outcome);
  EXPECT_EQ(2, igd.Count("AddPortMapping"));
}

TEST(PortMapRouterUpnp, DeletingAMissingMappingIsNotFound) {
  FakeIgd igd;
  UpnpRouter router(OptionsFor(igd));

  RouterResult deleted = router.DeletePortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kNotFound, deleted.outcome);
  EXPECT_EQ(kUpnpNoSuchEntry, deleted.code);
}

TEST(PortMapRouterUpnp, ListsTheWholeTable) {
  FakeIgd igd;
  igd.PutEntry({"UDP", 5000, "127.0.0.9", 5000, 3600, "other"});
  UpnpRouter router(OptionsFor(igd));
  ASSERT_TRUE(router.AddPortMapping(Tcp(8080, 80)).Ok());

  std::vector<RouterMapping> entries;
  RouterResult listed = router.ListMappings(entries);

  ASSERT_TRUE(listed.Ok()) << listed.message;
  ASSERT_EQ(2u, entries.size());
  EXPECT_EQ(IpProtocol::kUdp, entries[0].protocol);
  EXPECT_EQ(5000, entries[0].externalPort);
  EXPECT_EQ("127.0.0.9", entries[0].internalClient);
  EXPECT_EQ(3600u, entries[0].leaseSeconds);
  EXPECT_EQ(IpProtocol::kTcp, entries[1].protocol);
  EXPECT_EQ(8080, entries[1].externalPort);
  EXPECT_EQ(80, entries[1].internalPort);
  EXPECT_EQ("zarkportforward test", entries[1].description);
  EXPECT_EQ(3, igd.Count("GetGenericPortMappingEntry"));
}

TEST(PortMapRouterUpnp, ReadsTheExternalAddress) {
  FakeIgd igd;
  UpnpRouter router(OptionsFor(igd));
  std::string address;

  ASSERT_TRUE(router.GetExternalAddress(address).Ok());

  EXPECT_EQ("198.51.100.7", address);
}

TEST(PortMapRouterUpnp, SendsOneRequestAtATimeAndLogsEachCallOnce) {
  FakeIgd igd;
  UpnpRouter router(OptionsFor(igd));
  test::ClearLogs();
  for (uint16_t port = 9000; port < 9010; ++port) {
    ASSERT_TRUE(router.AddPortMapping(Tcp(port, port)).Ok());
  }

  EXPECT_EQ(1, igd.MaxOpenConnections());
  EXPECT_EQ(10, LogLinesContaining("UPNP_AddPortMapping: rc=0"));
  EXPECT_EQ(1, LogLinesContaining("UPNP_AddPortMapping: rc=0 TCP "
                                  "9003->127.0.0.1:9003 lease 0"));
  EXPECT_EQ(10, LogLinesContaining("UPNP_GetSpecificPortMappingEntry: rc=0"));
}

} // namespace
} // namespace zark::portmap
