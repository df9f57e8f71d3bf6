// A fake UPnP Internet Gateway Device on 127.0.0.1 for unit tests: a small
// HTTP server on a thread of its own that serves a root description and
// answers SOAP actions, either like a well-behaved router (a table of
// mappings, 718 on conflicts, 714 for missing entries, 713 past the end) or
// from handlers a test installs per action, which see the parsed request
// and choose the reply: a canned body, a fault, a 500 without body,
// truncated XML, no answer at all. Every request is counted.
//
// Reached without multicast: tests hand RootDescUrl() to the driver.
#ifndef ZARK_TESTS_PORTMAP_ROUTER_FAKE_IGD_H
#define ZARK_TESTS_PORTMAP_ROUTER_FAKE_IGD_H

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace zark::test {

// One SOAP request as the fake received it.
struct SoapRequest {
  std::string action;      // "AddPortMapping"
  std::string serviceType; // "urn:schemas-upnp-org:service:WANIPConnection:1"
  std::string path;        // "/ctl/IPConn"
  std::map<std::string, std::string> args; // "NewExternalPort" -> "8080"
  std::string Arg(const std::string &name) const;
};

struct HttpReply {
  int status = 200;
  std::string body;
  bool hang = false;  // read the request and never answer (held open until
                      // the fake stops)
  bool close = false; // close the connection without a byte
};

// A SOAP success reply of action with these output arguments.
HttpReply SoapResponse(
    const std::string &serviceType, const std::string &action,
    const std::vector<std::pair<std::string, std::string>> &outputs = {});
// A SOAP fault (HTTP 500) carrying a UPnP error code.
HttpReply SoapFault(int errorCode, const std::string &description);

enum class IgdVariant {
  kIpV1,       // IGD:1 with WANIPConnection:1
  kIpAndPppV1, // IGD:1 with WANPPPConnection:1 listed first, then
               // WANIPConnection:1
  kPppOnlyV1,  // IGD:1 with WANPPPConnection:1 only
  kIpV2Only,   // IGD:2 with WANIPConnection:2 only; answers
               // GetListOfPortMappings
};

class FakeIgd {
public:
  struct Entry {
    std::string protocol; // "TCP" / "UDP"
    uint16_t externalPort = 0;
    std::string client;
    uint16_t internalPort = 0;
    uint32_t lease = 0;
    std::string description;
    friend bool operator==(const Entry &, const Entry &) = default;
  };
  using Handler = std::function<std::optional<HttpReply>(const SoapRequest &)>;

  explicit FakeIgd(IgdVariant variant = IgdVariant::kIpV1);
  ~FakeIgd();
  FakeIgd(const FakeIgd &) = delete;
  FakeIgd &operator=(const FakeIgd &) = delete;

  std::string RootDescUrl() const;
  uint16_t Port() const { return mPort; }

  // A handler for one action; it answers when it returns a reply, else the
  // built-in router does. Replaces an earlier handler of the action.
  void OnAction(const std::string &action, Handler handler);
  // Serves this text as the root description instead of the variant's.
  void SetRootDescription(std::string xml);
  // Writes this control URL (absolute or relative) into the description's
  // connection services.
  void SetControlUrl(std::string url);
  // GetStatusInfo's NewConnectionStatus for services whose type contains
  // fragment ("WANPPPConnection"); "Connected" by default.
  void SetConnectionStatus(const std::string &fragment, std::string status);
  // From now on, every request is read and never answered.
  void StopAnswering();
  // With a capacity, adds beyond it are answered with success and dropped
  // (as some routers with a full table do).
  void SetTableCapacity(std::size_t capacity);
  void PutEntry(const Entry &entry);
  // Forgets every mapping (a router that rebooted).
  void ClearTable();

  // Requests received: "GET" for description fetches, else the SOAP
  // action's name. Total over all.
  int Count(const std::string &what) const;
  int TotalRequests() const;
  std::map<std::string, int> Counts() const;
  std::vector<SoapRequest> SoapRequests() const;
  void ResetCounts();
  std::vector<Entry> Table() const;
  // The most connections that were open at the same time.
  int MaxOpenConnections() const;

private:
  struct Connection;
  void Serve();
  HttpReply Answer(const std::string &method, const std::string &path,
                   const std::map<std::string, std::string> &headers,
                   const std::string &body, bool &counted);
  HttpReply BuiltIn(const SoapRequest &request);
  std::string Description() const;

  IgdVariant mVariant;
  int mListenFd = -1;
  int mWakeRead = -1;
  int mWakeWrite = -1;
  uint16_t mPort = 0;
  std::thread mThread;

  mutable std::mutex mMutex;
  std::map<std::string, Handler> mHandlers;
  std::optional<std::string> mDescription;
  std::optional<std::string> mControlUrl;
  std::map<std::string, std::string> mStatus;
  bool mStopAnswering = false;
  std::optional<std::size_t> mCapacity;
  std::vector<Entry> mTable;
  std::map<std::string, int> mCounts;
  std::vector<SoapRequest> mRequests;
  int mMaxOpen = 0;
};

} // namespace zark::test

#endif
