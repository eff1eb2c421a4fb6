// Remote alerts start the configured view-service program: here the real typhoractl playing the
// view service, which answers on the alert's endpoint.
#include <dirent.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <mutex>
#include <optional>

#include "platform/json_codec.h"
#include "platform/linux/linux_remote_alert.h"
#include "platform/linux/lumo_service.h"
#include "platform/semaphore.h"
#include "support/log_capture.h"
#include "support/temp_directory.h"

namespace typhora {
namespace {

using namespace std::chrono_literals;
using testing::TempDirectory;

// The side of the missing-fonts dialog that receives the view service's answer.
class AnswerReceiver final : public IpcListenerDelegate, public IpcExportedObject {
 public:
  bool shouldAcceptNewConnection(IpcListener&, std::shared_ptr<IpcConnection> connection) override {
    static const auto interface = std::make_shared<const IpcInterface>(
        "FontInstallViewServiceProtocol",
        std::vector<IpcOperation>{
            {"doneWithMissingFonts:", {{IpcType::Kind::Array, true}}, false, {}}});
    connection->setExportedInterface(interface);
    connection->setExportedObject(std::shared_ptr<IpcExportedObject>(self_.lock(), this));
    connection->resume();
    std::lock_guard lock(mutex_);
    connections_.push_back(std::move(connection));
    return true;
  }
  bool invoke(const IpcOperation&, const std::vector<Value>& arguments, IpcReply) override {
    {
      std::lock_guard lock(mutex_);
      answer_ = arguments.at(0);
    }
    answered_.signal();
    return true;
  }
  std::optional<Value> waitForAnswer() {
    if (!answered_.waitFor(20s)) return std::nullopt;
    std::lock_guard lock(mutex_);
    return answer_;
  }
  std::weak_ptr<AnswerReceiver> self_;

 private:
  std::mutex mutex_;
  Value answer_;
  std::vector<std::shared_ptr<IpcConnection>> connections_;
  Semaphore answered_;
};

// Children of this process that have ended but were not reaped.
int zombieChildren() {
  int zombies = 0;
  DIR* proc = opendir("/proc");
  for (dirent* entry; proc != nullptr && (entry = readdir(proc)) != nullptr;) {
    std::ifstream stat(std::string("/proc/") + entry->d_name + "/stat");
    std::string line;
    if (!std::getline(stat, line)) continue;
    auto close = line.rfind(')');
    if (close == std::string::npos) continue;
    char state = 0;
    int parent = 0;
    std::sscanf(line.c_str() + close + 1, " %c %d", &state, &parent);
    zombies += state == 'Z' && parent == getpid();
  }
  if (proc != nullptr) closedir(proc);
  return zombies;
}

class LinuxRemoteAlertTest : public ::testing::Test {
 protected:
  void SetUp() override {
    receiver_->self_ = receiver_;
    listener_->setDelegate(receiver_);
    listener_->resume();
  }
  void configure(const std::string& answer) {
    root_.write("etc/typhora/view-services/com.zorvane.FontInstallViewService.plist",
                JsonCodec::encode(Value::dictionary(
                    {{"Program", TYPHORACTL_PATH},
                     {"Arguments", Value::array({"view-service", "--answer", Value(answer)})}})));
  }
  void activate(const Value& userInfo) {
    auto handle =
        alert_.makeHandle({"com.zorvane.FontInstallViewService", "FontInstallMissingController"},
                          {listener_->endpoint()});
    handle->activate(userInfo);
  }

  TempDirectory root_;
  LumoService service_{root_.path()};
  LinuxRemoteAlert alert_{root_.path()};
  std::shared_ptr<AnswerReceiver> receiver_ = std::make_shared<AnswerReceiver>();
  std::shared_ptr<IpcListener> listener_ = service_.makeAnonymousListener();
};

TEST_F(LinuxRemoteAlertTest, TheViewServiceGetsTheUserInfoAndAnswersOnTheEndpoint) {
  configure(R"([{"uniqueID": "Family 1", "installProvider": "com.example.shop"}])");
  ValueArray fonts;
  for (int i = 0; i < 3000; ++i) {
    fonts.push_back(Value::dictionary({{"displayName", "Family " + std::to_string(i)},
                                       {"providers", Value::array({"com.example.shop"})}}));
  }
  activate(Value::dictionary({{"fonts", Value(std::move(fonts))}}));  // a few hundred KB
  auto answer = receiver_->waitForAnswer();
  ASSERT_TRUE(answer.has_value());
  EXPECT_EQ(*answer, *JsonCodec::decode(
                         R"([{"uniqueID": "Family 1", "installProvider": "com.example.shop"}])"));
  for (int i = 0; i < 200 && zombieChildren() > 0; ++i) std::this_thread::sleep_for(10ms);
  EXPECT_EQ(zombieChildren(), 0);
}

TEST_F(LinuxRemoteAlertTest, AnUnconfiguredServiceIsLoggedAndNothingStarts) {
  testing::LogCapture log;
  activate(Value::dictionary({}));
  EXPECT_TRUE(log.contains("is not configured"));
  root_.write("etc/typhora/view-services/com.zorvane.FontInstallViewService.plist",
              R"({"Program": "/nonexistent/program"})");
  activate(Value::dictionary({}));
  EXPECT_TRUE(log.contains("/nonexistent/program"));
}

}  // namespace
}  // namespace typhora
