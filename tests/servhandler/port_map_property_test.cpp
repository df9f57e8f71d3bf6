// Property tests of the port maps against a plain std::set reference, over
// random port maps and port lists (fixed seed, so a failure reproduces; the
// seed can be changed with ZARK_PROPERTY_SEED).
#include "RouterRuleServHandler.h"
#include "serv_test_env.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <random>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

namespace {

using namespace zark::test;

constexpr int kCases = 10000;
constexpr int kLastPort = 65535;

unsigned Seed() {
  const char *text = std::getenv("ZARK_PROPERTY_SEED");
  return text ? static_cast<unsigned>(std::strtoul(text, nullptr, 10))
              : 20240611u;
}

// A window of the port space where a case happens; windows at both ends of
// the port space come up often, so that 0 and 65535 get their share.
struct Window {
  int low;
  int high;
};

Window RandomWindow(std::mt19937 &rng) {
  std::uniform_int_distribution<int> width(1, 200);
  std::uniform_int_distribution<int> where(0, 9);
  int w = width(rng);
  int kind = where(rng);
  if (kind == 0) {
    return {0, w};
  }
  if (kind == 1) {
    return {kLastPort - w, kLastPort};
  }
  std::uniform_int_distribution<int> low(0, kLastPort - w);
  int l = low(rng);
  return {l, l + w};
}

int RandomIn(std::mt19937 &rng, int low, int high) {
  return std::uniform_int_distribution<int>(low, high)(rng);
}

// The free ports of first..last as maximal runs, "%d" or "%d-%d", joined
// with ",".
std::string ReferenceRuns(const std::set<int> &taken, int first, int last) {
  std::string out;
  int runStart = -1;
  auto close = [&](int end) {
    if (!out.empty()) {
      out += ",";
    }
    out += runStart == end
               ? std::to_string(end)
               : std::to_string(runStart) + "-" + std::to_string(end);
    runStart = -1;
  };
  for (int port = first; port <= last; ++port) {
    bool isTaken = taken.count(port) > 0;
    if (!isTaken && runStart < 0) {
      runStart = port;
    } else if (isTaken && runStart >= 0) {
      close(port - 1);
    }
  }
  if (runStart >= 0) {
    close(last);
  }
  return out;
}

// Expands "a,b-c" (the handler's output) into its ports, in order.
std::vector<int> Expand(const std::string &ports) {
  std::vector<int> out;
  size_t start = 0;
  while (start < ports.size()) {
    size_t comma = ports.find(',', start);
    std::string item = ports.substr(start, comma - start);
    size_t dash = item.find('-');
    int first = std::stoi(item.substr(0, dash));
    int last =
        dash == std::string::npos ? first : std::stoi(item.substr(dash + 1));
    for (int port = first; port <= last; ++port) {
      out.push_back(port);
    }
    if (comma == std::string::npos) {
      break;
    }
    start = comma + 1;
  }
  return out;
}

// Marks a random set of ports of the window in one map of the handler and
// in the reference.
std::set<int> RandomTaken(std::mt19937 &rng, const Window &window,
                          RouterRuleServHandler &handler, bool tcp) {
  std::set<int> taken;
  std::bernoulli_distribution density(RandomIn(rng, 0, 100) / 100.0);
  for (int port = window.low; port <= window.high; ++port) {
    if (density(rng)) {
      taken.insert(port);
      tcp ? handler.FillTCPBitSet(port, port)
          : handler.FillUDPBitSet(port, port);
    }
  }
  return taken;
}

// A random item in the window, in one of the forms "a", "a-b", "a-" (b may
// lie before a).
std::string RandomItem(std::mt19937 &rng, const Window &window, int &first,
                       int &last) {
  first = RandomIn(rng, window.low, window.high);
  switch (RandomIn(rng, 0, 3)) {
  case 0:
    last = first;
    return std::to_string(first);
  case 1:
    last = first;
    return std::to_string(first) + "-";
  default:
    last = RandomIn(rng, window.low, window.high);
    return std::to_string(first) + "-" + std::to_string(last);
  }
}

TEST(ServHandlerProperty, RemoveConflictPortGivesTheFreePortsAsMaximalRuns) {
  std::mt19937 rng(Seed());
  for (int round = 0; round < kCases; ++round) {
    RouterRuleServHandler handler;
    Window window = RandomWindow(rng);
    bool tcp = RandomIn(rng, 0, 1) == 0;
    std::set<int> taken = RandomTaken(rng, window, handler, tcp);

    SzList list = NewList();
    KLIBSZLIST *raw = list.release();
    std::string expected;
    std::vector<int> expectedPorts;
    int items = RandomIn(rng, 0, 8);
    for (int i = 0; i < items; ++i) {
      int first = 0;
      int last = 0;
      std::string item = RandomItem(rng, window, first, last);
      ASSERT_GE(KLIBCSzListPush(&raw, item.c_str()), 0);
      std::string runs = ReferenceRuns(taken, first, last);
      if (!runs.empty()) {
        expected += (expected.empty() ? "" : ",") + runs;
      }
      for (int port = first; port <= last; ++port) {
        if (!taken.count(port)) {
          expectedPorts.push_back(port);
        }
      }
    }
    list.reset(raw);

    std::string out = "stale";
    ASSERT_EQ(handler.RemoveConflictPort(tcp ? "tcp" : "udp", list.get(), out),
              0);
    ASSERT_EQ(out, expected) << "round " << round << " seed " << Seed();
    // The same, said independently of the run formatting: exactly the free
    // ports of the list, in list order.
    ASSERT_EQ(Expand(out), expectedPorts) << "round " << round;
  }
}

TEST(ServHandlerProperty, FilterAndCheckAgreeWithASetOfPorts) {
  std::mt19937 rng(Seed() + 1);
  for (int round = 0; round < kCases; ++round) {
    RouterRuleServHandler handler;
    Window window = RandomWindow(rng);
    std::set<int> tcpTaken;
    std::set<int> udpTaken;
    // Fill random ranges, some backwards (no effect), into random maps.
    int fills = RandomIn(rng, 0, 6);
    for (int i = 0; i < fills; ++i) {
      int first = RandomIn(rng, window.low, window.high);
      int last = RandomIn(rng, window.low, window.high);
      int mask = RandomIn(rng, 1, 3);
      for (int port = first; port <= last; ++port) {
        if (mask & 1) {
          tcpTaken.insert(port);
        }
        if (mask & 2) {
          udpTaken.insert(port);
        }
      }
      if (mask & 1) {
        handler.FillTCPBitSet(first, last);
      }
      if (mask & 2) {
        handler.FillUDPBitSet(first, last);
      }
    }

    for (int query = 0; query < 4; ++query) {
      int first = RandomIn(rng, window.low, window.high);
      int last = RandomIn(rng, window.low, window.high);
      bool tcp = RandomIn(rng, 0, 1) == 0;
      const std::set<int> &taken = tcp ? tcpTaken : udpTaken;

      bool covered = true;
      for (int port = first; port <= last; ++port) {
        covered = covered && taken.count(port) > 0;
      }
      bool checked = tcp ? handler.CheckTCPBitSet(first, last)
                         : handler.CheckUDPBitSet(first, last);
      ASSERT_EQ(checked, covered)
          << "round " << round << " " << first << ".." << last;

      std::string out;
      handler.FilterOutPorts(tcp ? "tcp" : "udp", first, last, out);
      ASSERT_EQ(out, ReferenceRuns(taken, first, last)) << "round " << round;

      ASSERT_EQ(handler.CheckPort(tcp ? "tcp" : "udp", first),
                taken.count(first) ? 1 : 0);
    }
  }
}

TEST(ServHandlerProperty, RangesPastTheEndFailLikeTheBoundedBitset) {
  std::mt19937 rng(Seed() + 2);
  for (int round = 0; round < kCases; ++round) {
    RouterRuleServHandler handler;
    int first = RandomIn(rng, kLastPort - 40, kLastPort);
    int last = RandomIn(rng, kLastPort + 1, kLastPort + 40);
    int preset = RandomIn(rng, kLastPort - 40, kLastPort + 1);
    // Ports preset..65535 are taken beforehand (none when preset is past).
    if (preset <= kLastPort) {
      handler.FillUDPBitSet(preset, kLastPort);
    }
    // A check throws only when every port first..65535 is taken, else it
    // answers false.
    bool allTaken = preset <= first;
    if (allTaken) {
      ASSERT_THROW(handler.CheckUDPBitSet(first, last), std::out_of_range);
    } else {
      ASSERT_FALSE(handler.CheckUDPBitSet(first, last));
    }
    // A fill marks first..65535 and then throws.
    ASSERT_THROW(handler.FillTCPBitSet(first, last), std::out_of_range);
    ASSERT_TRUE(handler.CheckTCPBitSet(first, kLastPort));
    ASSERT_FALSE(handler.CheckTCPBitSet(first - 1, first - 1));
  }
}

} // namespace
