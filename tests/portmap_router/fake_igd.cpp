#include "fake_igd.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <stdexcept>
#include <strings.h>

namespace zark::test {
namespace {

using Clock = std::chrono::steady_clock;

// A request larger than this, or idle longer, is dropped.
constexpr std::size_t kMaxRequestBytes = 1 << 20;
constexpr auto kIdleLimit = std::chrono::seconds(10);

std::string Lower(std::string text) {
  for (char &c : text) {
    c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  }
  return text;
}

// The text between <name> and </name> (namespace prefixes are not used in
// the argument elements miniupnpc writes).
std::optional<std::string> Element(const std::string &xml,
                                   const std::string &name) {
  std::string open = "<" + name + ">";
  std::string close = "</" + name + ">";
  std::size_t start = xml.find(open);
  if (start == std::string::npos) {
    // An empty element: <name/>
    if (xml.find("<" + name + "/>") != std::string::npos) {
      return std::string();
    }
    return std::nullopt;
  }
  start += open.size();
  std::size_t end = xml.find(close, start);
  if (end == std::string::npos) {
    return std::nullopt;
  }
  return xml.substr(start, end - start);
}

void WriteAll(int fd, const std::string &data) {
  std::size_t sent = 0;
  while (sent < data.size()) {
    ssize_t n =
        ::send(fd, data.data() + sent, data.size() - sent, MSG_NOSIGNAL);
    if (n < 0) {
      if (errno == EINTR) {
        continue;
      }
      return;
    }
    sent += static_cast<std::size_t>(n);
  }
}

const char *StatusText(int status) {
  switch (status) {
  case 200:
    return "OK";
  case 404:
    return "Not Found";
  case 500:
    return "Internal Server Error";
  default:
    return "Status";
  }
}

std::string ServiceXml(const std::string &type, const std::string &id,
                       const std::string &control) {
  return "<service><serviceType>" + type + "</serviceType><serviceId>" + id +
         "</serviceId><controlURL>" + control +
         "</controlURL><eventSubURL>/evt" + control.substr(4) +
         "</eventSubURL><SCPDURL>/scpd" + control.substr(4) +
         ".xml</SCPDURL></service>";
}

} // namespace

struct FakeIgd::Connection {
  int fd = -1;
  std::string data;
  Clock::time_point last = Clock::now();
  bool held = false;
};

std::string SoapRequest::Arg(const std::string &name) const {
  auto found = args.find(name);
  return found == args.end() ? std::string() : found->second;
}

HttpReply
SoapResponse(const std::string &serviceType, const std::string &action,
             const std::vector<std::pair<std::string, std::string>> &outputs) {
  std::string body =
      "<?xml version=\"1.0\"?>\r\n<s:Envelope "
      "xmlns:s=\"http://schemas.xmlsoap.org/soap/envelope/\" "
      "s:encodingStyle=\"http://schemas.xmlsoap.org/soap/encoding/\">"
      "<s:Body><u:" +
      action + "Response xmlns:u=\"" + serviceType + "\">";
  for (const auto &[name, value] : outputs) {
    body += "<" + name + ">" + value + "</" + name + ">";
  }
  body += "</u:" + action + "Response></s:Body></s:Envelope>\r\n";
  return HttpReply{200, body};
}

HttpReply SoapFault(int errorCode, const std::string &description) {
  std::string body =
      "<?xml version=\"1.0\"?>\r\n<s:Envelope "
      "xmlns:s=\"http://schemas.xmlsoap.org/soap/envelope/\" "
      "s:encodingStyle=\"http://schemas.xmlsoap.org/soap/encoding/\">"
      "<s:Body><s:Fault><faultcode>s:Client</faultcode>"
      "<faultstring>UPnPError</faultstring><detail>"
      "<UPnPError xmlns=\"urn:schemas-upnp-org:control-1-0\"><errorCode>" +
      std::to_string(errorCode) + "</errorCode><errorDescription>" +
      description +
      "</errorDescription></UPnPError></detail></s:Fault></s:Body>"
      "</s:Envelope>\r\n";
  return HttpReply{500, body};
}

FakeIgd::FakeIgd(IgdVariant variant) : mVariant(variant) {
  mListenFd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  int pipeFds[2];
  if (mListenFd < 0 ||
      ::bind(mListenFd, reinterpret_cast<sockaddr *>(&address),
             sizeof(address)) != 0 ||
      ::listen(mListenFd, 16) != 0 ||
      ::getsockname(mListenFd, reinterpret_cast<sockaddr *>(&address),
                    &length) != 0 ||
      ::pipe2(pipeFds, O_CLOEXEC) != 0) {
    std::perror("FakeIgd");
    std::abort();
  }
  mPort = ntohs(address.sin_port);
  mWakeRead = pipeFds[0];
  mWakeWrite = pipeFds[1];
  mThread = std::thread([this] { Serve(); });
}

FakeIgd::~FakeIgd() {
  char byte = 1;
  (void)!::write(mWakeWrite, &byte, 1);
  mThread.join();
  ::close(mListenFd);
  ::close(mWakeRead);
  ::close(mWakeWrite);
}

std::string FakeIgd::RootDescUrl() const {
  return "http://127.0.0.1:" + std::to_string(mPort) + "/rootDesc.xml";
}

void FakeIgd::OnAction(const std::string &action, Handler handler) {
  std::lock_guard<std::mutex> lock(mMutex);
  mHandlers[action] = std::move(handler);
}

void FakeIgd::SetRootDescription(std::string xml) {
  std::lock_guard<std::mutex> lock(mMutex);
  mDescription = std::move(xml);
}

void FakeIgd::SetControlUrl(std::string url) {
  std::lock_guard<std::mutex> lock(mMutex);
  mControlUrl = std::move(url);
}

void FakeIgd::SetConnectionStatus(const std::string &fragment,
                                  std::string status) {
  std::lock_guard<std::mutex> lock(mMutex);
  mStatus[fragment] = std::move(status);
}

void FakeIgd::StopAnswering() {
  std::lock_guard<std::mutex> lock(mMutex);
  mStopAnswering = true;
}

void FakeIgd::SetTableCapacity(std::size_t capacity) {
  std::lock_guard<std::mutex> lock(mMutex);
  mCapacity = capacity;
}

void FakeIgd::PutEntry(const Entry &entry) {
  std::lock_guard<std::mutex> lock(mMutex);
  mTable.push_back(entry);
}

void FakeIgd::ClearTable() {
  std::lock_guard<std::mutex> lock(mMutex);
  mTable.clear();
}

int FakeIgd::Count(const std::string &what) const {
  std::lock_guard<std::mutex> lock(mMutex);
  auto found = mCounts.find(what);
  return found == mCounts.end() ? 0 : found->second;
}

int FakeIgd::TotalRequests() const {
  std::lock_guard<std::mutex> lock(mMutex);
  int total = 0;
  for (const auto &[what, count] : mCounts) {
    total += count;
  }
  return total;
}

std::map<std::string, int> FakeIgd::Counts() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return mCounts;
}

std::vector<SoapRequest> FakeIgd::SoapRequests() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return mRequests;
}

void FakeIgd::ResetCounts() {
  std::lock_guard<std::mutex> lock(mMutex);
  mCounts.clear();
  mRequests.clear();
}

std::vector<FakeIgd::Entry> FakeIgd::Table() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return mTable;
}

int FakeIgd::MaxOpenConnections() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return mMaxOpen;
}

std::string FakeIgd::Description() const {
  if (mDescription) {
    return *mDescription;
  }
  const bool v2 = mVariant == IgdVariant::kIpV2Only;
  const std::string version = v2 ? "2" : "1";
  auto control = [&](const std::string &path) {
    return mControlUrl ? *mControlUrl : path;
  };
  std::string services;
  if (mVariant == IgdVariant::kIpAndPppV1 ||
      mVariant == IgdVariant::kPppOnlyV1) {
    services += ServiceXml("urn:schemas-upnp-org:service:WANPPPConnection:1",
                           "urn:upnp-org:serviceId:WANPPPConn1",
                           control("/ctl/PPPConn"));
  }
  if (mVariant != IgdVariant::kPppOnlyV1) {
    services +=
        ServiceXml("urn:schemas-upnp-org:service:WANIPConnection:" + version,
                   "urn:upnp-org:serviceId:WANIPConn1", control("/ctl/IPConn"));
  }
  return "<?xml version=\"1.0\"?>\r\n"
         "<root xmlns=\"urn:schemas-upnp-org:device-1-0\">"
         "<specVersion><major>1</major><minor>" +
         std::string(v2 ? "1" : "0") +
         "</minor></specVersion><device>"
         "<deviceType>urn:schemas-upnp-org:device:InternetGatewayDevice:" +
         version +
         "</deviceType><friendlyName>Fake router</friendlyName>"
         "<manufacturer>Test</manufacturer><modelName>Fake IGD</modelName>"
         "<UDN>uuid:00000000-0000-0000-0000-000000000001</UDN>"
         "<deviceList><device>"
         "<deviceType>urn:schemas-upnp-org:device:WANDevice:" +
         version +
         "</deviceType><UDN>uuid:00000000-0000-0000-0000-000000000002</UDN>"
         "<serviceList>" +
         ServiceXml("urn:schemas-upnp-org:service:WANCommonInterfaceConfig:1",
                    "urn:upnp-org:serviceId:WANCommonIFC1", "/ctl/CmnIfCfg") +
         "</serviceList><deviceList><device>"
         "<deviceType>urn:schemas-upnp-org:device:WANConnectionDevice:" +
         version +
         "</deviceType><UDN>uuid:00000000-0000-0000-0000-000000000003</UDN>"
         "<serviceList>" +
         services +
         "</serviceList></device></deviceList></device></deviceList>"
         "</device></root>\r\n";
}

HttpReply FakeIgd::BuiltIn(const SoapRequest &request) {
  // Called with mMutex held.
  const std::string &type = request.serviceType;
  auto find = [&](const std::string &protocol, uint16_t port) {
    return std::find_if(mTable.begin(), mTable.end(), [&](const Entry &e) {
      return e.protocol == protocol && e.externalPort == port;
    });
  };
  auto port = [&](const std::string &name) {
    return static_cast<uint16_t>(std::atoi(request.Arg(name).c_str()));
  };
  if (request.action == "AddPortMapping") {
    Entry entry;
    entry.protocol = request.Arg("NewProtocol");
    entry.externalPort = port("NewExternalPort");
    entry.client = request.Arg("NewInternalClient");
    entry.internalPort = port("NewInternalPort");
    entry.lease = static_cast<uint32_t>(
        std::strtoul(request.Arg("NewLeaseDuration").c_str(), nullptr, 10));
    entry.description = request.Arg("NewPortMappingDescription");
    if (entry.externalPort == 0) {
      return SoapFault(716, "WildCardNotPermittedInExtPort");
    }
    if (mVariant == IgdVariant::kIpV2Only && entry.lease == 0) {
      entry.lease = 604800; // IGDv2: "permanent" means one week
    }
    auto existing = find(entry.protocol, entry.externalPort);
    if (existing != mTable.end()) {
      if (existing->client != entry.client) {
        return SoapFault(718, "ConflictInMappingEntry");
      }
      *existing = entry;
    } else if (!mCapacity || mTable.size() < *mCapacity) {
      mTable.push_back(entry);
    }
    // A full table drops the entry and still answers success.
    return SoapResponse(type, request.action);
  }
  if (request.action == "DeletePortMapping") {
    auto existing = find(request.Arg("NewProtocol"), port("NewExternalPort"));
    if (existing == mTable.end()) {
      return SoapFault(714, "NoSuchEntryInArray");
    }
    mTable.erase(existing);
    return SoapResponse(type, request.action);
  }
  if (request.action == "GetSpecificPortMappingEntry") {
    auto existing = find(request.Arg("NewProtocol"), port("NewExternalPort"));
    if (existing == mTable.end()) {
      return SoapFault(714, "NoSuchEntryInArray");
    }
    return SoapResponse(
        type, request.action,
        {{"NewInternalPort", std::to_string(existing->internalPort)},
         {"NewInternalClient", existing->client},
         {"NewEnabled", "1"},
         {"NewPortMappingDescription", existing->description},
         {"NewLeaseDuration", std::to_string(existing->lease)}});
  }
  if (request.action == "GetGenericPortMappingEntry") {
    std::size_t index =
        std::strtoul(request.Arg("NewPortMappingIndex").c_str(), nullptr, 10);
    if (index >= mTable.size()) {
      return SoapFault(713, "SpecifiedArrayIndexInvalid");
    }
    const Entry &entry = mTable[index];
    return SoapResponse(
        type, request.action,
        {{"NewRemoteHost", ""},
         {"NewExternalPort", std::to_string(entry.externalPort)},
         {"NewProtocol", entry.protocol},
         {"NewInternalPort", std::to_string(entry.internalPort)},
         {"NewInternalClient", entry.client},
         {"NewEnabled", "1"},
         {"NewPortMappingDescription", entry.description},
         {"NewLeaseDuration", std::to_string(entry.lease)}});
  }
  if (request.action == "GetListOfPortMappings" &&
      mVariant == IgdVariant::kIpV2Only) {
    // IGD:2's listing of a port range: the entries as an XML document in
    // NewPortListing, sent as CDATA (as miniupnpd sends it).
    const uint16_t first = port("NewStartPort");
    const uint16_t last = port("NewEndPort");
    std::size_t most =
        std::strtoul(request.Arg("NewNumberOfPorts").c_str(), nullptr, 10);
    std::vector<Entry> listed;
    for (const Entry &entry : mTable) {
      if (entry.protocol == request.Arg("NewProtocol") &&
          entry.externalPort >= first && entry.externalPort <= last) {
        listed.push_back(entry);
      }
    }
    std::sort(listed.begin(), listed.end(), [](const Entry &a, const Entry &b) {
      return a.externalPort < b.externalPort;
    });
    listed.resize(std::min(listed.size(), most == 0 ? 1000 : most));
    if (listed.empty()) {
      return SoapFault(730, "PortMappingNotFound");
    }
    std::string list = "<p:PortMappingList "
                       "xmlns:p=\"urn:schemas-upnp-org:gw:WANIPConnection\">";
    for (const Entry &entry : listed) {
      list += "<p:PortMappingEntry><p:NewRemoteHost></p:NewRemoteHost>"
              "<p:NewExternalPort>" +
              std::to_string(entry.externalPort) +
              "</p:NewExternalPort><p:NewProtocol>" + entry.protocol +
              "</p:NewProtocol><p:NewInternalPort>" +
              std::to_string(entry.internalPort) +
              "</p:NewInternalPort><p:NewInternalClient>" + entry.client +
              "</p:NewInternalClient><p:NewEnabled>1</p:NewEnabled>"
              "<p:NewDescription>" +
              entry.description + "</p:NewDescription><p:NewLeaseTime>" +
              std::to_string(entry.lease) +
              "</p:NewLeaseTime></p:PortMappingEntry>";
    }
    list += "</p:PortMappingList>";
    return SoapResponse(type, request.action,
                        {{"NewPortListing", "<![CDATA[" + list + "]]>"}});
  }
  if (request.action == "GetExternalIPAddress") {
    return SoapResponse(type, request.action,
                        {{"NewExternalIPAddress", "198.51.100.7"}});
  }
  if (request.action == "GetStatusInfo") {
    std::string status = "Connected";
    for (const auto &[fragment, value] : mStatus) {
      if (type.find(fragment) != std::string::npos) {
        status = value;
      }
    }
    return SoapResponse(type, request.action,
                        {{"NewConnectionStatus", status},
                         {"NewLastConnectionError", "ERROR_NONE"},
                         {"NewUptime", "1000"}});
  }
  return SoapFault(401, "Invalid Action");
}

HttpReply FakeIgd::Answer(const std::string &method, const std::string &path,
                          const std::map<std::string, std::string> &headers,
                          const std::string &body, bool &counted) {
  std::unique_lock<std::mutex> lock(mMutex);
  counted = true;
  if (method == "GET") {
    ++mCounts["GET"];
    if (mStopAnswering) {
      return HttpReply{0, "", true};
    }
    if (path != "/rootDesc.xml") {
      return HttpReply{404, ""};
    }
    return HttpReply{200, Description()};
  }
  SoapRequest request;
  request.path = path;
  auto soapAction = headers.find("soapaction");
  if (soapAction != headers.end()) {
    std::string value = soapAction->second;
    value.erase(std::remove(value.begin(), value.end(), '"'), value.end());
    std::size_t hash = value.find('#');
    if (hash != std::string::npos) {
      request.serviceType = value.substr(0, hash);
      request.action = value.substr(hash + 1);
    }
  }
  static const char *const kArgs[] = {
      "NewRemoteHost",
      "NewExternalPort",
      "NewProtocol",
      "NewInternalPort",
      "NewInternalClient",
      "NewEnabled",
      "NewPortMappingDescription",
      "NewLeaseDuration",
      "NewPortMappingIndex",
      "NewStartPort",
      "NewEndPort",
      "NewNumberOfPorts",
  };
  for (const char *name : kArgs) {
    if (std::optional<std::string> value = Element(body, name)) {
      request.args[name] = *value;
    }
  }
  ++mCounts[request.action];
  mRequests.push_back(request);
  if (mStopAnswering) {
    return HttpReply{0, "", true};
  }
  auto handler = mHandlers.find(request.action);
  if (handler != mHandlers.end()) {
    Handler copy = handler->second;
    lock.unlock();
    std::optional<HttpReply> reply = copy(request);
    lock.lock();
    if (reply) {
      return *reply;
    }
  }
  return BuiltIn(request);
}

void FakeIgd::Serve() {
  std::vector<Connection> connections;
  for (;;) {
    std::vector<pollfd> watch;
    watch.push_back({mWakeRead, POLLIN, 0});
    watch.push_back({mListenFd, POLLIN, 0});
    for (const Connection &connection : connections) {
      watch.push_back(
          {connection.fd, connection.held ? short(0) : short(POLLIN), 0});
    }
    int ready = ::poll(watch.data(), watch.size(), 200);
    if (ready < 0 && errno != EINTR) {
      break;
    }
    if (watch[0].revents != 0) {
      break;
    }
    if (watch[1].revents & POLLIN) {
      int fd = ::accept4(mListenFd, nullptr, nullptr, SOCK_CLOEXEC);
      if (fd >= 0) {
        Connection accepted;
        accepted.fd = fd;
        connections.push_back(std::move(accepted));
        std::lock_guard<std::mutex> lock(mMutex);
        mMaxOpen = std::max(mMaxOpen, static_cast<int>(connections.size()));
      }
    }
    std::vector<std::size_t> done;
    for (std::size_t i = 0; i < connections.size(); ++i) {
      Connection &connection = connections[i];
      short events = watch.size() > i + 2 ? watch[i + 2].revents : 0;
      if (connection.held) {
        // Held without an answer until the fake stops, unless the client
        // has gone away meanwhile.
        if ((events & (POLLHUP | POLLERR)) != 0) {
          done.push_back(i);
        }
        continue;
      }
      if (Clock::now() - connection.last > kIdleLimit) {
        done.push_back(i);
        continue;
      }
      if ((events & (POLLIN | POLLHUP | POLLERR)) == 0) {
        continue;
      }
      char buffer[4096];
      ssize_t n = ::recv(connection.fd, buffer, sizeof(buffer), 0);
      if (n <= 0) {
        done.push_back(i);
        continue;
      }
      connection.data.append(buffer, static_cast<std::size_t>(n));
      connection.last = Clock::now();
      if (connection.data.size() > kMaxRequestBytes) {
        done.push_back(i);
        continue;
      }
      std::size_t headerEnd = connection.data.find("\r\n\r\n");
      if (headerEnd == std::string::npos) {
        continue;
      }
      // Request line and headers.
      std::string head = connection.data.substr(0, headerEnd);
      std::size_t lineEnd = head.find("\r\n");
      std::string requestLine = head.substr(0, lineEnd);
      std::map<std::string, std::string> headers;
      std::size_t pos =
          lineEnd == std::string::npos ? head.size() : lineEnd + 2;
      while (pos < head.size()) {
        std::size_t end = head.find("\r\n", pos);
        if (end == std::string::npos) {
          end = head.size();
        }
        std::string line = head.substr(pos, end - pos);
        std::size_t colon = line.find(':');
        if (colon != std::string::npos) {
          std::string value = line.substr(colon + 1);
          value.erase(0, value.find_first_not_of(" \t"));
          headers[Lower(line.substr(0, colon))] = value;
        }
        pos = end + 2;
      }
      std::size_t contentLength = 0;
      if (auto found = headers.find("content-length"); found != headers.end()) {
        contentLength = std::strtoul(found->second.c_str(), nullptr, 10);
      }
      if (connection.data.size() < headerEnd + 4 + contentLength) {
        continue;
      }
      std::string body = connection.data.substr(headerEnd + 4, contentLength);
      std::size_t space = requestLine.find(' ');
      std::size_t space2 = requestLine.find(' ', space + 1);
      std::string method = requestLine.substr(0, space);
      std::string path = requestLine.substr(space + 1, space2 - space - 1);
      bool counted = false;
      HttpReply reply = Answer(method, path, headers, body, counted);
      if (reply.hang) {
        connection.held = true;
        continue;
      }
      if (!reply.close) {
        std::string response = "HTTP/1.1 " + std::to_string(reply.status) +
                               " " + StatusText(reply.status) +
                               "\r\nContent-Type: text/xml; charset=\"utf-8\""
                               "\r\nConnection: close\r\nContent-Length: " +
                               std::to_string(reply.body.size()) +
                               "\r\nServer: fake-igd\r\n\r\n" + reply.body;
        WriteAll(connection.fd, response);
      }
      done.push_back(i);
    }
    for (auto it = done.rbegin(); it != done.rend(); ++it) {
      ::close(connections[*it].fd);
      connections.erase(connections.begin() + static_cast<std::ptrdiff_t>(*it));
    }
  }
  for (const Connection &connection : connections) {
    ::close(connection.fd);
  }
}

} // namespace zark::test
