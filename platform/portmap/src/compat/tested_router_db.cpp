#include "compat/tested_router_db.h"

#include "base/conf_file.h"
#include "base/portmap_log.h"
#include "base/strict_json.h"
#include "base/unique_fd.h"
#include "compat/compatibility_files.h"

#include <fcntl.h>
#include <sys/file.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <exception>
#include <thread>

namespace zark::portmap {
namespace {

using Clock = std::chrono::steady_clock;
constexpr int kDbVersion = 1;
constexpr std::size_t kMaxDbBytes = 1024 * 1024;

std::string FolderOf(const std::string &path) {
  std::size_t slash = path.find_last_of('/');
  return slash == std::string::npos || slash == 0 ? std::string("/")
                                                  : path.substr(0, slash);
}

bool Terminated(const char (&field)[ZARK_PORTMAP_TEXT_SIZE]) {
  return std::memchr(field, '\0', sizeof(field)) != nullptr;
}

// Holds an exclusive flock on "<path>.lock" for its life.
class DbLock {
public:
  DbLock(const std::string &path, std::chrono::milliseconds wait) {
    const std::string lockPath = path + ".lock";
    if (!MakeFolders(FolderOf(path), 0755)) {
      return;
    }
    UniqueFd fd(::open(lockPath.c_str(),
                       O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY,
                       0600));
    if (!fd.Valid()) {
      int saved = errno;
      ZARK_PM_LOG_CALL("open", -1, saved, lockPath.c_str());
      return;
    }
    const Clock::time_point deadline = Clock::now() + wait;
    auto pause = std::chrono::milliseconds(1);
    for (;;) {
      if (::flock(fd.Get(), LOCK_EX | LOCK_NB) == 0) {
        mFd = std::move(fd);
        return;
      }
      int saved = errno;
      if (saved != EWOULDBLOCK && saved != EINTR) {
        ZARK_PM_LOG_CALL("flock", -1, saved, lockPath.c_str());
        return;
      }
      if (Clock::now() >= deadline) {
        ZARK_PM_LOG_ERROR("%s is still held elsewhere after %lld ms",
                          lockPath.c_str(),
                          static_cast<long long>(wait.count()));
        return;
      }
      std::this_thread::sleep_for(pause);
      pause = std::min(pause * 2, std::chrono::milliseconds(50));
    }
  }
  [[nodiscard]] bool Held() const { return mFd.Valid(); }

private:
  UniqueFd mFd;
};

} // namespace

std::string SerializeTestedRouters(const std::vector<TestedRouter> &routers) {
  Json::Value root(Json::objectValue);
  root["version"] = kDbVersion;
  Json::Value list(Json::arrayValue);
  for (const TestedRouter &router : routers) {
    Json::Value entry(Json::objectValue);
    entry["brand"] = router.brand;
    entry["model"] = router.model;
    entry["version"] = router.version;
    entry["max_mappings"] = router.maxMappings;
    entry["date"] = router.date;
    list.append(entry);
  }
  root["routers"] = list;
  return WriteJsonText(root);
}

bool ParseTestedRouters(std::string_view text,
                        std::vector<TestedRouter> &routers,
                        std::string &why) noexcept {
  try {
    Json::Value root;
    if (!ParseStrictJson(text, root, why, 8)) {
      return false;
    }
    long long version = 0;
    if (!root.isObject() ||
        !ReadJsonInt(root, "version", kDbVersion, kDbVersion, version, why)) {
      if (why.empty()) {
        why = "not a JSON object";
      }
      return false;
    }
    const Json::Value &list = root["routers"];
    if (!list.isArray() || list.size() > kMaxTestedRouters) {
      why = "\"routers\" is not an array of at most " +
            std::to_string(kMaxTestedRouters);
      return false;
    }
    std::vector<TestedRouter> parsed;
    for (const Json::Value &entry : list) {
      TestedRouter router;
      long long max = 0;
      if (!entry.isObject()) {
        why = "a router is not an object";
        return false;
      }
      if (!ReadJsonString(entry, "brand", router.brand, why) ||
          !ReadJsonString(entry, "model", router.model, why) ||
          !ReadJsonString(entry, "version", router.version, why) ||
          !ReadJsonInt(entry, "max_mappings", 0, kMaxUpnpTestMappings, max,
                       why) ||
          !ReadJsonString(entry, "date", router.date, why)) {
        return false;
      }
      router.maxMappings = static_cast<int>(max);
      parsed.push_back(std::move(router));
    }
    routers = std::move(parsed);
    return true;
  } catch (const std::exception &e) {
    why = e.what();
    return false;
  }
}

bool TestedRouterOfRecord(const ZARK_ROUTER_RECORD &record,
                          TestedRouter &router, std::string &why) {
  if (!Terminated(record.brand) || !Terminated(record.model) ||
      !Terminated(record.version) || !Terminated(record.date)) {
    why = "a text field is not NUL-terminated";
    return false;
  }
  TestedRouter made;
  made.brand = record.brand;
  made.model = record.model;
  made.version = record.version;
  made.date = record.date;
  made.maxMappings = record.max_mappings;
  if (made.brand.empty() || made.model.empty()) {
    why = "brand or model is empty";
    return false;
  }
  if (made.maxMappings < 1 || made.maxMappings > kMaxUpnpTestMappings) {
    why = "max_mappings " + std::to_string(made.maxMappings) + " is not 1.." +
          std::to_string(kMaxUpnpTestMappings);
    return false;
  }
  router = std::move(made);
  return true;
}

bool LoadTestedRouters(const std::string &path,
                       std::vector<TestedRouter> &routers) {
  routers.clear();
  ReadResult read = ReadSmallFile(path, kMaxDbBytes);
  if (read.status == ReadStatus::kMissing) {
    return true;
  }
  std::string why = "cannot be read";
  if (read.status != ReadStatus::kRead ||
      !ParseTestedRouters(read.content, routers, why)) {
    ZARK_PM_LOG_ERROR("%s: %s", path.c_str(), why.c_str());
    return false;
  }
  return true;
}

bool StoreTestedRouter(const std::string &path, const TestedRouter &router,
                       std::chrono::milliseconds lockWait) {
  DbLock lock(path, lockWait);
  if (!lock.Held()) {
    return false;
  }
  std::vector<TestedRouter> routers;
  if (!LoadTestedRouters(path, routers)) {
    // Kept for a person to look at; the database starts again.
    const std::string aside = path + ".bad";
    if (std::rename(path.c_str(), aside.c_str()) != 0) {
      int saved = errno;
      ZARK_PM_LOG_CALL("rename", -1, saved, aside.c_str());
      return false;
    }
    ZARK_PM_LOG_ERROR("%s was moved to %s; starting a new database",
                      path.c_str(), aside.c_str());
    routers.clear();
  }
  std::erase_if(routers, [&](const TestedRouter &known) {
    return known.brand == router.brand && known.model == router.model &&
           known.version == router.version;
  });
  routers.push_back(router);
  if (routers.size() > kMaxTestedRouters) {
    routers.erase(routers.begin(),
                  routers.begin() + static_cast<std::ptrdiff_t>(
                                        routers.size() - kMaxTestedRouters));
  }
  return ReplaceFileAtomically(path, SerializeTestedRouters(routers), 0644);
}

} // namespace zark::portmap

extern "C" int KLibWriteRecordIntoUpnpDB(const ZARK_ROUTER_RECORD *record) {
  using namespace zark::portmap;
  if (record == nullptr) {
    ZARK_PM_LOG_ERROR("KLibWriteRecordIntoUpnpDB: record is NULL");
    return -1;
  }
  try {
    TestedRouter router;
    std::string why;
    if (!TestedRouterOfRecord(*record, router, why)) {
      ZARK_PM_LOG_ERROR("KLibWriteRecordIntoUpnpDB: %s", why.c_str());
      return -1;
    }
    return StoreTestedRouter(kTestedRoutersPath, router) ? 0 : -1;
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("KLibWriteRecordIntoUpnpDB: %s", e.what());
    return -1;
  }
}
