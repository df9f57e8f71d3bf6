// Service definition files for the firewall tests, written inside the
// private mount namespace.
#ifndef ZARK_TESTS_FIREWALL_TEST_FILES_H
#define ZARK_TESTS_FIREWALL_TEST_FILES_H

#include "klibc.h"

#include <memory>
#include <string>
#include <vector>

namespace zark::test {

// "<ZARK_FW_SYSTEM_SERVICE_DIR>/<id>.sc".
void WriteSystemService(const std::string &id, const std::string &text);
// "<ZARK_FW_PACKAGE_SERVICE_DIR>/<name>" (name with its suffix).
void WritePackageFile(const std::string &name, const std::string &text);
// One section's text.
std::string Section(const std::string &name, const std::string &protocol,
                    const std::string &ports, bool forwardable = true);
// Copies the definitions that ship with the system (services.d and the
// mapping table) to where they are installed.
void InstallShippedDefinitions();

struct SzListDeleter {
  void operator()(KLIBSZLIST *list) const { KLIBCSzListFree(list); }
};
using SzList = std::unique_ptr<KLIBSZLIST, SzListDeleter>;

SzList NewList(const std::vector<std::string> &items = {});
std::vector<std::string> Items(const KLIBSZLIST *list);

} // namespace zark::test

#endif
