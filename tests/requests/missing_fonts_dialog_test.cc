// The missing-fonts dialog on the fake platform: its items, the foreground rule, the alert it
// presents, and the one answer that reaches the completion.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/value/json_codec.h"
#include "requests/missing_fonts_dialog_handler.h"
#include "support/fake_platform.h"
#include "support/log_capture.h"

namespace typhora {
namespace {

using ::testing::ElementsAre;
using testing::FakeIpcEndpoint;
using testing::FakePlatform;
using testing::LogCapture;

Value json(const char* text) {
  return *JsonCodec::decode(text);
}

class MissingFontsDialogTest : public ::testing::Test {
 protected:
  void SetUp() override {
    fake_.fileSystem.writeFile("/var/mobile/Library/UserFonts/UserFonts.plist", R"({
      "/var/mobile/Library/UserFonts/FontFiles/com.a/A.otf": {"familyName": {"A-R": "A"}},
      "/var/mobile/Library/UserFonts/FontFiles/com.b/A2.otf": {"familyName": {"A-B": "A"}},
      "/var/mobile/Library/UserFonts/FontFiles/nobody/B.otf": {"familyName": {"B-R": "B"}}})");
    fake_.fontManager.setProviderDirectory("com.a", "com.a");
    fake_.fontManager.setProviderDirectory("com.b", "com.b");
  }
  // Shows a dialog for `pid` and answers how often, and with what, the completion ran.
  void show(std::int32_t pid) {
    daemon_->showDialog(ValueArray{json(R"({"displayName": "X", "providers": []})")}, pid,
                        [this](const ValueArray& answer) { answers_.push_back(answer); });
  }
  // The view service connecting back on the endpoint of the alert presented last.
  std::shared_ptr<testing::FakeIpcConnection> viewService() {
    auto activations = fake_.remoteAlert.activations();
    if (activations.empty()) return nullptr;
    auto endpoint =
        std::dynamic_pointer_cast<const FakeIpcEndpoint>(activations.back().configuration.endpoint);
    return endpoint ? endpoint->listener()->connect() : nullptr;
  }

  FakePlatform fake_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
  std::vector<ValueArray> answers_;
};

TEST_F(MissingFontsDialogTest, ItemsNameUnknownFontsAndDisabledFamiliesWithTheirProviders) {
  EXPECT_THAT(daemon_->missingFontsDialogRequestsFromUnknownFontNames({"Foo", "Bar", "Foo"}),
              ElementsAre(json(R"({"displayName": "Foo", "providers": []})"),
                          json(R"({"displayName": "Bar", "providers": []})"),
                          json(R"({"displayName": "Foo", "providers": []})")));
  EXPECT_THAT(
      daemon_->missingFontsDialogRequestsFromDisabledFamilyNames({"A", "B", "A", "Z"}),
      ElementsAre(json(R"({"displayName": "A", "providers": ["com.a", "com.b"], "uniqueID": "A"})"),
                  json(R"({"displayName": "B", "providers": [], "uniqueID": "B"})"),
                  json(R"({"displayName": "Z", "providers": [], "uniqueID": "Z"})")));
}

TEST_F(MissingFontsDialogTest, ABackgroundProcessGetsNoDialogAndAnEmptyAnswerAtOnce) {
  LogCapture log;
  fake_.appStates.setState(77, 4);
  show(77);
  EXPECT_THAT(answers_, ElementsAre(ValueArray{}));
  EXPECT_TRUE(fake_.remoteAlert.activations().empty());
  EXPECT_EQ(log.count("An application (pid:77) tried to show missing fonts dialog in the "
                      "background.  It's ignored."),
            1u);
}

TEST_F(MissingFontsDialogTest, TheViewServicesFirstAnswerReachesTheCompletionUnchanged) {
  fake_.appStates.setState(42, kApplicationStateForegroundRunning);
  show(42);
  auto activations = fake_.remoteAlert.activations();
  ASSERT_EQ(activations.size(), 1u);
  EXPECT_EQ(activations[0].definition.serviceName, "com.zorvane.FontInstallViewService");
  EXPECT_EQ(activations[0].definition.viewControllerClassName, "FontInstallMissingController");
  EXPECT_EQ(activations[0].userInfo, json(R"({"fonts": [{"displayName": "X", "providers": []}]})"));
  EXPECT_TRUE(answers_.empty());

  auto service = viewService();
  ASSERT_NE(service, nullptr);
  const Value answer = json(R"([{"uniqueID": "A", "installProvider": "com.a", "extra": 1}])");
  EXPECT_TRUE(service->deliver(op::kDoneWithMissingFonts, {answer}).accepted);
  service->deliver(op::kDoneWithMissingFonts, {json("[]")});  // a second answer is ignored
  service->invalidate();
  EXPECT_THAT(answers_, ElementsAre(*answer.asArray()));
  EXPECT_EQ(daemon_->missingFontsDialogHandler()->listener(), nullptr);
}

TEST_F(MissingFontsDialogTest, AViewServiceThatGoesAwayAnswersNothingChosen) {
  fake_.appStates.setState(42, kApplicationStateForegroundRunning);
  show(42);
  auto service = viewService();
  ASSERT_NE(service, nullptr);
  service->invalidate();
  EXPECT_THAT(answers_, ElementsAre(ValueArray{}));
}

}  // namespace
}  // namespace typhora
