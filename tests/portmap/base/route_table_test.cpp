// Picking the default gateway out of /proc/net/route texts.
#include "base/local_network.h"
#include "base/route_table.h"
#include "libzarkportmap.h"

#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <arpa/inet.h>

#include <fstream>
#include <sstream>
#include <string>
#include <vector>

namespace {

using zark::portmap::FormatIpv4;
using zark::portmap::ParseDefaultGateway;

const std::string kTitle = "Iface\tDestination\tGateway \tFlags\tRefCnt\tUse\t"
                           "Metric\tMask\t\tMTU\tWindow\tIRTT              \n";

std::string Gateway(const std::string &table) {
  auto gateway = ParseDefaultGateway(table);
  return gateway ? FormatIpv4(ntohl(*gateway)) : "none";
}

TEST(PortMapGatewayRoute, OneDefaultRoute) {
  // A typical table: a default route via 192.168.1.1 and the local subnet.
  std::string table =
      kTitle +
      "eth0\t00000000\t0101A8C0\t0003\t0\t0\t100\t00000000\t0\t0\t0   \n"
      "eth0\t0001A8C0\t00000000\t0001\t0\t0\t100\t00FFFFFF\t0\t0\t0   \n";
  EXPECT_EQ("192.168.1.1", Gateway(table));
}

TEST(PortMapGatewayRoute, NoDefaultRoute) {
  std::string table =
      kTitle +
      "eth0\t0001A8C0\t00000000\t0001\t0\t0\t100\t00FFFFFF\t0\t0\t0\n"
      "eth0\t0000FEA9\t00000000\t0001\t0\t0\t1000\t0000FFFF\t0\t0\t0\n";
  EXPECT_EQ("none", Gateway(table));
  EXPECT_EQ("none", Gateway(kTitle));
  EXPECT_EQ("none", Gateway(""));
}

TEST(PortMapGatewayRoute, LowestMetricWins) {
  std::string table =
      kTitle + "wlan0\t00000000\t0100000A\t0003\t0\t0\t600\t00000000\t0\t0\t0\n"
               "eth0\t00000000\t0101A8C0\t0003\t0\t0\t100\t00000000\t0\t0\t0\n"
               "eth1\t00000000\t0102A8C0\t0003\t0\t0\t300\t00000000\t0\t0\t0\n";
  EXPECT_EQ("192.168.1.1", Gateway(table));
}

TEST(PortMapGatewayRoute, EqualMetricsKeepTheFirst) {
  std::string table =
      kTitle + "eth1\t00000000\t0102A8C0\t0003\t0\t0\t100\t00000000\t0\t0\t0\n"
               "eth0\t00000000\t0101A8C0\t0003\t0\t0\t100\t00000000\t0\t0\t0\n";
  EXPECT_EQ("192.168.2.1", Gateway(table));
}

TEST(PortMapGatewayRoute, RoutesThatAreNotUsableDefaultsAreSkipped) {
  std::string table =
      kTitle +
      // Down (no RTF_UP), though its metric is lowest.
      "eth2\t00000000\t0103A8C0\t0002\t0\t0\t0\t00000000\t0\t0\t0\n"
      // No RTF_GATEWAY.
      "eth3\t00000000\t0104A8C0\t0001\t0\t0\t1\t00000000\t0\t0\t0\n"
      // Gateway 0.0.0.0.
      "eth4\t00000000\t00000000\t0003\t0\t0\t2\t00000000\t0\t0\t0\n"
      // Destination 0 but a mask: 0.0.0.0/8, not a default route.
      "eth5\t00000000\t0105A8C0\t0003\t0\t0\t3\t000000FF\t0\t0\t0\n"
      // The usable one.
      "eth0\t00000000\t0101A8C0\t0003\t0\t0\t100\t00000000\t0\t0\t0\n";
  EXPECT_EQ("192.168.1.1", Gateway(table));
}

TEST(PortMapGatewayRoute, MalformedLinesAreSkipped) {
  std::string table =
      kTitle + "\n" + "garbage\n" + "eth9\t00000000\t0109A8C0\n" +
      "eth8\tZZZZZZZZ\t0108A8C0\t0003\t0\t0\t1\t00000000\t0\t0\t0\n" +
      "eth7\t00000000\t0107A8C0\t0003\t0\t0\t-1\t00000000\t0\t0\t0\n" +
      "eth6\t00000000\t0106A8C0xx\t0003\t0\t0\t1\t00000000\t0\t0\t0\n" +
      "eth5\t00000000\t1FFFFFFFF\t0003\t0\t0\t1\t00000000\t0\t0\t0\n" +
      "eth4\t00000000\t0104A8C0\t0003\t0\t0\t99999999999999999999999\t00000000"
      "\t0\t0\t0\n" +
      "eth0\t00000000\t0101A8C0\t0003\t0\t0\t100\t00000000\t0\t0\t0";
  EXPECT_EQ("192.168.1.1", Gateway(table));
}

TEST(PortMapGatewayRoute, TheTitleLineIsNeverARoute) {
  // A table whose first line looks like a route: it is still the title.
  std::string table =
      "eth1\t00000000\t0102A8C0\t0003\t0\t0\t1\t00000000\t0\t0\t0\n"
      "eth0\t00000000\t0101A8C0\t0003\t0\t0\t100\t00000000\t0\t0\t0\n";
  EXPECT_EQ("192.168.1.1", Gateway(table));
}

TEST(PortMapGatewayRoute, CarriageReturnsAndSpaces) {
  std::string table =
      kTitle + "eth0 00000000 0A00A8C0 0003 0 0 5 00000000 0 0 0\r\n";
  EXPECT_EQ("192.168.0.10", Gateway(table));
}

TEST(PortMapGatewayRoute, GetGatewayIPMatchesTheMachinesTable) {
  std::ifstream in(zark::portmap::kRouteTablePath);
  std::stringstream content;
  content << in.rdbuf();
  auto expected = ParseDefaultGateway(content.str());

  char buf[1024] = "untouched";
  int rc = KLibGetGatewayIP(buf, sizeof(buf));
  if (expected) {
    EXPECT_EQ(0, rc);
    EXPECT_EQ(FormatIpv4(ntohl(*expected)), buf);
  } else {
    EXPECT_EQ(-1, rc);
    EXPECT_TRUE(zark::test::HasLogContaining("no default IPv4 route"));
  }
}

TEST(PortMapGatewayRoute, GetGatewayIPRefusesASmallBuffer) {
  char tiny[7] = "xxxxxx"; // "1.1.1.1" needs 8 bytes, the shortest address
  EXPECT_EQ(-1, KLibGetGatewayIP(tiny, sizeof(tiny)));
  EXPECT_EQ(-1, KLibGetGatewayIP(nullptr, 1024));
  char buf[16];
  EXPECT_EQ(-1, KLibGetGatewayIP(buf, 0));
  EXPECT_EQ(-1, KLibGetGatewayIP(buf, -5));
}

TEST(PortMapGatewayRoute, GatewayIsTheFirstOfTheDefaultRoutes) {
  // One parser serves both: the gateway is the first route's, in network
  // byte order, and the routes come lowest metric first.
  std::string table =
      kTitle + "wlan0\t00000000\t0100000A\t0003\t0\t0\t600\t00000000\t0\t0\t0\n"
               "eth0\t00000000\t0101A8C0\t0003\t0\t0\t100\t00000000\t0\t0\t0\n"
               "eth1\t0000A8C0\t00000000\t0001\t0\t0\t0\t0000FFFF\t0\t0\t0\n";
  const std::vector<zark::portmap::DefaultRoute> routes =
      zark::portmap::ParseDefaultRoutes(table);
  ASSERT_EQ(routes.size(), 2U);
  EXPECT_EQ(routes[0].interface, "eth0");
  EXPECT_EQ(routes[0].gateway, 0xC0A80101U);
  EXPECT_EQ(routes[0].metric, 100U);
  EXPECT_EQ(routes[1].interface, "wlan0");
  EXPECT_EQ(routes[1].gateway, 0x0A000001U);
  EXPECT_EQ(ParseDefaultGateway(table), htonl(routes[0].gateway));
}

} // namespace
