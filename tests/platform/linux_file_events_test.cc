// inotify-backed file event streams over a temporary device root: batches after the latency,
// directories made after the start, roots that appear later, and bursts.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <mutex>
#include <set>

#include "platform/linux/linux_file_event_stream.h"
#include "platform/semaphore.h"
#include "support/temp_directory.h"

namespace typhora {
namespace {

using namespace std::chrono_literals;
using ::testing::Contains;
using ::testing::IsSupersetOf;
using testing::TempDirectory;

constexpr double kLatency = 0.05;

// Collects the batches a stream delivers.
class Batches {
 public:
  FileEventStream::Callback callback() {
    return [this](const std::vector<std::string>& paths) {
      {
        std::lock_guard lock(mutex_);
        batches_.push_back(paths);
      }
      arrived_.signal();
    };
  }
  bool waitForBatch() { return arrived_.waitFor(10s); }
  std::vector<std::vector<std::string>> all() {
    std::lock_guard lock(mutex_);
    return batches_;
  }

 private:
  std::mutex mutex_;
  std::vector<std::vector<std::string>> batches_;
  Semaphore arrived_;
};

class LinuxFileEventsTest : public ::testing::Test {
 protected:
  std::unique_ptr<FileEventStream> start(const std::string& path) {
    auto stream = factory_.createStream({path}, kLatency, batches_.callback());
    stream->setDispatchQueue(queue_);
    EXPECT_TRUE(stream->start());
    return stream;
  }

  TempDirectory root_;
  LinuxFileEventStreamFactory factory_{root_.path()};
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("test.file-events");
  Batches batches_;
};

TEST_F(LinuxFileEventsTest, ChangesInNewDirectoriesArriveAsDaemonPathsInOneBatch) {
  root_.write("store/before.ttf", "old");
  auto stream = start("/store/");
  std::filesystem::create_directories(root_.path() + "/store/asset/AssetData");
  root_.write("store/asset/AssetData/font.ttf", "new");
  ASSERT_TRUE(batches_.waitForBatch());
  auto batch = batches_.all().front();
  EXPECT_THAT(batch, Contains("/store/asset/AssetData/font.ttf"));
  EXPECT_THAT(batch, Contains("/store/asset"));
  for (const std::string& path : batch) EXPECT_NE(path, "/store/before.ttf");  // no history

  root_.write("store/asset/AssetData/font.ttf", "changed");
  ASSERT_TRUE(batches_.waitForBatch());
  EXPECT_THAT(batches_.all().back(), Contains("/store/asset/AssetData/font.ttf"));
}

TEST_F(LinuxFileEventsTest, ARootThatAppearsLaterIsWatchedFromThen) {
  auto stream = start("/private/var/store");
  std::filesystem::create_directories(root_.path() + "/private/var/store/asset");
  root_.write("private/var/store/asset/font.ttf", "x");
  ASSERT_TRUE(batches_.waitForBatch());
  std::vector<std::string> seen;
  for (int i = 0; i < 5; ++i) {
    for (const auto& batch : batches_.all()) seen.insert(seen.end(), batch.begin(), batch.end());
    if (std::find(seen.begin(), seen.end(), "/private/var/store/asset/font.ttf") != seen.end())
      break;
    batches_.waitForBatch();
  }
  EXPECT_THAT(seen, IsSupersetOf({"/private/var/store", "/private/var/store/asset/font.ttf"}));
  for (const std::string& path : seen) EXPECT_TRUE(path.starts_with("/private/var/store")) << path;
}

TEST_F(LinuxFileEventsTest, ABurstComesInFewBatches) {
  std::filesystem::create_directories(root_.path() + "/burst");
  auto stream = start("/burst");
  for (int i = 0; i < 1000; ++i) root_.write("burst/f" + std::to_string(i), "x");
  // A file may show up in two batches (made in one, its write closed in the next).
  std::set<std::string> seen;
  while (seen.size() < 1000 && batches_.waitForBatch()) {
    for (const auto& batch : batches_.all()) seen.insert(batch.begin(), batch.end());
  }
  EXPECT_EQ(seen.size(), 1000u);
  // The writing took far longer than the latency on a slow machine at worst; still, the files
  // come in batches, not one call each.
  EXPECT_LT(batches_.all().size(), 100u);
}

TEST_F(LinuxFileEventsTest, AStreamNeedsAQueueAndEndsCleanly) {
  auto stream = factory_.createStream({"/x"}, kLatency, batches_.callback());
  EXPECT_FALSE(stream->start());
  std::filesystem::create_directories(root_.path() + "/x");
  stream->setDispatchQueue(queue_);
  EXPECT_TRUE(stream->start());
  root_.write("x/a", "1");
  stream.reset();  // a batch may be pending: it must not be delivered to a stream that is gone
  std::this_thread::sleep_for(100ms);
  EXPECT_TRUE(batches_.all().empty());
}

}  // namespace
}  // namespace typhora
