#include "catalog/router_db_archive.h"

#include "base/portmap_log.h"

#include <archive.h>
#include <archive_entry.h>

#include <cerrno>
#include <cstdlib>
#include <memory>

namespace zark::portmap {
namespace {

constexpr std::string_view kTopFolder = "routerdb/";

struct ReaderFree {
  void operator()(archive *reader) const { archive_read_free(reader); }
};
struct WriterFree {
  void operator()(archive *writer) const { archive_write_free(writer); }
};
using ArchiveReader = std::unique_ptr<archive, ReaderFree>;
using ArchiveWriter = std::unique_ptr<archive, WriterFree>;

std::string ErrorOf(archive *handle) {
  const char *text = archive_error_string(handle);
  return text != nullptr ? std::string(text).substr(0, 300)
                         : "error " + std::to_string(archive_errno(handle));
}

// A tar reader with the decompressors libarchive has built in. Filters that
// libarchive runs as an outside program (lzop, lrzip, grzip) stay off: no
// program is started for an archive.
ArchiveReader NewTarReader(std::string &why) {
  ArchiveReader reader(archive_read_new());
  if (!reader) {
    why = "archive_read_new failed";
    return reader;
  }
  archive *a = reader.get();
  if (archive_read_support_filter_gzip(a) != ARCHIVE_OK ||
      archive_read_support_filter_bzip2(a) != ARCHIVE_OK ||
      archive_read_support_filter_xz(a) != ARCHIVE_OK ||
      archive_read_support_filter_lzma(a) != ARCHIVE_OK ||
      archive_read_support_filter_lzip(a) != ARCHIVE_OK ||
      archive_read_support_filter_zstd(a) != ARCHIVE_OK ||
      archive_read_support_filter_compress(a) != ARCHIVE_OK ||
      archive_read_support_format_tar(a) != ARCHIVE_OK) {
    why = "cannot set up the archive reader: " + ErrorOf(a);
    reader.reset();
  }
  return reader;
}

bool NameIsSafe(std::string_view name, bool folder) {
  // A folder may come without its trailing slash ("routerdb").
  if (folder && !name.empty() && name.back() != '/') {
    if (name == kTopFolder.substr(0, kTopFolder.size() - 1)) {
      return true;
    }
  }
  if (name.substr(0, kTopFolder.size()) != kTopFolder) {
    return false;
  }
  std::string_view rest = name;
  while (!rest.empty()) {
    std::size_t slash = rest.find('/');
    std::string_view part = rest.substr(0, slash);
    if (part == "." || part == "..") {
      return false;
    }
    // "a//b": an empty component means the name is not what it looks like.
    if (part.empty() && slash != std::string_view::npos) {
      return false;
    }
    rest.remove_prefix(slash == std::string_view::npos ? rest.size()
                                                       : slash + 1);
  }
  return true;
}

std::string Quoted(std::string_view name) {
  return "\"" + std::string(name.substr(0, 200)) + "\"";
}

// The checks every member header passes, in both passes, with the running
// counts of members and bytes.
class MemberCheck {
public:
  [[nodiscard]] bool Check(archive_entry *entry, std::string &why) {
    if (++mMembers > kMaxArchiveMembers) {
      why = "more than " + std::to_string(kMaxArchiveMembers) + " members";
      return false;
    }
    const char *rawName = archive_entry_pathname(entry);
    if (rawName == nullptr) {
      why = "a member has no readable name";
      return false;
    }
    const std::string_view name(rawName);
    if (name.size() > kMaxArchiveNameBytes) {
      why = "member " + Quoted(name) + " has a name longer than " +
            std::to_string(kMaxArchiveNameBytes) + " bytes";
      return false;
    }
    // A hard link is a regular file in libarchive's eyes, with a target.
    const mode_t type = archive_entry_filetype(entry);
    if (archive_entry_hardlink(entry) != nullptr ||
        (type != AE_IFREG && type != AE_IFDIR)) {
      why =
          "member " + Quoted(name) + " is neither a folder nor a regular file";
      return false;
    }
    if (!NameIsSafe(name, type == AE_IFDIR)) {
      why = "member " + Quoted(name) + " is not a plain path under routerdb/";
      return false;
    }
    const la_int64_t size = archive_entry_size(entry);
    if (!archive_entry_size_is_set(entry) || size < 0) {
      why = "member " + Quoted(name) + " has no readable size";
      return false;
    }
    const auto bytes = static_cast<std::size_t>(size);
    if (bytes > kMaxArchiveFileBytes) {
      why = "member " + Quoted(name) + " is larger than " +
            std::to_string(kMaxArchiveFileBytes) + " bytes";
      return false;
    }
    mTotal += bytes;
    if (mTotal > kMaxArchiveBytes) {
      why =
          "content larger than " + std::to_string(kMaxArchiveBytes) + " bytes";
      return false;
    }
    return true;
  }

  [[nodiscard]] std::size_t Members() const { return mMembers; }

private:
  std::size_t mMembers = 0;
  std::size_t mTotal = 0;
};

bool StreamWithinBound(archive *reader, std::string &why) {
  if (archive_filter_bytes(reader, 0) >
      static_cast<la_int64_t>(kMaxArchiveStreamBytes)) {
    why = "uncompressed archive longer than " +
          std::to_string(kMaxArchiveStreamBytes) + " bytes";
    return false;
  }
  return true;
}

// Copies the current member's content from reader to disk, no further than
// its declared size allows.
bool CopyContent(archive *reader, archive *disk, std::string_view name,
                 std::string &why) {
  for (;;) {
    const void *block = nullptr;
    std::size_t size = 0;
    la_int64_t offset = 0;
    int rc = archive_read_data_block(reader, &block, &size, &offset);
    if (rc == ARCHIVE_EOF) {
      return true;
    }
    if (rc != ARCHIVE_OK) {
      why = "reading member " + Quoted(name) + ": " + ErrorOf(reader);
      return false;
    }
    if (offset < 0 ||
        static_cast<std::size_t>(offset) + size > kMaxArchiveFileBytes) {
      why = "member " + Quoted(name) + " is larger than " +
            std::to_string(kMaxArchiveFileBytes) + " bytes";
      return false;
    }
    if (!StreamWithinBound(reader, why)) {
      return false;
    }
    if (archive_write_data_block(disk, block, size, offset) < ARCHIVE_OK) {
      why = "writing member " + Quoted(name) + ": " + ErrorOf(disk);
      return false;
    }
  }
}

// Reads every member of the archive opened in reader and checks it. With
// disk null, contents are skipped; otherwise each member is written through
// disk to "<folder>/<its name>".
bool ReadMembers(archive *reader, archive *disk, const std::string &folder,
                 std::string &why) {
  MemberCheck check;
  for (;;) {
    archive_entry *entry = nullptr;
    int rc = archive_read_next_header(reader, &entry);
    if (rc == ARCHIVE_EOF) {
      break;
    }
    // A warning (a malformed extended header, a name that does not
    // convert) means the member is not what it seems: refused too.
    if (rc != ARCHIVE_OK) {
      why = "not a readable archive: " + ErrorOf(reader);
      return false;
    }
    if (!StreamWithinBound(reader, why) || !check.Check(entry, why)) {
      return false;
    }
    if (disk == nullptr) {
      if (archive_read_data_skip(reader) != ARCHIVE_OK) {
        why = "not a readable archive: " + ErrorOf(reader);
        return false;
      }
      continue;
    }
    const std::string name = archive_entry_pathname(entry);
    archive_entry_set_pathname(entry, (folder + "/" + name).c_str());
    rc = archive_write_header(disk, entry);
    if (rc < ARCHIVE_WARN) {
      why = "unpacking member " + Quoted(name) + ": " + ErrorOf(disk);
      return false;
    }
    if (rc == ARCHIVE_WARN) {
      ZARK_PM_LOG_ERROR("unpacking member \"%.200s\": %s", name.c_str(),
                        ErrorOf(disk).c_str());
    }
    if (!CopyContent(reader, disk, name, why)) {
      return false;
    }
    if (archive_write_finish_entry(disk) < ARCHIVE_WARN) {
      why = "unpacking member " + Quoted(name) + ": " + ErrorOf(disk);
      return false;
    }
  }
  if (check.Members() == 0) {
    why = "no member";
    return false;
  }
  return true;
}

// Size of a read block of the archive file.
constexpr std::size_t kReadBlock = 64 * 1024;

ArchiveReader OpenFile(const std::string &path, std::string &why) {
  ArchiveReader reader = NewTarReader(why);
  if (reader && archive_read_open_filename(reader.get(), path.c_str(),
                                           kReadBlock) != ARCHIVE_OK) {
    why = "not a readable archive: " + ErrorOf(reader.get());
    reader.reset();
  }
  return reader;
}

} // namespace

bool CheckRouterDbArchive(std::string_view archive, std::string &why) {
  ArchiveReader reader = NewTarReader(why);
  if (!reader) {
    return false;
  }
  if (archive_read_open_memory(reader.get(), archive.data(), archive.size()) !=
      ARCHIVE_OK) {
    why = "not a readable archive: " + ErrorOf(reader.get());
    return false;
  }
  return ReadMembers(reader.get(), nullptr, {}, why);
}

bool ExtractRouterDbArchive(const std::string &archive,
                            const std::string &folder) {
  std::string why;
  // Every header is checked before anything is written.
  ArchiveReader checker = OpenFile(archive, why);
  if (!checker || !ReadMembers(checker.get(), nullptr, {}, why)) {
    ZARK_PM_LOG_ERROR("router database archive %s refused: %s", archive.c_str(),
                      why.c_str());
    return false;
  }
  checker.reset();

  // Members are written under the folder's real path, so that the symlink
  // guard below judges only what the archive itself creates. That path is
  // absolute, which is why ARCHIVE_EXTRACT_SECURE_NOABSOLUTEPATHS cannot be
  // set: MemberCheck has refused every name outside "routerdb/" already.
  std::unique_ptr<char, decltype(&std::free)> real(
      ::realpath(folder.c_str(), nullptr), &std::free);
  if (!real) {
    ZARK_PM_LOG_CALL("realpath", -1, errno, folder.c_str());
    return false;
  }
  ArchiveWriter disk(archive_write_disk_new());
  if (!disk) {
    ZARK_PM_LOG_ERROR("archive_write_disk_new failed");
    return false;
  }
  // No ARCHIVE_EXTRACT_OWNER or _PERM: files belong to this process, the
  // umask applies and set-id bits are dropped. Times are kept.
  archive_write_disk_set_options(
      disk.get(), ARCHIVE_EXTRACT_TIME | ARCHIVE_EXTRACT_SECURE_NODOTDOT |
                      ARCHIVE_EXTRACT_SECURE_SYMLINKS);
  // The file is read again: it was checked, and each header is checked
  // once more as it comes, so a file changed in between is refused too.
  ArchiveReader reader = OpenFile(archive, why);
  if (!reader || !ReadMembers(reader.get(), disk.get(), real.get(), why)) {
    ZARK_PM_LOG_ERROR("unpacking %s failed: %s", archive.c_str(), why.c_str());
    return false;
  }
  // Closing sets the folders' modes and times, deferred until their
  // content was written.
  if (archive_write_close(disk.get()) != ARCHIVE_OK) {
    ZARK_PM_LOG_ERROR("unpacking %s failed: %s", archive.c_str(),
                      ErrorOf(disk.get()).c_str());
    return false;
  }
  return true;
}

} // namespace zark::portmap
