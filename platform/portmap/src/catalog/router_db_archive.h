// Router database archives: a tar file (plain, gzip, bzip2 or xz, as GNU tar
// recognises it) whose members all lie under "routerdb/" and are folders or
// regular files. It is unpacked by /bin/tar, run without a shell, after its
// listing passed the checks below.
#ifndef ZARK_PORTMAP_ROUTER_DB_ARCHIVE_H
#define ZARK_PORTMAP_ROUTER_DB_ARCHIVE_H

#include <cstddef>
#include <string>
#include <string_view>

namespace zark::portmap {

inline constexpr const char *kTarProgram = "/bin/tar";
// Bounds of an archive's content: members, bytes of all files together,
// bytes of one file.
inline constexpr std::size_t kMaxArchiveMembers = 20000;
inline constexpr std::size_t kMaxArchiveBytes = 16u * 1024u * 1024u;
inline constexpr std::size_t kMaxArchiveFileBytes = 1024u * 1024u;

// Checks the verbose listing of an archive, as
//   LC_ALL=C tar --list --verbose --numeric-owner --file ARCHIVE
// prints it, one member a line:
//   drwxr-xr-x 0/0               0 2024-05-01 12:00 routerdb/
//   -rw-r--r-- 0/0              74 2024-05-01 12:00 routerdb/routerdb.conf
// True when every member is a folder ("d") or a regular file ("-") whose
// name starts with "routerdb/" (or is "routerdb/") and has no "." or ".."
// component, and the bounds above hold. Otherwise false with why set.
// Pure: no file access.
[[nodiscard]] bool CheckArchiveListing(std::string_view listing,
                                       std::string &why);

// Unpacks archive into the existing empty folder (which then holds
// "routerdb/"), after CheckArchiveListing approved its listing. Owners and
// modes of the archive are not kept. tar gets a deadline and a file size
// limit. False, logged, when the archive is refused or tar fails.
[[nodiscard]] bool ExtractRouterDbArchive(const std::string &archive,
                                          const std::string &folder);

} // namespace zark::portmap

#endif
