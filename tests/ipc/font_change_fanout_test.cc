// Font changes fanned out to checked-in clients on the fake platform: who is told, with which
// URL strings, fonts and tokens.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/value/json_codec.h"
#include "support/fake_platform.h"
#include "support/log_capture.h"

namespace typhora {
namespace {

using ::testing::ElementsAre;
using testing::FakeIpcConnection;
using testing::FakePlatform;
using ::testing::IsEmpty;
using testing::LogCapture;

const std::string kFiles = "/var/mobile/Library/UserFonts/FontFiles/";
const std::string kUserFontsPath = "/var/mobile/Library/UserFonts/UserFonts.plist";

Value json(const std::string& text) {
  return *JsonCodec::decode(text);
}

class FanoutTest : public ::testing::Test {
 protected:
  void SetUp() override {
    writeFonts({kFiles + "com.shop/A.otf", kFiles + "com.other/B.otf"});
    fake_.fontManager.setProviderDirectory("com.shop", "com.shop");
    daemon_->setupForLumoService();
    enumerator_ = client(1, "com.reader", R"(["font-enumeration"])");
    provider_ = client(2, "com.shop", R"(["system-installation"])");
    access_ = client(3, "com.app", R"(["app-usage"])");
    plain_ = client(4, "com.plain", "null");
    registry_ = fake_.ipc.listener(kServiceName)->connect();
  }
  void TearDown() override {
    for (auto& c : {enumerator_, provider_, access_, plain_, registry_}) c->invalidate();
  }
  void writeFonts(const std::vector<std::string>& paths) {
    std::vector<DictionaryEntry> records;
    for (const auto& path : paths)
      records.emplace_back(path, json(R"({"familyName": {"F-Regular": "F"}})"));
    fake_.fileSystem.writeFile(kUserFontsPath,
                               JsonCodec::encode(Value(Dictionary(std::move(records)))));
  }
  std::shared_ptr<FakeIpcConnection> client(pid_t pid, const char* identifier, const char* rights) {
    AuditToken token{.pid = pid, .startTime = 1, .exeInode = 1};
    fake_.codeSigning.setRecord(
        token, identifier, Value::dictionary({{"com.zorvane.developer.user-fonts", json(rights)}}));
    auto connection = fake_.ipc.listener(kServiceName)->connect(token);
    EXPECT_TRUE(connection->deliver(op::kCheckin, {}).reply.has_value());
    return connection;
  }
  void change(const std::string& dictionary) {
    auto delivered = registry_->deliver(op::kFontChanged, {json(dictionary)});
    EXPECT_TRUE(delivered.reply.has_value());
    daemon_->mainHandlerQueue().sync([] {});
  }
  static std::vector<std::vector<Value>> messages(const std::shared_ptr<FakeIpcConnection>& c) {
    std::vector<std::vector<Value>> all;
    for (const auto& sent : c->sent()) {
      EXPECT_EQ(sent.wireName, op::kFontAddedInfo);
      all.push_back(sent.arguments);
    }
    return all;
  }

  FakePlatform fake_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
  std::shared_ptr<FakeIpcConnection> enumerator_, provider_, access_, plain_, registry_;
};

TEST_F(FanoutTest, RemovalsReachEnumeratorsAndProvidersWithEveryParsedUrl) {
  change(R"({"urls": ["file:///var/mobile/Library/UserFonts/FontFiles/com.other/B.otf",
                      "file:///elsewhere/C.otf", "not a url"]})");
  const std::vector<Value> expected{
      Value(Dictionary()), Value(),
      json(R"(["file:///var/mobile/Library/UserFonts/FontFiles/com.other/B.otf",
               "file:///elsewhere/C.otf"])")};
  EXPECT_THAT(messages(enumerator_), ElementsAre(expected));
  EXPECT_THAT(messages(provider_), ElementsAre(expected));
  EXPECT_THAT(messages(access_), IsEmpty());
  EXPECT_THAT(messages(plain_), IsEmpty());
  EXPECT_THAT(fake_.systemNotify.posted(),
              ElementsAre(FontProviderDidChangeDistributedNotification));
}

TEST_F(FanoutTest, AdditionsReachThoseWhoMaySeeThemWithTheirFontsAndTokens) {
  writeFonts({kFiles + "com.shop/A.otf", kFiles + "com.other/B.otf", kFiles + "com.shop/New.otf"});
  LogCapture log;
  change(R"({"added": true, "kind": 0, "urls": [
      "file:///var/mobile/Library/UserFonts/FontFiles/com.shop/New.otf",
      "file:///tmp/Outside.otf"]})");
  EXPECT_EQ(log.count("got invalid font path: /tmp/Outside.otf"), 2u);  // enumerator, provider

  auto reader = messages(enumerator_);
  ASSERT_EQ(reader.size(), 1u);
  EXPECT_THAT(reader[0][0].get("fontsInfo").asDictionary()->entries(),
              ElementsAre(::testing::Key(kFiles + "com.shop/New.otf")));
  EXPECT_EQ(reader[0][1],
            json(R"(["file:///var/mobile/Library/UserFonts/FontFiles/com.shop/New.otf"])"));
  EXPECT_TRUE(reader[0][2].isNull());

  auto shop = messages(provider_);
  ASSERT_EQ(shop.size(), 1u);
  EXPECT_FALSE(shop[0][0].get("extension.provider").isNull());

  // A font in another provider's directory does not reach this provider.
  change(
      R"({"added": true, "urls": ["file:///var/mobile/Library/UserFonts/FontFiles/com.other/B.otf"]})");
  EXPECT_EQ(messages(enumerator_).size(), 2u);
  EXPECT_EQ(messages(provider_).size(), 1u);
}

TEST_F(FanoutTest, ChangesReadNumbersAndUrlDirectoriesTheWayPropertyListsAndUrlsDo) {
  // "added": 1 is an addition. A provider's font is found by its URL's path components: a
  // directory URL lies in "FontFiles", a doubled separator changes nothing.
  change(R"({"added": 1, "kind": 0.0, "urls": [
      "file:///var/mobile/Library/UserFonts/FontFiles/com.shop//A.otf",
      "file:///var/mobile/Library/UserFonts/FontFiles/com.shop/"]})");
  auto shop = messages(provider_);
  ASSERT_EQ(shop.size(), 1u);
  EXPECT_EQ(shop[0][1],
            json(R"(["file:///var/mobile/Library/UserFonts/FontFiles/com.shop//A.otf"])"));
  EXPECT_TRUE(shop[0][2].isNull());

  // "kind": 1.0 is a profile change, which reaches a client without any capability.
  change(R"({"added": true, "kind": 1.0, "urls": []})");
  EXPECT_EQ(messages(plain_).size(), 1u);
}

TEST_F(FanoutTest, ProfileChangesReachEveryCheckedInClient) {
  fake_.fontManager.setProfileFontsInfo(json(
      R"({"/var/mobile/Library/Fonts/P.ttf": {"n": 1}, "/var/mobile/Library/Fonts/Q.ttf": {}})"));
  change(R"({"added": true, "kind": 1, "urls": ["file:///var/mobile/Library/Fonts/P.ttf"]})");
  const std::vector<Value> added{
      json(R"({"fontsInfo": {"/var/mobile/Library/Fonts/P.ttf": {"n": 1}}})"),
      json(R"(["file:///var/mobile/Library/Fonts/P.ttf"])"), Value()};
  for (const auto& c : {enumerator_, provider_, access_, plain_})
    EXPECT_THAT(messages(c), ElementsAre(added));

  change(R"({"kind": 2, "urls": ["bad url"]})");  // sent even when nothing parsed
  EXPECT_THAT(messages(plain_).back(), ElementsAre(Value(), Value(), Value(ValueArray{})));
}

}  // namespace
}  // namespace typhora
