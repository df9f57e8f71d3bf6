// Checks a request passes before it is routed, against attacks through a
// victim's browser: a Host header that is not this machine (a DNS rebinding
// page reaching the host under the attacker's name), an Origin of another
// site (a cross-site form logging the browser in, or calling a method),
// and control characters in the decoded path ("/index.html%00.png").
#ifndef ZARK_HOST_REQUEST_GUARD_H
#define ZARK_HOST_REQUEST_GUARD_H

#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace zark::host {

// True when host (a Host header: "name", "name:port", "192.0.2.1:5000",
// "[::1]:5000") names this machine: an IPv4 or IPv6 literal (a rebinding
// page has only names), or one of names (compared ignoring case and a
// final "."). An empty host (an HTTP/1.0 client) is true too: browsers
// always send one.
[[nodiscard]] bool IsAllowedHost(std::string_view host,
                                 std::span<const std::string> names);

// True when origin (an Origin header) is "http://" or "https://" followed by
// host (the request's Host header), ignoring case. "null" and every other
// site are false.
[[nodiscard]] bool IsSameOrigin(std::string_view origin, std::string_view host);

// True when the decoded path holds a byte below 0x20 or 0x7f.
[[nodiscard]] bool HasControlCharacter(std::string_view path);

// The names the host answers to besides address literals: "localhost", the
// machine's host name and that name under ".local".
[[nodiscard]] std::vector<std::string> LocalHostNames();

} // namespace zark::host

#endif
