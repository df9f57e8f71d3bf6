#include "service_file.h"

#include "klibc_text.h"
#include "port_list.h"
#include "zarkfw.h"

#include <algorithm>

namespace zark::fw {
namespace {

struct KeyValue {
  std::string key;
  std::string value;
  int line = 0;
};

// A section as written, before its keys are judged.
struct RawSection {
  std::string name;
  int line = 0;
  std::vector<KeyValue> keys;
};

std::string LinePrefix(int line) {
  return "line " + std::to_string(line) + ": ";
}

// key="value" keeps exactly what lies between the quotes.
std::string_view Unquote(std::string_view value) {
  if (value.size() >= 2 && value.front() == '"' && value.back() == '"') {
    return value.substr(1, value.size() - 2);
  }
  return value;
}

std::vector<RawSection> SplitSections(std::string_view text,
                                      std::vector<std::string> &problems) {
  constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";
  if (text.starts_with(kByteOrderMark)) {
    text.remove_prefix(kByteOrderMark.size());
  }
  std::vector<RawSection> sections;
  int lineNo = 0;
  while (!text.empty()) {
    size_t newline = text.find('\n');
    std::string_view line =
        klibc::Trim(text.substr(0, newline), klibc::kWhiteSpace);
    text = newline == std::string_view::npos ? std::string_view()
                                             : text.substr(newline + 1);
    ++lineNo;
    if (line.empty() || line.front() == '#' || line.front() == ';') {
      continue;
    }
    if (line.front() == '[') {
      // "[name]", anything after the "]" ignored; without "]" the line is
      // no header at all.
      size_t close = line.find(']');
      if (close == std::string_view::npos) {
        problems.push_back(LinePrefix(lineNo) +
                           "ignored: section header without \"]\"");
        continue;
      }
      sections.push_back(
          RawSection{std::string(klibc::Trim(line.substr(1, close - 1),
                                             klibc::kWhiteSpace)),
                     lineNo,
                     {}});
      continue;
    }
    size_t equals = line.find('=');
    std::string_view key =
        equals == std::string_view::npos
            ? std::string_view()
            : klibc::Trim(line.substr(0, equals), klibc::kWhiteSpace);
    if (key.empty()) {
      problems.push_back(LinePrefix(lineNo) +
                         "ignored: not a section header, key or comment");
      continue;
    }
    if (sections.empty()) {
      problems.push_back(LinePrefix(lineNo) + "key \"" + std::string(key) +
                         "\" ignored: no section header before it");
      continue;
    }
    sections.back().keys.push_back(
        KeyValue{std::string(key),
                 std::string(Unquote(
                     klibc::Trim(line.substr(equals + 1), klibc::kWhiteSpace))),
                 lineNo});
  }
  return sections;
}

// Judges one section; false with a reason when it cannot be used.
bool BuildSection(const RawSection &raw, ServiceSection &section,
                  std::string &reason, std::vector<std::string> &problems) {
  section.name = raw.name;
  section.line = raw.line;
  if (raw.name.empty()) {
    reason = "empty section name";
    return false;
  }
  if (raw.name.size() > kMaxSectionName) {
    reason = "section name longer than " + std::to_string(kMaxSectionName) +
             " bytes";
    return false;
  }
  std::optional<std::string_view> protocol;
  std::optional<std::string_view> ports;
  std::optional<std::string_view> forwardable;
  std::optional<std::string_view> title;
  for (const KeyValue &kv : raw.keys) {
    std::optional<std::string_view> *slot = nullptr;
    if (kv.key == kKeyProtocol) {
      slot = &protocol;
    } else if (kv.key == kKeyPorts) {
      slot = &ports;
    } else if (kv.key == kKeyForwardable) {
      slot = &forwardable;
    } else if (kv.key == kKeyTitle) {
      slot = &title;
    } else {
      continue; // keys of other tools
    }
    if (slot->has_value()) {
      problems.push_back(LinePrefix(kv.line) + "repeated key \"" + kv.key +
                         "\" of section [" + raw.name +
                         "] ignored, the first one counts");
      continue;
    }
    *slot = kv.value;
  }

  if (!protocol) {
    reason = "no protocol";
    return false;
  }
  if (*protocol == "tcp") {
    section.protoMask = ZARK_FW_PROTO_TCP;
  } else if (*protocol == "udp") {
    section.protoMask = ZARK_FW_PROTO_UDP;
  } else if (*protocol == "both") {
    section.protoMask = ZARK_FW_PROTO_BOTH;
  } else {
    reason =
        "bad protocol \"" + std::string(*protocol) + "\" (tcp, udp or both)";
    return false;
  }
  if (ports) {
    PortListParse parsed = ParsePortList(*ports);
    if (!parsed.ok) {
      reason = parsed.problem;
      return false;
    }
    section.ports = std::move(parsed.items);
  }
  if (forwardable) {
    if (*forwardable == "yes") {
      section.forwardable = true;
    } else if (*forwardable == "no") {
      section.forwardable = false;
    } else {
      reason =
          "bad forwardable \"" + std::string(*forwardable) + "\" (yes or no)";
      return false;
    }
  }
  if (title) {
    section.title = std::string(*title);
  }
  return true;
}

} // namespace

ServiceFileParse ParseServiceFile(std::string_view text) {
  ServiceFileParse result;
  std::vector<RawSection> raw = SplitSections(text, result.problems);
  for (const RawSection &rawSection : raw) {
    bool repeated =
        std::find(result.sectionNames.begin(), result.sectionNames.end(),
                  rawSection.name) != result.sectionNames.end();
    if (repeated) {
      result.problems.push_back(LinePrefix(rawSection.line) + "section [" +
                                rawSection.name +
                                "] skipped: repeats an earlier section");
      continue;
    }
    result.sectionNames.push_back(rawSection.name);
    ServiceSection section;
    std::string reason;
    if (!BuildSection(rawSection, section, reason, result.problems)) {
      result.problems.push_back(LinePrefix(rawSection.line) + "section [" +
                                rawSection.name + "] skipped: " + reason);
      continue;
    }
    result.sections.push_back(std::move(section));
  }
  if (raw.empty()) {
    result.problems.push_back("no section header");
  }
  return result;
}

} // namespace zark::fw
