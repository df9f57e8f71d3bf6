// The mapping state's file text: what is written is read back the same,
// and anything else is refused. Pure.
#include "catalog/mapping_state.h"

#include <gtest/gtest.h>

#include <string>

namespace zark::portmap {
namespace {

MappingState Sample() {
  MappingState state;
  RouterRecord &upnp = state.FindOrAdd("192.168.1.1", RouterProtocol::kUpnp);
  upnp.location = "http://192.168.1.1:5000/rootDesc.xml";
  upnp.finiteLeases = true;
  upnp.Put({IpProtocol::kTcp, 8080, 80, "192.168.1.10", 3600, 1700003600, true,
            "1"});
  upnp.Put({IpProtocol::kUdp, 5000, 5000, "192.168.1.10", 0, 0, false,
            "rule \"two\""});
  RouterRecord &natpmp = state.FindOrAdd("10.0.0.1", RouterProtocol::kNatPmp);
  natpmp.Put(
      {IpProtocol::kTcp, 22, 2222, "10.0.0.5", 7200, 1700007200, true, "ssh"});
  return state;
}

TEST(PortMapRouterMappingState, RoundTrips) {
  MappingState state = Sample();
  std::string text = SerializeMappingState(state);
  MappingState read;
  std::string why;
  ASSERT_TRUE(ParseMappingState(text, read, why)) << why;
  EXPECT_EQ(state, read);
}

TEST(PortMapRouterMappingState, RecordsAreFoundByGatewayAndProtocol) {
  MappingState state = Sample();
  ASSERT_NE(nullptr, state.Find("192.168.1.1", RouterProtocol::kUpnp));
  EXPECT_EQ(nullptr, state.Find("192.168.1.1", RouterProtocol::kNatPmp));
  RouterRecord *record = state.Find("192.168.1.1", RouterProtocol::kUpnp);
  ASSERT_NE(nullptr, record->Find(IpProtocol::kUdp, 5000));
  EXPECT_EQ(nullptr, record->Find(IpProtocol::kTcp, 5000));
  record->Remove(IpProtocol::kUdp, 5000);
  EXPECT_EQ(nullptr, record->Find(IpProtocol::kUdp, 5000));
  record->Put({IpProtocol::kTcp, 8080, 81, "192.168.1.10", 0, 0, true, "1"});
  EXPECT_EQ(1u, record->mappings.size());
  EXPECT_EQ(81, record->mappings[0].internalPort);
}

TEST(PortMapRouterMappingState, DropsOnlyRecordsWithNothingToRemember) {
  MappingState state;
  state.FindOrAdd("192.168.1.1", RouterProtocol::kUpnp).location = "http://x/";
  state.FindOrAdd("192.168.1.1", RouterProtocol::kNatPmp);
  state.DropEmpty();
  ASSERT_EQ(1u, state.routers.size());
  EXPECT_EQ(RouterProtocol::kUpnp, state.routers[0].protocol);
}

TEST(PortMapRouterMappingState, RefusesWhatItDoesNotWrite) {
  const char *const bad[] = {
      "",
      "{",
      "[]",
      "{\"version\": 3, \"routers\": []}",
      "{\"version\": 1}",
      "{\"version\": 1, \"routers\": {}}",
      // a comment
      "{\"version\": 1, \"routers\": []} // x",
      // a port out of range
      "{\"version\":1,\"routers\":[{\"gateway\":\"1.2.3.4\",\"protocol\":"
      "\"upnp\",\"location\":\"\",\"finite_leases\":false,\"mappings\":[{"
      "\"protocol\":\"tcp\",\"external_port\":70000,\"internal_port\":80,"
      "\"internal_client\":\"1.2.3.5\",\"lease\":0,\"expires\":0,\"held\":"
      "true,\"rule_id\":\"1\"}]}]}",
      // a protocol in capitals
      "{\"version\":1,\"routers\":[{\"gateway\":\"1.2.3.4\",\"protocol\":"
      "\"upnp\",\"location\":\"\",\"finite_leases\":false,\"mappings\":[{"
      "\"protocol\":\"TCP\",\"external_port\":80,\"internal_port\":80,"
      "\"internal_client\":\"1.2.3.5\",\"lease\":0,\"expires\":0,\"held\":"
      "true,\"rule_id\":\"1\"}]}]}",
      // a gateway that is not an address
      "{\"version\":1,\"routers\":[{\"gateway\":\"router\",\"protocol\":"
      "\"upnp\",\"location\":\"\",\"finite_leases\":false,\"mappings\":[]}]}",
      // held as a number
      "{\"version\":1,\"routers\":[{\"gateway\":\"1.2.3.4\",\"protocol\":"
      "\"upnp\",\"location\":\"\",\"finite_leases\":false,\"mappings\":[{"
      "\"protocol\":\"tcp\",\"external_port\":80,\"internal_port\":80,"
      "\"internal_client\":\"1.2.3.5\",\"lease\":0,\"expires\":0,\"held\":"
      "1,\"rule_id\":\"1\"}]}]}",
      // the same router twice
      "{\"version\":1,\"routers\":[{\"gateway\":\"1.2.3.4\",\"protocol\":"
      "\"upnp\",\"location\":\"\",\"finite_leases\":false,\"mappings\":[]},"
      "{\"gateway\":\"1.2.3.4\",\"protocol\":\"upnp\",\"location\":\"\","
      "\"finite_leases\":false,\"mappings\":[]}]}",
  };
  for (const char *text : bad) {
    MappingState state = Sample();
    std::string why;
    EXPECT_FALSE(ParseMappingState(text, state, why)) << text;
    EXPECT_FALSE(why.empty()) << text;
    EXPECT_EQ(Sample(), state) << "a refused text changes nothing";
  }
}

TEST(PortMapRouterMappingState, IgnoresMembersItDoesNotKnow) {
  std::string text =
      "{\"version\":1,\"later\":true,\"routers\":[{\"gateway\":\"1.2.3.4\","
      "\"protocol\":\"natpmp\",\"location\":\"1.2.3.4\",\"finite_leases\":"
      "true,\"extra\":[1],\"mappings\":[]}]}";
  MappingState state;
  std::string why;
  ASSERT_TRUE(ParseMappingState(text, state, why)) << why;
  ASSERT_EQ(1u, state.routers.size());
  EXPECT_EQ(RouterProtocol::kNatPmp, state.routers[0].protocol);
}

} // namespace
} // namespace zark::portmap
