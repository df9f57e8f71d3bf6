#include "firewall_test_files.h"

#include "hermetic.h"
#include "zarkfw.h"

#include <gtest/gtest.h>

#include <filesystem>

namespace zark::test {

void WriteSystemService(const std::string &id, const std::string &text) {
  WriteFile(std::string(ZARK_FW_SYSTEM_SERVICE_DIR) + "/" + id + ".sc", text);
}

void WritePackageFile(const std::string &name, const std::string &text) {
  WriteFile(std::string(ZARK_FW_PACKAGE_SERVICE_DIR) + "/" + name, text);
}

std::string Section(const std::string &name, const std::string &protocol,
                    const std::string &ports, bool forwardable) {
  return "[" + name + "]\nprotocol=" + protocol + "\nports=" + ports +
         "\nforwardable=" + (forwardable ? "yes" : "no") + "\n";
}

void InstallShippedDefinitions() {
  namespace fs = std::filesystem;
  const fs::path data(ZARK_FIREWALL_DATA_DIR);
  for (const auto &entry : fs::directory_iterator(data / "services.d")) {
    WriteFile(std::string(ZARK_FW_SYSTEM_SERVICE_DIR) + "/" +
                  entry.path().filename().string(),
              ReadFile(entry.path().string()));
  }
  WriteFile(ZARK_FW_SERVICE_MAPPING_TABLE,
            ReadFile((data / "firewall_service_mapping_table").string()));
}

SzList NewList(const std::vector<std::string> &items) {
  KLIBSZLIST *list = KLIBCSzListAlloc(1024);
  EXPECT_NE(list, nullptr);
  for (const std::string &item : items) {
    EXPECT_GE(KLIBCSzListPush(&list, item.c_str()), 0);
  }
  return SzList(list);
}

std::vector<std::string> Items(const KLIBSZLIST *list) {
  std::vector<std::string> items;
  if (list == nullptr) {
    return items;
  }
  for (int i = 0; i < list->nItem; ++i) {
    items.emplace_back(KLIBCSzListGet(list, i));
  }
  return items;
}

} // namespace zark::test
