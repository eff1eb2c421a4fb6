// The real typhorad in a temporary device root (<dir>/root, sockets in <dir>/run), started as
// a child process, and typhoractl run against it.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "integration/child_process.h"

namespace typhora::testing {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

inline const std::string kDaemon = std::string(TYPHORA_BINARY_DIR) + "/src/typhorad";
inline const std::string kCtl = std::string(TYPHORA_BINARY_DIR) + "/tools/typhoractl";
inline constexpr const char* kService = "com.zorvane.typhorad";

// Sanitizers' shadow memory makes resident sizes say nothing about the daemon's own.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
inline constexpr bool kMemoryMeasurable = false;
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
inline constexpr bool kMemoryMeasurable = false;
#else
inline constexpr bool kMemoryMeasurable = true;
#endif
#else
inline constexpr bool kMemoryMeasurable = true;
#endif

class DaemonTestBase : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/typhora-it-XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    dir_ = pattern;
    root_ = dir_ / "root";
    runtime_ = dir_ / "run";
    fs::create_directories(root_ / "var/mobile/Library/UserFonts");
    fs::create_directories(runtime_);
    std::ofstream(root_ / "var/mobile/Library/UserFonts/UserFonts.plist")
        << R"({"/var/mobile/Library/UserFonts/FontFiles/com.example.shop/A.otf":)"
        << R"({"familyName": {"A-Regular": "A"}}})";
  }
  void TearDown() override {
    daemon_.reset();
    fs::remove_all(dir_);
  }

  std::vector<std::string> daemonArgs() const {
    return {kDaemon,       "--root", root_,          "--runtime-dir", runtime_,
            "--log-level", "debug",  "--log-target", "stderr"};
  }

  void startDaemon() {
    daemon_ = std::make_unique<ChildProcess>(daemonArgs());
    waitForSocket();
  }

  void waitForSocket() {
    const fs::path socket = runtime_ / kService;
    for (int i = 0; i < 1000 && !fs::exists(socket); ++i) std::this_thread::sleep_for(5ms);
    ASSERT_TRUE(fs::exists(socket)) << (daemon_ ? daemon_->output() : "");
  }

  // Installs a copy of typhoractl as application `name`: a manifest signs it as `identifier`
  // with `entitlements` (a JSON dictionary), sandboxed with no readable paths unless told.
  std::string installApp(const std::string& name, const std::string& identifier,
                         const std::string& entitlements, bool sandboxed = true) {
    const fs::path program = dir_ / "apps" / name;
    fs::create_directories(program.parent_path());
    fs::copy_file(kCtl, program);
    auto digest = runCommand({"/usr/bin/sha256sum", program.string()}, 20s);
    fs::create_directories(root_ / "etc/typhora/apps");
    std::ofstream(root_ / "etc/typhora/apps" / (name + ".plist"))
        << R"({"identifier": ")" << identifier << R"(", "executable": ")" << program.string()
        << R"(", "sha256": ")" << digest.out.substr(0, 64) << R"(", "entitlements": )"
        << entitlements << (sandboxed ? R"(, "sandbox": {"readOnlyPaths": []}})" : "}");
    return program.string();
  }

  CommandResult ctl(std::vector<std::string> args) const {
    std::vector<std::string> argv = {kCtl, "--runtime-dir", runtime_};
    argv.insert(argv.end(), args.begin(), args.end());
    return runCommand(argv, 20s);
  }

  fs::path dir_, root_, runtime_;
  std::unique_ptr<ChildProcess> daemon_;
};

}  // namespace typhora::testing
