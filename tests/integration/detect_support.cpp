#include "detect_support.h"

#include "base/library_config.h"
#include "catalog/router_conf_store.h"
#include "hermetic.h"
#include "klibc.h"
#include "outside_services.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>

namespace zark::integration {
namespace {

namespace fs = std::filesystem;

bool SetConfig(std::string_view key, const std::string &value,
               std::string &why) {
  const std::string keyText(key);
  if (KLIBCFileSetKeyValue(ZARK_PORTMAP_CONF_DIR "/portmap.conf",
                           keyText.c_str(), value.c_str(), 0) != 0) {
    why = "cannot set " + keyText + " in the library configuration";
    return false;
  }
  return true;
}

bool Write(const std::string &path, const std::string &content, mode_t mode,
           std::string &why) {
  {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << content;
    if (!out) {
      why = "cannot write " + path;
      return false;
    }
  }
  ::chmod(path.c_str(), mode);
  return true;
}

} // namespace

bool ConfigureDetection(const zark::testnet::TestNetwork &network,
                        std::string &why) {
  if (!zark::test::InPrivateMountNamespace()) {
    why = "not in the private mount namespace: /etc/resolv.conf is the "
          "machine's";
    return false;
  }
  std::error_code ec;
  fs::create_directories(ZARK_PORTMAP_CONF_DIR, ec);
  if (!SetConfig(zark::portmap::config_key::kWanProbeHosts,
                 network.wanOutside + ":" + std::to_string(kWanProbePort),
                 why) ||
      !SetConfig(zark::portmap::config_key::kDnsProbeName, kDetectProbeName,
                 why)) {
    return false;
  }
  // /etc is an overlay here; a symbolic link there (to a resolver's own
  // file) is replaced, never written through.
  if (::unlink("/etc/resolv.conf") != 0 && errno != ENOENT) {
    why =
        std::string("cannot remove /etc/resolv.conf: ") + std::strerror(errno);
    return false;
  }
  return Write("/etc/resolv.conf", "nameserver " + network.wanOutside + "\n",
               0644, why);
}

bool InstallPortForwardTool(const std::string &toolPath, bool record,
                            const std::string &gateway, std::string &why) {
  if (!zark::test::InPrivateMountNamespace()) {
    why = "not in the private mount namespace: /usr/zark is the machine's";
    return false;
  }
  std::error_code ec;
  fs::create_directories("/usr/zark/bin", ec);
  const std::string real =
      record ? std::string(kPortForwardTool) + ".real" : kPortForwardTool;
  fs::copy_file(toolPath, real, fs::copy_options::overwrite_existing, ec);
  if (ec) {
    why = "cannot copy " + toolPath + ": " + ec.message();
    return false;
  }
  ::chmod(real.c_str(), 0755);
  if (!record) {
    return true;
  }
  const std::string conf = zark::portmap::RouterConfPath(gateway);
  return Write(kPortForwardTool,
               "#!/bin/sh\n"
               "# Records what the tool saw, then runs it.\n"
               "cp '" +
                   conf + "' '" + kToolSeenConf +
                   "'\n"
                   "'" +
                   real +
                   "' \"$@\"\n"
                   "status=$?\n"
                   "echo \"$status\" > '" +
                   kToolStatus +
                   "'\n"
                   "exit \"$status\"\n",
               0755, why);
}

int DetectInTestNetwork(const zark::testnet::TestNetwork &network,
                        ZARK_ROUTER_DETECT_RESULT &result, std::string &why) {
  if (!ConfigureDetection(network, why)) {
    return -2;
  }
  OutsideServices outside(network, kDetectProbeName, network.wanOutside,
                          kWanProbePort);
  if (!outside.Running()) {
    why = outside.Why();
    return -2;
  }
  result = ZARK_ROUTER_DETECT_RESULT{};
  return KLibDetectRouter(&result, nullptr, nullptr, true);
}

} // namespace zark::integration
