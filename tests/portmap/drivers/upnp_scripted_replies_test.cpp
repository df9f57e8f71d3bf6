// The UPnP driver against the fake IGD's scripted misbehaviour: replies
// that arrive a few bytes at a time, a script that answers the next
// requests before the router does, raw responses that lie about their
// length, and a description fetch that is refused.
#include "drivers/upnp.h"

#include "fake_igd.h"
#include "upnp_driver_options.h"

#include <gtest/gtest.h>

#include <chrono>
#include <string>
#include <vector>

namespace zark::portmap {
namespace {

using test::FakeIgd;
using test::HttpReply;
using test::SoapFault;
using test::SoapRequest;
using test::SoapResponse;

using test::kLoopback;
using test::OptionsFor;
using test::Tcp;

TEST(PortMapRouterUpnpScripted, TrickledReplyIsReadWhole) {
  FakeIgd igd;
  igd.OnAction("GetExternalIPAddress",
               [](const SoapRequest &request) -> std::optional<HttpReply> {
                 HttpReply reply =
                     SoapResponse(request.serviceType, request.action,
                                  {{"NewExternalIPAddress", "203.0.113.9"}});
                 reply.trickleBytes = 16;
                 reply.trickleDelay = std::chrono::milliseconds(1);
                 return reply;
               });
  UpnpRouter router(OptionsFor(igd));

  std::string address;
  RouterResult got = router.GetExternalAddress(address);

  ASSERT_EQ(RouterOutcome::kOk, got.outcome) << got.message;
  EXPECT_EQ("203.0.113.9", address);
  EXPECT_EQ(1, igd.Count("GetExternalIPAddress"));
}

TEST(PortMapRouterUpnpScripted, ScriptAnswersFirstThenTheRouter) {
  FakeIgd igd;
  UpnpRouter router(OptionsFor(igd));
  ASSERT_TRUE(router.Open().Ok());
  igd.ResetCounts();
  igd.Script({SoapFault(501, "ActionFailed")});

  RouterResult refused = router.AddPortMapping(Tcp(8080, 80));
  RouterResult added = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kRefused, refused.outcome) << refused.message;
  EXPECT_EQ(501, refused.code);
  ASSERT_EQ(RouterOutcome::kOk, added.outcome) << added.message;
  EXPECT_EQ((std::vector<FakeIgd::Entry>{
                {"TCP", 8080, "127.0.0.1", 80, 0, "zarkportforward test"}}),
            igd.Table());
  EXPECT_EQ(
      (std::vector<std::string>{"SOAP AddPortMapping", "SOAP AddPortMapping",
                                "SOAP GetSpecificPortMappingEntry"}),
      igd.RequestLines());
}

TEST(PortMapRouterUpnpScripted, ResponseShorterThanItsLengthIsNoAddress) {
  FakeIgd igd;
  UpnpRouter router(OptionsFor(igd));
  ASSERT_TRUE(router.Open().Ok());
  igd.Script({HttpReply{.raw = "HTTP/1.1 200 OK\r\nContent-Type: text/xml\r\n"
                               "Content-Length: 5000\r\n\r\n<s:Envelope>"}});

  std::string address;
  RouterResult got = router.GetExternalAddress(address);

  EXPECT_FALSE(got.Ok()) << got.message;
  EXPECT_EQ("", address);
  EXPECT_EQ(1, igd.Count("GetExternalIPAddress"));
}

// miniupnpc reads a 404 as no description at all: no usable answer.
TEST(PortMapRouterUpnpScripted, RefusedDescriptionIsNoAnswerAndNothingMore) {
  FakeIgd igd;
  igd.OnGet([](const std::string &) { return HttpReply{404, ""}; });
  UpnpRouter router(OptionsFor(igd));

  RouterResult opened = router.Open();

  EXPECT_EQ(RouterOutcome::kNoAnswer, opened.outcome) << opened.message;
  EXPECT_EQ("no UPnP description at " + igd.RootDescUrl(), opened.message);
  // Only description fetches: no SOAP request without a description.
  EXPECT_GE(igd.Count("GET"), 1);
  EXPECT_EQ(igd.Count("GET"), igd.TotalRequests());
}

} // namespace
} // namespace zark::portmap
