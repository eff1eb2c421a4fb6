// Requested font names sorted against the installed user fonts, and the providers of families
// and PostScript names.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "daemon/typhora_daemon.h"
#include "platform/value/json_codec.h"
#include "support/fake_platform.h"

namespace typhora {
namespace {

using ::testing::ElementsAre;
using testing::FakePlatform;
using ::testing::IsEmpty;
using ::testing::UnorderedElementsAre;

Value request(const char* family, const char* postScript) {
  std::vector<DictionaryEntry> keys;
  if (family != nullptr) keys.emplace_back(kSVFontFamilyNameAttribute, family);
  if (postScript != nullptr) keys.emplace_back(kSVFontNameAttribute, postScript);
  return Value(Dictionary(std::move(keys)));
}

class NameResolutionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    fake_.fileSystem.writeFile("/var/mobile/Library/UserFonts/UserFonts.plist", R"({
      "/var/mobile/Library/UserFonts/FontFiles/com.a/A.otf":
          {"familyName": {"A-Regular": "A", "A-Bold": "A"}},
      "/var/mobile/Library/UserFonts/FontFiles/com.b/B.otf":
          {"familyName": {"B-Regular": "B", "A-Light": "A"}, "disabled": true},
      "/var/mobile/Library/UserFonts/FontFiles/com.c/C.otf":
          {"familyName": {"C-Regular": "C"}, "disabled": true},
      "/var/mobile/Library/UserFonts/FontFiles/nobody/D.otf":
          {"familyName": {"D-Regular": "D"}}})");
    for (const char* provider : {"com.a", "com.b", "com.c"})
      fake_.fontManager.setProviderDirectory(provider, provider);
  }
  std::vector<std::string> sort(std::initializer_list<Value> requests) {
    enabled_.clear();
    disabled_.clear();
    return daemon_->unknownFontNamesAndEnabledFamilyNames(&enabled_, &disabled_,
                                                          ValueArray(requests));
  }

  FakePlatform fake_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
  std::vector<std::string> enabled_, disabled_;
};

TEST_F(NameResolutionTest, RequestsSortIntoEnabledDisabledAndUnknown) {
  EXPECT_THAT(sort({request("A", "Nope-Regular")}), IsEmpty());
  EXPECT_THAT(enabled_, ElementsAre("A"));

  // A known PostScript name settles its record: the unknown family X is not reported.
  EXPECT_THAT(sort({request("X", "C-Regular")}), IsEmpty());
  EXPECT_THAT(disabled_, ElementsAre("C"));

  // Both unknown: the family name is what is reported; repeats collapse; sorted by bytes.
  EXPECT_THAT(sort({request("X", "Y-Regular"), request(nullptr, "Z-Regular"), request("X", nullptr),
                    request("a", nullptr), request(nullptr, nullptr)}),
              ElementsAre("X", "Z-Regular", "a"));

  // Enabled in one record, disabled in another: enabled only. Letter case matters.
  EXPECT_THAT(sort({request("C", nullptr), request(nullptr, "C-Regular"), request("c", nullptr),
                    request(nullptr, "B-Regular"), request("A", nullptr)}),
              ElementsAre("c"));
  EXPECT_THAT(enabled_, ElementsAre("A"));
  EXPECT_THAT(disabled_, UnorderedElementsAre("B", "C"));
}

TEST_F(NameResolutionTest, ProvidersComeFromTheDirectoriesOfEveryMatchingFile) {
  EXPECT_THAT(daemon_->providerIdentifiersFromFamilyName("A"),
              UnorderedElementsAre("com.a", "com.b"));
  EXPECT_THAT(daemon_->providerIdentifiersFromFamilyName("D"), IsEmpty());  // no identifier
  bool enabled = true;
  EXPECT_TRUE(daemon_->isKnownFamilyName("D", &enabled));
  EXPECT_TRUE(enabled);

  std::optional<std::string> family = "unset";
  EXPECT_THAT(daemon_->providerIdentifiersAndFamilyName(&family, "B-Regular"),
              ElementsAre("com.b"));
  EXPECT_EQ(family, "B");
  EXPECT_THAT(daemon_->providerIdentifiersAndFamilyName(&family, "Nope"), IsEmpty());
  EXPECT_EQ(family, std::nullopt);
  EXPECT_EQ(daemon_->knownFamilyNameFromPostScriptName("C-Regular", &enabled), "C");
  EXPECT_FALSE(enabled);
}

// Look-ups answer from the generation loaded last: a font change drops its names with the cache,
// and the next look-up sees what the file holds then, first and last matching files included.
TEST_F(NameResolutionTest, AFontChangeDropsTheNamesAndTheNextGenerationAnswersAfresh) {
  bool enabled = false;
  EXPECT_TRUE(daemon_->isKnownFamilyName("A", &enabled));
  fake_.fileSystem.writeFile("/var/mobile/Library/UserFonts/UserFonts.plist", R"({
      "/var/mobile/Library/UserFonts/FontFiles/com.b/B.otf":
          {"familyName": {"A-Regular": "A", "E-Regular": "E"}, "disabled": true},
      "/var/mobile/Library/UserFonts/FontFiles/com.c/C.otf":
          {"familyName": {"A-Regular": "Z", "E-Bold": "E", "Q-Regular": 3}},
      "/var/mobile/Library/UserFonts/FontFiles/com.c/Odd.otf": 7})");
  EXPECT_FALSE(daemon_->isKnownFamilyName("E", nullptr));  // not told yet

  daemon_->fontChanged(Value::dictionary({}), [](std::vector<Value>) {});
  daemon_->mainHandlerQueue().sync([] {});
  EXPECT_TRUE(daemon_->isKnownFamilyName("E", &enabled));
  EXPECT_FALSE(enabled);  // the first file by path decides
  EXPECT_EQ(daemon_->knownFamilyNameFromPostScriptName("A-Regular", &enabled), "A");
  EXPECT_FALSE(enabled);
  std::optional<std::string> family;
  EXPECT_THAT(daemon_->providerIdentifiersAndFamilyName(&family, "A-Regular"),
              ElementsAre("com.b", "com.c"));
  EXPECT_EQ(family, "Z");  // the last file by path
  EXPECT_THAT(daemon_->providerIdentifiersFromFamilyName("E"), ElementsAre("com.b", "com.c"));
  EXPECT_EQ(daemon_->knownFamilyNameFromPostScriptName("Q-Regular", nullptr), std::nullopt);
  EXPECT_THAT(sort({request("C", nullptr), request("E", "E-Bold")}), ElementsAre("C"));
  EXPECT_THAT(enabled_, ElementsAre("E"));
  EXPECT_THAT(disabled_, IsEmpty());

  // Replacing the information through the setter replaces its names too.
  daemon_->setUserFontsInfo(Value::dictionary(
      {{"/var/mobile/Library/UserFonts/FontFiles/com.a/F.otf",
        Value::dictionary({{"familyName", Value::dictionary({{"F-Regular", "F"}})}})}}));
  EXPECT_TRUE(daemon_->isKnownFamilyName("F", nullptr));
  EXPECT_FALSE(daemon_->isKnownFamilyName("E", nullptr));
  daemon_->invalidateUserFonts();
  EXPECT_FALSE(daemon_->isKnownFamilyName("F", nullptr));
  EXPECT_TRUE(daemon_->isKnownFamilyName("E", nullptr));
}

TEST_F(NameResolutionTest, WithoutUserFontsEveryNameIsUnknown) {
  fake_.fileSystem.removeFile("/var/mobile/Library/UserFonts/UserFonts.plist");
  EXPECT_THAT(sort({request("A", "A-Regular")}), ElementsAre("A"));
  EXPECT_THAT(enabled_, IsEmpty());
  EXPECT_THAT(daemon_->providerIdentifiersFromFamilyName("A"), IsEmpty());
}

}  // namespace
}  // namespace typhora
