// The mapping state file since version 2: each mapping's apply state,
// failure and verification time, the router's outside address and last job
// survive a write and a read; version 1 files are read with their held
// mappings on the router and the others pending. Pure.
#include "catalog/mapping_state.h"

#include <gtest/gtest.h>

#include <string>

namespace zark::portmap {
namespace {

TEST(PortMapCatalogMappingState, ApplyStatesAndTheLastJobRoundTrip) {
  MappingState state;
  RouterRecord &router = state.FindOrAdd("192.168.1.1", RouterProtocol::kUpnp);
  router.externalAddress = "100.64.1.2";
  router.lastJob = LastJob{
      "repair",           1700000100, false, 2, 3, 1, ZARK_FAILURE_CONFLICT,
      "tcp 8080 is taken"};
  RecordedMapping refused;
  refused.protocol = IpProtocol::kTcp;
  refused.externalPort = 8080;
  refused.internalPort = 80;
  refused.internalClient = "192.168.1.10";
  refused.ruleId = "web";
  refused.apply = MappingApply::kRefused;
  refused.failure = ZARK_FAILURE_CONFLICT;
  refused.reason = "held by 192.168.1.9:80 (\"game console\")";
  router.Put(refused);
  RecordedMapping held = refused;
  held.externalPort = 22;
  held.held = true;
  held.apply = MappingApply::kOnRouter;
  held.failure = ZARK_FAILURE_NONE;
  held.reason.clear();
  held.verified = 1700000050;
  router.Put(held);

  const std::string text = SerializeMappingState(state);
  EXPECT_NE(std::string::npos, text.find("\"version\" : 2"));
  EXPECT_NE(std::string::npos, text.find("\"state\" : \"refused\""));
  EXPECT_NE(std::string::npos, text.find("\"failure\" : \"conflict\""));
  MappingState read;
  std::string why;
  ASSERT_TRUE(ParseMappingState(text, read, why)) << why;
  EXPECT_EQ(state, read);
}

TEST(PortMapCatalogMappingState, VersionOneIsReadHeldOnTheRouterElsePending) {
  const std::string text =
      "{\"version\":1,\"routers\":[{\"gateway\":\"1.2.3.4\",\"protocol\":"
      "\"upnp\",\"location\":\"\",\"finite_leases\":false,\"mappings\":[{"
      "\"protocol\":\"tcp\",\"external_port\":80,\"internal_port\":80,"
      "\"internal_client\":\"1.2.3.5\",\"lease\":0,\"expires\":0,\"held\":"
      "true,\"rule_id\":\"1\"},{"
      "\"protocol\":\"udp\",\"external_port\":53,\"internal_port\":53,"
      "\"internal_client\":\"1.2.3.5\",\"lease\":0,\"expires\":0,\"held\":"
      "false,\"rule_id\":\"2\"}]}]}";
  MappingState state;
  std::string why;
  ASSERT_TRUE(ParseMappingState(text, state, why)) << why;
  ASSERT_EQ(1u, state.routers.size());
  const RouterRecord &router = state.routers[0];
  EXPECT_EQ("", router.externalAddress);
  EXPECT_FALSE(router.lastJob.has_value());
  ASSERT_EQ(2u, router.mappings.size());
  EXPECT_EQ(MappingApply::kOnRouter, router.mappings[0].apply);
  EXPECT_EQ(MappingApply::kPending, router.mappings[1].apply);
  EXPECT_EQ(0, router.mappings[0].verified);
}

TEST(PortMapCatalogMappingState, VersionTwoNeedsItsMembers) {
  // A version 2 mapping without "state".
  const std::string text =
      "{\"version\":2,\"routers\":[{\"gateway\":\"1.2.3.4\",\"protocol\":"
      "\"upnp\",\"location\":\"\",\"finite_leases\":false,"
      "\"external_address\":\"\",\"control_url\":\"\",\"service_type\":"
      "\"\",\"last_job\":null,\"mappings\":[{"
      "\"protocol\":\"tcp\",\"external_port\":80,\"internal_port\":80,"
      "\"internal_client\":\"1.2.3.5\",\"lease\":0,\"expires\":0,\"held\":"
      "true,\"rule_id\":\"1\",\"failure\":\"\",\"reason\":\"\","
      "\"verified\":0}]}]}";
  MappingState state;
  std::string why;
  EXPECT_FALSE(ParseMappingState(text, state, why));
  EXPECT_NE(std::string::npos, why.find("state"));
  // An unknown failure word.
  std::string unknown = text;
  unknown.replace(unknown.find("\"failure\":\"\""), 12,
                  "\"state\":\"pending\",\"failure\":\"gremlins\"");
  EXPECT_FALSE(ParseMappingState(unknown, state, why));
  EXPECT_NE(std::string::npos, why.find("gremlins"));
}

TEST(PortMapCatalogMappingState, LookupsFollowPutsRemovesAndDirectChanges) {
  RouterRecord router;
  for (uint16_t port = 1; port <= 2000; ++port) {
    RecordedMapping mapping;
    mapping.protocol = port % 2 == 0 ? IpProtocol::kTcp : IpProtocol::kUdp;
    mapping.externalPort = port;
    mapping.internalPort = port;
    mapping.internalClient = "10.0.0.2";
    router.Put(mapping);
  }
  ASSERT_EQ(2000u, router.mappings.size());
  ASSERT_NE(nullptr, router.Find(IpProtocol::kTcp, 1000));
  EXPECT_EQ(nullptr, router.Find(IpProtocol::kUdp, 1000));
  router.Remove(IpProtocol::kTcp, 2);
  EXPECT_EQ(nullptr, router.Find(IpProtocol::kTcp, 2));
  const RecordedMapping *last = router.Find(IpProtocol::kTcp, 2000);
  ASSERT_NE(nullptr, last);
  EXPECT_EQ(2000, last->externalPort);
  // A change made to the list itself is seen too.
  router.mappings.pop_back();
  RecordedMapping added;
  added.protocol = IpProtocol::kUdp;
  added.externalPort = 4000;
  router.mappings.push_back(added);
  EXPECT_EQ(nullptr, router.Find(IpProtocol::kTcp, 2000));
  ASSERT_NE(nullptr, router.Find(IpProtocol::kUdp, 4000));
  // Putting an existing port replaces it in place.
  added.internalPort = 7;
  router.Put(added);
  EXPECT_EQ(1999u, router.mappings.size());
  EXPECT_EQ(7, router.Find(IpProtocol::kUdp, 4000)->internalPort);
}

TEST(PortMapCatalogMappingState, TheFileCapHoldsEveryPortOfBothProtocols) {
  // A sample of 1000 refused mappings with long rule ids and reasons; the
  // whole state grows linearly from it.
  constexpr std::size_t kSample = 1000;
  MappingState state;
  RouterRecord &router = state.FindOrAdd("192.168.1.1", RouterProtocol::kUpnp);
  router.location = "http://192.168.1.1:5000/rootDesc.xml";
  for (std::size_t i = 0; i < kSample; ++i) {
    RecordedMapping mapping;
    mapping.protocol = IpProtocol::kTcp;
    mapping.externalPort = static_cast<uint16_t>(60000 + i);
    mapping.internalPort = mapping.externalPort;
    mapping.internalClient = "192.168.100.200";
    mapping.leaseSeconds = 4294967295u;
    mapping.expires = 9999999999;
    mapping.verified = 9999999999;
    mapping.ruleId = std::string(200, 'r');
    mapping.apply = MappingApply::kRefused;
    mapping.failure = ZARK_FAILURE_ROUTER_NOT_ANSWERING;
    mapping.reason = std::string(200, 'w');
    router.Put(mapping);
  }
  const std::size_t sampleBytes = SerializeMappingState(state).size();
  const std::size_t wholeBytes =
      sampleBytes / kSample * kMaxRecordedMappings + sampleBytes % kSample;
  EXPECT_LT(wholeBytes, kMaxMappingStateBytes)
      << sampleBytes << " bytes for " << kSample << " mappings";
  EXPECT_EQ(2u * 65535u, kMaxRecordedMappings);
}

} // namespace
} // namespace zark::portmap
