// Fuzz target of the router database reader: the files under
// "/etc.defaults/portforward/routerdb" that an update unpacks from a
// downloaded archive. Runs in a private mount namespace; each input is
// written out as a database, then read by ReadRouterDbAt and listed through
// the C interface (KLibGetRouterDBList), as the module lists it.
//
// Input: pieces separated by kPieceSeparator. The first is routerdb.conf;
// each further piece is one description file: three bytes choose its brand
// folder, model folder and file name from small sets (plain, odd and
// hidden names), the rest is its text.
//
// Besides not crashing:
// - a refusal has an error code; an accepted database has syntax version 1,
//   at most kMaxRouterDbEntries entries in the documented order, max_rules
//   1..65536, no two descriptions of one model with the same version, and
//   names and versions that fit a list node;
// - the C list holds exactly the entries, in the same order, with the same
//   texts.
#include "catalog/router_db.h"
#include "fuzz_support.h"
#include "libzarkportmap.h"
#include "syslog_capture.h"

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <string>
#include <tuple>

namespace {

namespace fs = std::filesystem;
using zark::fuzz::Require;
using namespace zark::portmap;

const std::string kRoot = ZARK_PORTMAP_ROUTERDB_DIR;

const char *const kBrands[] = {"Acme",
                               "acme",
                               "Acme Corp",
                               ("\xc3\x9c"
                                "ber"),
                               ".staging",
                               "b"};
const char *const kModels[] = {"R1", "R-1 v2", "r1", ".old", "m"};
const char *const kFiles[] = {"generic", "1.0",  "1.0.1",
                              "v2",      ".swp", "Generic"};

template <std::size_t N>
const char *Pick(const char *const (&names)[N], uint8_t byte) {
  return names[byte % N];
}

void Write(const fs::path &path, std::string_view text) {
  std::error_code error;
  fs::create_directories(path.parent_path(), error);
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(text.data(), static_cast<std::streamsize>(text.size()));
}

bool Before(const RouterDbEntry &a, const RouterDbEntry &b) {
  return std::forward_as_tuple(a.brand, a.model, !a.generic, a.version,
                               a.file) <
         std::forward_as_tuple(b.brand, b.model, !b.generic, b.version, b.file);
}

bool Fits(const std::string &text) {
  return text.size() < ZARK_PORTMAP_TEXT_SIZE &&
         text.find('\0') == std::string::npos;
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***) {
  zark::fuzz::EnterHermeticOrDie();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  zark::test::ClearLogs();
  std::error_code error;
  fs::remove_all(kRoot, error);
  const std::vector<std::string_view> pieces =
      zark::fuzz::SplitPieces(zark::fuzz::AsText(data, size));
  Write(fs::path(kRoot) / kRouterDbInfoFile,
        pieces.empty() ? std::string_view() : pieces[0]);
  for (std::size_t i = 1; i < pieces.size(); ++i) {
    zark::fuzz::InputReader piece(pieces[i]);
    const fs::path path = fs::path(kRoot) / Pick(kBrands, piece.Byte()) /
                          Pick(kModels, piece.Byte()) /
                          Pick(kFiles, piece.Byte());
    Write(path, piece.Rest());
  }

  RouterDb db;
  int err = ZARK_PORTMAP_ERR_NONE;
  const bool read = ReadRouterDbAt(kRoot, db, err);
  ZARK_ROUTERDB_LIST *list = nullptr;
  const int listed = KLibGetRouterDBList(&list);
  if (!read) {
    Require(err != ZARK_PORTMAP_ERR_NONE, "a refusal without an error code");
    Require(listed < 0 && list == nullptr,
            "the C interface lists a database the reader refused");
    return 0;
  }
  Require(err == ZARK_PORTMAP_ERR_NONE, "success with an error code");
  Require(db.syntaxVersion == kRouterDbSyntaxVersion,
          "a database of another syntax version accepted");
  Require(db.entries.size() <= kMaxRouterDbEntries, "entries beyond the bound");
  for (std::size_t i = 0; i < db.entries.size(); ++i) {
    const RouterDbEntry &entry = db.entries[i];
    Require(entry.maxRules >= 1 && entry.maxRules <= kMaxRouterDbRules,
            "max_rules out of range");
    Require(Fits(entry.brand) && Fits(entry.model) && Fits(entry.version),
            "a name or version that does not fit a list node");
    Require(entry.brand[0] != '.' && entry.model[0] != '.' &&
                entry.file[0] != '.',
            "a hidden name taken into the database");
    if (i > 0) {
      const RouterDbEntry &previous = db.entries[i - 1];
      Require(Before(previous, entry), "entries out of order");
      Require(!(previous.brand == entry.brand &&
                previous.model == entry.model &&
                previous.version == entry.version),
              "two descriptions of one version");
    }
  }
  Require(listed == 0, "the C interface refuses a database the reader took");
  std::size_t count = 0;
  for (const ZARK_ROUTERDB_LIST *node = list; node != nullptr;
       node = node->next, ++count) {
    Require(count < db.entries.size(), "the C list is longer");
    const RouterDbEntry &entry = db.entries[count];
    Require(entry.brand == node->brand && entry.model == node->model &&
                entry.version == node->version &&
                entry.generic == node->generic,
            "the C list differs from the database at " + std::to_string(count));
  }
  Require(count == db.entries.size(), "the C list is shorter");
  KLibFreeRouterDBList(list);
  return 0;
}
