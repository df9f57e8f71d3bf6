// The result of the last router detection, kept on disk so that
// KLibGetRouterDetectResult answers it in any process until the next
// detection replaces it: /etc/portforward/detect_result.json (mode 0644:
// it holds no secret), replaced atomically.
//
//   {"format": 1, "en_progress": 100, "reserved": 0, "warning": 0,
//    "hops": 1, "gateway_ip": "192.168.1.1", "network_interface": "eth0",
//    "support_upnp": 1, "support_natpmp": 1, "router_brand": "ZarkTest",
//    "router_model": "TestIGD", "router_version": "1",
//    "upnp_pfpath": "ZarkTest: TestIGD(1)", "router_user_setting_name": "",
//    "router_max_rule": 0}
//
// Every member of ZARK_ROUTER_DETECT_RESULT, by its name; texts at most
// 1023 bytes without NUL.
#ifndef ZARK_PORTMAP_DETECT_RESULT_STORE_H
#define ZARK_PORTMAP_DETECT_RESULT_STORE_H

#include "libzarkportmap.h"

#include <string>
#include <string_view>

namespace zark::portmap {

inline constexpr const char *kDetectResultPath =
    ZARK_PORTMAP_CONF_DIR "/detect_result.json";
inline constexpr int kDetectResultFormat = 1;

// The file's text. Pure. Text fields are read up to their first NUL.
[[nodiscard]] std::string
SerializeDetectResult(const ZARK_ROUTER_DETECT_RESULT &result);

// Reads a text of SerializeDetectResult. False, why set, for anything
// else: not strict JSON, another format, a member missing or of another
// type, a number out of the field's range, a text too long or holding a
// NUL. result is only written on success. Never throws.
[[nodiscard]] bool ParseDetectResult(std::string_view text,
                                     ZARK_ROUTER_DETECT_RESULT &result,
                                     std::string &why) noexcept;

// Replaces the stored result (the folder is created when missing). False,
// logged, when it cannot be written; the old one is then untouched.
[[nodiscard]] bool StoreDetectResult(const std::string &path,
                                     const ZARK_ROUTER_DETECT_RESULT &result);

enum class DetectResultLoad {
  kLoaded, // result filled
  kNone,   // no detection result is stored
  kBroken, // the file cannot be read or parsed (logged)
};

[[nodiscard]] DetectResultLoad
LoadDetectResult(const std::string &path, ZARK_ROUTER_DETECT_RESULT &result);

} // namespace zark::portmap

#endif
