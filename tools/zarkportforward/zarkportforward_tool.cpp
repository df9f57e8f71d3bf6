#include "zarkportforward_tool.h"

#include "catalog/mapping_state.h"
#include "drivers/driver_choice.h"
#include "libzarkportmap.h"

#include <getopt.h>

#include <memory>
#include <vector>

namespace zark::portmap {
namespace {

// Holds the system-wide port-map lock for the tool's whole run, so that
// the tool and a save from the web interface never talk to the router at
// the same time.
class PortMapLock {
public:
  PortMapLock() : mHeld(KLibZarkPortMapLock() == 0) {}
  PortMapLock(const PortMapLock &) = delete;
  PortMapLock &operator=(const PortMapLock &) = delete;
  ~PortMapLock() {
    if (mHeld) {
      KLibZarkPortMapUnLock();
    }
  }
  [[nodiscard]] bool Held() const { return mHeld; }

private:
  bool mHeld;
};

struct RulesArrayDeleter {
  void operator()(ZARK_ROUTER_RULE *rules) const { KLibFreeRulesArr(rules); }
};

int ExitForSaveError(uint32_t type) {
  switch (type) {
  case ZARK_SAVE_ERR_NONE:
    return kToolOk;
  case ZARK_SAVE_ERR_NOT_CONFIGURED:
    return kToolNotConfigured;
  case kSaveErrIo:
    return kToolFileFailed;
  case ZARK_SAVE_ERR_TOO_MANY_RULES:
  case ZARK_SAVE_ERR_BAD_PORT_TEXT:
  case ZARK_SAVE_ERR_BAD_PROTOCOL:
  case ZARK_SAVE_ERR_PORT_TOO_HIGH:
  case ZARK_SAVE_ERR_TOO_MANY_PORTS:
  case ZARK_SAVE_ERR_RANGE_TOO_LONG:
    return kToolRulesRefused;
  default:
    return kToolRouterFailed;
  }
}

int Apply(const std::string &gateway, bool renew, std::ostream &out,
          std::ostream &err, const ToolEnvironment &environment) {
  int count = 0;
  ZARK_ROUTER_RULE *raw = nullptr;
  ZARK_LIBZARKPORTMAP_ERR readErr{};
  if (KLibGetRulesArrFromRuleConf(&count, &raw, nullptr, false, &readErr) < 0) {
    err << "zarkportforward: cannot read the saved rules ("
        << ZARK_PORTMAP_RULE_CONF << ")\n";
    return kToolFileFailed;
  }
  std::unique_ptr<ZARK_ROUTER_RULE, RulesArrayDeleter> rules(raw);

  ApplyOptions options;
  options.verifyUnchanged = true;
  options.refreshLeases = true;
  options.writeRuleConf = false;
  options.reportProgress = !renew;
  ZARK_ROUTER_SAVE_RULE_RESULT result{};
  ApplySummary summary;
  int rc = ApplyRules(gateway,
                      std::span<const ZARK_ROUTER_RULE>(
                          rules.get(), static_cast<std::size_t>(count)),
                      options, environment.apply, result, nullptr, nullptr,
                      &summary);
  out << (renew ? "renew" : "apply") << ": " << summary.deleted << " deleted, "
      << summary.added << " added, " << summary.checked << " checked, "
      << summary.unchanged << " unchanged, " << summary.failed << " failed\n";
  if (rc == 0) {
    return kToolOk;
  }
  // Below ZARK_SAVE_ERR_TOO_MANY_RULES (not configured among them), the
  // detail is a text too.
  const bool textual = result.errType == ZARK_SAVE_ERR_BAD_PORT_TEXT ||
                       result.errType == ZARK_SAVE_ERR_BAD_PROTOCOL ||
                       result.errType < ZARK_SAVE_ERR_TOO_MANY_RULES;
  err << "zarkportforward: failed (error type " << result.errType << ")";
  if (textual && result.detail.text[0] != '\0') {
    err << ": " << result.detail.text;
  } else if (!textual) {
    err << ": limit " << result.detail.limit.maxPort;
  }
  err << "\n";
  return ExitForSaveError(result.errType);
}

int List(const std::string &gateway, std::ostream &out, std::ostream &err,
         const ToolEnvironment &environment) {
  RouterChoice choice;
  int code = ZARK_PORTMAP_ERR_NONE;
  if (!environment.apply.chooseRouter(gateway, choice, code)) {
    err << "zarkportforward: no router that the library can drive is "
           "configured for "
        << gateway << "\n";
    return code == ZARK_PORTMAP_ERR_NOT_CONFIGURED ? kToolNotConfigured
                                                   : kToolFileFailed;
  }
  MappingState state;
  if (!LoadMappingState(environment.apply.statePath, state)) {
    err << "zarkportforward: the record of our mappings cannot be read\n";
  }
  const RouterRecord *record = state.Find(gateway, choice.protocol);
  std::unique_ptr<RouterDriver> router =
      environment.apply.makeRouter(choice.protocol, gateway, record);
  if (router == nullptr) {
    return kToolRouterFailed;
  }
  std::vector<RouterMapping> entries;
  RouterResult listed = router->ListMappings(entries);
  auto ours = [&](IpProtocol protocol, uint16_t port) {
    return record != nullptr && record->Find(protocol, port) != nullptr;
  };
  if (listed.outcome == RouterOutcome::kUnsupported) {
    out << "router: " << RouterProtocolName(choice.protocol) << " at "
        << gateway
        << " (it cannot list its table; these are the mappings this server "
           "made)\n";
    if (record != nullptr) {
      for (const RecordedMapping &mapping : record->mappings) {
        out << "* " << UpnpProtocolName(mapping.protocol) << " "
            << mapping.externalPort << " -> " << mapping.internalClient << ":"
            << mapping.internalPort << " lease " << mapping.leaseSeconds
            << (mapping.held ? "" : " (not known to be held)") << " rule \""
            << mapping.ruleId << "\"\n";
      }
    }
    return kToolOk;
  }
  if (!listed.Ok()) {
    err << "zarkportforward: " << listed.message << "\n";
    return kToolRouterFailed;
  }
  out << "router: " << RouterProtocolName(choice.protocol) << " at "
      << router->Location() << "\n";
  for (const RouterMapping &entry : entries) {
    out << (ours(entry.protocol, entry.externalPort) ? "* " : "  ")
        << UpnpProtocolName(entry.protocol) << " " << entry.externalPort
        << " -> " << entry.internalClient << ":" << entry.internalPort
        << " lease " << entry.leaseSeconds << " \"" << entry.description
        << "\"\n";
  }
  out << entries.size() << " mapping(s); * made by this server\n";
  return kToolOk;
}

} // namespace

std::string Usage() {
  return "usage: zarkportforward [renew | list | --help]\n"
         "\n"
         "  (no argument)  apply the saved port-forwarding rules to the "
         "router\n"
         "                 configured for the default gateway: delete what is\n"
         "                 no longer wanted, add what is missing, ask the\n"
         "                 router about the rest and add again what it lost\n"
         "  renew          the same without progress file: refresh leases\n"
         "                 that run out within 45 minutes and add again every\n"
         "                 mapping the router lost (run by a timer)\n"
         "  list           print the router's port mappings (* marks those\n"
         "                 made by this server; a NAT-PMP router cannot list\n"
         "                 its table, so the server's own record is printed)\n"
         "  --help         print this text\n"
         "\n"
         "exit codes:\n"
         "  0  done\n"
         "  1  unknown argument\n"
         "  2  no router that the library can drive is configured for the\n"
         "     gateway\n"
         "  3  no default gateway, or another port-map job holds the lock\n"
         "  4  the router refused, dropped or did not answer some mappings\n"
         "  5  a file of the library cannot be read or written\n"
         "  6  the saved rules are refused (the system log says why)\n";
}

ToolEnvironment DefaultToolEnvironment() {
  ToolEnvironment environment;
  environment.gateway = []() -> std::optional<std::string> {
    char buffer[64] = {};
    if (KLibGetGatewayIP(buffer, sizeof(buffer)) < 0) {
      return std::nullopt;
    }
    return std::string(buffer);
  };
  environment.apply = DefaultApplyEnvironment();
  return environment;
}

int RunZarkPortForward(std::span<const std::string> args, std::ostream &out,
                       std::ostream &err, const ToolEnvironment &environment) {
  if (args.size() > 1) {
    err << Usage();
    return kToolUsage;
  }
  static const option kOptions[] = {
      {"help", no_argument, nullptr, 'h'},
      {nullptr, 0, nullptr, 0},
  };
  // getopt_long wants writable strings and the program's name first.
  std::vector<std::string> words(args.begin(), args.end());
  std::string program = "zarkportforward";
  std::vector<char *> argv = {program.data()};
  for (std::string &word : words) {
    argv.push_back(word.data());
  }
  argv.push_back(nullptr);
  const int argc = static_cast<int>(argv.size()) - 1;
  // optind 0 makes GNU getopt start over: the tool runs more than once in
  // a test process. "+": the command is no option and ends them.
  optind = 0;
  opterr = 0;
  for (int got = 0;
       (got = getopt_long(argc, argv.data(), "+h", kOptions, nullptr)) != -1;) {
    if (got == 'h') {
      out << Usage();
      return kToolOk;
    }
    err << "zarkportforward: unknown argument \"" << args[0] << "\"\n"
        << Usage();
    return kToolUsage;
  }
  // "--" alone ends the options and names no command: refused as it always
  // was, rather than read as "apply".
  if (!args.empty() && optind >= argc) {
    err << "zarkportforward: unknown argument \"" << args[0] << "\"\n"
        << Usage();
    return kToolUsage;
  }
  const std::string command = optind < argc ? argv[optind] : std::string();
  if (!command.empty() && command != "renew" && command != "list") {
    err << "zarkportforward: unknown argument \"" << command << "\"\n"
        << Usage();
    return kToolUsage;
  }
  std::optional<std::string> gateway = environment.gateway();
  if (!gateway) {
    err << "zarkportforward: the default gateway is unknown\n";
    return kToolNoGateway;
  }
  PortMapLock lock;
  if (!lock.Held()) {
    err << "zarkportforward: another port-map job holds the lock\n";
    return kToolNoGateway;
  }
  if (command == "list") {
    return List(*gateway, out, err, environment);
  }
  return Apply(*gateway, command == "renew", out, err, environment);
}

} // namespace zark::portmap
