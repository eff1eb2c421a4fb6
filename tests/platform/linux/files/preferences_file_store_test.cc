// The preferences file: round trips, corrupt files, and crashes in the middle of writing.
#include "platform/linux/files/preferences_file_store.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <random>

#include "support/log_capture.h"

namespace typhora {
namespace {

namespace fs = std::filesystem;

class PreferencesFileStoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/typhora-prefs-XXXXXX";
    root_ = mkdtemp(pattern);
    path_ = PreferencesFileStore::pathFor(root_, "com.zorvane.typhorad");
  }
  void TearDown() override { fs::remove_all(root_); }

  std::string root_;
  std::string path_;
};

TEST_F(PreferencesFileStoreTest, ValuesSurviveANewInstanceOnlyOnceSynchronized) {
  {
    PreferencesFileStore store(path_);
    store.setValue("version", Value(1));
    store.setValue("delete", Value::dictionary({{"/var/mobile/x", Value(Date{5})}}));
    store.setValue("gone", Value("soon"));
    store.setValue("gone", Value());
    ASSERT_TRUE(store.synchronize());
    store.setValue("unsynchronized", Value(true));
  }
  PreferencesFileStore reread(path_);
  EXPECT_EQ(reread.value("version"), Value(1));
  EXPECT_EQ(reread.value("delete").get("/var/mobile/x"), Value(Date{5}));
  EXPECT_TRUE(reread.value("gone").isNull());
  EXPECT_TRUE(reread.value("unsynchronized").isNull());
}

TEST_F(PreferencesFileStoreTest, ACorruptFileReadsAsAnEmptyDomainAndIsReported) {
  fs::create_directories(fs::path(path_).parent_path());
  std::ofstream(path_) << "{\"version\": ";
  testing::LogCapture log;
  PreferencesFileStore store(path_);
  EXPECT_TRUE(store.value("version").isNull());
  EXPECT_TRUE(log.contains("unreadable"));
  // A hand-written JSON domain loads too.
  std::ofstream(path_, std::ios::trunc) << "{\"version\": 5}";
  EXPECT_EQ(PreferencesFileStore(path_).value("version"), Value(5));
}

TEST_F(PreferencesFileStoreTest, AProcessKilledWhileSynchronizingNeverLeavesATornFile) {
  std::mt19937 random(12345);
  std::int64_t lastSeen = -1;
  for (int round = 0; round < 40; ++round) {
    pid_t child = fork();
    if (child == 0) {
      PreferencesFileStore store(path_);
      // Large values make each write take long enough to be cut in the middle.
      std::string padding(64 * 1024, 'x');
      for (std::int64_t i = 0;; ++i) {
        store.setValue("counter", Value(i));
        store.setValue("padding", Value(padding + std::to_string(i)));
        store.synchronize();
      }
    }
    // Slow builds (sanitizers) take a while to write the first file: wait for it, then kill
    // at a random moment of the storm.
    for (int i = 0; i < 5000 && !fs::exists(path_); ++i) usleep(1000);
    usleep(static_cast<useconds_t>(random() % 20000));
    kill(child, SIGKILL);
    waitpid(child, nullptr, 0);
    if (!fs::exists(path_)) continue;  // killed before its first rename
    testing::LogCapture log;
    PreferencesFileStore store(path_);
    Value counter = store.value("counter");
    ASSERT_TRUE(counter.asInt()) << "round " << round << ": the file did not read whole";
    EXPECT_FALSE(log.contains("unreadable"));
    // The file is one whole write: its padding belongs to the same iteration as its counter.
    EXPECT_EQ(*store.value("padding").asString(),
              std::string(64 * 1024, 'x') + std::to_string(*counter.asInt()));
    lastSeen = *counter.asInt();
  }
  EXPECT_GE(lastSeen, 0);
}

}  // namespace
}  // namespace typhora
