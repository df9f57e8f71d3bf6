// A UPnP IGD whose every reply the test writes, listening on an address of
// the test network's LAN (the server's own, 192.168.77.2): the root
// description (with any URLBase and control URL, or a redirect), and the
// SOAP replies (a small mapping table, or a redirect). Requests are served
// one at a time on a thread of its own and recorded.
#ifndef ZARK_TESTS_SECURITY_SCRIPTED_IGD_H
#define ZARK_TESTS_SECURITY_SCRIPTED_IGD_H

#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace zark::security {

struct IgdReply {
  int status = 200;
  std::string body;
  std::string location; // a Location header when not empty
};

// An IGD:1 root description with one WANIPConnection:1 service. urlBase
// empty: no <URLBase> element.
std::string IgdDescription(const std::string &urlBase,
                           const std::string &controlUrl);

class ScriptedIgd {
public:
  // Replies to "GET <path>".
  using GetHandler = std::function<IgdReply(const std::string &path)>;

  // Listens on address (dotted quad), any free port. Without a handler,
  // GET answers 404; SOAP actions are answered by a small table of
  // mappings (AddPortMapping, GetSpecificPortMappingEntry,
  // DeletePortMapping, GetExternalIPAddress, GetStatusInfo).
  explicit ScriptedIgd(const std::string &address);
  ~ScriptedIgd();
  ScriptedIgd(const ScriptedIgd &) = delete;
  ScriptedIgd &operator=(const ScriptedIgd &) = delete;

  [[nodiscard]] bool Ok() const { return mFd >= 0; }
  [[nodiscard]] uint16_t Port() const { return mPort; }
  // "http://<address>:<port><path>".
  [[nodiscard]] std::string Url(const std::string &path) const;

  void OnGet(GetHandler handler);
  // Every SOAP action is answered with this instead of the table.
  void ReplyToEverySoapAction(IgdReply reply);

  // "GET /rootDesc.xml", "SOAP AddPortMapping", ... in order.
  [[nodiscard]] std::vector<std::string> Requests() const;

private:
  void Serve();
  void ServeConnection(int fd);
  IgdReply Soap(const std::string &action, const std::string &body);

  std::string mAddress;
  int mFd = -1;
  uint16_t mPort = 0;
  int mWake[2] = {-1, -1};
  std::thread mThread;
  mutable std::mutex mMutex;
  GetHandler mGet;
  bool mSoapOverride = false;
  IgdReply mSoapReply;
  // "TCP 8080" -> (client, internal port)
  std::map<std::string, std::pair<std::string, std::string>> mTable;
  std::vector<std::string> mRequests;
};

} // namespace zark::security

#endif
