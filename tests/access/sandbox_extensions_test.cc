// What each kind of caller receives at check-in: fonts filtered by capability and sandbox, with
// the extension tokens that open them; and the two check-ins through a connection's handler.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <future>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "ipc/typhora_handler.h"
#include "platform/dispatch/semaphore.h"
#include "platform/value/json_codec.h"
#include "support/fake_platform.h"

namespace typhora {
namespace {

using ::testing::ElementsAre;
using testing::FakePlatform;
using ::testing::UnorderedElementsAre;

const std::string kFiles = "/var/mobile/Library/UserFonts/FontFiles/";
const std::string kShopA = kFiles + "com.shop/A.otf";
const std::string kShopB = kFiles + "com.shop/B.otf";  // disabled
const std::string kOtherC = kFiles + "com.other/C.otf";
const std::string kAssetS = "/var/mobile/Library/UserFonts/FontAssets/Serif/S.ttc";
const std::string kStoreX =
    "/private/var/Cargell/AssetsV2/com_zorvane_Cargell_Font6/X/AssetData/X.ttf";

Value record(const std::string& family, bool disabled) {
  return Value::dictionary(
      {{"disabled", disabled}, {"familyName", Value::dictionary({{family + "-Regular", family}})}});
}

std::vector<std::string> keys(const Value& dictionary) {
  std::vector<std::string> names;
  for (const auto& [key, value] : dictionary.asDictionary()->entries()) names.push_back(key);
  return names;
}

Value token(const std::string& path, pid_t pid) {
  std::string text = "token:" + path + "@" + std::to_string(pid);
  Bytes bytes(text.begin(), text.end());
  bytes.push_back(0);
  return Value(std::move(bytes));
}

class CheckinTest : public ::testing::Test {
 protected:
  void SetUp() override {
    info_ = Value::dictionary({{kShopA, record("A", false)},
                               {kShopB, record("B", true)},
                               {kOtherC, record("C", false)},
                               {kAssetS, record("S", false)},
                               {kStoreX, record("X", false)}});
    fake_.fileSystem.writeFile("/var/mobile/Library/UserFonts/UserFonts.plist",
                               JsonCodec::encode(info_));
    fake_.fontManager.setProviderDirectory("com.shop", "com.shop");
    fake_.fontManager.setProviderDirectory("com.none", "com.none");
    fake_.sandbox.setSandboxed(kClient.pid, 1);
  }
  Value setup(bool e, bool f, bool p, std::optional<std::string> identifier) {
    std::optional<std::vector<Value>> reply;
    daemon_->setupUserInstalledFontsFor(kClient, kClient, e, f, p, identifier,
                                        [&reply](std::vector<Value> r) { reply = std::move(r); });
    EXPECT_TRUE(reply.has_value());
    return reply ? reply->at(0) : Value();
  }

  static constexpr AuditToken kClient{.pid = 42, .uid = 501, .startTime = 3, .exeInode = 4};
  FakePlatform fake_;
  Value info_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
};

TEST_F(CheckinTest, NoCapabilityIsAnsweredAbsentWithoutEnteringTheQueue) {
  Semaphore release;
  daemon_->mainHandlerQueue().async([&release] { release.wait(); });  // keep the queue busy
  auto answered =
      std::async(std::launch::async, [this] { return setup(false, false, false, "x"); });
  ASSERT_EQ(answered.wait_for(std::chrono::seconds(10)), std::future_status::ready);
  EXPECT_TRUE(answered.get().isNull());
  release.signal();
  // The job still waking from the semaphore must be done before the semaphore goes.
  daemon_->mainHandlerQueue().sync([] {});
}

TEST_F(CheckinTest, EnumerationGetsEveryEnabledCachedRecordAndDirectoryTokens) {
  fake_.sandbox.allowRead(kClient.pid, "/var/mobile/Library/UserFonts/FontFiles");
  Value checkin = setup(true, true, true, "com.shop");
  EXPECT_THAT(keys(checkin), ElementsAre("extension", "extension.fontasset", "fontsInfo"));
  EXPECT_EQ(checkin.get("fontsInfo"), Value::dictionary({{kShopA, info_.get(kShopA)},
                                                         {kOtherC, info_.get(kOtherC)},
                                                         {kAssetS, info_.get(kAssetS)},
                                                         {kStoreX, info_.get(kStoreX)}}));
  EXPECT_EQ(checkin.get("extension"), token("/var/mobile/Library/UserFonts/FontFiles", 42));

  fake_.sandbox.allowRead(kClient.pid, "/var/mobile/Library/UserFonts/FontAssets/");
  EXPECT_FALSE(
      setup(true, false, false, "com.shop").asDictionary()->contains("extension.fontasset"));
}

// Every enumerating caller receives the same records, filtered once per loaded generation; only
// the tokens are its own. Dropping the cache drops them.
TEST_F(CheckinTest, EnumeratingCallersShareTheRecordsOfAGenerationAndNotTheirTokens) {
  constexpr AuditToken kOther{.pid = 77, .uid = 502, .startTime = 5, .exeInode = 6};
  auto checkinOf = [this](const AuditToken& caller) {
    std::optional<std::vector<Value>> reply;
    daemon_->setupUserInstalledFontsFor(caller, caller, true, false, false, "com.any",
                                        [&reply](std::vector<Value> r) { reply = std::move(r); });
    return reply ? reply->at(0) : Value();
  };
  Value first = checkinOf(kClient);
  Value second = checkinOf(kOther);  // not sandboxed
  EXPECT_EQ(first.get("fontsInfo"), second.get("fontsInfo"));
  EXPECT_THAT(keys(second.get("fontsInfo")),
              UnorderedElementsAre(kOtherC, kShopA, kAssetS, kStoreX));
  EXPECT_EQ(first.get("extension"), token("/var/mobile/Library/UserFonts/FontFiles", 42));
  EXPECT_EQ(second.get("extension"), token("/var/mobile/Library/UserFonts/FontFiles", 77));

  fake_.fileSystem.writeFile("/var/mobile/Library/UserFonts/UserFonts.plist",
                             JsonCodec::encode(Value::dictionary({{kShopB, record("B", false)}})));
  EXPECT_EQ(keys(checkinOf(kOther).get("fontsInfo")), keys(first.get("fontsInfo")));
  daemon_->invalidateUserFonts();
  EXPECT_THAT(keys(checkinOf(kOther).get("fontsInfo")), ElementsAre(kShopB));
  EXPECT_THAT(keys(checkinOf(kClient).get("fontsInfo")), ElementsAre(kShopB));
}

TEST_F(CheckinTest, AProviderGetsItsOwnEnabledFontsAndItsDirectory) {
  Value checkin = setup(false, false, true, "com.shop");
  Value a = record("A", false);
  EXPECT_EQ(
      checkin.get("fontsInfo"),
      Value::dictionary({{kShopA, Value::dictionary({{"familyName", a.get("familyName")}})}}));
  EXPECT_EQ(checkin.get("extension.provider"), token(kFiles + "com.shop", 42));
  EXPECT_EQ(checkin.get("hide-profilefonts"), Value(true));

  fake_.sandbox.allowRead(kClient.pid, kFiles + "com.shop");
  EXPECT_FALSE(
      setup(false, false, true, "com.shop").asDictionary()->contains("extension.provider"));
  // No enabled font in its directory: no token either.
  Value none = setup(false, false, true, "com.none");
  EXPECT_TRUE(none.get("fontsInfo").asDictionary()->empty());
  EXPECT_FALSE(none.asDictionary()->contains("extension.provider"));
}

TEST_F(CheckinTest, FontAccessGetsTheIssuedFontsEachWithItsOwnToken) {
  daemon_->recordIssuedFontPaths(
      std::vector<std::string>{kShopA, kShopB, kOtherC, kAssetS, kStoreX}, "com.app");
  fake_.sandbox.allowRead(kClient.pid, kOtherC);
  Value fonts = setup(false, true, false, "com.app").get("fontsInfo");
  EXPECT_THAT(keys(fonts), UnorderedElementsAre(kShopA, kShopB, kAssetS, kStoreX));
  EXPECT_EQ(fonts.get(kShopA).get("data"), token(kShopA, 42));
  EXPECT_EQ(fonts.get(kShopB).get("data"), token(kShopB, 42));
  EXPECT_TRUE(fonts.get(kShopB).get("disabled").isNull());
  EXPECT_TRUE(fonts.get(kStoreX).get("data").isNull());  // the asset store needs no token
  EXPECT_EQ(fonts.get(kAssetS).get("data"), token(kAssetS, 42));

  // Unsandboxed: the records as cached, "disabled" included, and no tokens.
  fake_.sandbox.setSandboxed(kClient.pid, 0);
  Value open = setup(false, true, false, "com.app");
  EXPECT_EQ(open.get("fontsInfo").get(kShopB), info_.get(kShopB));
  EXPECT_FALSE(open.asDictionary()->contains("hide-profilefonts"));

  // Without a signing identifier there is nothing issued to look up.
  Value anonymous = setup(false, true, false, std::nullopt);
  EXPECT_TRUE(anonymous.get("fontsInfo").asDictionary()->empty());
  EXPECT_FALSE(anonymous.asDictionary()->contains("hide-profilefonts"));
}

TEST_F(CheckinTest, APathSetLimitsTheAnswerAndTheDirectoryIsReportedOnlyWhenFound) {
  std::optional<std::string> directory = "untouched";
  daemon_->mainHandlerQueue().sync([&] {
    Value only = daemon_->fontInfoForAuditToken(kClient, false, true, "com.shop",
                                                std::set<std::string>{kOtherC}, &directory);
    EXPECT_TRUE(only.asDictionary()->empty());
  });
  EXPECT_EQ(directory, "untouched");
}

TEST_F(CheckinTest, HandlersCheckInWithTheCallersCapabilities) {
  daemon_->setupForLumoService();
  auto client = fake_.ipc.listener(kServiceName)->connect(kClient);
  auto handler = std::dynamic_pointer_cast<TyphoraHandler>(client->exportedObject());
  fake_.codeSigning.setRecord(kClient, "com.shop",
                              Value::dictionary({{"com.zorvane.developer.user-fonts",
                                                  Value::array({"system-installation"})}}));
  auto reply = client->deliver(op::kCheckin, {}).reply;
  ASSERT_TRUE(reply.has_value());
  EXPECT_TRUE(reply->at(0).asDictionary()->contains("extension.provider"));
  EXPECT_TRUE(handler->isFontProvider());
  EXPECT_EQ(handler->processIdentifier(), "com.shop");

  // The registry's own process gets nothing; a client that is no provider leaves the identifier.
  fake_.codeSigning.setRecord(
      kClient, "com.zorvane.Typhora.UserFontManager",
      Value::dictionary({{"com.zorvane.developer.user-fonts", Value::array({"app-usage"})}}));
  EXPECT_TRUE(client->deliver(op::kCheckin, {}).reply->at(0).isNull());
  EXPECT_TRUE(handler->hasFontAccessEntitlement());
  EXPECT_EQ(handler->processIdentifier(), "com.shop");

  // Only the font picker may use its check-in; it sees every enabled font.
  EXPECT_TRUE(client->deliver(op::kCheckinForFontPicker, {}).reply->at(0).isNull());
  EXPECT_FALSE(handler->hasEnumerationEntitlement());
  fake_.codeSigning.setRecord(kClient, "com.zorvane.Panelor.FontPicker");
  Value picker = client->deliver(op::kCheckinForFontPicker, {}).reply->at(0);
  EXPECT_THAT(keys(picker.get("fontsInfo")),
              UnorderedElementsAre(kShopA, kOtherC, kAssetS, kStoreX));
  EXPECT_TRUE(picker.asDictionary()->contains("extension"));
  EXPECT_TRUE(handler->hasEnumerationEntitlement());
  client->invalidate();
}

TEST_F(CheckinTest, TheFontPickerGetsAnEmptyDictionaryWithoutUserFonts) {
  fake_.fileSystem.removeFile("/var/mobile/Library/UserFonts/UserFonts.plist");
  daemon_->setupForLumoService();
  auto client = fake_.ipc.listener(kServiceName)->connect(kClient);
  fake_.codeSigning.setRecord(kClient, "com.zorvane.Panelor.FontPicker");
  Value picker = client->deliver(op::kCheckinForFontPicker, {}).reply->at(0);
  EXPECT_EQ(picker.get("fontsInfo"), Value(Dictionary()));
  client->invalidate();
}

}  // namespace
}  // namespace typhora
