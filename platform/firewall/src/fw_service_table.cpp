// The firewall-section table: every section of the system service
// definitions (ZARK_FW_SYSTEM_SERVICE_DIR) and of the package service files
// (ZARK_FW_PACKAGE_SERVICE_DIR), looked up by name.
#include "zarkfw.h"

#include "fw_log.h"
#include "service_dir.h"
#include "service_file.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <new>
#include <string>
#include <unordered_map>
#include <vector>

namespace {

struct SzListFree {
  void operator()(KLIBSZLIST *list) const { KLIBCSzListFree(list); }
};
using SzListPtr = std::unique_ptr<KLIBSZLIST, SzListFree>;

// One section: the record handed out by ZARKFWServiceFind and the port list
// it points to.
struct FwSectionEntry {
  ZARK_FW_SERVICE record{};
  SzListPtr ports;
};

} // namespace

struct _ZARK_FW_SERVICE_TABLE {
  // Entries never move once added: ZARKFWServiceFind hands out pointers.
  std::vector<std::unique_ptr<FwSectionEntry>> entries;
  std::unordered_map<std::string, const FwSectionEntry *> byName;
};

namespace {

// Adds a section; false (core library error state set) when a list cannot
// be allocated.
bool AddSection(_ZARK_FW_SERVICE_TABLE &table,
                const zark::fw::ServiceSection &section) {
  auto entry = std::make_unique<FwSectionEntry>();
  std::memcpy(entry->record.szName, section.name.data(), section.name.size());
  entry->record.szName[section.name.size()] = '\0';
  entry->record.blUsable = section.forwardable ? 1 : 0;
  entry->record.protoMask = section.protoMask;
  if (section.ports) {
    entry->ports.reset(KLIBCSzListAlloc(
        std::max<int>(1, static_cast<int>(section.ports->size()))));
    if (!entry->ports) {
      return false;
    }
    for (const std::string &item : *section.ports) {
      KLIBSZLIST *list = entry->ports.release();
      int pushed = KLIBCSzListPush(&list, item.c_str());
      entry->ports.reset(list);
      if (pushed < 0) {
        return false;
      }
    }
  }
  entry->record.pslPorts = entry->ports.get();
  table.byName.emplace(section.name, entry.get());
  table.entries.push_back(std::move(entry));
  return true;
}

// Adds the sections of every service file of dir. A missing folder holds
// no section; an unreadable folder or file, and every section refused by
// the parser, is logged and left out. False only when memory ran out.
bool AddServiceDir(_ZARK_FW_SERVICE_TABLE &table, const std::string &dir) {
  zark::fw::ServiceDirListing listing = zark::fw::ListServiceDir(dir);
  if (listing.err == ENOENT) {
    return true;
  }
  if (listing.err != 0) {
    ZARKFW_LOG(LOG_ERR, "cannot list service folder %s: %s", dir.c_str(),
               std::strerror(listing.err));
    return true;
  }
  for (const std::string &serviceId : listing.serviceIds) {
    std::string path =
        dir + "/" + serviceId + std::string(zark::fw::kServiceFileSuffix);
    zark::fw::FileText file = zark::fw::ReadServiceFile(path);
    if (file.err != 0) {
      ZARKFW_LOG(LOG_ERR, "cannot read service file %s: %s", path.c_str(),
                 std::strerror(file.err));
      continue;
    }
    zark::fw::ServiceFileParse parsed = zark::fw::ParseServiceFile(file.text);
    for (const std::string &problem : parsed.problems) {
      ZARKFW_LOG(LOG_WARNING, "%s: %s", path.c_str(), problem.c_str());
    }
    for (const zark::fw::ServiceSection &section : parsed.sections) {
      if (table.byName.contains(section.name)) {
        ZARKFW_LOG(LOG_WARNING,
                   "%s: line %d: section [%s] skipped: already defined by "
                   "another service file",
                   path.c_str(), section.line, section.name.c_str());
        continue;
      }
      if (!AddSection(table, section)) {
        return false;
      }
    }
  }
  return true;
}

} // namespace

extern "C" int ZARKFwServiceEnum(ZARK_FW_SERVICE_TABLE **table) {
  if (table == nullptr) {
    KLIBCErrSetEx(KLIBC_ERR_BAD_PARAMETER, __FILE__, __LINE__);
    return -1;
  }
  *table = nullptr;
  try {
    auto built = std::make_unique<_ZARK_FW_SERVICE_TABLE>();
    // System sections first: a package cannot take over a system section's
    // name.
    if (!AddServiceDir(*built, ZARK_FW_SYSTEM_SERVICE_DIR) ||
        !AddServiceDir(*built, ZARK_FW_PACKAGE_SERVICE_DIR)) {
      ZARKFW_LOG(LOG_ERR, "firewall-section table not built: out of memory");
      return -1;
    }
    int count = static_cast<int>(built->entries.size());
    *table = built.release();
    return count;
  } catch (const std::bad_alloc &) {
    KLIBCErrSetEx(KLIBC_ERR_OUT_OF_MEMORY, __FILE__, __LINE__);
    ZARKFW_LOG(LOG_ERR, "firewall-section table not built: out of memory");
    return -1;
  }
}

extern "C" const ZARK_FW_SERVICE *
ZARKFWServiceFind(const ZARK_FW_SERVICE_TABLE *table, const char *name) {
  if (table == nullptr || name == nullptr) {
    return nullptr;
  }
  try {
    auto found = table->byName.find(name);
    return found == table->byName.end() ? nullptr : &found->second->record;
  } catch (const std::bad_alloc &) {
    return nullptr;
  }
}

extern "C" void ZARKFwServiceFree(ZARK_FW_SERVICE_TABLE *table) {
  // Deletes the table when it goes out of scope.
  // cppcheck-suppress unreadVariable
  std::unique_ptr<_ZARK_FW_SERVICE_TABLE> owned(table);
}
