// The daemon's spine on the fake platform: start-up, migration, admission, dispatch, the
// user-fonts store and the update queue.
#include "daemon/typhora_daemon.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "ipc/interface_descriptions.h"
#include "ipc/typhora_handler.h"
#include "support/fake_platform.h"
#include "support/log_capture.h"

namespace typhora {
namespace {

using testing::FakePlatform;
using testing::LogCapture;

constexpr const char* kUserFontsPath = "/var/mobile/Library/UserFonts/UserFonts.plist";
constexpr const char* kFontsJson =
    R"({"/var/mobile/Library/UserFonts/FontFiles/com.a/A.otf": {"familyName": {"A-Bold": "A"}}})";

class DaemonTest : public ::testing::Test {
 protected:
  std::shared_ptr<TyphoraDaemon> makeDaemon() {
    return std::make_shared<TyphoraDaemon>(fake.platform);
  }

  FakePlatform fake;
};

// ---- Preferences migration ----

struct MigrationCase {
  const char* name;
  Value stored;
  bool resets;
};

class MigrationTest : public DaemonTest, public ::testing::WithParamInterface<MigrationCase> {};

TEST_P(MigrationTest, ResetsAndWritesVersionOneOnlyBelowOne) {
  const MigrationCase& c = GetParam();
  if (!c.stored.isNull()) fake.preferences.setValue("version", c.stored);
  const int writesBefore = fake.preferences.writes();
  makeDaemon()->setup();
  if (c.resets) {
    EXPECT_EQ(fake.fontManager.resets(), 1);
    EXPECT_EQ(fake.preferences.value("version"), Value(1));
    EXPECT_EQ(fake.preferences.synchronizations(), 1);
  } else {
    EXPECT_EQ(fake.fontManager.resets(), 0);
    EXPECT_EQ(fake.preferences.value("version"), c.stored);
    EXPECT_EQ(fake.preferences.writes(), writesBefore);
    EXPECT_EQ(fake.preferences.synchronizations(), 0);
  }
}

INSTANTIATE_TEST_SUITE_P(
    Versions, MigrationTest,
    ::testing::Values(MigrationCase{"absent", Value(), true},
                      MigrationCase{"minus1", Value(-1), true},
                      MigrationCase{"zero", Value(0), true}, MigrationCase{"one", Value(1), false},
                      MigrationCase{"five", Value(5), false},
                      MigrationCase{"text", Value("7"), true},
                      MigrationCase{"twoTo63", Value(std::uint64_t{1} << 63), false},
                      MigrationCase{"hugeDouble", Value(1e300), false},
                      MigrationCase{"minusHugeDouble", Value(-1e300), true}),
    [](const auto& testCase) { return std::string(testCase.param.name); });

// ---- The one daemon ----

TEST(SharedDaemon, ConcurrentFirstCallsGetTheSameDaemon) {
  static FakePlatform fake;  // outlives the process-wide daemon
  TyphoraDaemon::installPlatform(fake.platform);
  std::vector<TyphoraDaemon*> seen(8);
  std::vector<std::thread> threads;
  for (auto& slot : seen) threads.emplace_back([&slot] { slot = &TyphoraDaemon::sharedDaemon(); });
  for (auto& t : threads) t.join();
  for (TyphoraDaemon* d : seen) EXPECT_EQ(d, seen[0]);
  EXPECT_EQ(seen[0]->mainHandlerQueue().label(), "com.zorvane.typhorad");
}

// ---- Start-up and admission ----

TEST_F(DaemonTest, ConnectionsAreServedWhileStartUpStillRuns) {
  fake.fileSystem.writeFile(kUserFontsPath, kFontsJson);
  fake.fontManager.holdReset();
  auto daemon = makeDaemon();
  std::thread startUp([&] { daemon->startUp(); });

  // Start-up is held inside the migration; the listener opened long before.
  fake.fontManager.waitUntilResetEntered();
  auto listener = fake.ipc.waitForListener(kServiceName);
  auto client = listener->connect();
  ASSERT_NE(client, nullptr);
  EXPECT_TRUE(client->resumed());
  EXPECT_EQ(client->exportedInterface(), typhoraDaemonProtocol());
  EXPECT_EQ(client->remoteInterface(), typhoraClientProtocol());
  auto answer = client->deliver(op::kUpdatingUserFonts, {});
  EXPECT_TRUE(answer.accepted) << answer.error;
  ASSERT_TRUE(answer.reply.has_value());
  EXPECT_TRUE(answer.reply->empty());

  fake.fontManager.releaseReset();
  startUp.join();
  // The preload at start-up read the file once.
  EXPECT_EQ(fake.fileSystem.reads(kUserFontsPath), 1);
  EXPECT_TRUE(daemon->isUserFontInstalled());
  client->invalidate();
  TyphoraDaemon::fontAssetsMonitorQueue()->sync([] {});  // asset monitoring has started
}

TEST_F(DaemonTest, EachConnectionGetsItsOwnHandlerWhichGoesWithIt) {
  LogCapture log;
  auto daemon = makeDaemon();
  daemon->setupForLumoService();
  auto listener = fake.ipc.listener(kServiceName);
  auto first = listener->connect();
  auto second = listener->connect();
  auto firstHandler = std::dynamic_pointer_cast<TyphoraHandler>(first->exportedObject());
  auto secondHandler = std::dynamic_pointer_cast<TyphoraHandler>(second->exportedObject());
  ASSERT_NE(firstHandler, nullptr);
  ASSERT_NE(secondHandler, nullptr);
  EXPECT_NE(firstHandler, secondHandler);
  EXPECT_EQ(firstHandler->clientConnection(), first);
  EXPECT_EQ(firstHandler->server(), daemon);
  EXPECT_FALSE(firstHandler->hasEnumerationEntitlement());
  EXPECT_FALSE(firstHandler->processIdentifier().has_value());

  // The client goes away: the connection lets go, the cycle is broken, the handler is freed once.
  std::weak_ptr<TyphoraHandler> weak = firstHandler;
  firstHandler.reset();
  first->invalidate();
  EXPECT_TRUE(weak.expired());
  EXPECT_EQ(log.count("TyphoraHandler deallocated."), 1u);
  first->invalidate();
  EXPECT_EQ(log.count("TyphoraHandler deallocated."), 1u);
  second->invalidate();
  EXPECT_EQ(log.count("TyphoraHandler deallocated."), 1u);  // secondHandler is still held here
}

TEST_F(DaemonTest, OperationsReachTheDaemonOnlyWhenItCarriesThemOut) {
  auto daemon = makeDaemon();
  daemon->setupForLumoService();
  auto client = fake.ipc.listener(kServiceName)->connect();

  // A daemon operation, sent without any check-in.
  EXPECT_TRUE(client->deliver(op::kUpdatingUserFonts, {}).reply.has_value());
  // A font request from a caller without a signature is answered at once, with nothing.
  auto request = client->deliver(op::kRequestFonts, {Value(ValueArray{})});
  EXPECT_TRUE(request.accepted);
  EXPECT_EQ(request.reply, std::vector<Value>{Value(Dictionary())});
  // An endpoint that is absent is no endpoint: refused before the daemon sees it.
  EXPECT_FALSE(client->deliver(op::kRequestFontsForClient, {Value("com.a"), Value()}).accepted);
  // sendFonts:reply: is accepted and never answered.
  auto sent = client->deliver(op::kSendFonts, {Value(Dictionary())});
  EXPECT_TRUE(sent.accepted);
  EXPECT_FALSE(sent.reply.has_value());
  // Wrong argument types never reach a handler.
  EXPECT_FALSE(client->deliver(op::kScheduleFontFilesDeletion, {Value("x")}).accepted);
  client->invalidate();
}

TEST(TyphoraHandlerIdentifiers, OnlyTheRegistryProcessIsIgnored) {
  const std::string exact = "com.zorvane.Typhora.UserFontManager";
  const std::string otherCase = "com.zorvane.typhora.userfontmanager";
  const std::string longer = exact + ".helper";
  EXPECT_TRUE(TyphoraHandler::isProcessIdentifierToIgnore(&exact));
  EXPECT_FALSE(TyphoraHandler::isProcessIdentifierToIgnore(&otherCase));
  EXPECT_FALSE(TyphoraHandler::isProcessIdentifierToIgnore(&longer));
  EXPECT_FALSE(TyphoraHandler::isProcessIdentifierToIgnore(nullptr));
}

// ---- The user-fonts store ----

TEST_F(DaemonTest, MissingOrEmptyInformationReadsAsNoUserFontsWithoutComplaint) {
  LogCapture log;
  auto daemon = makeDaemon();
  EXPECT_FALSE(daemon->isUserFontInstalled());
  EXPECT_TRUE(daemon->userFontsInfo().isNull());

  fake.fileSystem.writeFile(kUserFontsPath, "{}");
  daemon->invalidateUserFonts();
  EXPECT_FALSE(daemon->isUserFontInstalled());
  EXPECT_TRUE(daemon->userFontsInfo().isNull());
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(DaemonTest, UnreadableInformationIsLoggedOncePerLoadAndRetriedAfterInvalidation) {
  LogCapture log;
  const std::string message = std::string("error reading ") + kUserFontsPath;
  auto daemon = makeDaemon();
  for (const char* broken : {"{\"unterminated\": ", "[1, 2]", "\xff\x00"}) {
    fake.fileSystem.writeFile(kUserFontsPath, broken);
    daemon->invalidateUserFonts();
    const std::size_t before = log.count(message);
    EXPECT_FALSE(daemon->isUserFontInstalled()) << broken;
    EXPECT_TRUE(daemon->userFontsInfo().isNull());
    EXPECT_EQ(log.count(message), before + 1) << broken;  // loaded once, not once per reader
  }
  fake.fileSystem.writeFile(kUserFontsPath, kFontsJson);
  EXPECT_FALSE(daemon->isUserFontInstalled());  // a failed load is not retried by itself
  daemon->invalidateUserFonts();
  EXPECT_TRUE(daemon->isUserFontInstalled());
  EXPECT_EQ(log.lines().back().level, LogLevel::Error);
}

TEST_F(DaemonTest, TheCacheIsServedUntilInvalidatedAndReadOncePerInvalidation) {
  fake.fileSystem.writeFile(kUserFontsPath, kFontsJson);
  auto daemon = makeDaemon();
  Value first = daemon->userFontsInfo();
  ASSERT_EQ(first.asDictionary()->size(), 1u);

  // Changed on disk without an invalidation: the old contents are still served, shared.
  fake.fileSystem.writeFile(kUserFontsPath, "{\"/x\": {}, \"/y\": {}}");
  EXPECT_EQ(daemon->userFontsInfo().asDictionary(), first.asDictionary());
  EXPECT_EQ(fake.fileSystem.reads(kUserFontsPath), 1);

  // After one invalidation, many readers at once cause one read; the old object stays valid.
  daemon->invalidateUserFonts();
  std::vector<std::thread> readers;
  for (int i = 0; i < 8; ++i) readers.emplace_back([&] { (void)daemon->userFontsInfo(); });
  daemon->mainHandlerQueue().sync([&] { (void)daemon->isUserFontInstalled(); });
  for (auto& t : readers) t.join();
  EXPECT_EQ(fake.fileSystem.reads(kUserFontsPath), 2);
  EXPECT_EQ(daemon->userFontsInfo().asDictionary()->size(), 2u);
  EXPECT_EQ(first.asDictionary()->size(), 1u);
}

// ---- The update queue ----

TEST_F(DaemonTest, UpdatingUserFontsRunsOneReplyAtATime) {
  auto daemon = makeDaemon();
  std::atomic<int> inside{0};
  std::atomic<int> most{0};
  std::atomic<int> replies{0};
  std::vector<std::thread> callers;
  for (int i = 0; i < 6; ++i) {
    callers.emplace_back([&] {
      daemon->updatingUserFonts([&] {
        int now = ++inside;
        most = std::max(most.load(), now);
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
        --inside;
        ++replies;
      });
    });
  }
  for (auto& t : callers) t.join();
  EXPECT_EQ(replies.load(), 6);
  EXPECT_EQ(most.load(), 1);
}

TEST(DaemonDeathTest, UpdatingUserFontsFromTheUpdateQueueItselfAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        FakePlatform fake;
        auto daemon = std::make_shared<TyphoraDaemon>(fake.platform);
        daemon->updatingUserFonts([&] { daemon->updatingUserFonts({}); });
      },
      "com.zorvane.typhora.UpdatingUserFonts");
}

}  // namespace
}  // namespace typhora
