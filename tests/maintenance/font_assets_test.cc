// Font asset synchronisation on the fake platform: who may ask, which mirrored entries answer,
// when the registry is asked to synchronise first, and the asset store's monitoring.
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
using testing::FakePlatform;
using ::testing::HasSubstr;
using testing::LogCapture;

const std::string kStore = "/private/var/Cargell/AssetsV2/com_zorvane_Cargell_Font6/";
const std::string kMirror = "/var/mobile/Library/UserFonts/FontAssets/";

std::vector<std::string> keys(const Value& dictionary) {
  std::vector<std::string> names;
  for (const auto& [key, value] : dictionary.asDictionary()->entries()) names.push_back(key);
  return names;
}

class FontAssetsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    daemon_->setupForLumoService();
    client_ = fake_.ipc.listener(kServiceName)->connect(kCaller);
    entitle(R"(["app-usage"])");
    fake_.fontManager.setUserFontsInfo(Value::dictionary({
        {kMirror + "Serif/Serif-Regular.ttf", Value::dictionary({{"n", 1}})},
        {kMirror + "Serif/Serif-Bold.ttf", Value::dictionary({{"n", 2}})},
        {kMirror + "Serif/Serif-Italic.ttf", Value::dictionary({{"n", 3}})},
        {kMirror + "Mono/Mono.ttf", Value::dictionary({{"n", 4}})},
        {"/var/mobile/Library/UserFonts/FontFiles/com.a/Serif/A.otf", Value::dictionary({})},
    }));
  }
  void TearDown() override { client_->invalidate(); }
  void entitle(const char* capabilities) {
    fake_.codeSigning.setRecord(kCaller, "com.app",
                                Value::dictionary({{"com.zorvane.developer.user-fonts",
                                                    *JsonCodec::decode(capabilities)}}));
  }
  std::vector<Value> ask(std::vector<std::string> paths) {
    ValueArray list(paths.begin(), paths.end());
    auto delivered = client_->deliver(op::kSynchronizeFontAssets, {Value(std::move(list))});
    EXPECT_TRUE(delivered.reply.has_value()) << delivered.error;
    return delivered.reply.value_or(std::vector<Value>{});
  }

  static constexpr AuditToken kCaller{.pid = 9, .startTime = 1, .exeInode = 2};
  FakePlatform fake_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
  std::shared_ptr<testing::FakeIpcConnection> client_;
};

TEST_F(FontAssetsTest, OnlyEnumeratingOrFontAccessCallersAreAnswered) {
  entitle(R"(["system-installation"])");
  EXPECT_THAT(ask({}), ElementsAre(Value(false), Value()));
  entitle(R"("app-usage")");
  EXPECT_THAT(ask({}), ElementsAre(Value(false), Value()));

  entitle(R"(["font-enumeration"])");
  auto empty = ask({});
  ASSERT_EQ(empty.size(), 2u);
  EXPECT_EQ(empty[0], Value(true));
  EXPECT_EQ(empty[1].get("fontsInfo"), Value(Dictionary()));
  EXPECT_FALSE(empty[1].get("extension.fontasset").isNull());
  EXPECT_EQ(fake_.fontManager.assetSynchronizations(), 0);
}

TEST_F(FontAssetsTest, NamedAssetsAreAnsweredFromTheMirrorAndSynchronisedWhenShort) {
  LogCapture log;
  auto serif = ask({kStore + "Serif/AssetData/Serif-Regular.ttf",
                    kStore + "Serif/AssetData/Serif-Bold.ttf", kStore + "Mono/Mono.ttf"});
  EXPECT_THAT(keys(serif[1].get("fontsInfo")),
              ElementsAre(kMirror + "Serif/Serif-Bold.ttf", kMirror + "Serif/Serif-Italic.ttf",
                          kMirror + "Serif/Serif-Regular.ttf"));
  EXPECT_EQ(serif[1].get("fontsInfo").get(kMirror + "Serif/Serif-Bold.ttf"),
            Value::dictionary({{"n", 2}}));
  EXPECT_EQ(fake_.fontManager.assetSynchronizations(), 0);
  EXPECT_EQ(log.count("synchronizeFontAssets got a non-asset font file path: " + kStore +
                      "Mono/Mono.ttf"),
            1u);

  // Two assets named, one of them not mirrored yet: the registry synchronises, and the answer
  // carries what the synchronisation mirrored.
  fake_.fontManager.setAssetSyncResult(
      false, Value::dictionary({{kMirror + "Sans/Sans.ttf", Value::dictionary({{"n", 5}})},
                                {kMirror + "Mono/Mono.ttf", Value::dictionary({{"n", 4}})}}));
  auto both = ask({kStore + "Sans/AssetData/Sans.ttf", kStore + "Mono/AssetData/Mono.ttf",
                   kStore + "Other/AssetData/Other.ttf"});
  EXPECT_EQ(fake_.fontManager.assetSynchronizations(), 1);
  EXPECT_THAT(keys(both[1].get("fontsInfo")),
              ElementsAre(kMirror + "Mono/Mono.ttf", kMirror + "Sans/Sans.ttf"));
}

TEST_F(FontAssetsTest, TheAssetStoreIsWatchedAfterTheFirstSynchronisation) {
  daemon_->setupForMonitoringFontAssets();
  TyphoraDaemon::fontAssetsMonitorQueue()->sync([] {});
  EXPECT_EQ(fake_.fontManager.assetSynchronizations(), 1);
  auto streams = fake_.fileEvents.streams();
  ASSERT_EQ(streams.size(), 1u);
  EXPECT_THAT(streams[0].paths, ElementsAre(kStore));
  EXPECT_EQ(streams[0].latency, 3.0);
  EXPECT_TRUE(streams[0].started);

  LogCapture log;
  fake_.fontManager.setAssetSyncResult(false);
  fake_.fileEvents.deliver({kStore + "Serif/AssetData/Serif-Regular.ttf"});
  TyphoraDaemon::fontAssetsMonitorQueue()->sync([] {});
  EXPECT_EQ(fake_.fontManager.assetSynchronizations(), 2);
  EXPECT_TRUE(log.contains("FontAssetsEventStreamCallback - "));
  EXPECT_EQ(log.count("synchronizeFontAssets result - fail"), 1u);
}

}  // namespace
}  // namespace typhora
