// The kernel's sandbox and the token exchange between real processes: applications (copies of
// typhoractl) run under `typhoractl sandbox-exec`, check in with the real daemon and trade their
// tokens for descriptors on the sandbox socket.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>

#include <cstring>

#include <map>
#include <sstream>

#include "integration/daemon_test_base.h"
#include "platform/linux/sandbox/sandbox_extension_client.h"
#include "platform/value/json_codec.h"

namespace typhora::testing {
namespace {

using ::testing::AnyOf;
using ::testing::HasSubstr;
using ::testing::Not;

constexpr const char* kAppUsage = R"({"com.zorvane.developer.user-fonts": ["app-usage"]})";
constexpr const char* kFonts = "/var/mobile/Library/UserFonts/FontFiles/com.example.shop/";

class SandboxProcessTest : public DaemonTestBase {
 protected:
  void SetUp() override {
    DaemonTestBase::SetUp();
    const fs::path fonts = root_ / std::string(kFonts).substr(1);
    fs::create_directories(fonts);
    std::ofstream(fonts / "A.otf") << "font-A";
    std::ofstream(fonts / "B.otf") << "font-B";
    reader_ = installApp("reader", "com.example.reader", kAppUsage);
  }

  // The daemon, once its sandbox socket is there too (it is made after the service's).
  void start() {
    startDaemon();
    const fs::path socket = runtime_ / "com.zorvane.typhorad.sandbox";
    for (int i = 0; i < 1000 && !fs::exists(socket); ++i) std::this_thread::sleep_for(5ms);
    ASSERT_TRUE(fs::exists(socket)) << daemon_->output();
  }

  // `program ARGS` run in its sandbox, speaking to the test's daemon.
  std::vector<std::string> sandboxed(const std::string& program,
                                     const std::vector<std::string>& args) const {
    std::vector<std::string> argv = {
        kCtl,    "sandbox-exec", "--root",       root_,           "--",
        program, "--root",       root_.string(), "--runtime-dir", runtime_};
    argv.insert(argv.end(), args.begin(), args.end());
    return argv;
  }
  // The reader asks for family A in the foreground, from its sandbox: A is issued to it.
  void grantA() {
    const std::string script =
        kCtl + " --root " + root_.string() + " app-state set $$ 8 >/dev/null && exec \"$0\" \"$@\"";
    std::vector<std::string> argv = {"/bin/sh", "-c", script};
    for (const std::string& arg : sandboxed(reader_, {"request-fonts", "--family", "A"}))
      argv.push_back(arg);
    auto result = runCommand(argv, 30s);
    ASSERT_EQ(result.status, 0) << result.all << daemon_->output();
    ASSERT_THAT(result.out, HasSubstr("A.otf"));
  }
  // Each JSON line of `out` by its "via" (or "event").
  static std::map<std::string, Value> byVia(const std::string& out) {
    std::map<std::string, Value> lines;
    std::istringstream in(out);
    for (std::string line; std::getline(in, line);) {
      std::optional<Value> value = JsonCodec::decode(line);
      if (!value) continue;
      const Value& via = value->get("via");
      lines[via.isNull() ? *value->get("event").asString() : *via.asString()] = *value;
    }
    return lines;
  }
  static std::string error(const Value& line) {
    const std::string* text = line.get("error").asString();
    return text != nullptr ? *text : "";
  }

  std::string reader_;
};

TEST_F(SandboxProcessTest, ASandboxedApplicationReadsAFontOnlyThroughItsOwnToken) {
  start();
  grantA();
  const std::string a = std::string(kFonts) + "A.otf";
  auto run = runCommand(
      sandboxed(reader_, {"sandbox-open", "--checkin", "--read", "--direct", "--alter",
                          std::string(kFonts) + "B.otf", "--forge", "--child", "--handed", "--also",
                          "1;0;0;0;0;" + std::string(64, '0') + ";" + a}),
      30s);
  ASSERT_EQ(run.status, 0) << run.all << daemon_->output();
  auto lines = byVia(run.out);
  const Value& tokens = lines["checkin"].get("tokens");
  ASSERT_EQ(tokens.at(0).get("path"), Value(a)) << run.out;
  const std::string token = *tokens.at(0).get("token").asString();

  // The kernel keeps the file from it; the daemon hands it over for its token.
  EXPECT_EQ(lines["direct"].get("errno"), Value(EACCES)) << run.out;
  EXPECT_EQ(lines["token"].get("kind"), Value("file")) << run.out;
  EXPECT_EQ(lines["token"].get("head"), Value("font-A"));
  // A sibling by an altered path, a forged MAC, the all-zero token: the MAC does not hold.
  EXPECT_THAT(error(lines["altered"]), HasSubstr("altered")) << run.out;
  EXPECT_THAT(error(lines["forged"]), HasSubstr("altered"));
  EXPECT_THAT(error(lines["also"]), HasSubstr("altered"));
  // Its forked child: on a connection of its own, or on its parent's.
  EXPECT_THAT(error(lines["child"]), HasSubstr("not issued to this process"));
  EXPECT_THAT(error(lines["handed"]), HasSubstr("not written by the process that connected"));

  // A later process of the same program, and another program, hold the text but not the token.
  auto later = runCommand(sandboxed(reader_, {"sandbox-open", token}), 20s);
  EXPECT_EQ(later.status, 1) << later.all;
  EXPECT_THAT(later.out, HasSubstr("not issued to this process"));
  auto other = ctl({"sandbox-open", token, "--read"});
  EXPECT_EQ(other.status, 1) << other.all;
  EXPECT_THAT(other.out, Not(HasSubstr("font-A")));

  // The daemon kept serving, and logged the application's refusals once.
  auto checkin = ctl({"call", "checkin:"});
  EXPECT_EQ(checkin.status, 0) << checkin.all;
  const std::string pid = std::to_string(*lines["checkin"].get("pid").asInt());
  const std::string log = daemon_->output();
  const std::string refusal = "sandbox socket: pid " + pid + " ";
  const std::size_t first = log.find(refusal);
  EXPECT_NE(first, std::string::npos) << log;
  EXPECT_EQ(log.find(refusal, first + 1), std::string::npos) << log;
}

// An enumerating application holds a token of the font directory, not of each file: in its
// sandbox the directory's descriptor lists the fonts but opens none, so it asks for each font
// beneath the directory by name, and gets nothing above it or through a link.
TEST_F(SandboxProcessTest, AnEnumeratingApplicationOpensTheFontsBeneathItsDirectoryToken) {
  const std::string browser =
      installApp("browser", "com.example.browser",
                 R"({"com.zorvane.developer.user-fonts": ["font-enumeration"]})");
  const fs::path fonts = root_ / std::string(kFonts).substr(1);
  fs::create_symlink("../../UserFonts.plist", fonts / "link.otf");
  start();
  const std::string a = "com.example.shop/A.otf";
  auto run =
      runCommand(sandboxed(browser, {"sandbox-open", "--checkin", "--read", "--direct", "--beneath",
                                     a, "--beneath", "com.example.shop/../../UserFonts.plist",
                                     "--beneath", "com.example.shop/link.otf"}),
                 30s);
  ASSERT_EQ(run.status, 0) << run.all << daemon_->output();
  // Each answer by the directory and the entry asked for beneath it.
  std::map<std::string, Value> answers;
  std::istringstream in(run.out);
  for (std::string line; std::getline(in, line);) {
    std::optional<Value> v = JsonCodec::decode(line);
    if (!v) continue;
    const std::string* via = v->get("via").asString();
    const std::string* path = v->get("path").asString();
    const std::string* entry = v->get("beneath").asString();
    if (via == nullptr || path == nullptr) continue;
    answers[*via + " " + *path + (entry != nullptr ? " " + *entry : "")] = *v;
  }
  const std::string directory = "/var/mobile/Library/UserFonts/FontFiles";
  ASSERT_TRUE(answers.contains("token " + directory)) << run.out;
  EXPECT_EQ(answers["token " + directory].get("kind"), Value("directory"));
  EXPECT_EQ(answers["direct " + directory + "/" + a].get("errno"), Value(EACCES)) << run.out;
  const Value& font = answers["beneath " + directory + " " + a];
  EXPECT_EQ(font.get("kind"), Value("file")) << run.out;
  EXPECT_EQ(font.get("head"), Value("font-A"));
  EXPECT_THAT(error(answers["beneath " + directory + " com.example.shop/../../UserFonts.plist"]),
              HasSubstr("malformed path"));
  EXPECT_THAT(error(answers["beneath " + directory + " com.example.shop/link.otf"]),
              HasSubstr("symbolic links"));
}

TEST_F(SandboxProcessTest, TheLauncherFailsClosedAndTheSandboxWritesNothing) {
  const std::string plain = installApp("plain", "com.example.plain", kAppUsage, false);
  start();
  auto unsigned_ = runCommand(sandboxed(kCtl, {"status"}), 20s);
  EXPECT_EQ(unsigned_.status, 1);
  EXPECT_THAT(unsigned_.all, HasSubstr("no application manifest"));
  auto unsandboxed = runCommand(sandboxed(plain, {"status"}), 20s);
  EXPECT_EQ(unsandboxed.status, 1);
  EXPECT_THAT(unsandboxed.all, HasSubstr("not a sandboxed application"));

  // The platform's record of application states is beneath the device root: not writable.
  auto write = runCommand(sandboxed(reader_, {"app-state", "set", "1", "8"}), 20s);
  EXPECT_NE(write.status, 0) << write.all;
  EXPECT_FALSE(fs::exists(root_ / "var/run/typhora/app-states.plist")) << write.all;
}

TEST_F(SandboxProcessTest, TheSandboxSocketTakesHostilePeersInStride) {
  start();
  const fs::path socket = runtime_ / "com.zorvane.typhorad.sandbox";
  struct stat info {};
  ASSERT_EQ(stat(socket.c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 0777, 0666u);

  const SandboxExtensionClient client(runtime_);
  auto exchange = [&](const std::string& message) {
    std::string failure;
    UniqueFd fd = client.connect(&failure);
    EXPECT_TRUE(fd.valid()) << failure;
    return SandboxExtensionClient::exchange(fd.get(), message, 5).error;
  };
  // A peer that says nothing is cut off (after 5 s) while the others are answered.
  std::string failure;
  UniqueFd quiet = client.connect(&failure);
  ASSERT_TRUE(quiet.valid()) << failure;
  EXPECT_EQ(exchange(std::string(64 * 1024, 'x')), "message too long");
  EXPECT_EQ(exchange(std::string("1;2\0../3", 8)), "malformed path beneath the token's");
  EXPECT_THAT(exchange("not a token"), HasSubstr("not issued to this process"));

  // Silent connections up to this user's cap (16, the quiet one among them): the next one is
  // closed at once, and once they have gone, exchanges are answered again.
  std::vector<UniqueFd> silent;
  for (int i = 0; i < 15; ++i) silent.push_back(client.connect(&failure));
  EXPECT_THAT(exchange("not a token"),
              AnyOf(HasSubstr("closed the connection"), HasSubstr("reset by peer")));
  silent.clear();
  bool answered = false;
  for (int i = 0; i < 100 && !answered; ++i) {
    answered = exchange("not a token").find("not issued") != std::string::npos;
    if (!answered) std::this_thread::sleep_for(20ms);
  }
  EXPECT_TRUE(answered);
  timeval patience{10, 0};
  setsockopt(quiet.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  char byte = 0;
  EXPECT_EQ(recv(quiet.get(), &byte, 1, 0), 0) << std::strerror(errno);
  EXPECT_EQ(ctl({"call", "checkin:"}).status, 0);
}

// One user opening connection after connection holds its own share of the socket, no more: a
// process of another user is answered meanwhile, and the daemon goes on serving.
TEST_F(SandboxProcessTest, ACrowdOfOneUserLeavesTheSocketToOthers) {
  start();
  fs::permissions(dir_, fs::perms::others_exec, fs::perm_options::add);
  fs::permissions(runtime_, fs::perms::others_exec | fs::perms::others_read, fs::perm_options::add);
  const SandboxExtensionClient client(runtime_);
  std::vector<UniqueFd> crowd;
  std::string failure;
  for (int i = 0; i < 600; ++i) {
    UniqueFd fd = client.connect(&failure);
    if (fd.valid()) crowd.push_back(std::move(fd));
  }
  EXPECT_GT(crowd.size(), 16u) << failure;
  auto other = runCommand({"/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups",
                           kCtl, "--runtime-dir", runtime_, "sandbox-open", "not a token"},
                          20s);
  EXPECT_EQ(other.status, 1) << other.all;
  EXPECT_THAT(other.out, HasSubstr("not issued to this process")) << other.all;
  crowd.clear();
  EXPECT_EQ(ctl({"call", "checkin:"}).status, 0);
}

}  // namespace
}  // namespace typhora::testing
