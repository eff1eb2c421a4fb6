// The smaller Linux platform services in a temporary device root: application states, analytics,
// the build variant, file removal and listing, and the font registry's files.
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <thread>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/dispatch/manual_clock.h"
#include "platform/dispatch/semaphore.h"
#include "platform/linux/files/linux_analytics_sink.h"
#include "platform/linux/files/linux_file_system.h"
#include "platform/linux/fonts/linux_user_font_manager.h"
#include "platform/linux/identity/linux_app_state_monitor.h"
#include "platform/linux/identity/linux_build_variant.h"
#include "platform/value/plist_reader.h"
#include "support/log_capture.h"
#include "support/temp_directory.h"

namespace typhora {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using testing::TempDirectory;
using ::testing::UnorderedElementsAre;

constexpr const char* kFontFile = "/usr/share/fonts/truetype/dejavu/DejaVuSans.ttf";
constexpr const char* kAssetStore = "private/var/Cargell/AssetsV2/com_zorvane_Cargell_Font6/";

std::string readText(const std::string& path) {
  std::ifstream in(path);
  return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
}

TEST(LinuxAppStateMonitorTest, StatesHoldOnlyForTheProcessThatWasRecorded) {
  TempDirectory root;
  LinuxAppStateMonitor states(root.path());
  EXPECT_EQ(states.mostElevatedApplicationState(getpid()), kApplicationStateUnknown);

  std::string error;
  ASSERT_TRUE(states.setState(getpid(), kApplicationStateForegroundRunning, &error)) << error;
  EXPECT_EQ(states.mostElevatedApplicationState(getpid()), kApplicationStateForegroundRunning);
  EXPECT_FALSE(states.setState(999999999, 8, &error));

  // An entry of a pid whose process started at another time is somebody else's.
  root.write("var/run/typhora/app-states.plist",
             "{\"" + std::to_string(getppid()) + "\": {\"state\": 8, \"startTime\": 1}}");
  EXPECT_EQ(states.mostElevatedApplicationState(getppid()), kApplicationStateUnknown);
  root.write("var/run/typhora/app-states.plist", "garbage");
  EXPECT_EQ(states.mostElevatedApplicationState(getpid()), kApplicationStateUnknown);

  ASSERT_TRUE(states.setState(getpid(), 8, &error));
  ASSERT_TRUE(states.setState(getpid(), std::nullopt, &error));
  EXPECT_EQ(states.mostElevatedApplicationState(getpid()), kApplicationStateUnknown);
}

TEST(LinuxAnalyticsSinkTest, OneLinePerEventAndNothingBuiltWhenDisabled) {
  TempDirectory root;
  ManualClock clock;
  {
    LinuxAnalyticsSink sink(root.path(), clock);
    std::vector<std::thread> senders;
    for (int i = 0; i < 4; ++i) {
      senders.emplace_back([&sink, i] {
        for (int j = 0; j < 25; ++j)
          sink.sendEvent("com.example.event", [&] { return Value::dictionary({{"n", i}}); });
      });
    }
    for (auto& sender : senders) sender.join();
    std::istringstream lines(readText(sink.logPath()));
    int count = 0;
    for (std::string line; std::getline(lines, line); ++count) {
      auto event = PlistReader::read(
          {reinterpret_cast<const std::uint8_t*>(line.data()), line.size()}, {}, nullptr);
      ASSERT_TRUE(event) << line;
      EXPECT_EQ(*event->get("name").asString(), "com.example.event");
    }
    EXPECT_EQ(count, 100);
  }
  root.write("etc/typhora/analytics.plist", R"({"enabled": false})");
  LinuxAnalyticsSink disabled(root.path(), clock);
  bool built = false;
  disabled.sendEvent("x", [&] {
    built = true;
    return Value();
  });
  EXPECT_FALSE(built);
}

TEST(LinuxBuildVariantTest, InternalOnlyWhenTheFileSaysSoForTheSubsystem) {
  TempDirectory root;
  LinuxBuildVariant variant(root.path());
  EXPECT_FALSE(variant.isInternalBuild("com.zorvane.Typhora"));
  root.write("etc/typhora/build-variant.plist", R"({"internal": true})");
  EXPECT_TRUE(variant.isInternalBuild("com.zorvane.Typhora"));
  root.write("etc/typhora/build-variant.plist",
             R"({"internal": true, "subsystems": ["com.zorvane.Other"]})");
  EXPECT_FALSE(variant.isInternalBuild("com.zorvane.Typhora"));
  root.write("etc/typhora/build-variant.plist", R"({"internal": "yes"})");
  EXPECT_FALSE(variant.isInternalBuild("com.zorvane.Typhora"));
}

TEST(LinuxFileSystemTest, RemovesTreesAndListsDirectories) {
  TempDirectory root;
  LinuxFileSystem files(root.path());
  root.write("var/a/one.ttf", "1");
  root.write("var/a/sub/two.ttf", "2");
  auto listing = files.contentsOfDirectory("/var/a");
  ASSERT_TRUE(listing);
  EXPECT_THAT(*listing, UnorderedElementsAre("one.ttf", "sub"));
  EXPECT_EQ(files.contentsOfDirectory("/var/missing"), std::nullopt);
  EXPECT_EQ(files.contentsOfDirectory("/var/a/one.ttf"), std::nullopt);

  std::string error;
  EXPECT_TRUE(files.removeItem("/var/a/sub", &error));
  EXPECT_FALSE(files.fileExists("/var/a/sub/two.ttf"));
  EXPECT_FALSE(files.removeItem("/var/a/sub", &error));
  EXPECT_THAT(error, HasSubstr("No such file"));
  EXPECT_THAT(*files.contentsOfDirectory("/var/a"), ElementsAre("one.ttf"));
}

class LinuxFontRegistryTest : public ::testing::Test {
 protected:
  void addAsset(const std::string& asset, const std::string& file, const std::string& source) {
    std::string target = root_.path() + "/" + kAssetStore + asset + "/AssetData/" + file;
    std::filesystem::create_directories(std::filesystem::path(target).parent_path());
    std::filesystem::copy_file(source, target);
  }
  bool synchronizeAssets() {
    bool result = false;
    registry_.synchronizeFontAssets([&](bool success) { result = success; });
    return result;
  }

  TempDirectory root_;
  LinuxUserFontManager registry_{root_.path()};
};

TEST_F(LinuxFontRegistryTest, MirrorsFontAssetsWithTheirNamesAndForgetsRemovedOnes) {
  addAsset("abc123", "DejaVuSans.ttf", kFontFile);
  ASSERT_TRUE(synchronizeAssets());
  const std::string mirrored = "/var/mobile/Library/UserFonts/FontAssets/abc123/DejaVuSans.ttf";
  EXPECT_EQ(
      registry_.userFontsInfo(),
      Value::dictionary(
          {{mirrored, Value::dictionary(
                          {{"disabled", false},
                           {"familyName", Value::dictionary({{"DejaVuSans", "DejaVu Sans"}})}})}}));
  EXPECT_TRUE(std::filesystem::exists(root_.path() + mirrored));
  ASSERT_TRUE(synchronizeAssets());  // nothing changes the second time
  EXPECT_EQ(registry_.userFontsInfo().asDictionary()->size(), 1u);

  std::filesystem::remove_all(root_.path() + "/" + kAssetStore + "abc123");
  ASSERT_TRUE(synchronizeAssets());
  EXPECT_TRUE(registry_.userFontsInfo().asDictionary()->empty());
  EXPECT_FALSE(std::filesystem::exists(root_.path() + mirrored));

  testing::LogCapture log;
  addAsset("junk", "notes.ttf", "/etc/hostname");
  EXPECT_FALSE(synchronizeAssets());
  EXPECT_TRUE(log.contains("is not a font"));
}

TEST_F(LinuxFontRegistryTest, EnablesDisablesAndRemovesProviders) {
  const std::string a = "/var/mobile/Library/UserFonts/FontFiles/com.example.a/A.ttf";
  const std::string b = "/var/mobile/Library/UserFonts/FontFiles/com.example.b/B.ttf";
  root_.write("var/mobile/Library/UserFonts/UserFonts.plist",
              "{\"" + a + "\": {\"disabled\": true, \"familyName\": {\"A\": \"A\"}}, \"" + b +
                  "\": {\"disabled\": true}}");
  root_.write(a.substr(1), "a");
  root_.write(b.substr(1), "b");

  registry_.enableOrDisablePersistentURLs({"file://" + a, "not a url"}, true);
  Value info = registry_.userFontsInfo();
  EXPECT_EQ(info.get(a).get("disabled"), Value(false));
  EXPECT_EQ(info.get(a).get("familyName"), Value::dictionary({{"A", "A"}}));
  EXPECT_EQ(info.get(b).get("disabled"), Value(true));

  Semaphore done;
  std::optional<std::string> error = "not called";
  bool onCallingThread = true;
  auto caller = std::this_thread::get_id();
  registry_.unregisterAndRemoveFontFilesForIdentifier("com.example.a", [&](const auto& e) {
    error = e;
    onCallingThread = std::this_thread::get_id() == caller;
    done.signal();
  });
  done.wait();
  EXPECT_EQ(error, std::nullopt);
  EXPECT_FALSE(onCallingThread);
  EXPECT_FALSE(registry_.userFontsInfo().asDictionary()->contains(a));
  EXPECT_TRUE(registry_.userFontsInfo().asDictionary()->contains(b));
  EXPECT_FALSE(std::filesystem::exists(root_.path() + a));

  registry_.unregisterAndRemoveFontFilesForIdentifier("..", [&](const auto& e) {
    error = e;
    done.signal();
  });
  done.wait();
  EXPECT_TRUE(error.has_value());
  EXPECT_TRUE(std::filesystem::exists(root_.path() + b));

  registry_.synchronizeFontProviders();
  EXPECT_EQ(
      PlistReader::readFile(root_.path() + "/var/mobile/Library/UserFonts/FontProviders.plist"),
      Value::array({"com.example.b"}));
  EXPECT_EQ(registry_.directoryNameFromIdentifier("com.example.b"), "com.example.b");
  EXPECT_EQ(registry_.directoryNameFromIdentifier("a/b"), std::nullopt);
  EXPECT_EQ(registry_.identifierFromDirectoryName(""), std::nullopt);
  // Only a provider's directory under FontFiles/ names a provider.
  root_.write("var/mobile/Library/UserFonts/FontAssets/Serif/Serif.ttf", "s");
  EXPECT_EQ(registry_.identifierFromDirectoryName("com.example.b"), "com.example.b");
  for (const char* other : {"com.example.a", "Serif", "AssetData", "FontFiles", "Fonts"})
    EXPECT_EQ(registry_.identifierFromDirectoryName(other), std::nullopt) << other;
}

}  // namespace
}  // namespace typhora
