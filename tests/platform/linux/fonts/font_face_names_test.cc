// The names FreeType gives each face agree with fontconfig's for real Debian font packages, and
// files that are no complete font are refused.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <memory>
#include <set>
#include <sstream>

#include "platform/linux/fonts/font_face_names.h"
#include "platform/fd/regular_file.h"

namespace typhora {
namespace {

namespace fs = std::filesystem;
using Faces = std::set<std::pair<std::string, std::string>>;  // PostScript name, family

std::string commandOutput(const std::string& command) {
  std::unique_ptr<FILE, int (*)(FILE*)> pipe(popen(command.c_str(), "r"), pclose);
  std::string out;
  char buffer[4096];
  while (pipe && fgets(buffer, sizeof buffer, pipe.get()) != nullptr) out += buffer;
  return out;
}

std::vector<std::string> fontFilesOf(const std::string& package) {
  std::istringstream listing(commandOutput("dpkg -L " + package + " 2>/dev/null"));
  std::vector<std::string> files;
  for (std::string line; std::getline(listing, line);) {
    const std::string extension = fs::path(line).extension().string();
    if ((extension == ".ttf" || extension == ".otf" || extension == ".ttc") &&
        fs::is_regular_file(line))
      files.push_back(line);
  }
  return files;
}

// fontconfig's faces of a file: every face and named instance with a PostScript name (the
// variable font itself, listed apart from its default instance, has none), with its first family.
Faces fontconfigFaces(const std::string& file) {
  std::istringstream lines(
      commandOutput("fc-scan --format '%{postscriptname}\\t%{family[0]}\\n' '" + file + "'"));
  Faces faces;
  for (std::string line; std::getline(lines, line);) {
    const std::size_t tab = line.find('\t');
    if (tab != std::string::npos && tab > 0)
      faces.emplace(line.substr(0, tab), line.substr(tab + 1));
  }
  return faces;
}

Faces ourFaces(const std::string& file) {
  Faces faces;
  std::optional<Value> names = FontFaceNames::read(file);
  if (names && names->asDictionary() != nullptr) {
    for (const auto& [postScript, family] : names->asDictionary()->entries())
      faces.emplace(postScript, family.asString() != nullptr ? *family.asString() : "");
  }
  return faces;
}

class FontconfigAgreement : public ::testing::TestWithParam<const char*> {};

TEST_P(FontconfigAgreement, EveryFaceOfThePackageIsNamedAsFontconfigNamesIt) {
  const std::vector<std::string> files = fontFilesOf(GetParam());
  ASSERT_FALSE(files.empty()) << GetParam() << " is not installed (scripts/deps.sh installs it)";
  std::size_t faces = 0;
  for (const std::string& file : files) {
    const Faces expected = fontconfigFaces(file);
    ASSERT_FALSE(expected.empty()) << file;
    EXPECT_EQ(ourFaces(file), expected) << file;
    faces += expected.size();
  }
  RecordProperty("faces", static_cast<int>(faces));
}

// DejaVu: single-face TrueType files; Noto: hundreds of TrueType and OpenType files; WenQuanYi
// Micro Hei: a TrueType collection of two faces; Inter: variable fonts with named instances.
INSTANTIATE_TEST_SUITE_P(DebianPackages, FontconfigAgreement,
                         ::testing::Values("fonts-dejavu-core", "fonts-noto-core",
                                           "fonts-wqy-microhei", "fonts-inter-variable"));

std::vector<std::uint8_t> bytesOf(const std::string& file) {
  std::optional<std::vector<std::uint8_t>> bytes = RegularFile::read(file, 64u << 20, nullptr);
  return bytes.value_or(std::vector<std::uint8_t>{});
}

TEST(FontFaceNames, RefusesWhatIsNoCompleteFont) {
  const std::vector<std::uint8_t> sans = bytesOf("/usr/share/fonts/truetype/dejavu/DejaVuSans.ttf");
  const std::vector<std::uint8_t> collection =
      bytesOf("/usr/share/fonts/truetype/wqy/wqy-microhei.ttc");
  ASSERT_FALSE(sans.empty());
  ASSERT_FALSE(collection.empty());
  std::string error;
  ASSERT_TRUE(FontFaceNames::fromBytes(sans, &error)) << error;

  const std::string text = "this is not a font\n";
  const std::map<std::string, std::vector<std::uint8_t>> refused = {
      {"empty", {}},
      {"text", {text.begin(), text.end()}},
      {"header only", {sans.begin(), sans.begin() + 12}},
      {"cut in its table directory", {sans.begin(), sans.begin() + 40}},
      {"cut at half", {sans.begin(), sans.begin() + sans.size() / 2}},
      {"last byte missing", {sans.begin(), sans.end() - 1}},
      {"collection cut at half", {collection.begin(), collection.begin() + collection.size() / 2}},
      {"collection header only", {collection.begin(), collection.begin() + 16}},
  };
  for (const auto& [what, bytes] : refused) {
    error.clear();
    EXPECT_FALSE(FontFaceNames::fromBytes(bytes, &error)) << what;
    EXPECT_FALSE(error.empty()) << what;
  }
  error.clear();
  FontFaceNames::fromBytes(std::vector<std::uint8_t>(sans.begin(), sans.end() - 1), &error);
  EXPECT_THAT(error, ::testing::HasSubstr("truncated"));
}

}  // namespace
}  // namespace typhora
