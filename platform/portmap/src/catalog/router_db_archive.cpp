#include "catalog/router_db_archive.h"

#include "base/child_process.h"
#include "base/portmap_log.h"

#include <charconv>

namespace zark::portmap {
namespace {

constexpr std::string_view kTopFolder = "routerdb/";

// Cuts the next blank-separated field off the front of line.
std::string_view NextField(std::string_view &line) {
  std::size_t start = line.find_first_not_of(' ');
  if (start == std::string_view::npos) {
    line = {};
    return {};
  }
  line.remove_prefix(start);
  std::size_t end = line.find(' ');
  std::string_view field = line.substr(0, end);
  line.remove_prefix(end == std::string_view::npos ? line.size() : end);
  return field;
}

bool NameIsSafe(std::string_view name) {
  if (name.substr(0, kTopFolder.size()) != kTopFolder) {
    return false;
  }
  std::string_view rest = name;
  while (!rest.empty()) {
    std::size_t slash = rest.find('/');
    std::string_view part = rest.substr(0, slash);
    if (part == "." || part == "..") {
      return false;
    }
    // "a//b": an empty component means the name is not what it looks like.
    if (part.empty() && slash != std::string_view::npos) {
      return false;
    }
    rest.remove_prefix(slash == std::string_view::npos ? rest.size()
                                                       : slash + 1);
  }
  return true;
}

bool CheckLine(std::string_view line, std::size_t &total, std::string &why) {
  const std::string_view original = line;
  // tar starts each line with the mode; anything before it means the line
  // is not what it seems.
  if (line.empty() || line[0] == ' ') {
    why = "unexpected listing line \"" + std::string(original.substr(0, 200)) +
          "\"";
    return false;
  }
  std::string_view mode = NextField(line);
  std::string_view owner = NextField(line);
  std::string_view size = NextField(line);
  std::string_view date = NextField(line);
  std::string_view time = NextField(line);
  // One blank separates the time from the name, which may hold blanks.
  if (mode.size() != 10 || owner.empty() || size.empty() || date.empty() ||
      time.empty() || line.size() < 2 || line[0] != ' ') {
    why = "unexpected listing line \"" + std::string(original.substr(0, 200)) +
          "\"";
    return false;
  }
  std::string_view name = line.substr(1);
  if (mode[0] != '-' && mode[0] != 'd') {
    why = "member \"" + std::string(name.substr(0, 200)) +
          "\" is neither a folder nor a regular file";
    return false;
  }
  if (!NameIsSafe(name)) {
    why = "member \"" + std::string(name.substr(0, 200)) +
          "\" is not a plain path under routerdb/";
    return false;
  }
  std::size_t bytes = 0;
  auto [end, ec] =
      std::from_chars(size.data(), size.data() + size.size(), bytes);
  if (ec != std::errc() || end != size.data() + size.size()) {
    why = "member \"" + std::string(name.substr(0, 200)) +
          "\" has no readable size";
    return false;
  }
  if (bytes > kMaxArchiveFileBytes) {
    why = "member \"" + std::string(name.substr(0, 200)) +
          "\" is larger than " + std::to_string(kMaxArchiveFileBytes) +
          " bytes";
    return false;
  }
  total += bytes;
  if (total > kMaxArchiveBytes) {
    why = "content larger than " + std::to_string(kMaxArchiveBytes) + " bytes";
    return false;
  }
  return true;
}

} // namespace

bool CheckArchiveListing(std::string_view listing, std::string &why) {
  std::size_t members = 0;
  std::size_t total = 0;
  while (!listing.empty()) {
    std::size_t newline = listing.find('\n');
    std::string_view line = listing.substr(0, newline);
    listing.remove_prefix(newline == std::string_view::npos ? listing.size()
                                                            : newline + 1);
    if (line.empty()) {
      continue;
    }
    if (++members > kMaxArchiveMembers) {
      why = "more than " + std::to_string(kMaxArchiveMembers) + " members";
      return false;
    }
    if (!CheckLine(line, total, why)) {
      return false;
    }
  }
  if (members == 0) {
    why = "no member";
    return false;
  }
  return true;
}

bool ExtractRouterDbArchive(const std::string &archive,
                            const std::string &folder) {
  ChildOptions listOptions;
  listOptions.timeout = std::chrono::seconds(30);
  // A listing line is about 60 bytes plus the name.
  listOptions.maxOutput = kMaxArchiveMembers * 1200;
  ChildResult listed =
      RunProgram(kTarProgram,
                 {"tar", "--list", "--verbose", "--numeric-owner",
                  "--quoting-style=escape", "--file", archive},
                 listOptions);
  if (!listed.Succeeded()) {
    ZARK_PM_LOG_ERROR("%s is not a readable archive: tar --list %s (exit "
                      "%d%s%s): %.300s",
                      archive.c_str(), listed.started ? "ran" : "did not start",
                      listed.exitStatus, listed.timedOut ? ", timed out" : "",
                      listed.outputTooLarge ? ", listing too long" : "",
                      listed.errors.c_str());
    return false;
  }
  std::string why;
  if (!CheckArchiveListing(listed.output, why)) {
    ZARK_PM_LOG_ERROR("router database archive %s refused: %s", archive.c_str(),
                      why.c_str());
    return false;
  }
  ChildOptions extractOptions;
  extractOptions.timeout = std::chrono::seconds(60);
  extractOptions.maxOutput = 64 * 1024;
  extractOptions.maxFileSize = kMaxArchiveFileBytes;
  ChildResult extracted =
      RunProgram(kTarProgram,
                 {"tar", "--extract", "--file", archive, "--directory", folder,
                  "--no-same-owner", "--no-same-permissions",
                  "--no-overwrite-dir", "--no-wildcards"},
                 extractOptions);
  if (!extracted.Succeeded()) {
    ZARK_PM_LOG_ERROR(
        "unpacking %s failed: tar --extract %s (exit %d%s): "
        "%.300s",
        archive.c_str(), extracted.started ? "ran" : "did not start",
        extracted.exitStatus, extracted.timedOut ? ", timed out" : "",
        extracted.errors.c_str());
    return false;
  }
  return true;
}

} // namespace zark::portmap
