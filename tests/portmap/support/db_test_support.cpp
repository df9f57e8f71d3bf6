#include "db_test_support.h"

#include "hermetic.h"
#include "klibc.h"

#include <gtest/gtest.h>

#include <archive.h>
#include <archive_entry.h>
#include <sys/stat.h>

#include <filesystem>
#include <map>
#include <memory>
#include <sstream>

namespace zark::test {

namespace fs = std::filesystem;

void InstallShippedRouterDb() {
  std::error_code ec;
  fs::remove_all(kDbRoot, ec);
  fs::create_directories(fs::path(kDbRoot).parent_path(), ec);
  fs::copy(ZARK_TEST_ROUTERDB_DATA_DIR, kDbRoot, fs::copy_options::recursive,
           ec);
  ASSERT_FALSE(ec) << ec.message();
}

void WriteRouterDb(const std::string &root, int syntaxVersion, int version,
                   const std::vector<DescriptionSpec> &entries) {
  WriteFile(root + "/routerdb.conf",
            "syntax_version=" + std::to_string(syntaxVersion) +
                "\nversion=" + std::to_string(version) + "\n");
  for (const DescriptionSpec &entry : entries) {
    WriteFile(root + "/" + entry.brand + "/" + entry.model + "/" + entry.file,
              "version=" + entry.version + "\nprotocol=" + entry.protocol +
                  "\nsupport_change_port=" + entry.changePort +
                  "\nmax_rules=" + entry.maxRules + "\n");
  }
}

namespace {

struct WriterFree {
  void operator()(archive *writer) const { archive_write_free(writer); }
};
struct EntryFree {
  void operator()(archive_entry *entry) const { archive_entry_free(entry); }
};

// Adds the file at path as member name.
void AddMember(archive *writer, const fs::path &path, const std::string &name) {
  struct stat info {};
  ASSERT_EQ(0, ::lstat(path.c_str(), &info)) << path;
  std::unique_ptr<archive_entry, EntryFree> entry(archive_entry_new());
  archive_entry_copy_stat(entry.get(), &info);
  archive_entry_set_pathname(entry.get(), name.c_str());
  std::string content;
  if (S_ISLNK(info.st_mode)) {
    archive_entry_set_symlink(entry.get(), fs::read_symlink(path).c_str());
  } else if (S_ISREG(info.st_mode)) {
    content = ReadFile(path);
  }
  ASSERT_EQ(ARCHIVE_OK, archive_write_header(writer, entry.get()))
      << archive_error_string(writer);
  if (!content.empty()) {
    ASSERT_EQ(static_cast<la_ssize_t>(content.size()),
              archive_write_data(writer, content.data(), content.size()))
        << archive_error_string(writer);
  }
}

la_ssize_t AppendToString(archive *, void *out, const void *data, size_t size) {
  static_cast<std::string *>(out)->append(static_cast<const char *>(data),
                                          size);
  return static_cast<la_ssize_t>(size);
}

} // namespace

std::string MakeTar(const std::vector<TarMember> &members, int filter) {
  std::string out;
  std::unique_ptr<struct archive, WriterFree> writer(archive_write_new());
  EXPECT_TRUE(writer);
  EXPECT_EQ(ARCHIVE_OK, archive_write_add_filter(writer.get(), filter));
  EXPECT_EQ(ARCHIVE_OK, archive_write_set_format_pax_restricted(writer.get()));
  EXPECT_EQ(ARCHIVE_OK, archive_write_set_bytes_in_last_block(writer.get(), 1));
  EXPECT_EQ(ARCHIVE_OK, archive_write_open(writer.get(), &out, nullptr,
                                           AppendToString, nullptr));
  for (const TarMember &member : members) {
    std::unique_ptr<archive_entry, EntryFree> entry(archive_entry_new());
    archive_entry_set_pathname(entry.get(), member.name.c_str());
    archive_entry_set_filetype(entry.get(), member.type);
    archive_entry_set_perm(entry.get(), member.type == AE_IFDIR ? 0755 : 0644);
    archive_entry_set_size(entry.get(),
                           static_cast<la_int64_t>(member.content.size()));
    if (!member.symlink.empty()) {
      archive_entry_set_symlink(entry.get(), member.symlink.c_str());
    }
    if (!member.hardLink.empty()) {
      archive_entry_set_hardlink(entry.get(), member.hardLink.c_str());
    }
    EXPECT_EQ(ARCHIVE_OK, archive_write_header(writer.get(), entry.get()))
        << archive_error_string(writer.get());
    if (!member.content.empty()) {
      EXPECT_EQ(static_cast<la_ssize_t>(member.content.size()),
                archive_write_data(writer.get(), member.content.data(),
                                   member.content.size()));
    }
  }
  EXPECT_EQ(ARCHIVE_OK, archive_write_close(writer.get()))
      << archive_error_string(writer.get());
  return out;
}

bool ListTarMembers(std::string_view archive,
                    std::vector<ListedMember> &members) {
  struct ReaderFree {
    void operator()(struct archive *reader) const { archive_read_free(reader); }
  };
  std::unique_ptr<struct archive, ReaderFree> reader(archive_read_new());
  archive_read_support_filter_gzip(reader.get());
  archive_read_support_filter_bzip2(reader.get());
  archive_read_support_filter_xz(reader.get());
  archive_read_support_filter_lzma(reader.get());
  archive_read_support_filter_lzip(reader.get());
  archive_read_support_filter_zstd(reader.get());
  archive_read_support_filter_compress(reader.get());
  archive_read_support_format_tar(reader.get());
  if (archive_read_open_memory(reader.get(), archive.data(), archive.size()) !=
      ARCHIVE_OK) {
    return false;
  }
  members.clear();
  archive_entry *entry = nullptr;
  int rc = ARCHIVE_OK;
  while ((rc = archive_read_next_header(reader.get(), &entry)) == ARCHIVE_OK ||
         rc == ARCHIVE_WARN) {
    char type = '?';
    switch (archive_entry_filetype(entry)) {
    case AE_IFDIR:
      type = 'd';
      break;
    case AE_IFREG:
      type = '-';
      break;
    case AE_IFLNK:
      type = 'l';
      break;
    case AE_IFCHR:
      type = 'c';
      break;
    case AE_IFBLK:
      type = 'b';
      break;
    case AE_IFIFO:
      type = 'p';
      break;
    case AE_IFSOCK:
      type = 's';
      break;
    default:
      break;
    }
    if (archive_entry_hardlink(entry) != nullptr) {
      type = 'h';
    }
    const char *name = archive_entry_pathname(entry);
    members.push_back({type, name != nullptr ? name : ""});
    if (archive_read_data_skip(reader.get()) != ARCHIVE_OK) {
      return false;
    }
  }
  return rc == ARCHIVE_EOF;
}

void PackRouterDb(const std::string &parent, const std::string &archive,
                  const std::string &top) {
  std::unique_ptr<struct archive, WriterFree> writer(archive_write_new());
  ASSERT_TRUE(writer);
  ASSERT_EQ(ARCHIVE_OK, archive_write_add_filter_gzip(writer.get()));
  ASSERT_EQ(ARCHIVE_OK, archive_write_set_format_gnutar(writer.get()));
  ASSERT_EQ(ARCHIVE_OK,
            archive_write_open_filename(writer.get(), archive.c_str()))
      << archive_error_string(writer.get());
  const fs::path root = fs::path(parent) / "routerdb";
  AddMember(writer.get(), root, top);
  std::error_code ec;
  for (fs::recursive_directory_iterator it(root, ec), end;
       !ec && it != end && !testing::Test::HasFatalFailure();
       it.increment(ec)) {
    AddMember(writer.get(), it->path(),
              top + "/" + fs::relative(it->path(), root).string());
  }
  ASSERT_FALSE(ec) << ec.message();
  ASSERT_EQ(ARCHIVE_OK, archive_write_close(writer.get()))
      << archive_error_string(writer.get());
}

std::string DescribeTree(const std::string &root) {
  std::map<std::string, std::string> files;
  std::error_code ec;
  for (fs::recursive_directory_iterator it(root, ec), end; !ec && it != end;
       it.increment(ec)) {
    std::string relative = fs::relative(it->path(), root).string();
    files[relative] = it->is_regular_file() ? ReadFile(it->path()) : "<dir>";
  }
  std::ostringstream out;
  for (const auto &[name, content] : files) {
    out << name << ":\n" << content << "\n";
  }
  return out.str();
}

void SetLibraryConfig(const std::string &key, const std::string &value) {
  ASSERT_EQ(0, KLIBCFileSetKeyValue(ZARK_PORTMAP_CONF_DIR "/portmap.conf",
                                    key.c_str(), value.c_str(), 0));
}

} // namespace zark::test
