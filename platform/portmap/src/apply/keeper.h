// The keeper's round (KLibKeepRouter): the renewal service that runs under
// the host keeps the router holding the saved rules without anyone pressing
// anything.
//
// A round sends nothing unless something is due:
//  - a lease past half of what the router granted (a 120 s NAT-PMP grant is
//    renewed after 60 s);
//  - a verification: checkInterval passed since a mapping was last seen on
//    the router, a wanted mapping is not known to be there (pending,
//    missing, never applied), or the last job failed (then retried after at
//    most kRetrySeconds: a failed request is a sign of a restarted router).
// What is due runs as one apply job (save_rules.h, kind "renew"), one
// request at a time; what it restores is logged. After a verification the
// router's outside address is compared with the one recorded: a change is
// logged as a sign of a restart.
#ifndef ZARK_PORTMAP_APPLY_KEEPER_H
#define ZARK_PORTMAP_APPLY_KEEPER_H

#include "apply/save_rules.h"

#include <span>
#include <string>

namespace zark::portmap {

// How soon a round retries after a failed job, at most.
inline constexpr int kRetrySeconds = 60;

// One round for rules at gateway. nextSeconds receives the seconds until the
// next round is due (1..checkIntervalSeconds). Returns 0 when nothing was due
// or the job succeeded (no rules, no router configured: nothing due); -1
// with result set when the job failed. summary counts what the job did.
[[nodiscard]] int KeepRouter(const std::string &gateway,
                             std::span<const ZARK_ROUTER_RULE> rules,
                             int checkIntervalSeconds,
                             const ApplyEnvironment &environment,
                             ZARK_ROUTER_SAVE_RULE_RESULT &result,
                             ApplySummary &summary, int &nextSeconds);

} // namespace zark::portmap

#endif
