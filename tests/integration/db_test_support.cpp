#include "db_test_support.h"

#include "base/child_process.h"
#include "hermetic.h"
#include "klibc.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <map>
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

void PackRouterDb(const std::string &parent, const std::string &archive,
                  const std::vector<std::string> &extra) {
  std::vector<std::string> args = {"tar",   "--create",    "--gzip", "--file",
                                   archive, "--directory", parent};
  args.insert(args.end(), extra.begin(), extra.end());
  args.push_back("routerdb");
  zark::portmap::ChildOptions options;
  options.timeout = std::chrono::seconds(30);
  zark::portmap::ChildResult result =
      zark::portmap::RunProgram("/bin/tar", args, options);
  ASSERT_TRUE(result.Succeeded()) << result.errors;
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
