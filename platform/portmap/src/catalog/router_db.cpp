#include "catalog/router_db.h"

#include "base/portmap_log.h"
#include "catalog/router_db_lock.h"
#include "klibc.h"
#include "libzarkportmap.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <filesystem>
#include <optional>
#include <system_error>
#include <tuple>

namespace zark::portmap {
namespace {

namespace fs = std::filesystem;

constexpr const char *kKeySyntaxVersion = "syntax_version";
constexpr const char *kKeyDbVersion = "version";
constexpr const char *kKeyVersion = "version";
constexpr const char *kKeyProtocol = "protocol";
constexpr const char *kKeySupportChangePort = "support_change_port";
constexpr const char *kKeyMaxRules = "max_rules";

enum class KeyRead { kFound, kAbsent, kFailed };

// Reads one value with the core library's key/value reader. kAbsent covers
// a missing key and an empty value alike (the reader does not tell them
// apart); kFailed is logged.
KeyRead ReadKey(const std::string &file, const char *key, std::string &value) {
  std::array<char, ZARK_PORTMAP_TEXT_SIZE> buffer{};
  int got = KLIBCFileGetKeyValue(file.c_str(), key, buffer.data(),
                                 static_cast<int>(buffer.size()), 0);
  if (got < 0) {
    ZARK_PM_LOG_ERROR("cannot read %s (klibc error 0x%04X at %s:%d)",
                      file.c_str(), KLIBCErrGet(), KLIBCErrorGetFile(),
                      KLIBCErrorGetLine());
    return KeyRead::kFailed;
  }
  if (got == 0) {
    return KeyRead::kAbsent;
  }
  value.assign(buffer.data());
  return KeyRead::kFound;
}

std::optional<int> ParseDecimal(std::string_view text, int lowest,
                                int highest) {
  int value = 0;
  const char *end = text.data() + text.size();
  auto [ptr, ec] = std::from_chars(text.data(), end, value);
  if (text.empty() || ec != std::errc() || ptr != end || value < lowest ||
      value > highest) {
    return std::nullopt;
  }
  return value;
}

// Reads one description file into entry (brand, model and file already
// set). False, logged, when a key is missing or malformed.
bool ReadDescription(const std::string &path, RouterDbEntry &entry) {
  std::string version;
  std::string protocol;
  std::string changePort;
  std::string maxRules;
  for (auto [key, value] :
       {std::pair{kKeyVersion, &version}, std::pair{kKeyProtocol, &protocol},
        std::pair{kKeySupportChangePort, &changePort},
        std::pair{kKeyMaxRules, &maxRules}}) {
    switch (ReadKey(path, key, *value)) {
    case KeyRead::kFound:
      break;
    case KeyRead::kAbsent:
      ZARK_PM_LOG_ERROR("router description %s has no \"%s\"", path.c_str(),
                        key);
      return false;
    case KeyRead::kFailed:
      return false;
    }
  }
  std::optional<RouterProtocol> parsedProtocol = ParseRouterProtocol(protocol);
  if (!parsedProtocol) {
    ZARK_PM_LOG_ERROR("router description %s: protocol \"%s\" is not upnp, "
                      "natpmp or web",
                      path.c_str(), protocol.c_str());
    return false;
  }
  if (changePort != "yes" && changePort != "no") {
    ZARK_PM_LOG_ERROR("router description %s: support_change_port \"%s\" is "
                      "not yes or no",
                      path.c_str(), changePort.c_str());
    return false;
  }
  std::optional<int> parsedMax = ParseDecimal(maxRules, 1, kMaxRouterDbRules);
  if (!parsedMax) {
    ZARK_PM_LOG_ERROR("router description %s: max_rules \"%s\" is not a "
                      "number from 1 to %d",
                      path.c_str(), maxRules.c_str(), kMaxRouterDbRules);
    return false;
  }
  entry.version = std::move(version);
  entry.generic = entry.file == kRouterDbGenericFile;
  entry.protocol = *parsedProtocol;
  entry.supportChangePort = changePort == "yes";
  entry.maxRules = *parsedMax;
  return true;
}

bool PartOfDatabase(const fs::path &name) {
  const std::string text = name.string();
  // A list node keeps each name with its NUL in 1024 bytes.
  return !text.empty() && text[0] != '.' &&
         text.size() < ZARK_PORTMAP_TEXT_SIZE;
}

// The names of the entries of folder that are part of the database, sorted;
// each must be a folder (wantFolders) or a regular file, not a link.
bool ListNames(const fs::path &folder, bool wantFolders,
               std::vector<std::string> &names) {
  std::error_code ec;
  fs::directory_iterator it(folder, ec);
  if (ec) {
    ZARK_PM_LOG_ERROR("cannot list %s: %s", folder.c_str(),
                      ec.message().c_str());
    return false;
  }
  for (const fs::directory_entry &item : it) {
    const fs::path name = item.path().filename();
    if (!PartOfDatabase(name)) {
      if (name.string()[0] != '.') {
        ZARK_PM_LOG_ERROR("%s: name longer than 1023 bytes",
                          item.path().c_str());
        return false;
      }
      continue;
    }
    fs::file_status status = item.symlink_status(ec);
    if (ec) {
      ZARK_PM_LOG_ERROR("cannot examine %s: %s", item.path().c_str(),
                        ec.message().c_str());
      return false;
    }
    const bool isFolder = status.type() == fs::file_type::directory;
    const bool isFile = status.type() == fs::file_type::regular;
    if (wantFolders ? !isFolder : !isFile) {
      // Top-level files (the info file) are skipped by the caller; anything
      // else in the wrong place means the tree is not a database.
      if (!wantFolders || !isFile) {
        ZARK_PM_LOG_ERROR("%s is not a %s", item.path().c_str(),
                          wantFolders ? "folder" : "regular file");
        return false;
      }
      continue;
    }
    names.push_back(name.string());
    if (names.size() > kMaxRouterDbEntries) {
      ZARK_PM_LOG_ERROR("%s holds more than %zu entries", folder.c_str(),
                        kMaxRouterDbEntries);
      return false;
    }
  }
  if (ec) {
    ZARK_PM_LOG_ERROR("cannot list %s: %s", folder.c_str(),
                      ec.message().c_str());
    return false;
  }
  std::sort(names.begin(), names.end());
  return true;
}

bool EntryBefore(const RouterDbEntry &a, const RouterDbEntry &b) {
  return std::forward_as_tuple(a.brand, a.model, !a.generic, a.version,
                               a.file) <
         std::forward_as_tuple(b.brand, b.model, !b.generic, b.version, b.file);
}

bool ReadEntries(const fs::path &root, RouterDb &db) {
  std::vector<std::string> brands;
  if (!ListNames(root, true, brands)) {
    return false;
  }
  for (const std::string &brand : brands) {
    std::vector<std::string> models;
    if (!ListNames(root / brand, true, models)) {
      return false;
    }
    for (const std::string &model : models) {
      std::vector<std::string> files;
      if (!ListNames(root / brand / model, false, files)) {
        return false;
      }
      for (const std::string &file : files) {
        if (db.entries.size() >= kMaxRouterDbEntries) {
          ZARK_PM_LOG_ERROR("router database %s holds more than %zu entries",
                            root.c_str(), kMaxRouterDbEntries);
          return false;
        }
        RouterDbEntry entry;
        entry.brand = brand;
        entry.model = model;
        entry.file = file;
        if (!ReadDescription((root / brand / model / file).string(), entry)) {
          return false;
        }
        db.entries.push_back(std::move(entry));
      }
    }
  }
  std::sort(db.entries.begin(), db.entries.end(), EntryBefore);
  // Two descriptions of one model with the same version could not be told
  // apart by a configuration that names that version.
  for (std::size_t i = 1; i < db.entries.size(); ++i) {
    const RouterDbEntry &a = db.entries[i - 1];
    const RouterDbEntry &b = db.entries[i];
    if (a.brand == b.brand && a.model == b.model && a.version == b.version) {
      ZARK_PM_LOG_ERROR("router database %s: %s/%s has two descriptions of "
                        "version \"%s\" (%s, %s)",
                        root.c_str(), a.brand.c_str(), a.model.c_str(),
                        a.version.c_str(), a.file.c_str(), b.file.c_str());
      return false;
    }
  }
  return true;
}

} // namespace

bool ReadRouterDbInfoAt(const std::string &root, RouterDb &info, int &err) {
  const std::string path = root + "/" + kRouterDbInfoFile;
  std::string syntax;
  std::string version;
  for (auto [key, value] : {std::pair{kKeySyntaxVersion, &syntax},
                            std::pair{kKeyDbVersion, &version}}) {
    switch (ReadKey(path, key, *value)) {
    case KeyRead::kFound:
      break;
    case KeyRead::kAbsent:
      ZARK_PM_LOG_ERROR("router database info %s has no \"%s\"", path.c_str(),
                        key);
      err = ZARK_PORTMAP_ERR_IO;
      return false;
    case KeyRead::kFailed:
      err = ZARK_PORTMAP_ERR_IO;
      return false;
    }
  }
  std::optional<int> parsedSyntax = ParseDecimal(syntax, 0, 1 << 30);
  std::optional<int> parsedVersion = ParseDecimal(version, 0, 1 << 30);
  if (!parsedSyntax || !parsedVersion) {
    ZARK_PM_LOG_ERROR("router database info %s: syntax_version \"%s\" and "
                      "version \"%s\" must be whole numbers",
                      path.c_str(), syntax.c_str(), version.c_str());
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  info.syntaxVersion = *parsedSyntax;
  info.version = *parsedVersion;
  if (info.syntaxVersion != kRouterDbSyntaxVersion) {
    ZARK_PM_LOG_ERROR("router database %s has syntax version %d; this "
                      "library reads syntax version %d",
                      root.c_str(), info.syntaxVersion, kRouterDbSyntaxVersion);
    err = ZARK_PORTMAP_ERR_DB_SYNTAX;
    return false;
  }
  err = ZARK_PORTMAP_ERR_NONE;
  return true;
}

bool ReadRouterDbAt(const std::string &root, RouterDb &db, int &err) {
  RouterDb result;
  if (!ReadRouterDbInfoAt(root, result, err)) {
    return false;
  }
  try {
    if (!ReadEntries(root, result)) {
      err = ZARK_PORTMAP_ERR_IO;
      return false;
    }
  } catch (const std::exception &e) {
    // Out of memory, or a name that cannot be converted.
    ZARK_PM_LOG_ERROR("reading router database %s: %s", root.c_str(), e.what());
    err = ZARK_PORTMAP_ERR_GENERIC;
    return false;
  }
  db = std::move(result);
  err = ZARK_PORTMAP_ERR_NONE;
  return true;
}

bool ReadRouterDb(RouterDb &db, int &err) {
  RouterDbLock lock(kRouterDbLockFile, RouterDbLock::Mode::kShared);
  if (!lock.Held()) {
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  return ReadRouterDbAt(ZARK_PORTMAP_ROUTERDB_DIR, db, err);
}

bool FindRouterDbEntry(std::string_view brand, std::string_view model,
                       std::string_view version, RouterDbEntry &entry,
                       int &err) {
  RouterDb db;
  if (!ReadRouterDb(db, err)) {
    return false;
  }
  for (const RouterDbEntry &candidate : db.entries) {
    if (candidate.brand == brand && candidate.model == model &&
        candidate.version == version) {
      entry = candidate;
      err = ZARK_PORTMAP_ERR_NONE;
      return true;
    }
  }
  err = ZARK_PORTMAP_ERR_NOT_CONFIGURED;
  return false;
}

} // namespace zark::portmap
