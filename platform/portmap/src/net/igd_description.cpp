#include "net/igd_description.h"

#include "base/portmap_log.h"
#include "base/unique_fd.h"
#include "net/http_download.h"

#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <vector>

namespace zark::portmap {
namespace {

constexpr std::size_t kMaxDepth = 64;

std::string_view LocalName(std::string_view name) {
  const std::size_t colon = name.find(':');
  return colon == std::string_view::npos ? name : name.substr(colon + 1);
}

// Appends the text with entities decoded; unknown entities stay as written.
void AppendDecoded(std::string_view text, std::string &out) {
  while (!text.empty()) {
    const std::size_t amp = text.find('&');
    out.append(text.substr(0, amp));
    if (amp == std::string_view::npos) {
      return;
    }
    text.remove_prefix(amp);
    const std::size_t semicolon = text.find(';');
    // No ';' at all (npos) is as far away as a too long name.
    if (semicolon > 10) {
      out += '&';
      text.remove_prefix(1);
      continue;
    }
    std::string_view entity = text.substr(1, semicolon - 1);
    text.remove_prefix(semicolon + 1);
    if (entity == "amp") {
      out += '&';
    } else if (entity == "lt") {
      out += '<';
    } else if (entity == "gt") {
      out += '>';
    } else if (entity == "quot") {
      out += '"';
    } else if (entity == "apos") {
      out += '\'';
    } else if (entity.size() > 1 && entity[0] == '#') {
      unsigned code = 0;
      const bool hex = entity[1] == 'x' || entity[1] == 'X';
      std::string_view digits = entity.substr(hex ? 2 : 1);
      auto [end, ec] = std::from_chars(
          digits.data(), digits.data() + digits.size(), code, hex ? 16 : 10);
      const bool ok = !digits.empty() && ec == std::errc() &&
                      end == digits.data() + digits.size();
      // Names are shown as they are; anything beyond ASCII shows as "?".
      out += ok && code >= 0x20 && code < 0x7F ? static_cast<char>(code) : '?';
    } else {
      out += '&';
      out.append(entity);
      out += ';';
    }
  }
}

std::string Clean(std::string_view text) {
  std::string cleaned;
  bool blank = false;
  for (char c : text) {
    const bool isBlank =
        static_cast<unsigned char>(c) < 0x20 || c == ' ' || c == 0x7F;
    if (isBlank) {
      blank = !cleaned.empty();
      continue;
    }
    if (blank) {
      cleaned += ' ';
      blank = false;
    }
    cleaned += c;
  }
  if (cleaned.size() > kMaxIdentityText) {
    cleaned.resize(kMaxIdentityText);
  }
  return cleaned;
}

} // namespace

IgdIdentity ParseIgdIdentity(std::string_view xml) {
  IgdIdentity identity;
  std::vector<std::string> open;   // names of the open elements
  std::size_t rootDeviceDepth = 0; // 0: the root device is not open yet
  bool rootDeviceDone = false;
  std::string text; // the current element's text
  bool haveManufacturer = false;
  bool haveModelName = false;
  bool haveModelNumber = false;

  auto inRootDevice = [&] {
    return rootDeviceDepth != 0 && open.size() == rootDeviceDepth + 1;
  };
  std::size_t at = 0;
  while (at < xml.size() && !rootDeviceDone) {
    if (xml[at] != '<') {
      const std::size_t next = xml.find('<', at);
      const std::size_t end =
          next == std::string_view::npos ? xml.size() : next;
      if (inRootDevice() && text.size() < 4 * kMaxIdentityText) {
        AppendDecoded(xml.substr(at, end - at), text);
      }
      at = end;
      continue;
    }
    std::string_view rest = xml.substr(at);
    if (rest.starts_with("<!--")) {
      const std::size_t end = xml.find("-->", at + 4);
      at = end == std::string_view::npos ? xml.size() : end + 3;
      continue;
    }
    if (rest.starts_with("<![CDATA[")) {
      const std::size_t end = xml.find("]]>", at + 9);
      const std::size_t stop = end == std::string_view::npos ? xml.size() : end;
      if (inRootDevice() && text.size() < 4 * kMaxIdentityText) {
        text.append(xml.substr(at + 9, stop - at - 9));
      }
      at = end == std::string_view::npos ? xml.size() : end + 3;
      continue;
    }
    if (rest.starts_with("<?") || rest.starts_with("<!")) {
      const std::size_t end = xml.find('>', at);
      at = end == std::string_view::npos ? xml.size() : end + 1;
      continue;
    }
    // A start or end tag; attribute values may hold '>' inside quotes.
    std::size_t end = at + 1;
    char quote = 0;
    while (end < xml.size() && (quote != 0 || xml[end] != '>')) {
      if (quote != 0 && xml[end] == quote) {
        quote = 0;
      } else if (quote == 0 && (xml[end] == '"' || xml[end] == '\'')) {
        quote = xml[end];
      }
      ++end;
    }
    if (end >= xml.size()) {
      break; // an unclosed tag: the text ends here
    }
    std::string_view tag = xml.substr(at + 1, end - at - 1);
    at = end + 1;
    if (tag.starts_with("/")) {
      std::string_view name =
          LocalName(tag.substr(1, tag.find_first_of(" \t\r\n", 1) - 1));
      auto match = std::find(open.rbegin(), open.rend(), name);
      if (match == open.rend()) {
        continue; // an end tag that closes nothing: ignored
      }
      const std::size_t depth = open.size() - (match - open.rbegin());
      if (inRootDevice() && depth == open.size()) {
        std::string value = Clean(text);
        if (name == "manufacturer" && !haveManufacturer) {
          identity.manufacturer = value;
          haveManufacturer = true;
        } else if (name == "modelName" && !haveModelName) {
          identity.modelName = value;
          haveModelName = true;
        } else if (name == "modelNumber" && !haveModelNumber) {
          identity.modelNumber = value;
          haveModelNumber = true;
        }
      }
      open.resize(depth - 1);
      text.clear();
      if (rootDeviceDepth != 0 && open.size() < rootDeviceDepth) {
        rootDeviceDone = true;
      }
      continue;
    }
    const bool selfClosing = tag.ends_with("/");
    std::string_view name =
        LocalName(tag.substr(0, tag.find_first_of(" \t\r\n/")));
    text.clear();
    if (selfClosing) {
      continue;
    }
    if (open.size() == kMaxDepth) {
      break;
    }
    open.emplace_back(name);
    if (rootDeviceDepth == 0 && name == "device") {
      rootDeviceDepth = open.size();
    }
  }
  return identity;
}

std::optional<std::string>
FetchRootDescription(const std::string &url, std::chrono::milliseconds budget) {
  // The body goes to an anonymous memory file and is read back from it.
  UniqueFd fd(::memfd_create("zark-igd-description", MFD_CLOEXEC));
  if (!fd.Valid()) {
    ZARK_PM_LOG_CALL("memfd_create", -1, errno);
    return std::nullopt;
  }
  DownloadLimits limits;
  limits.maxBytes = kMaxRootDescriptionBytes;
  limits.connectTimeout = budget;
  limits.deadline = budget;
  if (!DownloadToFd(url, fd.Get(), limits)) {
    return std::nullopt;
  }
  struct stat info {};
  if (::fstat(fd.Get(), &info) != 0) {
    ZARK_PM_LOG_CALL("fstat", -1, errno, "(root description)");
    return std::nullopt;
  }
  std::string body(static_cast<std::size_t>(info.st_size), '\0');
  std::size_t got = 0;
  while (got < body.size()) {
    const ssize_t n = ::pread(fd.Get(), body.data() + got, body.size() - got,
                              static_cast<off_t>(got));
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      ZARK_PM_LOG_CALL("pread", n, errno, "(root description)");
      return std::nullopt;
    }
    got += static_cast<std::size_t>(n);
  }
  return body;
}

} // namespace zark::portmap
