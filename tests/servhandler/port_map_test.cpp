// The handler's TCP and UDP port maps: filling and testing ranges, port
// strings, and reducing port lists to the ports still free.
#include "RouterRuleServHandler.h"
#include "serv_test_env.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <stdexcept>
#include <string>

namespace {

using namespace zark::test;

// Runs f and returns the what() of the std::out_of_range it throws, or
// "no exception".
template <typename F> std::string OutOfRangeText(F f) {
  try {
    f();
  } catch (const std::out_of_range &e) {
    return e.what();
  }
  return "no exception";
}

// The standard bitset's messages start with the operation's name.
bool IsBitsetSet(const std::string &what) {
  return what.rfind("bitset::set", 0) == 0;
}
bool IsBitsetTest(const std::string &what) {
  return what.rfind("bitset::test", 0) == 0;
}

class ServHandlerPortMap : public ::testing::Test {
protected:
  void SetUp() override { ClearLogs(); }

  // Fills the TCP map from a port string of one or more items.
  void FillTcp(const std::string &ports) {
    SzList list = NewList();
    KLIBSZLIST *raw = list.release();
    ASSERT_GE(KLIBCStrSep(ports.c_str(), ",", &raw), 0);
    list.reset(raw);
    handler.FillPortMapByPorts(1, list.get());
  }

  // The ports from..to that are set in the TCP map.
  std::vector<int> TcpSet(int from, int to) {
    std::vector<int> set;
    for (int port = from; port <= to; ++port) {
      if (handler.CheckPort("tcp", port)) {
        set.push_back(port);
      }
    }
    return set;
  }

  RouterRuleServHandler handler;
};

TEST_F(ServHandlerPortMap, NewHandlerHasNoPortTaken) {
  for (int port : {0, 1, 80, 65535}) {
    EXPECT_EQ(handler.CheckPort("tcp", port), 0);
    EXPECT_EQ(handler.CheckPort("udp", port), 0);
  }
}

TEST_F(ServHandlerPortMap, SinglePortFillsThatPortOnly) {
  FillTcp("80");
  EXPECT_EQ(TcpSet(0, 65535), (std::vector<int>{80}));
  EXPECT_EQ(handler.CheckPort("udp", 80), 0);
}

TEST_F(ServHandlerPortMap, OpenEndedItemFillsItsFirstPortOnly) {
  FillTcp("80-");
  EXPECT_EQ(TcpSet(0, 65535), (std::vector<int>{80}));
}

TEST_F(ServHandlerPortMap, BackwardRangeFillsNothingAndTestsCovered) {
  FillTcp("90-80");
  EXPECT_TRUE(TcpSet(0, 65535).empty());
  EXPECT_TRUE(handler.CheckTCPBitSet(90, 80));
  SzList list = NewList({"90-80"});
  EXPECT_EQ(handler.CheckPfRulesByPorts(1, list.get()), 1);
}

TEST_F(ServHandlerPortMap, RangeFillsEveryPortInclusive) {
  FillTcp("8080-8082,1");
  EXPECT_EQ(TcpSet(0, 65535), (std::vector<int>{1, 8080, 8081, 8082}));
}

TEST_F(ServHandlerPortMap, LastPortFills) {
  FillTcp("65535");
  EXPECT_EQ(TcpSet(65000, 65535), (std::vector<int>{65535}));
}

TEST_F(ServHandlerPortMap, PortPastTheEndThrowsBitsetSet) {
  EXPECT_TRUE(IsBitsetSet(OutOfRangeText([&] { FillTcp("65536"); })));
  EXPECT_TRUE(TcpSet(0, 65535).empty());
}

TEST_F(ServHandlerPortMap, RangeRunningPastTheEndSetsUpTo65535ThenThrows) {
  EXPECT_TRUE(IsBitsetSet(OutOfRangeText([&] { FillTcp("65530-65540"); })));
  EXPECT_EQ(TcpSet(65000, 65535),
            (std::vector<int>{65530, 65531, 65532, 65533, 65534, 65535}));
}

TEST_F(ServHandlerPortMap, ItemsAreCutTo15Characters) {
  // Read as 10000-200000000: 10000..65535 are set, then the fill fails.
  EXPECT_TRUE(
      IsBitsetSet(OutOfRangeText([&] { FillTcp("10000-200000000000"); })));
  EXPECT_EQ(handler.CheckPort("tcp", 9999), 0);
  EXPECT_TRUE(handler.CheckTCPBitSet(10000, 65535));
}

TEST_F(ServHandlerPortMap, CutCanChangeAnItemsMeaning) {
  // The first 15 characters are "00000000000080-": the port 80 alone.
  FillTcp("00000000000080-90");
  EXPECT_EQ(TcpSet(0, 65535), (std::vector<int>{80}));
}

TEST_F(ServHandlerPortMap, NumbersAreReadAsStrtolReadsThem) {
  // Leading blanks skipped, reading stops at a non-digit, no digit is 0,
  // an empty first part is 0.
  FillTcp(" 21,22abc,xyz,-3");
  EXPECT_EQ(TcpSet(0, 65535), (std::vector<int>{0, 1, 2, 3, 21, 22}));
}

TEST_F(ServHandlerPortMap, HugeNumbersStayOutOfRangeInsteadOfWrapping) {
  // 4294967376 is 2^32 + 80: it must not come out as port 80.
  EXPECT_TRUE(IsBitsetSet(OutOfRangeText([&] { FillTcp("4294967376"); })));
  EXPECT_TRUE(IsBitsetSet(OutOfRangeText([&] { FillTcp("80-4294967376"); })));
  EXPECT_EQ(handler.CheckPort("tcp", 79), 0);
  EXPECT_TRUE(handler.CheckTCPBitSet(80, 65535));
}

TEST_F(ServHandlerPortMap, NegativeFirstPortThrowsBeforeSettingAnything) {
  EXPECT_TRUE(
      IsBitsetSet(OutOfRangeText([&] { handler.FillTCPBitSet(-1, 5); })));
  EXPECT_TRUE(TcpSet(0, 65535).empty());
  EXPECT_TRUE(
      IsBitsetSet(OutOfRangeText([&] { handler.FillUDPBitSet(-7, -7); })));
}

TEST_F(ServHandlerPortMap, CheckOfAnEmptyRangeIsTrue) {
  EXPECT_TRUE(handler.CheckTCPBitSet(5, 4));
  EXPECT_TRUE(handler.CheckUDPBitSet(5, 4));
}

TEST_F(ServHandlerPortMap, CheckFromANegativePortThrowsBitsetTest) {
  EXPECT_TRUE(
      IsBitsetTest(OutOfRangeText([&] { handler.CheckTCPBitSet(-1, 3); })));
  EXPECT_TRUE(
      IsBitsetTest(OutOfRangeText([&] { handler.CheckUDPBitSet(-1, 3); })));
}

TEST_F(ServHandlerPortMap, CheckPastTheEndIsFalseWhileAPortIsClear) {
  handler.FillTCPBitSet(65530, 65534);
  EXPECT_FALSE(handler.CheckTCPBitSet(65530, 65540));
  handler.FillTCPBitSet(65535, 65535);
  EXPECT_TRUE(IsBitsetTest(
      OutOfRangeText([&] { handler.CheckTCPBitSet(65530, 65540); })));
}

TEST_F(ServHandlerPortMap, CheckStopsAtTheFirstClearPort) {
  handler.FillUDPBitSet(100, 200);
  EXPECT_TRUE(handler.CheckUDPBitSet(100, 200));
  EXPECT_FALSE(handler.CheckUDPBitSet(99, 200));
  EXPECT_FALSE(handler.CheckUDPBitSet(100, 201));
  EXPECT_FALSE(handler.CheckTCPBitSet(100, 200));
}

TEST_F(ServHandlerPortMap, CheckPortOutsideThePortSpaceThrowsBitsetTest) {
  EXPECT_TRUE(
      IsBitsetTest(OutOfRangeText([&] { handler.CheckPort("tcp", 65536); })));
  EXPECT_TRUE(
      IsBitsetTest(OutOfRangeText([&] { handler.CheckPort("udp", -1); })));
}

TEST_F(ServHandlerPortMap, FillByNullListFailsWithLog) {
  EXPECT_EQ(handler.FillPortMapByPorts(3, nullptr), -1);
  EXPECT_TRUE(HasServLog("pslPorts should not be null"));
}

TEST_F(ServHandlerPortMap, FillByListHonoursTheMask) {
  SzList list = NewList({"10", "20-21"});
  EXPECT_EQ(handler.FillPortMapByPorts(2, list.get()), 0);
  EXPECT_FALSE(handler.CheckTCPBitSet(10, 10));
  EXPECT_TRUE(handler.CheckUDPBitSet(20, 21));
  EXPECT_EQ(handler.FillPortMapByPorts(3, list.get()), 0);
  EXPECT_TRUE(handler.CheckTCPBitSet(20, 21));
  EXPECT_TRUE(handler.CheckTCPBitSet(10, 10));
  SzList other = NewList({"30"});
  EXPECT_EQ(handler.FillPortMapByPorts(0, other.get()), 0);
  EXPECT_EQ(handler.CheckPort("tcp", 30) + handler.CheckPort("udp", 30), 0);
}

TEST_F(ServHandlerPortMap, FillByTwoStringsFillsTcpThenUdp) {
  EXPECT_EQ(handler.FillPortMapByPorts("80,443", "53,1000-1001"), 0);
  EXPECT_EQ(TcpSet(0, 65535), (std::vector<int>{80, 443}));
  EXPECT_TRUE(handler.CheckUDPBitSet(1000, 1001));
  EXPECT_EQ(handler.CheckPort("udp", 53), 1);
  EXPECT_EQ(handler.CheckPort("udp", 80), 0);
  EXPECT_EQ(handler.FillPortMapByPorts("", ""), 0);
  EXPECT_TRUE(CapturedLogs().empty());
}

TEST_F(ServHandlerPortMap, FilterOutPortsGivesTheFreeRuns) {
  handler.FillTCPBitSet(8082, 8082);
  std::string out;
  handler.FilterOutPorts("tcp", 8080, 8085, out);
  EXPECT_EQ(out, "8080-8081,8083-8085");
}

TEST_F(ServHandlerPortMap, FilterOutPortsWithEveryPortTakenLeavesOutAlone) {
  handler.FillTCPBitSet(8080, 8085);
  std::string out = "21";
  handler.FilterOutPorts("tcp", 8080, 8085, out);
  EXPECT_EQ(out, "21");
  std::string empty;
  handler.FilterOutPorts("tcp", 8080, 8085, empty);
  EXPECT_EQ(empty, "");
}

TEST_F(ServHandlerPortMap, FilterOutPortsWithNothingTakenAppendsOneRun) {
  std::string out;
  handler.FilterOutPorts("tcp", 8080, 8085, out);
  EXPECT_EQ(out, "8080-8085");
  handler.FilterOutPorts("tcp", 22, 22, out);
  EXPECT_EQ(out, "8080-8085,22");
}

TEST_F(ServHandlerPortMap, FilterOutPortsOfABackwardRangeAppendsNothing) {
  std::string out = "x";
  handler.FilterOutPorts("udp", 9, 1, out);
  EXPECT_EQ(out, "x");
}

TEST_F(ServHandlerPortMap, FilterOutPortsRunsEndWhereTakenPortsStart) {
  handler.FillUDPBitSet(0, 0);
  handler.FillUDPBitSet(3, 4);
  handler.FillUDPBitSet(65535, 65535);
  std::string out;
  handler.FilterOutPorts("udp", 0, 6, out);
  EXPECT_EQ(out, "1-2,5-6");
  out.clear();
  handler.FilterOutPorts("udp", 65530, 65535, out);
  EXPECT_EQ(out, "65530-65534");
}

TEST_F(ServHandlerPortMap, RemoveConflictPortOfAnEmptyListIsEmpty) {
  SzList list = NewList();
  std::string out = "stale";
  EXPECT_EQ(handler.RemoveConflictPort("tcp", list.get(), out), 0);
  EXPECT_EQ(out, "");
}

TEST_F(ServHandlerPortMap, RemoveConflictPortOfANullListLeavesOutAlone) {
  std::string out = "stale";
  EXPECT_EQ(handler.RemoveConflictPort("tcp", nullptr, out), -1);
  EXPECT_EQ(out, "stale");
}

TEST_F(ServHandlerPortMap, RemoveConflictPortKeepsListOrderAndDropsTakenItems) {
  handler.FillTCPBitSet(80, 80);
  handler.FillTCPBitSet(8082, 8082);
  SzList list = NewList({"8080-8085", "80", "443", "22-"});
  std::string out;
  EXPECT_EQ(handler.RemoveConflictPort("tcp", list.get(), out), 0);
  EXPECT_EQ(out, "8080-8081,8083-8085,443,22");
}

TEST_F(ServHandlerPortMap, ProtocolTextsOtherThanTcpSelectTheUdpMap) {
  handler.FillUDPBitSet(53, 53);
  for (const char *proto : {"TCP", "udp", "", "both", "tcp "}) {
    EXPECT_EQ(handler.CheckPort(proto, 53), 1) << "[" << proto << "]";
    std::string out;
    handler.FilterOutPorts(proto, 52, 54, out);
    EXPECT_EQ(out, "52,54") << "[" << proto << "]";
    SzList list = NewList({"53"});
    EXPECT_EQ(handler.RemoveConflictPort(proto, list.get(), out), 0);
    EXPECT_EQ(out, "") << "[" << proto << "]";
  }
  EXPECT_EQ(handler.CheckPort("tcp", 53), 0);
  std::string out;
  handler.FilterOutPorts("tcp", 52, 54, out);
  EXPECT_EQ(out, "52-54");
}

} // namespace
