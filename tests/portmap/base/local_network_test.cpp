// Which hosts count as the local network: the check that keeps a forged
// UPnP description from sending our requests elsewhere. Pure functions.
#include "base/local_network.h"

#include <gtest/gtest.h>

#include <vector>

namespace zark::portmap {
namespace {

const std::vector<Ipv4Network> kLan = {{0xc0a80100u, 0xffffff00u}}; // /24
constexpr uint32_t kGateway = 0xc0a80101u;                          // .1

TEST(PortMapRouterLocalNetwork, ParsesDottedQuadsOnly) {
  EXPECT_EQ(0xc0a80101u, ParseIpv4("192.168.1.1"));
  EXPECT_EQ(0u, ParseIpv4("0.0.0.0"));
  EXPECT_FALSE(ParseIpv4(""));
  EXPECT_FALSE(ParseIpv4("192.168.1"));
  EXPECT_FALSE(ParseIpv4("192.168.1.1.1"));
  EXPECT_FALSE(ParseIpv4("192.168.1.256"));
  EXPECT_FALSE(ParseIpv4(" 192.168.1.1"));
  EXPECT_FALSE(ParseIpv4("router.lan"));
  EXPECT_FALSE(ParseIpv4("::1"));
  EXPECT_EQ("10.0.0.138", FormatIpv4(0x0a00008au));
}

TEST(PortMapRouterLocalNetwork, CutsTheHostAsMiniupnpcDoes) {
  EXPECT_EQ("192.168.1.1", UrlHost("http://192.168.1.1:5000/rootDesc.xml"));
  EXPECT_EQ("192.168.1.1", UrlHost("http://192.168.1.1/ctl"));
  EXPECT_EQ("router.lan", UrlHost("http://router.lan:80/ctl"));
  // "user@host" is not split: miniupnpc would look up the whole text.
  EXPECT_EQ("192.168.1.1@203.0.113.5",
            UrlHost("http://192.168.1.1@203.0.113.5/ctl"));
  EXPECT_FALSE(UrlHost("https://192.168.1.1/ctl"));
  EXPECT_FALSE(UrlHost("http://192.168.1.1"));
  EXPECT_FALSE(UrlHost("http://[fe80::1]:5000/ctl"));
  EXPECT_FALSE(UrlHost("/ctl/IPConn"));
}

TEST(PortMapRouterLocalNetwork, SameSubnetOrTheGatewayIsLocal) {
  EXPECT_TRUE(IsOnLocalNetwork("192.168.1.1", kLan, kGateway));
  EXPECT_TRUE(IsOnLocalNetwork("192.168.1.254", kLan, kGateway));
  EXPECT_TRUE(IsOnLocalNetwork("192.168.1.77", kLan, std::nullopt));
  EXPECT_FALSE(IsOnLocalNetwork("192.168.2.1", kLan, kGateway));
  EXPECT_FALSE(IsOnLocalNetwork("203.0.113.5", kLan, kGateway));
  EXPECT_FALSE(IsOnLocalNetwork("127.0.0.1", kLan, kGateway));
  // A gateway outside every subnet (a point-to-point link) still counts.
  EXPECT_TRUE(IsOnLocalNetwork("10.9.9.9", kLan, 0x0a090909u));
}

TEST(PortMapRouterLocalNetwork, NamesAndDefaultRoutesNeverCount) {
  EXPECT_FALSE(IsOnLocalNetwork("router.lan", kLan, kGateway));
  EXPECT_FALSE(IsOnLocalNetwork("", kLan, kGateway));
  const std::vector<Ipv4Network> anything = {{0, 0}};
  EXPECT_FALSE(IsOnLocalNetwork("203.0.113.5", anything, std::nullopt));
}

TEST(PortMapRouterLocalNetwork, UrlsAreJudgedByTheirHost) {
  EXPECT_TRUE(IsUrlOnLocalNetwork("http://192.168.1.1:5000/ctl/IPConn", kLan,
                                  kGateway));
  EXPECT_FALSE(IsUrlOnLocalNetwork("http://203.0.113.5:5000/ctl/IPConn", kLan,
                                   kGateway));
  EXPECT_FALSE(IsUrlOnLocalNetwork("http://192.168.1.1@203.0.113.5/ctl", kLan,
                                   kGateway));
  EXPECT_FALSE(IsUrlOnLocalNetwork("ftp://192.168.1.1/ctl", kLan, kGateway));
}

TEST(PortMapRouterLocalNetwork, FindsOurAddressTowardsAHost) {
  EXPECT_EQ("127.0.0.1", LocalAddressTowards("127.0.0.1"));
  EXPECT_FALSE(LocalAddressTowards("not an address"));
}

TEST(PortMapRouterLocalNetwork, InterfaceNetworksLeaveLoopbackOut) {
  for (const Ipv4Network &network : InterfaceNetworks()) {
    EXPECT_NE(0x7f000000u, network.address & 0xff000000u);
  }
}

} // namespace
} // namespace zark::portmap
