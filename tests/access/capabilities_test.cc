// Capabilities from entitlements, the block list's say on enumeration, the sandbox test and the
// font-picker test, on the fake platform.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "daemon/typhora_daemon.h"
#include "platform/value/json_codec.h"
#include "support/fake_ipc_connection.h"
#include "support/fake_platform.h"
#include "support/log_capture.h"

namespace typhora {
namespace {

using testing::FakePlatform;
using testing::LogCapture;

Value json(const char* text) {
  return *JsonCodec::decode(text);
}

struct Capabilities {
  bool enumerate = true, userFonts = true, installation = true;
  std::optional<std::string> identifier = "unset";
  bool operator==(const Capabilities&) const = default;
};

class CapabilitiesTest : public ::testing::Test {
 protected:
  Capabilities of(std::optional<std::string> identifier, const char* entitlement) {
    fake_.codeSigning.setRecord(
        token_, std::move(identifier),
        entitlement == nullptr
            ? Value::dictionary({})
            : Value::dictionary({{"com.zorvane.developer.user-fonts", json(entitlement)}}));
    return current();
  }
  Capabilities current() {
    Capabilities c;
    daemon_->capabilitiesFor(token_, &c.enumerate, &c.userFonts, &c.installation, &c.identifier);
    return c;
  }

  FakePlatform fake_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
  AuditToken token_{.pid = 42, .uid = 501, .gid = 501, .startTime = 7, .exeInode = 9};
};

TEST_F(CapabilitiesTest, TheEntitlementArrayNamesEachCapability) {
  const char* all = R"(["font-enumeration", "app-usage", "system-installation"])";
  EXPECT_EQ(of("com.a", all), (Capabilities{true, true, true, "com.a"}));
  EXPECT_EQ(of("com.a", R"(["app-usage", 7, "Font-Enumeration"])"),
            (Capabilities{false, true, false, "com.a"}));
  // Enumeration needs a signing identifier; the other two do not.
  EXPECT_EQ(of(std::nullopt, all), (Capabilities{false, true, true, std::nullopt}));
  // Anything but an array grants nothing, and the identifier is still reported.
  EXPECT_EQ(of("com.a", R"("font-enumeration")"), (Capabilities{false, false, false, "com.a"}));
  EXPECT_EQ(of("com.a", nullptr), (Capabilities{false, false, false, "com.a"}));
  // No signing record at all: nothing, and no identifier.
  fake_.codeSigning.removeRecord(token_);
  EXPECT_EQ(current(), (Capabilities{false, false, false, std::nullopt}));
}

TEST_F(CapabilitiesTest, TheBlockListWithdrawsOnlyEnumerationOfTheListedVersion) {
  const char* all = R"(["font-enumeration", "app-usage", "system-installation"])";
  fake_.appRegistry.setVersion("com.a", "2.0");
  // Not loaded yet: nobody is refused, and the registry is not even asked.
  EXPECT_TRUE(of("com.a", all).enumerate);
  EXPECT_EQ(fake_.appRegistry.queries(), 0);

  daemon_->setBlacklistInfo(json(R"([{"com.a": ["1.0"]}, "junk", {"com.a": "2.0"}])"));
  EXPECT_TRUE(of("com.a", all).enumerate);  // other versions only; malformed elements skipped

  LogCapture log;
  daemon_->setBlacklistInfo(json(R"([{"com.b": ["2.0"]}, {"com.a": ["1.0", "2.0"]}])"));
  EXPECT_EQ(of("com.a", all), (Capabilities{false, true, true, "com.a"}));
  EXPECT_EQ(log.count("BLACKLISTED - com.a"), 1u);

  // An application the registry reports no version for is never refused.
  fake_.appRegistry.setVersion("com.a", std::nullopt);
  EXPECT_TRUE(daemon_->isIdentifierAllowed("com.a"));
}

TEST_F(CapabilitiesTest, SandboxAndFontPickerTestsFailClosed) {
  fake_.sandbox.setSandboxed(token_.pid, 1);
  EXPECT_TRUE(daemon_->isAuditTokenSandboxed(token_));
  fake_.sandbox.setSandboxed(token_.pid, 0);
  EXPECT_FALSE(daemon_->isAuditTokenSandboxed(token_));
  EXPECT_TRUE(daemon_->isAuditTokenSandboxed(AuditToken{}));  // a failed check

  EXPECT_FALSE(daemon_->isCurrentConnectionFontPicker());  // no current connection
  auto connection = std::make_shared<testing::FakeIpcConnection>(token_);
  IpcConnection::CurrentScope scope(connection);
  fake_.codeSigning.setRecord(token_, "com.zorvane.Panelor.FontPicker");
  EXPECT_TRUE(daemon_->isCurrentConnectionFontPicker());
  fake_.codeSigning.setRecord(token_, "com.zorvane.Panelor.FontPicker.Extra");
  EXPECT_FALSE(daemon_->isCurrentConnectionFontPicker());
  fake_.codeSigning.setRecord(token_, std::nullopt);
  EXPECT_FALSE(daemon_->isCurrentConnectionFontPicker());
}

}  // namespace
}  // namespace typhora
