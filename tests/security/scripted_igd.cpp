#include "scripted_igd.h"

#include "security_support.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <cstring>

namespace zark::security {
namespace {

using Clock = std::chrono::steady_clock;

constexpr char kServiceType[] =
    "urn:schemas-upnp-org:service:WANIPConnection:1";

// The text of <name>...</name> in xml, or empty.
std::string Element(const std::string &xml, const std::string &name) {
  const std::string open = "<" + name + ">";
  std::size_t start = xml.find(open);
  if (start == std::string::npos) {
    return "";
  }
  start += open.size();
  std::size_t end = xml.find("</" + name + ">", start);
  return end == std::string::npos ? "" : xml.substr(start, end - start);
}

std::string
SoapBody(const std::string &action,
         const std::vector<std::pair<std::string, std::string>> &outputs) {
  std::string body =
      "<?xml version=\"1.0\"?>\r\n<s:Envelope "
      "xmlns:s=\"http://schemas.xmlsoap.org/soap/envelope/\" "
      "s:encodingStyle=\"http://schemas.xmlsoap.org/soap/encoding/\">"
      "<s:Body><u:" +
      action + "Response xmlns:u=\"" + kServiceType + "\">";
  for (const auto &[name, value] : outputs) {
    body += "<" + name + ">" + value + "</" + name + ">";
  }
  body += "</u:" + action + "Response></s:Body></s:Envelope>\r\n";
  return body;
}

IgdReply SoapFault(int code, const std::string &description) {
  return {500,
          "<?xml version=\"1.0\"?>\r\n<s:Envelope "
          "xmlns:s=\"http://schemas.xmlsoap.org/soap/envelope/\" "
          "s:encodingStyle=\"http://schemas.xmlsoap.org/soap/encoding/\">"
          "<s:Body><s:Fault><faultcode>s:Client</faultcode><faultstring>"
          "UPnPError</faultstring><detail><UPnPError xmlns=\"urn:schemas-"
          "upnp-org:control-1-0\"><errorCode>" +
              std::to_string(code) + "</errorCode><errorDescription>" +
              description +
              "</errorDescription></UPnPError></detail></s:Fault></s:Body>"
              "</s:Envelope>\r\n",
          ""};
}

const char *StatusText(int status) {
  switch (status) {
  case 200:
    return "OK";
  case 301:
    return "Moved Permanently";
  case 302:
    return "Found";
  case 307:
    return "Temporary Redirect";
  case 308:
    return "Permanent Redirect";
  case 404:
    return "Not Found";
  default:
    return "Internal Server Error";
  }
}

bool SendAll(int fd, const std::string &text) {
  std::size_t sent = 0;
  while (sent < text.size()) {
    ssize_t n =
        ::send(fd, text.data() + sent, text.size() - sent, MSG_NOSIGNAL);
    if (n <= 0) {
      if (n < 0 && errno == EINTR) {
        continue;
      }
      return false;
    }
    sent += static_cast<std::size_t>(n);
  }
  return true;
}

} // namespace

std::string IgdDescription(const std::string &urlBase,
                           const std::string &controlUrl) {
  return "<?xml version=\"1.0\"?>\r\n"
         "<root xmlns=\"urn:schemas-upnp-org:device-1-0\">"
         "<specVersion><major>1</major><minor>0</minor></specVersion>" +
         (urlBase.empty() ? std::string()
                          : "<URLBase>" + urlBase + "</URLBase>") +
         "<device><deviceType>urn:schemas-upnp-org:device:"
         "InternetGatewayDevice:1</deviceType>"
         "<friendlyName>Scripted IGD</friendlyName>"
         "<manufacturer>Scripted</manufacturer><modelName>IGD</modelName>"
         "<modelNumber>1</modelNumber>"
         "<UDN>uuid:5c0d7a11-0000-4000-8000-000000000001</UDN>"
         "<deviceList><device><deviceType>urn:schemas-upnp-org:device:"
         "WANDevice:1</deviceType>"
         "<deviceList><device><deviceType>urn:schemas-upnp-org:device:"
         "WANConnectionDevice:1</deviceType><serviceList><service>"
         "<serviceType>" +
         std::string(kServiceType) +
         "</serviceType>"
         "<serviceId>urn:upnp-org:serviceId:WANIPConn1</serviceId>"
         "<controlURL>" +
         controlUrl +
         "</controlURL><eventSubURL>/evt/IPConn</eventSubURL>"
         "<SCPDURL>/WANIPCn.xml</SCPDURL></service></serviceList>"
         "</device></deviceList></device></deviceList></device></root>\r\n";
}

ScriptedIgd::ScriptedIgd(const std::string &address) : mAddress(address) {
  int fd = BoundSocket(SOCK_STREAM, address, 0);
  if (fd < 0 || ::pipe2(mWake, O_CLOEXEC) != 0) {
    if (fd >= 0) {
      ::close(fd);
    }
    return;
  }
  mFd = fd;
  mPort = BoundPort(fd);
  mThread = std::thread([this] { Serve(); });
}

ScriptedIgd::~ScriptedIgd() {
  if (mThread.joinable()) {
    (void)!::write(mWake[1], "x", 1);
    mThread.join();
  }
  for (int fd : {mFd, mWake[0], mWake[1]}) {
    if (fd >= 0) {
      ::close(fd);
    }
  }
}

std::string ScriptedIgd::Url(const std::string &path) const {
  return "http://" + mAddress + ":" + std::to_string(mPort) + path;
}

void ScriptedIgd::OnGet(GetHandler handler) {
  std::lock_guard<std::mutex> lock(mMutex);
  mGet = std::move(handler);
}

void ScriptedIgd::ReplyToEverySoapAction(IgdReply reply) {
  std::lock_guard<std::mutex> lock(mMutex);
  mSoapOverride = true;
  mSoapReply = std::move(reply);
}

std::vector<std::string> ScriptedIgd::Requests() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return mRequests;
}

void ScriptedIgd::Serve() {
  for (;;) {
    pollfd watched[2] = {{mFd, POLLIN, 0}, {mWake[0], POLLIN, 0}};
    if (::poll(watched, 2, -1) < 0 && errno != EINTR) {
      return;
    }
    if (watched[1].revents != 0) {
      return;
    }
    if ((watched[0].revents & POLLIN) == 0) {
      continue;
    }
    int client = ::accept4(mFd, nullptr, nullptr, SOCK_CLOEXEC);
    if (client >= 0) {
      ServeConnection(client);
      ::close(client);
    }
  }
}

void ScriptedIgd::ServeConnection(int fd) {
  // One request a connection, as miniupnpc sends them; read within 5 s.
  const Clock::time_point deadline = Clock::now() + std::chrono::seconds(5);
  std::string request;
  std::size_t headEnd = std::string::npos;
  std::size_t wanted = 0;
  while (request.size() < 65536) {
    if (headEnd == std::string::npos) {
      headEnd = request.find("\r\n\r\n");
      if (headEnd != std::string::npos) {
        std::string head = request.substr(0, headEnd);
        for (char &c : head) {
          c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
        }
        std::size_t length = head.find("content-length:");
        wanted = length == std::string::npos
                     ? 0
                     : std::strtoul(head.c_str() + length + 15, nullptr, 10);
      }
    }
    if (headEnd != std::string::npos &&
        request.size() >= headEnd + 4 + wanted) {
      break;
    }
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - Clock::now());
    pollfd watched{fd, POLLIN, 0};
    if (left.count() <= 0 ||
        ::poll(&watched, 1, static_cast<int>(left.count())) <= 0) {
      return;
    }
    char buffer[4096];
    ssize_t n = ::recv(fd, buffer, sizeof(buffer), 0);
    if (n <= 0) {
      return;
    }
    request.append(buffer, static_cast<std::size_t>(n));
  }
  if (headEnd == std::string::npos) {
    return;
  }
  const std::string method = request.substr(0, request.find(' '));
  const std::size_t pathStart = method.size() + 1;
  const std::string path =
      request.substr(pathStart, request.find(' ', pathStart) - pathStart);
  const std::string body = request.substr(headEnd + 4);

  IgdReply reply;
  if (method == "GET") {
    GetHandler handler;
    {
      std::lock_guard<std::mutex> lock(mMutex);
      mRequests.push_back("GET " + path);
      handler = mGet;
    }
    reply = handler ? handler(path) : IgdReply{404, "", ""};
  } else {
    // SOAPAction: "urn:schemas-upnp-org:service:WANIPConnection:1#Action"
    std::string action;
    std::size_t hash = request.find('#');
    if (hash != std::string::npos && hash < headEnd) {
      std::size_t end = request.find_first_of("\"\r", hash);
      action = request.substr(hash + 1, end - hash - 1);
    }
    {
      std::lock_guard<std::mutex> lock(mMutex);
      mRequests.push_back("SOAP " + action);
    }
    reply = Soap(action, body);
  }
  std::string answer = "HTTP/1.1 " + std::to_string(reply.status) + " " +
                       StatusText(reply.status) +
                       "\r\nContent-Type: text/xml; charset=\"utf-8\"\r\n"
                       "Connection: close\r\nContent-Length: " +
                       std::to_string(reply.body.size()) + "\r\n";
  if (!reply.location.empty()) {
    answer += "Location: " + reply.location + "\r\n";
  }
  answer += "\r\n" + reply.body;
  (void)SendAll(fd, answer);
}

IgdReply ScriptedIgd::Soap(const std::string &action, const std::string &body) {
  std::lock_guard<std::mutex> lock(mMutex);
  if (mSoapOverride) {
    return mSoapReply;
  }
  const std::string key =
      Element(body, "NewProtocol") + " " + Element(body, "NewExternalPort");
  if (action == "GetExternalIPAddress") {
    return {200, SoapBody(action, {{"NewExternalIPAddress", "1.2.3.1"}}), ""};
  }
  if (action == "GetStatusInfo") {
    return {200,
            SoapBody(action, {{"NewConnectionStatus", "Connected"},
                              {"NewLastConnectionError", "ERROR_NONE"},
                              {"NewUptime", "100"}}),
            ""};
  }
  if (action == "AddPortMapping") {
    mTable[key] = {Element(body, "NewInternalClient"),
                   Element(body, "NewInternalPort")};
    return {200, SoapBody(action, {}), ""};
  }
  if (action == "DeletePortMapping") {
    if (mTable.erase(key) == 0) {
      return SoapFault(714, "NoSuchEntryInArray");
    }
    return {200, SoapBody(action, {}), ""};
  }
  if (action == "GetSpecificPortMappingEntry") {
    auto found = mTable.find(key);
    if (found == mTable.end()) {
      return SoapFault(714, "NoSuchEntryInArray");
    }
    return {200,
            SoapBody(action, {{"NewInternalPort", found->second.second},
                              {"NewInternalClient", found->second.first},
                              {"NewEnabled", "1"},
                              {"NewPortMappingDescription", "scripted"},
                              {"NewLeaseDuration", "0"}}),
            ""};
  }
  return SoapFault(401, "Invalid Action");
}

} // namespace zark::security
