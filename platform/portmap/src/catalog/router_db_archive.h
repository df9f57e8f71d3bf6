// Router database archives: a tar file (plain, or compressed with gzip,
// bzip2, xz, lzma, lzip, zstd or compress) whose members all lie under
// "routerdb/" and are folders or regular files. libarchive reads it in this
// process: a first pass checks every member's header without writing
// anything, a second unpacks the members, checked again as they come.
#ifndef ZARK_PORTMAP_ROUTER_DB_ARCHIVE_H
#define ZARK_PORTMAP_ROUTER_DB_ARCHIVE_H

#include <cstddef>
#include <string>
#include <string_view>

namespace zark::portmap {

// Bounds of an archive's content: members, bytes of all files together,
// bytes of one file.
inline constexpr std::size_t kMaxArchiveMembers = 20000;
inline constexpr std::size_t kMaxArchiveBytes = 16u * 1024u * 1024u;
inline constexpr std::size_t kMaxArchiveFileBytes = 1024u * 1024u;
// Bytes of a member's name: keeps every unpacked path far below PATH_MAX.
inline constexpr std::size_t kMaxArchiveNameBytes = 1024;
// Bytes of the uncompressed tar stream (headers, long names, contents,
// padding) read at most: bounds the work a hostile archive can cause,
// whatever its compression.
inline constexpr std::size_t kMaxArchiveStreamBytes = 64u * 1024u * 1024u;

// Checks an archive held in memory without unpacking it. True when it is a
// tar archive (compressed or not, as above) that reads to its end, holds at
// least one member, every member is a folder or a regular file (no link,
// device or FIFO) whose name is "routerdb/" or lies below it with no empty,
// "." or ".." component, and the bounds above hold. Otherwise false with why
// set. Pure: no file access.
[[nodiscard]] bool CheckRouterDbArchive(std::string_view archive,
                                        std::string &why);

// Unpacks the archive file into the existing empty folder (which then holds
// "routerdb/") when the checks of CheckRouterDbArchive pass on it. Owners
// and the set-id bits of the archive are not kept; the umask applies.
// False, logged, when the archive is refused or unpacking fails; what was
// unpacked before a failure stays in folder, for the caller to remove.
[[nodiscard]] bool ExtractRouterDbArchive(const std::string &archive,
                                          const std::string &folder);

} // namespace zark::portmap

#endif
