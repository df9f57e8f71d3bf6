#include "zarkportforward_tool.h"

#include "libzarkportmap.h"
#include "zarkportforward.h"

#include <getopt.h>

#include <memory>
#include <span>
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

int ExitForSaveError(uint32_t type) {
  switch (type) {
  case ZARK_SAVE_ERR_NONE:
    return kToolOk;
  case ZARK_SAVE_ERR_NOT_CONFIGURED:
    return kToolNotConfigured;
  case ZARK_PORTMAP_ERR_IO:
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
          std::ostream &err) {
  ZARK_PORTMAP_APPLY_SUMMARY summary{};
  ZARK_ROUTER_SAVE_RULE_RESULT result{};
  const int rc = KLibApplySavedRules(gateway.c_str(), renew, &summary, &result);
  if (rc == ZARK_APPLY_SAVED_RULES_UNREADABLE) {
    err << "zarkportforward: cannot read the saved rules ("
        << ZARK_PORTMAP_RULE_CONF << ")\n";
    return kToolFileFailed;
  }
  out << (renew ? "renew" : "apply") << ": " << summary.deleted << " deleted, "
      << summary.added << " added, " << summary.checked << " checked, "
      << summary.unchanged << " unchanged, " << summary.failed << " failed, "
      << summary.repaired << " repaired\n";
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

// A list from KLibListRouterMappings, freed on every path.
struct OwnedMappings {
  OwnedMappings() = default;
  OwnedMappings(const OwnedMappings &) = delete;
  OwnedMappings &operator=(const OwnedMappings &) = delete;
  ~OwnedMappings() { KLibFreeRouterMappings(&list); }
  ZARK_ROUTER_MAPPINGS list{};
};

int List(const std::string &gateway, std::ostream &out, std::ostream &err) {
  OwnedMappings owned;
  ZARK_ROUTER_MAPPINGS &mappings = owned.list;
  ZARK_LIBZARKPORTMAP_ERR listErr{};
  const int rc = KLibListRouterMappings(gateway.c_str(), &mappings, &listErr);
  if (mappings.record_unreadable != 0) {
    err << "zarkportforward: the record of our mappings cannot be read\n";
  }
  if (rc != 0) {
    if (mappings.message[0] != '\0') {
      err << "zarkportforward: " << mappings.message << "\n";
    }
    switch (listErr.err) {
    case ZARK_PORTMAP_ERR_NOT_CONFIGURED:
      return kToolNotConfigured;
    case ZARK_PORTMAP_ERR_ROUTER:
      return kToolRouterFailed;
    default:
      return kToolFileFailed;
    }
  }
  const std::span<const ZARK_ROUTER_MAPPING> entries(
      mappings.mappings, static_cast<std::size_t>(mappings.count));
  if (mappings.from_record != 0) {
    out << "router: " << mappings.router_protocol << " at " << mappings.location
        << " (it cannot list its table; these are the mappings this server "
           "made)\n";
    for (const ZARK_ROUTER_MAPPING &mapping : entries) {
      out << "* " << mapping.protocol << " " << mapping.external_port << " -> "
          << mapping.internal_client << ":" << mapping.internal_port
          << " lease " << mapping.lease_seconds
          << (mapping.held != 0 ? "" : " (not known to be held)") << " rule \""
          << mapping.rule_id << "\"\n";
    }
    return kToolOk;
  }
  out << "router: " << mappings.router_protocol << " at " << mappings.location
      << "\n";
  for (const ZARK_ROUTER_MAPPING &entry : entries) {
    out << (entry.ours != 0 ? "* " : "  ") << entry.protocol << " "
        << entry.external_port << " -> " << entry.internal_client << ":"
        << entry.internal_port << " lease " << entry.lease_seconds << " \""
        << entry.description << "\"\n";
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
    return List(*gateway, out, err);
  }
  return Apply(*gateway, command == "renew", out, err);
}

} // namespace zark::portmap
