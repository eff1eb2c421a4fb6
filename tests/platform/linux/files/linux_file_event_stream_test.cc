// inotify file event streams over a temporary device root.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <set>
#include <thread>

#include "platform/dispatch/manual_clock.h"
#include "platform/dispatch/semaphore.h"
#include "platform/linux/files/linux_file_event_stream_factory.h"

namespace typhora {
namespace {

using namespace std::chrono_literals;
using ::testing::Contains;
using ::testing::Not;
namespace fs = std::filesystem;

constexpr double kLatency = 0.05;
constexpr auto kPatience = 20s;
constexpr const char* kFonts = "/var/mobile/Library/UserFonts";

// The batches a stream delivered, with a way to wait for a path to show up.
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
  bool waitFor(const std::string& path) {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (!seen(path)) {
      if (!arrived_.waitFor(deadline - std::chrono::steady_clock::now())) return seen(path);
    }
    return true;
  }
  bool seen(const std::string& path) const { return indexOf(path) >= 0; }
  // The batch that reported `path` first, or -1.
  int indexOf(const std::string& path) const {
    std::lock_guard lock(mutex_);
    for (std::size_t i = 0; i < batches_.size(); ++i) {
      if (std::find(batches_[i].begin(), batches_[i].end(), path) != batches_[i].end()) {
        return static_cast<int>(i);
      }
    }
    return -1;
  }
  std::vector<std::vector<std::string>> all() const {
    std::lock_guard lock(mutex_);
    return batches_;
  }
  std::vector<std::string> paths() const {
    std::vector<std::string> flat;
    for (const auto& batch : all()) flat.insert(flat.end(), batch.begin(), batch.end());
    return flat;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::vector<std::string>> batches_;
  Semaphore arrived_;
};

void touch(const fs::path& path) {
  std::ofstream(path) << "x";
}

class LinuxFileEventStreamTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/typhora-file-events-XXXXXX";
    root_ = mkdtemp(pattern);
    fs::create_directories(onDisk(kFonts));
  }
  void TearDown() override {
    stream_.reset();
    fs::remove_all(root_);
  }
  fs::path onDisk(const std::string& daemonPath) const { return root_ + daemonPath; }

  FileEventStream& makeStream(std::vector<std::string> paths, Clock& clock = Clock::system(),
                              double latency = kLatency) {
    factory_ = std::make_unique<LinuxFileEventStreamFactory>(root_ + "/", clock);
    stream_ = factory_->createStream(std::move(paths), latency, batches_.callback());
    stream_->setDispatchQueue(queue_);
    return *stream_;
  }

  std::string root_;
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("test.file-events");
  std::unique_ptr<LinuxFileEventStreamFactory> factory_;
  std::unique_ptr<FileEventStream> stream_;
  Batches batches_;
};

TEST_F(LinuxFileEventStreamTest, NewNestedDirectoriesAreWatchedAndReportedWithTheirFiles) {
  touch(onDisk(kFonts) / "old.ttf");  // made before start: no history
  ASSERT_TRUE(makeStream({kFonts}).start());
  const std::string fonts = kFonts;
  fs::create_directories(onDisk(fonts + "/a/b/c"));
  touch(onDisk(fonts + "/a/b/c/new.ttf"));

  ASSERT_TRUE(batches_.waitFor(fonts + "/a/b/c/new.ttf"));
  // Made together, they travel together, and as the daemon's paths.
  EXPECT_EQ(batches_.indexOf(fonts + "/a"), batches_.indexOf(fonts + "/a/b/c/new.ttf"));
  EXPECT_THAT(batches_.paths(), Not(Contains(fonts + "/old.ttf")));
  for (const std::string& path : batches_.paths()) EXPECT_TRUE(path.starts_with(fonts)) << path;

  // A directory moved in brings its contents, and is watched from then on.
  fs::create_directories(onDisk("/var/outside/d/e"));
  touch(onDisk("/var/outside/d/e/moved.ttf"));
  fs::rename(onDisk("/var/outside/d"), onDisk(fonts + "/d"));
  ASSERT_TRUE(batches_.waitFor(fonts + "/d/e/moved.ttf"));
  touch(onDisk(fonts + "/d/e/later.ttf"));
  ASSERT_TRUE(batches_.waitFor(fonts + "/d/e/later.ttf"));
  // A directory moved within the tree is reported under its new name.
  fs::rename(onDisk(fonts + "/d"), onDisk(fonts + "/renamed"));
  touch(onDisk(fonts + "/renamed/e/after-rename.ttf"));
  EXPECT_TRUE(batches_.waitFor(fonts + "/renamed/e/after-rename.ttf"));
}

TEST_F(LinuxFileEventStreamTest, TreesThatAppearLaterAreTakenUpAndTheirSurroundingsIgnored) {
  const std::string assets = "/private/var/Cargell/AssetsV2/com_zorvane_Cargell_Font6";
  fs::create_directories(onDisk("/private/var"));
  ASSERT_TRUE(makeStream({assets, kFonts}).start());

  fs::create_directories(onDisk(assets + "/x/y"));  // several levels at once
  touch(onDisk(assets + "/x/y/font.ttf"));
  touch(onDisk("/private/var/Cargell/unrelated"));
  ASSERT_TRUE(batches_.waitFor(assets + "/x/y/font.ttf"));
  EXPECT_TRUE(batches_.seen(assets));

  // Gone, then back again.
  fs::remove_all(onDisk("/private/var/Cargell"));
  fs::create_directories(onDisk(assets));
  touch(onDisk(assets + "/again.ttf"));
  ASSERT_TRUE(batches_.waitFor(assets + "/again.ttf"));
  EXPECT_THAT(batches_.paths(), Not(Contains("/private/var/Cargell/unrelated")));
}

TEST_F(LinuxFileEventStreamTest, ABatchWaitsForTheLatencyOnTheStreamsClock) {
  ManualClock clock;
  ASSERT_TRUE(makeStream({kFonts}, clock, 2.0).start());
  touch(onDisk(kFonts) / "one.ttf");
  // The first event opens the batch: an alarm on the clock.
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (clock.pendingAlarms() == 0 && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(1ms);
  }
  ASSERT_EQ(clock.pendingAlarms(), 1u);
  clock.advance(1999ms);
  queue_->sync([] {});
  EXPECT_TRUE(batches_.all().empty());
  clock.advance(1ms);
  ASSERT_TRUE(batches_.waitFor(std::string(kFonts) + "/one.ttf"));
  EXPECT_EQ(batches_.all().size(), 1u);
}

TEST_F(LinuxFileEventStreamTest, ABurstComesInFewBatchesWithEveryFile) {
  ASSERT_TRUE(makeStream({kFonts}).start());
  constexpr int kFiles = 1000;
  for (int i = 0; i < kFiles; ++i) touch(onDisk(kFonts) / ("f" + std::to_string(i)));
  ASSERT_TRUE(batches_.waitFor(std::string(kFonts) + "/f" + std::to_string(kFiles - 1)));
  const std::vector<std::string> paths = batches_.paths();
  const std::set<std::string> distinct(paths.begin(), paths.end());
  EXPECT_EQ(distinct.size(), static_cast<std::size_t>(kFiles));
  // Each batch stays open for the latency; a file's events are merged within one.
  EXPECT_LE(batches_.all().size(), 40u);
  EXPECT_LT(paths.size(), 2u * kFiles);
}

TEST_F(LinuxFileEventStreamTest, NoCallbackRunsOnceTheStreamIsDestroyed) {
  for (int round = 0; round < 20; ++round) {
    auto destroyed = std::make_shared<std::atomic<bool>>(false);
    auto late = std::make_shared<std::atomic<int>>(0);
    LinuxFileEventStreamFactory factory(root_, Clock::system());
    auto stream = factory.createStream({kFonts}, 0, [destroyed, late](const auto&) {
      if (*destroyed) ++*late;
      std::this_thread::sleep_for(1ms);
    });
    stream->setDispatchQueue(queue_);
    ASSERT_TRUE(stream->start());
    touch(onDisk(kFonts) / ("r" + std::to_string(round)));
    std::this_thread::sleep_for(std::chrono::microseconds(round * 100));
    stream.reset();
    *destroyed = true;
    queue_->sync([] {});
    EXPECT_EQ(*late, 0);
  }
}

}  // namespace
}  // namespace typhora
