// Fuzz target of the NAT-PMP driver (natpmp.cpp over libnatpmp), with the
// fuzzer playing the router: every datagram that answers a request comes
// from the input, sent from 127.0.0.1 by the tests' fake router
// (fake_natpmp.h) playing a script, inside a private network namespace.
//
// Input: pieces separated by kPieceSeparator.
//   piece 0: the job, up to eight operations of three bytes: kind (add,
//            delete, external address, get one, list; modulo 5) and router
//            port (two bytes, big-endian; its low bit picks UDP).
//   piece 1...: the datagrams answering the requests, in order (an empty
//            piece sends nothing). After the last one every request is
//            refused with result 2.
//
// Besides not crashing or hanging, every operation keeps the interface's
// promises (drivers/router_driver.h, natpmp.h):
// - its outcome is one the operation documents;
// - an add answered kOk holds the port asked for with a lease above 0; an
//   add answered kConflict names the other port the router granted;
// - an external address answered kOk is a dotted quad;
// - reading or listing the table answers kUnsupported without a request.
#include "base/local_network.h"
#include "drivers/natpmp.h"
#include "fake_natpmp.h"
#include "fuzz_support.h"
#include "syslog_capture.h"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <optional>
#include <string>
#include <vector>

namespace {

using zark::fuzz::Require;
using namespace zark::portmap;

zark::test::FakeNatPmp *gRouter = nullptr;

bool OneOf(RouterOutcome outcome, std::initializer_list<RouterOutcome> set) {
  for (RouterOutcome allowed : set) {
    if (outcome == allowed) {
      return true;
    }
  }
  return false;
}

void RequireOutcome(const char *operation, const RouterResult &result,
                    std::initializer_list<RouterOutcome> set) {
  Require(OneOf(result.outcome, set),
          std::string(operation) + " answered outcome " +
              RouterOutcomeName(result.outcome) + ": " + result.message);
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***) {
  zark::fuzz::EnterPrivateNetworkOrDie();
  static zark::test::FakeNatPmp router;
  // Once an input's datagrams are used up, every request is refused:
  // version 0, opcode 128 + the request's, result 2 (not authorized), the
  // seconds since the start of epoch; a mapping reply's ports and lifetime
  // stay 0.
  router.SetHandler([](const zark::test::NatPmpRequest &request) {
    std::vector<uint8_t> refusal = {
        0, static_cast<uint8_t>(128 + request.opcode), 0, 2, 0, 0, 0, 1};
    refusal.resize(request.opcode == 0 ? 12 : 16, 0);
    return std::optional<std::vector<uint8_t>>(std::move(refusal));
  });
  gRouter = &router;
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  zark::test::ClearLogs();
  const std::vector<std::string_view> pieces =
      zark::fuzz::SplitPieces(zark::fuzz::AsText(data, size));
  std::vector<std::vector<uint8_t>> replies;
  for (std::size_t i = 1; i < pieces.size(); ++i) {
    replies.emplace_back(pieces[i].begin(), pieces[i].end());
  }
  gRouter->ResetRequests();
  gRouter->Script(std::move(replies));

  NatPmpOptions options;
  options.gateway = "127.0.0.1";
  options.port = gRouter->Port();
  // Short waits: a reply the driver does not take costs a whole wait.
  options.firstWait = std::chrono::milliseconds(5);
  options.tries = 3;
  options.lifetimeSeconds = 7200;
  NatPmpRouter router(options);

  zark::fuzz::InputReader job(pieces.empty() ? std::string_view() : pieces[0]);
  for (int operation = 0; operation < 8 && !job.Empty(); ++operation) {
    const uint8_t kind = job.Byte() % 5;
    const uint16_t port = job.Uint16();
    PortMapping mapping;
    mapping.protocol = (port & 1) != 0 ? IpProtocol::kUdp : IpProtocol::kTcp;
    mapping.externalPort = port;
    mapping.internalPort = static_cast<uint16_t>(port ^ 0x0101);
    mapping.internalClient = "192.168.77.2";
    switch (kind) {
    case 0: {
      const RouterResult added = router.AddPortMapping(mapping);
      RequireOutcome("AddPortMapping", added,
                     {RouterOutcome::kOk, RouterOutcome::kConflict,
                      RouterOutcome::kNotHeld, RouterOutcome::kRefused,
                      RouterOutcome::kNoAnswer, RouterOutcome::kBadReply,
                      RouterOutcome::kNoRouter, RouterOutcome::kFailed});
      if (added.Ok()) {
        Require(added.leaseSeconds > 0, "a mapping held with lease 0");
        Require(added.grantedExternalPort == 0,
                "kOk with another granted port");
      }
      if (added.outcome == RouterOutcome::kConflict) {
        Require(added.grantedExternalPort != mapping.externalPort,
                "a conflict naming the port asked for");
      }
      break;
    }
    case 1:
      RequireOutcome("DeletePortMapping", router.DeletePortMapping(mapping),
                     {RouterOutcome::kOk, RouterOutcome::kNotFound,
                      RouterOutcome::kRefused, RouterOutcome::kNoAnswer,
                      RouterOutcome::kBadReply, RouterOutcome::kNoRouter,
                      RouterOutcome::kFailed});
      break;
    case 2: {
      std::string address;
      const RouterResult got = router.GetExternalAddress(address);
      RequireOutcome("GetExternalAddress", got,
                     {RouterOutcome::kOk, RouterOutcome::kRefused,
                      RouterOutcome::kNoAnswer, RouterOutcome::kBadReply,
                      RouterOutcome::kNoRouter, RouterOutcome::kFailed});
      if (got.Ok()) {
        Require(ParseIpv4(address).has_value(),
                "an external address that is not IPv4: " + address);
      }
      break;
    }
    case 3: {
      const int before = gRouter->Requests();
      RouterMapping entry;
      Require(router.GetSpecificPortMapping(mapping.protocol, port, entry)
                          .outcome == RouterOutcome::kUnsupported &&
                  gRouter->Requests() == before,
              "NAT-PMP read a mapping");
      break;
    }
    default: {
      const int before = gRouter->Requests();
      std::vector<RouterMapping> entries;
      Require(router.ListMappings(entries).outcome ==
                      RouterOutcome::kUnsupported &&
                  entries.empty() && gRouter->Requests() == before,
              "NAT-PMP listed mappings");
      break;
    }
    }
  }
  return 0;
}
