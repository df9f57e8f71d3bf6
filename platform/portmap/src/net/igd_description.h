// Who made the router: the manufacturer, model name and model number that
// a UPnP device states in its root description (UPnP Device Architecture
// 1.1, section 2.3), fetched with tight time and size bounds.
#ifndef ZARK_PORTMAP_IGD_DESCRIPTION_H
#define ZARK_PORTMAP_IGD_DESCRIPTION_H

#include <chrono>
#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace zark::portmap {

// A description larger than this is refused.
inline constexpr std::size_t kMaxRootDescriptionBytes = 64 * 1024;
// Longer texts are cut.
inline constexpr std::size_t kMaxIdentityText = 255;

struct IgdIdentity {
  std::string manufacturer; // <manufacturer>
  std::string modelName;    // <modelName>
  std::string modelNumber;  // <modelNumber> (optional in the standard)
  friend bool operator==(const IgdIdentity &, const IgdIdentity &) = default;
};

// Reads the root device's own <manufacturer>, <modelName> and
// <modelNumber> from a root description:
//
//   <root xmlns="urn:schemas-upnp-org:device-1-0">
//     <device>
//       <deviceType>urn:...:InternetGatewayDevice:2</deviceType>
//       <manufacturer>ZarkTest</manufacturer>
//       <modelName>TestIGD</modelName><modelNumber>1</modelNumber>
//       <deviceList><device>...embedded devices, not read...</device>
//
// Read with expat (net/xml_reader.h): namespace prefixes are ignored,
// entities and CDATA decoded, undeclared entities kept as written,
// characters written as references beyond printable ASCII shown as "?",
// blanks trimmed, control characters turned into blanks, each text cut to
// kMaxIdentityText bytes. Only the first of a repeated element counts.
// Missing elements stay empty. Reading ends at the end of the root device,
// at the first fault of a document that is not well-formed (what was
// whole before it is kept), at a DOCTYPE, at nesting deeper than 64
// elements; a text longer than kMaxRootDescriptionBytes gives all three
// empty, and so does text that is not XML. Pure.
[[nodiscard]] IgdIdentity ParseIgdIdentity(std::string_view xml);

// GETs the root description at url (http:// only), at most
// kMaxRootDescriptionBytes, within budget. Nothing (logged) on any
// failure.
[[nodiscard]] std::optional<std::string>
FetchRootDescription(const std::string &url, std::chrono::milliseconds budget);

} // namespace zark::portmap

#endif
