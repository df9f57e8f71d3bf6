// A fake UPnP Internet Gateway Device for unit tests, the security walk and
// the fuzz targets: a small HTTP server on a thread of its own, on 127.0.0.1
// or another local address, that serves a root description and answers SOAP
// actions. By default it behaves like a well-behaved router (a table of
// mappings, 718 on conflicts, 714 for missing entries, 713 past the end).
// Its misbehaviour is scripted:
//   - handlers per action, for any action, or for GET requests, which see
//     the parsed request and choose the reply: a canned body, a fault
//     (725, 718, 714, 402, 501...), a 500 without body, truncated XML,
//     elements in the wrong case, a redirect, a huge or trickled body, no
//     answer at all, a connection closed without a byte;
//   - a script of replies that answers the next requests in order, before
//     any handler, down to the raw bytes of the response.
// Every request is counted and recorded, so tests compare counts exactly.
//
// Reached without multicast: tests hand RootDescUrl() to the driver.
#ifndef ZARK_TESTS_PORTMAP_SUPPORT_FAKE_IGD_H
#define ZARK_TESTS_PORTMAP_SUPPORT_FAKE_IGD_H

#include <chrono>
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
  std::string action;      // "AddPortMapping", from the SOAPAction header
  std::string serviceType; // "urn:schemas-upnp-org:service:WANIPConnection:1"
  std::string path;        // "/ctl/IPConn"
  std::map<std::string, std::string> args; // "NewExternalPort" -> "8080"
  // The body's first "<u:" element: miniupnpc names the action there too,
  // and only there when the SOAPAction header had no room left for it.
  std::string bodyAction;
  std::string Arg(const std::string &name) const;
};

struct HttpReply {
  int status = 200;
  std::string body{};
  std::string location{}; // a Location header when not empty (redirects)
  bool hang = false;      // read the request and never answer (held open
                          // until the fake stops)
  bool close = false;     // close the connection without a byte
  // Sent as it is instead of a response made of the fields above (a broken
  // status line, a wrong Content-Length, half a header), then the
  // connection closes.
  std::optional<std::string> raw{};
  // When not 0, the response goes out in pieces of this many bytes,
  // trickleDelay apart (a slow router). The fake serves nothing else
  // meanwhile: keep the whole under a few seconds.
  std::size_t trickleBytes = 0;
  std::chrono::milliseconds trickleDelay{10};
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
  // Chooses the reply to "GET <path>", or nothing to let the built-in
  // router answer (the root description at /rootDesc.xml, else 404).
  using GetHandler =
      std::function<std::optional<HttpReply>(const std::string &path)>;

  // Listens on address (a dotted quad of this machine), on a free port. When
  // that fails, says why on stderr and Ok() is false.
  explicit FakeIgd(IgdVariant variant = IgdVariant::kIpV1,
                   const std::string &address = "127.0.0.1");
  ~FakeIgd();
  FakeIgd(const FakeIgd &) = delete;
  FakeIgd &operator=(const FakeIgd &) = delete;

  [[nodiscard]] bool Ok() const { return mThread.joinable(); }
  // "http://<address>:<port><path>".
  std::string Url(const std::string &path) const;
  std::string RootDescUrl() const { return Url("/rootDesc.xml"); }
  uint16_t Port() const { return mPort; }

  // A handler for one action; it answers when it returns a reply, else the
  // handler for any action, else the built-in router does. Replaces an
  // earlier handler of the action.
  void OnAction(const std::string &action, Handler handler);
  // A handler asked about every action that has none of its own.
  void OnAnyAction(Handler handler);
  void OnGet(GetHandler handler);
  // The next requests (GET or SOAP) are answered with these replies in
  // order, before any handler; then the handlers and the built-in router
  // answer again. Replaces a script not used up.
  void Script(std::vector<HttpReply> replies);
  // Serves this text as the root description instead of the variant's.
  void SetRootDescription(std::string xml);
  // Writes this control URL (absolute or relative) into the description's
  // connection services.
  void SetControlUrl(std::string url);
  // Writes a <URLBase> with this text into the description.
  void SetUrlBase(std::string url);
  // GetExternalIPAddress's answer; "198.51.100.7" by default.
  void SetExternalAddress(std::string address);
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
  // Every request in order: "GET /rootDesc.xml", "SOAP AddPortMapping".
  std::vector<std::string> RequestLines() const;
  // Forgets the counts and the requests recorded.
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
  HttpReply AnswerGet(const std::string &path,
                      std::unique_lock<std::mutex> &lock);
  HttpReply AnswerSoap(const SoapRequest &request,
                       std::unique_lock<std::mutex> &lock);
  std::optional<HttpReply> NextScripted();
  HttpReply BuiltIn(const SoapRequest &request);
  std::string Description() const;

  IgdVariant mVariant;
  std::string mAddress;
  int mListenFd = -1;
  int mWakeRead = -1;
  int mWakeWrite = -1;
  uint16_t mPort = 0;
  std::thread mThread;

  mutable std::mutex mMutex;
  std::map<std::string, Handler> mHandlers;
  Handler mAnyAction;
  GetHandler mGet;
  std::vector<HttpReply> mScript;
  std::size_t mScriptNext = 0;
  std::optional<std::string> mDescription;
  std::optional<std::string> mControlUrl;
  std::optional<std::string> mUrlBase;
  std::string mExternalAddress = "198.51.100.7";
  std::map<std::string, std::string> mStatus;
  bool mStopAnswering = false;
  std::optional<std::size_t> mCapacity;
  std::vector<Entry> mTable;
  std::map<std::string, int> mCounts;
  std::vector<SoapRequest> mRequests;
  std::vector<std::string> mRequestLines;
  int mMaxOpen = 0;
};

} // namespace zark::test

#endif
