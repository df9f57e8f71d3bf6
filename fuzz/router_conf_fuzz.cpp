// Fuzz target of the router configuration reader (ParseRouterConf), the
// text of /etc/portforward/routers/<gateway>.conf. Besides not crashing:
// - a refusal has a reason;
// - every field of an accepted configuration ends with a NUL within its
//   record field;
// - writing it again (SerializeRouterConf) reads back to the same record
//   and writes the same text.
#include "catalog/router_conf_store.h"
#include "fuzz_support.h"
#include "syslog_capture.h"

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>

namespace {

using zark::fuzz::Require;
using namespace zark::portmap;

bool Terminated(const char (&field)[ZARK_PORTMAP_TEXT_SIZE]) {
  return std::memchr(field, '\0', sizeof(field)) != nullptr;
}

bool SameConf(const ZARK_ROUTER_CONF &a, const ZARK_ROUTER_CONF &b) {
  const auto same = [](const char *x, const char *y) {
    return std::strcmp(x, y) == 0;
  };
  return same(a.brand, b.brand) && same(a.model, b.model) &&
         same(a.version, b.version) && same(a.support_upnp, b.support_upnp) &&
         same(a.support_natpmp, b.support_natpmp) &&
         same(a.account, b.account) && same(a.password, b.password) &&
         same(a.conn_type, b.conn_type) && same(a.conn_port, b.conn_port) &&
         same(a.max_rule, b.max_rule);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  // Log lines are captured (tests/support/syslog_capture.h); keep only
  // this input's.
  zark::test::ClearLogs();
  const std::string_view text = zark::fuzz::AsText(data, size);
  ZARK_ROUTER_CONF conf{};
  std::string why;
  if (!ParseRouterConf(text, conf, why)) {
    Require(!why.empty(), "a refusal without a reason");
    return 0;
  }
  Require(Terminated(conf.brand) && Terminated(conf.model) &&
              Terminated(conf.version) && Terminated(conf.support_upnp) &&
              Terminated(conf.support_natpmp) && Terminated(conf.account) &&
              Terminated(conf.password) && Terminated(conf.conn_type) &&
              Terminated(conf.conn_port) && Terminated(conf.max_rule),
          "an accepted field is not NUL-terminated");
  const std::string written = SerializeRouterConf("192.168.1.1", conf);
  ZARK_ROUTER_CONF again{};
  Require(ParseRouterConf(written, again, why),
          "a written configuration does not read back: " + why);
  Require(SameConf(conf, again),
          "a written configuration reads back different");
  Require(SerializeRouterConf("192.168.1.1", again) == written,
          "writing is not stable");
  return 0;
}
