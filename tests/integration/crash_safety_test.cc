// State files under SIGKILL and damage: a writer killed at random moments in a storm of changes
// never leaves a file torn, empty or older than its last commit; a damaged file at start-up is
// set aside and the daemon starts.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <iostream>
#include <map>
#include <random>
#include <sstream>

#include "integration/daemon_test_base.h"
#include "platform/value/plist_reader.h"

namespace typhora::testing {
namespace {

using ::testing::HasSubstr;

const std::string kWriter = std::string(TYPHORA_BINARY_DIR) + "/tests/state_writer";

std::int64_t fillerLength(std::int64_t step) {
  return step * 7919 % 20000;
}

class CrashSafetyTest : public DaemonTestBase {
 protected:
  fs::path preferences() const {
    return root_ / "var/mobile/Library/Preferences/com.zorvane.typhorad.plist";
  }
  fs::path userFonts() const { return root_ / "var/mobile/Library/UserFonts/UserFonts.plist"; }
  fs::path assets() const { return root_ / "var/mobile/Library/UserFonts/FontAssets.plist"; }
  fs::path appStates() const { return root_ / "var/run/typhora/app-states.plist"; }

  // The step a file holds, or -1 (with a failure) when it is not a state the writer wrote.
  std::int64_t stepOf(const std::string& file, const fs::path& path, pid_t writer) {
    std::string error;
    std::optional<Value> v = PlistReader::readFile(path.string(), {}, &error);
    if (!v) {
      ADD_FAILURE() << file << " does not read: " << error;
      return -1;
    }
    std::int64_t step = -1;  // steps start at 1
    std::optional<std::size_t> filler;
    if (file == "preferences") {
      step = v->get("missed").asInt().value_or(-1);
      const bool agree = v->get("resolved").asInt() == step &&
                         v->get("delete").get("/var/x").asInt() == step &&
                         v->get("issues").get("com.example.app").at(0).asInt() == step;
      if (!agree) step = -1;
      if (const std::string* s = v->get("version").asString()) filler = s->size();
    } else if (file == "appstates") {
      return v->get(std::to_string(writer)).get("state").asInt().value_or(-1);
    } else {
      const Value& record =
          v->get("/var/mobile/Library/UserFonts/FontFiles/com.example.shop/A.otf");
      step = record.get("step").asInt().value_or(-1);
      if (const std::string* s = record.get("filler").asString()) filler = s->size();
    }
    if (step <= 0 || !filler || static_cast<std::int64_t>(*filler) != fillerLength(step)) {
      ADD_FAILURE() << file << " holds a state never written";
      return -1;
    }
    return step;
  }
};

TEST_F(CrashSafetyTest, AWriterKilledAtRandomNeverLeavesATornEmptyOrStaleFile) {
  const int kills = std::getenv("TYPHORA_KILLS") ? std::atoi(std::getenv("TYPHORA_KILLS")) : 300;
  fs::remove(userFonts());  // the writer's states only
  std::mt19937 rng(1124);
  std::int64_t next = 1;
  long commits = 0, inFlight = 0;
  // The last step each file committed, over all the writers so far.
  std::map<std::string, std::int64_t> lastCommitted;
  for (int kill = 0; kill < kills && !HasFailure(); ++kill) {
    ChildProcess writer({kWriter, root_.string(), std::to_string(next)});
    std::this_thread::sleep_for(std::chrono::microseconds(2000 + rng() % 40000));
    writer.kill(SIGKILL);
    writer.wait();
    writer.finishOutput();
    std::map<std::string, std::int64_t> committed;  // by this writer, by its own account
    std::int64_t latest = next - 1;
    std::istringstream lines(writer.standardOutput());
    std::string file;
    std::int64_t step = 0;
    while (lines >> file >> step) {
      committed[file] = step;
      latest = std::max(latest, step);
      ++commits;
    }
    for (const auto& [name, last] : committed) {
      if (name != "appstates") lastCommitted[name] = last;
    }
    for (const auto& [name, path] :
         std::vector<std::pair<std::string, fs::path>>{{"preferences", preferences()},
                                                       {"userfonts", userFonts()},
                                                       {"assets", assets()},
                                                       {"appstates", appStates()}}) {
      // The app-state table holds each writer's own entry; the others one state for all.
      const auto& floor = name == "appstates" ? committed : lastCommitted;
      if (!fs::exists(path)) {
        EXPECT_FALSE(floor.contains(name)) << name << " committed and gone";
        continue;
      }
      const std::int64_t held = stepOf(name, path, writer.pid());
      if (floor.contains(name)) {
        EXPECT_GE(held, floor.at(name)) << name << ": a commit lost";
      }
      // At most the step in progress got through after the last commit.
      EXPECT_LE(held, latest + 1) << name;
      if (held > (floor.contains(name) ? floor.at(name) : 0)) ++inFlight;
      next = std::max(next, held + 1);
    }
    next = std::max(next, latest + 2);
  }
  std::cout << "[figures] " << kills << " kills, " << commits << " commits, " << inFlight
            << " files holding a step whose commit the writer had not yet reported\n";
}

// A pid that named a process which has ended.
pid_t endedPid() {
  const pid_t child = fork();
  if (child == 0) _exit(0);
  waitpid(child, nullptr, 0);
  return child;
}

TEST_F(CrashSafetyTest, DamagedStateFilesAreSetAsideAndKilledWritersLeftoversRemovedAtStart) {
  fs::create_directories(preferences().parent_path());
  fs::create_directories(appStates().parent_path());
  // What writers killed mid-write leave; one whose writer still runs is its to finish.
  const fs::path dead = userFonts().string() + ".tmp-" + std::to_string(endedPid());
  const fs::path deadPreferences = preferences().string() + ".tmp-" + std::to_string(endedPid());
  const fs::path live = assets().string() + ".tmp-" + std::to_string(getpid());
  for (const fs::path& leftover : {dead, deadPreferences, live}) std::ofstream(leftover) << "{}";
  std::ofstream{preferences()};  // empty
  std::ofstream(userFonts()) << R"({"/var/mobile/Library/UserFonts/FontFiles/a.otf": {"fam)";
  std::ofstream(assets()) << std::string("\xbf\x61", 2);  // a CBOR map cut short
  std::ofstream(appStates()) << "\x01\x02garbage";
  startDaemon();
  EXPECT_EQ(ctl({"call", "checkin:"}).status, 0) << daemon_->output();
  EXPECT_EQ(daemon_->countLines("is corrupt"), 4u) << daemon_->output();
  for (const fs::path& original : {preferences(), userFonts(), assets(), appStates()}) {
    bool setAside = false;
    for (const auto& entry : fs::directory_iterator(original.parent_path())) {
      setAside = setAside || entry.path().filename().string().starts_with(
                                 original.filename().string() + ".corrupt-");
    }
    EXPECT_TRUE(setAside) << original;
  }
  EXPECT_THAT(daemon_->output(), HasSubstr("UserFonts.plist is corrupt"));
  EXPECT_FALSE(fs::exists(dead));
  EXPECT_FALSE(fs::exists(deadPreferences));
  EXPECT_TRUE(fs::exists(live));
  EXPECT_EQ(daemon_->countLines("that ended mid-write"), 2u) << daemon_->output();
}

}  // namespace
}  // namespace typhora::testing
