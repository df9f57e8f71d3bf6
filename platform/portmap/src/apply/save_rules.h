// Applying a rule set to the router configured for a gateway
// (KLibSaveRules, and the zarkportforward tool).
//
// 1. The rules are checked (rule_validation.h) before anything else; a
//    refusal touches nothing.
// 2. The router configuration picks the protocol (drivers/driver_choice.h).
// 3. The work is the difference between the mappings the rules ask for and
//    those the library remembers having made on that router
//    (mapping_state.h): mappings no longer wanted, or changed, are deleted
//    first (the "del" stage), then the missing ones are added (the "add"
//    stage). With verifyUnchanged (every save) the router is asked about
//    the unchanged ones too, and what it lost is added again ("repaired").
// 4. Before the router is touched, the state file marks every mapping about
//    to change as "not known to be held"; after each stage (and every
//    second during a long one) it records what the router answered. A job
//    that is killed or stopped half way therefore leaves a state that the
//    next job repairs.
// 5. A rule set that passed the checks becomes the saved rule configuration
//    before the router is touched, so that a router that does not answer
//    or refuses some mappings never costs the administrator the rules: the
//    mapping state marks each wanted mapping with where it stands (on the
//    router, refused and why, pending) and the next save, repair or keeper
//    round applies what is left.
//
// Every router operation is bounded by its protocol's deadline (upnp.h,
// natpmp.h); a router that stops answering ends the job at once with
// kSaveErrRouter, and the whole job also stops when ApplyEnvironment's
// deadline has passed.
#ifndef ZARK_PORTMAP_SAVE_RULES_H
#define ZARK_PORTMAP_SAVE_RULES_H

#include "base/running_task.h"
#include "catalog/mapping_state.h"
#include "drivers/driver_choice.h"
#include "drivers/router_driver.h"
#include "libzarkportmap.h"

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace zark::portmap {

// Error types of a failed save besides the refusals of rule_validation.h
// and ZARK_SAVE_ERR_NOT_CONFIGURED (2). The module has no code of its own
// for these and answers its default 1500; detail.text says what happened.
// 1: an unexpected failure (out of memory).
inline constexpr uint32_t kSaveErrGeneric = ZARK_PORTMAP_ERR_GENERIC;
// 3: bad arguments (NULL gateway or rules, a gateway that is not an IPv4
// address, a rule text that does not fit the rule store).
inline constexpr uint32_t kSaveErrBadParameter = ZARK_PORTMAP_ERR_BAD_PARAMETER;
// 4: a file of the library (mapping state, rule configuration) could not be
// written.
inline constexpr uint32_t kSaveErrIo = ZARK_PORTMAP_ERR_IO;
// 5: the router refused a mapping, a router port is taken (UPnP 718/729,
// NAT-PMP granted another port), the router dropped a mapping it said it
// added, it stopped answering, or the job ran out of time.
inline constexpr uint32_t kSaveErrRouter = ZARK_PORTMAP_ERR_ROUTER;

struct ApplyOptions {
  // Also ask the router about the mappings the state says it holds (UPnP:
  // one GetSpecificPortMappingEntry each; NAT-PMP, which cannot be asked:
  // map them again) and re-add the ones it lost.
  bool verifyUnchanged = false;
  // Re-add mappings whose lease ends within ApplyEnvironment::renewAhead.
  bool refreshLeases = false;
  // On success the rules become the saved rule configuration.
  bool writeRuleConf = true;
  // Write the progress file (the callback is called either way).
  bool reportProgress = true;
  // The job's name in the record of the last job: "save", "renew",
  // "repair".
  std::string jobKind = "save";
  // Refresh a lease once half of what the router granted has passed
  // (instead of renewAhead before its end): the keeper's rule.
  bool renewAtHalfLease = false;
  // Also ask the router for its outside address (it is always asked when a
  // mapping fails, to tell a double NAT).
  bool askExternalAddress = false;
};

struct ApplyEnvironment {
  std::function<bool(const std::string &gateway, RouterChoice &choice,
                     int &err)>
      chooseRouter;
  std::function<std::unique_ptr<RouterDriver>(RouterProtocol protocol,
                                              const std::string &gateway,
                                              const RouterRecord *memo)>
      makeRouter;
  // Our address as the router sees it.
  std::function<std::optional<std::string>(const std::string &gateway)>
      localAddress;
  // Seconds since 1970.
  std::function<int64_t()> now;
  std::string statePath = kMappingStatePath;
  std::string progressPath = ZARK_PORTMAP_APPLY_PROGRESS;
  std::string ruleConfPath = ZARK_PORTMAP_RULE_CONF;
  std::string runningTaskPath = kRunningTaskPath;
  std::chrono::seconds deadline{600};
  std::chrono::seconds renewAhead{2700};
  std::chrono::milliseconds stateSaveInterval{1000};
};

// The real environment: ChooseRouter, MakeRouter, LocalAddressTowards, the
// system clock, the library's paths.
[[nodiscard]] ApplyEnvironment DefaultApplyEnvironment();

// What a job did, counted by operation sent to the router.
struct ApplySummary {
  int deleted = 0;    // mappings deleted
  int added = 0;      // mappings added (and seen held)
  int checked = 0;    // mappings asked about (verifyUnchanged)
  int unchanged = 0;  // mappings left alone without a request
  int failed = 0;     // mappings the router refused or dropped
  int repaired = 0;   // mappings found missing on the router, added again
  int operations = 0; // router operations started
};

// Applies rules to the router configured for gateway. result is reset, then
// receives the percentage for the callback (which may be null) and, on
// failure, the error type and its detail. 0 on success, -1 on failure.
[[nodiscard]] int ApplyRules(const std::string &gateway,
                             std::span<const ZARK_ROUTER_RULE> rules,
                             const ApplyOptions &options,
                             const ApplyEnvironment &environment,
                             ZARK_ROUTER_SAVE_RULE_RESULT &result,
                             ZARK_SAVE_RULE_PROGRESS_CB callback, void *arg,
                             ApplySummary *summary = nullptr);

// The description a mapping gets in the router's table:
// "zarkportforward <rule id>", the id cut to 40 bytes and limited to
// letters, digits, ".", "-" and "_" (others become "_"): miniupnpc puts the
// text into its SOAP request unescaped.
[[nodiscard]] std::string MappingDescription(std::string_view ruleId);

} // namespace zark::portmap

#endif
