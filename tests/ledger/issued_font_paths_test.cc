// The issued-fonts ledger on the fake platform: stored forms, unions pruned to known fonts,
// writes only on change, forgetting and the entitled reset.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/value/json_codec.h"
#include "support/fake_platform.h"

namespace typhora {
namespace {

using ::testing::ElementsAre;
using testing::FakePlatform;
using ::testing::IsEmpty;
using ::testing::UnorderedElementsAre;

constexpr const char* kFiles = "/var/mobile/Library/UserFonts/FontFiles/";
constexpr const char* kAssets = "/var/mobile/Library/UserFonts/FontAssets/";
constexpr const char* kElsewhere = "/var/mobile/Library/Fonts/Managed/Profile.ttf";

class LedgerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::vector<DictionaryEntry> records;
    for (const std::string& path :
         {std::string(kFiles) + "A.otf", std::string(kFiles) + "B.otf",
          std::string(kAssets) + "Serif/Serif.ttc", std::string(kElsewhere)})
      records.emplace_back(path, Value::dictionary({{"familyName", Value::dictionary({})}}));
    fake_.fileSystem.writeFile("/var/mobile/Library/UserFonts/UserFonts.plist",
                               JsonCodec::encode(Value(Dictionary(std::move(records)))));
  }
  Value stored() { return fake_.preferences.value("issues"); }

  FakePlatform fake_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
};

TEST_F(LedgerTest, KnownPathsAreStoredShortAndReadBackWhole) {
  const std::string a = std::string(kFiles) + "A.otf";
  const std::string serif = std::string(kAssets) + "Serif/Serif.ttc";
  daemon_->recordIssuedFontPaths(std::vector<std::string>{a, serif, kElsewhere,
                                                          "/private/var/mobile/Library/UserFonts/"
                                                          "FontFiles/A.otf",
                                                          "/unknown.ttf", a},
                                 "com.app");
  EXPECT_THAT(*stored().get("com.app").asArray(),
              UnorderedElementsAre("U/A.otf", "A/Serif/Serif.ttc", kElsewhere));
  EXPECT_THAT(daemon_->issuedFontFilePathsForIdentifier("com.app"),
              UnorderedElementsAre(a, serif, kElsewhere));
  EXPECT_THAT(daemon_->issuedFontFilePathsForIdentifier("com.none"), IsEmpty());

  // Nothing known: an empty entry all the same. No identifier: nothing at all.
  daemon_->recordIssuedFontPaths(std::vector<std::string>{"/unknown.ttf"}, "com.empty");
  EXPECT_EQ(stored().get("com.empty"), Value(ValueArray{}));
  const int synchronizations = fake_.preferences.synchronizations();
  daemon_->recordIssuedFontPaths(std::vector<std::string>{a}, std::nullopt);
  EXPECT_EQ(fake_.preferences.synchronizations(), synchronizations);
}

TEST_F(LedgerTest, EntriesGrowByUnionPrunedToKnownFontsAndSameSetsWriteNothing) {
  const std::string a = std::string(kFiles) + "A.otf";
  const std::string b = std::string(kFiles) + "B.otf";
  fake_.preferences.setValue("issues",
                             *JsonCodec::decode(R"({"com.app": ["U/A.otf", "U/Gone.otf"]})"));
  daemon_->recordIssuedFontPaths(std::vector<std::string>{b}, "com.app");
  EXPECT_THAT(*stored().get("com.app").asArray(), UnorderedElementsAre("U/A.otf", "U/B.otf"));

  const int synchronizations = fake_.preferences.synchronizations();
  daemon_->recordIssuedFontPaths(std::vector<std::string>{b, a}, "com.app");
  daemon_->recordIssuedFontPaths(std::nullopt, "com.app");
  EXPECT_EQ(fake_.preferences.synchronizations(), synchronizations);
}

TEST_F(LedgerTest, ForgettingAndResettingRemoveOnlyWhatIsThereAndOnlyForEntitledCallers) {
  fake_.preferences.setValue("issues", *JsonCodec::decode(R"({"com.a": ["U/A.otf"],
                                                               "com.b": ["U/B.otf"]})"));
  int synchronizations = fake_.preferences.synchronizations();
  daemon_->forgetClientApplication("com.none");
  daemon_->forgetClientApplication(std::nullopt);
  EXPECT_EQ(fake_.preferences.synchronizations(), synchronizations);
  daemon_->forgetClientApplication("com.a");
  EXPECT_EQ(stored(), *JsonCodec::decode(R"({"com.b": ["U/B.otf"]})"));

  // Over IPC: every caller gets its reply; only a true boolean entitlement resets.
  daemon_->setupForLumoService();
  const AuditToken caller{.pid = 7, .startTime = 1, .exeInode = 2};
  auto client = fake_.ipc.listener(kServiceName)->connect(caller);
  for (const char* entitlement : {"null", "\"yes\"", "false"}) {
    fake_.codeSigning.setRecord(caller, "com.tool",
                                Value::dictionary({{"com.zorvane.Typhora.allow-reset-issued-fonts",
                                                    *JsonCodec::decode(entitlement)}}));
    EXPECT_TRUE(client->deliver(op::kResetIssuedFontsFor, {Value("com.b")}).reply.has_value());
    EXPECT_TRUE(stored().asDictionary()->contains("com.b")) << entitlement;
  }
  fake_.codeSigning.setRecord(
      caller, "com.tool",
      Value::dictionary({{"com.zorvane.Typhora.allow-reset-issued-fonts", true}}));
  EXPECT_TRUE(client->deliver(op::kResetIssuedFontsFor, {Value("com.b")}).reply.has_value());
  EXPECT_TRUE(stored().asDictionary()->empty());
  client->invalidate();
}

TEST_F(LedgerTest, ChangesFromManyThreadsAreNotLost) {
  std::vector<std::thread> writers;
  for (int i = 0; i < 8; ++i) {
    writers.emplace_back([this, i] {
      daemon_->recordIssuedFontPaths(
          std::vector<std::string>{std::string(kFiles) + (i % 2 ? "A.otf" : "B.otf")},
          "com.app" + std::to_string(i));
    });
  }
  for (auto& writer : writers) writer.join();
  EXPECT_EQ(stored().asDictionary()->size(), 8u);
}

}  // namespace
}  // namespace typhora
