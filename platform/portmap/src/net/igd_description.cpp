#include "net/igd_description.h"

#include "base/portmap_log.h"
#include "base/unique_fd.h"
#include "net/http_download.h"
#include "net/xml_reader.h"

#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

namespace zark::portmap {
namespace {

constexpr std::size_t kMaxDepth = 64;

// Appends text to out with runs of blanks and control characters made one
// blank, none at the start; a blank is written only when something
// follows it, so out never ends with one. Stops growing past
// kMaxIdentityText.
void AppendCleaned(std::string_view text, std::string &out, bool &blank) {
  for (char c : text) {
    if (out.size() > kMaxIdentityText) {
      return;
    }
    const bool isBlank =
        static_cast<unsigned char>(c) < 0x20 || c == ' ' || c == 0x7F;
    if (isBlank) {
      blank = !out.empty();
      continue;
    }
    if (blank) {
      out += ' ';
      blank = false;
    }
    out += c;
  }
}

// Collects the names of the first <device> element, the root device,
// from its own children only: the names of embedded devices (in its
// <deviceList>) belong to their chips, not to the router.
class IdentityReader final : public XmlVisitor {
public:
  [[nodiscard]] const IgdIdentity &Identity() const { return mIdentity; }

  bool OnStart(std::string_view name, std::size_t depth) override {
    if (mRootDevice == 0 && name == "device") {
      mRootDevice = depth;
    }
    StartText();
    return true;
  }

  bool OnEnd(std::string_view name, std::size_t depth) override {
    if (mRootDevice != 0 && depth == mRootDevice + 1) {
      Keep(name);
    }
    StartText();
    // Nothing after the root device is read.
    return depth != mRootDevice;
  }

  void OnText(std::string_view text, std::size_t depth,
              bool fromReference) override {
    if (mRootDevice == 0 || depth != mRootDevice + 1) {
      return;
    }
    // Names are shown as they are; a character written as a reference
    // shows only when it is printable ASCII, anything else as "?".
    if (fromReference &&
        !(text.size() == 1 && text[0] >= 0x20 && text[0] < 0x7F)) {
      text = "?";
    }
    AppendCleaned(text, mText, mBlank);
  }

private:
  void StartText() {
    mText.clear();
    mBlank = false;
  }

  // Only the first of a repeated element counts.
  void Keep(std::string_view name) {
    std::string value = mText.substr(0, kMaxIdentityText);
    if (!value.empty() && value.back() == ' ') {
      value.pop_back(); // the cut fell just after a blank
    }
    if (name == "manufacturer" && !mHaveManufacturer) {
      mIdentity.manufacturer = std::move(value);
      mHaveManufacturer = true;
    } else if (name == "modelName" && !mHaveModelName) {
      mIdentity.modelName = std::move(value);
      mHaveModelName = true;
    } else if (name == "modelNumber" && !mHaveModelNumber) {
      mIdentity.modelNumber = std::move(value);
      mHaveModelNumber = true;
    }
  }

  IgdIdentity mIdentity;
  std::size_t mRootDevice = 0; // its depth; 0 until it opens
  std::string mText;           // the current element's text, cleaned
  bool mBlank = false;         // a blank is due before the next character
  bool mHaveManufacturer = false;
  bool mHaveModelName = false;
  bool mHaveModelNumber = false;
};

} // namespace

IgdIdentity ParseIgdIdentity(std::string_view xml) {
  IdentityReader reader;
  // However the reading ends, what was whole before the end is kept.
  (void)ReadXml(
      xml, reader,
      XmlLimits{.maxBytes = kMaxRootDescriptionBytes, .maxDepth = kMaxDepth});
  return reader.Identity();
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
