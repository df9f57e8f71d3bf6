#include "fake_firewall.h"

#include <cstdio>
#include <memory>

struct _ZARK_FW_SERVICE_TABLE {
  struct Entry {
    ZARK_FW_SERVICE record{};
    std::string name;
  };
  std::vector<std::unique_ptr<Entry>> entries;

  ~_ZARK_FW_SERVICE_TABLE() {
    for (auto &entry : entries) {
      KLIBCSzListFree(entry->record.pslPorts);
    }
  }
};

namespace zark::fake {

Firewall &FakeFirewall() {
  static Firewall firewall;
  return firewall;
}

void ResetFakeFirewall() {
  FakeFirewall() = Firewall();
}

namespace {

int Fail(int result) {
  if (result < 0) {
    KLIBCErrSetEx(KLIBC_ERR_FILE_OPEN, __FILE__, __LINE__);
  }
  return result;
}

int Append(KLIBSZLIST **list, const std::vector<std::string> &items) {
  for (const std::string &item : items) {
    if (KLIBCSzListPush(list, item.c_str()) < 0) {
      return -1;
    }
  }
  return 0;
}

} // namespace
} // namespace zark::fake

using zark::fake::FakeFirewall;

extern "C" int ZARKFwServiceEnum(ZARK_FW_SERVICE_TABLE **table) {
  if (table == nullptr) {
    KLIBCErrSetEx(KLIBC_ERR_BAD_PARAMETER, __FILE__, __LINE__);
    return -1;
  }
  auto built = std::make_unique<_ZARK_FW_SERVICE_TABLE>();
  for (const zark::fake::FwSection &section : FakeFirewall().sections) {
    auto entry = std::make_unique<_ZARK_FW_SERVICE_TABLE::Entry>();
    entry->name = section.name;
    snprintf(entry->record.szName, sizeof(entry->record.szName), "%s",
             section.name.c_str());
    entry->record.blUsable = section.usable;
    entry->record.protoMask = section.protoMask;
    if (section.hasPorts) {
      entry->record.pslPorts = KLIBCSzListAlloc(16);
      zark::fake::Append(&entry->record.pslPorts, section.ports);
    }
    built->entries.push_back(std::move(entry));
  }
  ++FakeFirewall().tablesBuilt;
  int count = static_cast<int>(built->entries.size());
  *table = built.release();
  if (FakeFirewall().fwServiceEnumResult) {
    return zark::fake::Fail(*FakeFirewall().fwServiceEnumResult);
  }
  return count;
}

extern "C" const ZARK_FW_SERVICE *
ZARKFWServiceFind(const ZARK_FW_SERVICE_TABLE *table, const char *name) {
  if (table == nullptr || name == nullptr) {
    return nullptr;
  }
  for (const auto &entry : table->entries) {
    if (entry->name == name) {
      return &entry->record;
    }
  }
  return nullptr;
}

extern "C" void ZARKFwServiceFree(ZARK_FW_SERVICE_TABLE *table) {
  if (table != nullptr) {
    ++FakeFirewall().tablesFreed;
  }
  std::unique_ptr<_ZARK_FW_SERVICE_TABLE> owned(table);
}

extern "C" int KLIBServiceEnum(KLIBSZLIST **list) {
  ++FakeFirewall().serviceEnumCalls;
  if (FakeFirewall().serviceEnumResult) {
    return zark::fake::Fail(*FakeFirewall().serviceEnumResult);
  }
  if (list == nullptr || *list == nullptr) {
    KLIBCErrSetEx(KLIBC_ERR_BAD_PARAMETER, __FILE__, __LINE__);
    return -1;
  }
  return zark::fake::Append(list, FakeFirewall().systemServices);
}

extern "C" int KLIBServicecfgInfoGet(const char *serviceId, int kind,
                                     KLIBSZLIST **list) {
  if (FakeFirewall().servicecfgInfoGetResult) {
    return zark::fake::Fail(*FakeFirewall().servicecfgInfoGetResult);
  }
  if (serviceId == nullptr || list == nullptr || *list == nullptr ||
      kind != KLIB_SERVICE_INFO_FW_SECTIONS) {
    KLIBCErrSetEx(KLIBC_ERR_BAD_PARAMETER, __FILE__, __LINE__);
    return -1;
  }
  auto found = FakeFirewall().serviceSections.find(serviceId);
  if (found == FakeFirewall().serviceSections.end()) {
    KLIBCErrSetEx(KLIBC_ERR_FILE_NOT_FOUND, __FILE__, __LINE__);
    return -1;
  }
  return zark::fake::Append(list, found->second);
}
