// Service definition files: one file per service, one [section] per
// firewall section of the service.
//
//   # Web administration
//   [webadmin_http]
//   title="Web administration (HTTP)"
//   protocol=tcp
//   ports=5000
//   forwardable=yes
//
// The line syntax is the core library's key/value file syntax (section
// headers, key=value, key="value", # and ; comments, a leading UTF-8 byte
// order mark skipped), so that the core
// library's section enumeration and this parser see the same sections.
#ifndef ZARK_PLATFORM_FIREWALL_SERVICE_FILE_H
#define ZARK_PLATFORM_FIREWALL_SERVICE_FILE_H

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zark::fw {

// Keys of a section.
inline constexpr std::string_view kKeyTitle = "title";
inline constexpr std::string_view kKeyProtocol = "protocol";
inline constexpr std::string_view kKeyPorts = "ports";
inline constexpr std::string_view kKeyForwardable = "forwardable";

// Longest section name (bytes) that fits the firewall-section record.
inline constexpr size_t kMaxSectionName = 255;

// One well-formed section.
struct ServiceSection {
  std::string name;
  int line = 0; // line of its header, 1-based
  std::string title;
  int protoMask = 0; // ZARK_FW_PROTO_*
  bool forwardable = true;
  // Port items; nullopt when the section has no "ports" key at all.
  std::optional<std::vector<std::string>> ports;
};

struct ServiceFileParse {
  // Every section name of the file, in file order, each once (also those of
  // sections that were refused): what a section enumeration of the file
  // lists.
  std::vector<std::string> sectionNames;
  // The well-formed sections, in file order.
  std::vector<ServiceSection> sections;
  // One human-readable line per thing refused or ignored ("line 7: section
  // [ftp] skipped: bad port \"x\"").
  std::vector<std::string> problems;
};

// Parses the text of one service definition file. Never fails: what cannot
// be used is left out and described in problems. A section is refused when
// its name is longer than kMaxSectionName, when it repeats an earlier
// section's name, when "protocol" is missing or not one of tcp, udp, both,
// when "ports" is not a valid port list (see ParsePortList), or when
// "forwardable" is neither yes nor no. Key/value lines before the first
// section header are ignored, as are unknown keys; a repeated key keeps its
// first value.
[[nodiscard]] ServiceFileParse ParseServiceFile(std::string_view text);

} // namespace zark::fw

#endif
