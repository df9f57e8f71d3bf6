// Recorded SSDP answers and root descriptions (data/, see its README)
// against the parse written beside each.
#include "net/igd_description.h"
#include "net/ssdp_search.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>

namespace zark::test {
namespace {

using namespace zark::portmap;
namespace fs = std::filesystem;

std::string Slurp(const fs::path &path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream content;
  content << in.rdbuf();
  return content.str();
}

std::map<std::string, std::string> Expected(const fs::path &path) {
  std::map<std::string, std::string> expected;
  std::istringstream lines(Slurp(path));
  std::string line;
  while (std::getline(lines, line)) {
    const std::size_t equals = line.find('=');
    if (equals != std::string::npos) {
      expected[line.substr(0, equals)] = line.substr(equals + 1);
    }
  }
  return expected;
}

std::vector<fs::path> Recordings(const std::string &prefix,
                                 const std::string &extension) {
  std::vector<fs::path> found;
  for (const auto &entry : fs::directory_iterator(ZARK_DETECT_DATA_DIR)) {
    const std::string name = entry.path().filename().string();
    if (name.rfind(prefix, 0) == 0 && entry.path().extension() == extension) {
      found.push_back(entry.path());
    }
  }
  std::sort(found.begin(), found.end());
  return found;
}

TEST(DetectRecorded, SsdpAnswersParseAsRecorded) {
  const std::vector<fs::path> recordings = Recordings("ssdp_reply_", ".txt");
  ASSERT_GE(recordings.size(), 2u);
  for (const fs::path &path : recordings) {
    std::map<std::string, std::string> expected =
        Expected(fs::path(path).replace_extension(".expect"));
    std::optional<SsdpReply> reply = ParseSsdpReply(Slurp(path));
    ASSERT_TRUE(reply.has_value()) << path;
    EXPECT_EQ(expected["location"], reply->location) << path;
    EXPECT_EQ(expected["st"], reply->searchTarget) << path;
    EXPECT_EQ(expected["server"], reply->server) << path;
  }
}

TEST(DetectRecorded, RootDescriptionsNameTheRootDevice) {
  const std::vector<fs::path> recordings = Recordings("rootdesc_", ".xml");
  ASSERT_GE(recordings.size(), 2u);
  for (const fs::path &path : recordings) {
    std::map<std::string, std::string> expected =
        Expected(fs::path(path).replace_extension(".expect"));
    IgdIdentity identity = ParseIgdIdentity(Slurp(path));
    EXPECT_EQ(expected["manufacturer"], identity.manufacturer) << path;
    EXPECT_EQ(expected["modelName"], identity.modelName) << path;
    EXPECT_EQ(expected["modelNumber"], identity.modelNumber) << path;
  }
}

TEST(DetectRecorded, DescriptionsThatAreNotXmlNameNothing) {
  EXPECT_EQ(IgdIdentity{}, ParseIgdIdentity(""));
  EXPECT_EQ(IgdIdentity{}, ParseIgdIdentity("manufacturer=Acme"));
  // Truncated inside the root device: what was whole is kept.
  EXPECT_EQ((IgdIdentity{"Acme", "", ""}),
            ParseIgdIdentity("<root><device><manufacturer>Acme</manufacturer>"
                             "<modelName>R"));
  // Names of an embedded device are never the router's.
  EXPECT_EQ(IgdIdentity{},
            ParseIgdIdentity("<root><device><deviceList><device>"
                             "<manufacturer>Chip</manufacturer></device>"
                             "</deviceList></device></root>"));
  // Only the first of a repeated element, control characters blanked,
  // unknown entities kept, characters beyond ASCII shown as "?".
  EXPECT_EQ((IgdIdentity{"A B", "M &nbsp; ?", ""}),
            ParseIgdIdentity("<root><device><manufacturer>A\x01\x02 B"
                             "</manufacturer><manufacturer>C</manufacturer>"
                             "<modelName>M &nbsp; &#x263A;</modelName>"
                             "</device></root>"));
  // A '>' inside an attribute value does not end the tag.
  EXPECT_EQ((IgdIdentity{"Q", "", ""}),
            ParseIgdIdentity("<root><device a=\"x>y\"><manufacturer b='>'>Q"
                             "</manufacturer></device></root>"));
  const IgdIdentity longText =
      ParseIgdIdentity("<root><device><modelName>" + std::string(5000, 'n') +
                       "</modelName></device></root>");
  EXPECT_EQ(kMaxIdentityText, longText.modelName.size());
}

} // namespace
} // namespace zark::test
