// Signing records, installed applications and sandboxes from application manifests, with real
// processes: copies of a small program started in a temporary device root.
#include <fcntl.h>
#include <signal.h>
#include <sodium.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <filesystem>
#include <fstream>
#include <memory>
#include <thread>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/linux/identity/app_manifest_store.h"
#include "platform/linux/identity/linux_app_registry.h"
#include "platform/linux/identity/linux_code_signing_query.h"
#include "platform/linux/identity/process_identity.h"
#include "platform/linux/sandbox/linux_sandbox_broker.h"
#include "platform/value/json_codec.h"
#include "support/log_capture.h"
#include "support/temp_directory.h"

namespace typhora {
namespace {

using ::testing::HasSubstr;
using testing::TempDirectory;

std::string sha256Of(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  std::array<unsigned char, crypto_hash_sha256_BYTES> digest{};
  crypto_hash_sha256(digest.data(), reinterpret_cast<const unsigned char*>(bytes.data()),
                     bytes.size());
  std::array<char, crypto_hash_sha256_BYTES * 2 + 1> hex{};
  sodium_bin2hex(hex.data(), hex.size(), digest.data(), digest.size());
  return hex.data();
}

// A process running a copy of /bin/sleep, optionally as another user; killed at the end.
class Program {
 public:
  Program(const std::string& path, uid_t uid = getuid()) {
    pid_ = fork();
    if (pid_ == 0) {
      if (uid != getuid() && (setgid(uid) != 0 || setuid(uid) != 0)) _exit(126);
      execl(path.c_str(), path.c_str(), "60", static_cast<char*>(nullptr));
      _exit(127);
    }
    // Wait until the child runs the program, not the test binary any more.
    const std::filesystem::path program = std::filesystem::canonical(path);
    for (int i = 0; i < 2000; ++i) {
      std::error_code ec;
      if (std::filesystem::read_symlink("/proc/" + std::to_string(pid_) + "/exe", ec) == program)
        break;
      usleep(1000);
    }
    token_ = ProcessIdentity::ofProcess(pid_, uid, uid);
  }
  ~Program() { stop(); }
  void stop() {
    if (pid_ <= 0) return;
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
    pid_ = -1;
  }
  const AuditToken& token() const { return token_; }

 private:
  pid_t pid_ = -1;
  AuditToken token_;
};

class LinuxIdentityTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_GE(sodium_init(), 0); }

  // Installs a copy of /bin/sleep as application `name` with the given manifest fields.
  std::string install(const std::string& name, const std::string& identifier,
                      const std::string& extraJson = "") {
    std::string program = root_.path() + "/programs/" + name;
    std::filesystem::create_directories(root_.path() + "/programs");
    std::filesystem::copy_file("/bin/sleep", program,
                               std::filesystem::copy_options::overwrite_existing);
    chmod(program.c_str(), 0755);
    writeManifest(name, "{\"identifier\": \"" + identifier + "\", \"executable\": \"" + program +
                            "\", \"sha256\": \"" + sha256Of(program) + "\"" + extraJson + "}");
    return program;
  }
  void writeManifest(const std::string& name, const std::string& json) {
    // Installers replace manifests by rename, which the store notices.
    std::string final = root_.path() + "/etc/typhora/apps/" + name + ".plist";
    root_.write("manifest.tmp", json);
    std::filesystem::create_directories(std::filesystem::path(final).parent_path());
    std::filesystem::rename(root_.path() + "/manifest.tmp", final);
  }

  TempDirectory root_;
  AppManifestStore manifests_{root_.path()};
  LinuxCodeSigningQuery signing_{manifests_};
  LinuxAppRegistry registry_{manifests_};
  LinuxSandboxBroker sandbox_{root_.path(), manifests_};
};

TEST_F(LinuxIdentityTest, SignedProgramHasItsIdentifierEntitlementsAndVersion) {
  std::string path = install("fonts", "com.example.fonts",
                             R"(, "entitlements": {"com.zorvane.developer.user-fonts":
                                   ["app-usage"]}, "shortVersionString": "2.1")");
  Program app(path);
  auto record = signing_.codeSigningRecord(app.token());
  ASSERT_TRUE(record.has_value());
  EXPECT_EQ(record->signingIdentifier(), "com.example.fonts");
  EXPECT_EQ(record->entitlementValue("com.zorvane.developer.user-fonts"),
            Value::array({"app-usage"}));
  EXPECT_TRUE(record->entitlementValue("other").isNull());
  EXPECT_EQ(registry_.shortVersionString("com.example.fonts"), "2.1");
  EXPECT_EQ(registry_.shortVersionString("com.example.none"), std::nullopt);
}

TEST_F(LinuxIdentityTest, NoRecordWithoutAnUnchangedProgramOfAManifest) {
  std::string path = install("fonts", "com.example.fonts");
  Program unlisted("/bin/sleep");
  EXPECT_FALSE(signing_.codeSigningRecord(unlisted.token()));
  EXPECT_FALSE(signing_.codeSigningRecord(AuditToken{}));

  // A manifest whose digest is not the program's.
  writeManifest("fonts", "{\"identifier\": \"com.example.fonts\", \"executable\": \"" + path +
                             "\", \"sha256\": \"" + std::string(64, '0') + "\"}");
  Program mismatched(path);
  EXPECT_FALSE(signing_.codeSigningRecord(mismatched.token()));
  mismatched.stop();

  // The program replaced on disk while it runs, and the process gone.
  install("fonts", "com.example.fonts");
  Program replaced(path);
  ASSERT_TRUE(signing_.codeSigningRecord(replaced.token()));
  std::filesystem::copy_file("/bin/true", path + ".new");
  std::filesystem::rename(path + ".new", path);
  EXPECT_FALSE(signing_.codeSigningRecord(replaced.token()));
  replaced.stop();
  EXPECT_FALSE(signing_.codeSigningRecord(replaced.token()));
}

TEST_F(LinuxIdentityTest, ProcessesOfOneProgramAskingAtOnceAllGetItsManifest) {
  // The first queries about a program hash it once while the others wait for that digest.
  std::string path = install("fonts", "com.example.fonts");
  std::vector<std::unique_ptr<Program>> apps;
  for (int i = 0; i < 4; ++i) apps.push_back(std::make_unique<Program>(path));
  std::vector<std::thread> askers;
  std::atomic<int> signed_{0};
  for (int i = 0; i < 16; ++i) {
    askers.emplace_back([&, i] {
      auto record = signing_.codeSigningRecord(apps[i % apps.size()]->token());
      if (record && record->signingIdentifier() == "com.example.fonts") ++signed_;
    });
  }
  for (auto& asker : askers) asker.join();
  EXPECT_EQ(signed_.load(), 16);
}

TEST_F(LinuxIdentityTest, MalformedManifestsAreSkippedAndNewOnesSeen) {
  testing::LogCapture log;
  writeManifest("broken", "{\"identifier\": 7}");
  writeManifest("corrupt", "{not json");
  EXPECT_EQ(registry_.shortVersionString("com.example.late"), std::nullopt);
  auto lines = log.lines();
  EXPECT_EQ(
      std::count_if(lines.begin(), lines.end(),
                    [](const auto& line) { return line.message.starts_with("app manifest"); }),
      2);

  install("late", "com.example.late", R"(, "shortVersionString": "1.0")");
  EXPECT_EQ(registry_.shortVersionString("com.example.late"), "1.0");
}

TEST_F(LinuxIdentityTest, SandboxedApplicationsReadOnlyTheirPaths) {
  std::string path = install("boxed", "com.example.boxed",
                             R"(, "sandbox": {"readOnlyPaths": ["/var/mobile/Documents"]})");
  Program boxed(path);
  Program free(install("free", "com.example.free"));

  EXPECT_NE(sandbox_.sandboxCheck(boxed.token()), 0);
  EXPECT_EQ(sandbox_.sandboxCheck(free.token()), 0);
  EXPECT_NE(sandbox_.sandboxCheck(AuditToken{}), 0);  // a failed check counts as sandboxed

  const char* read = kSandboxOperationFileReadData;
  EXPECT_EQ(sandbox_.sandboxCheck(boxed.token(), read, "/var/mobile/Documents"), 0);
  EXPECT_EQ(sandbox_.sandboxCheck(boxed.token(), read, "/var/mobile/Documents/a.ttf"), 0);
  EXPECT_NE(sandbox_.sandboxCheck(boxed.token(), read, "/var/mobile/Documents2/a.ttf"), 0);
  EXPECT_NE(sandbox_.sandboxCheck(boxed.token(), read, "/var/mobile/Library"), 0);
  EXPECT_NE(sandbox_.sandboxCheck(boxed.token(), "file-write-data", "/var/mobile/Documents"), 0);
}

TEST_F(LinuxIdentityTest, UnsandboxedProcessesReadWhatTheirUserMay) {
  if (getuid() != 0) GTEST_SKIP() << "needs root to run a process as another user";
  root_.write("var/mobile/open.ttf", "x");
  std::string secret = root_.write("var/mobile/secret.ttf", "x");
  chmod(secret.c_str(), 0600);
  std::string program = install("nobody", "com.example.nobody");
  Program nobody(program, 65534);
  Program rootProcess(program);

  const char* read = kSandboxOperationFileReadData;
  EXPECT_EQ(sandbox_.sandboxCheck(nobody.token(), read, "/var/mobile/open.ttf"), 0);
  EXPECT_NE(sandbox_.sandboxCheck(nobody.token(), read, "/var/mobile/secret.ttf"), 0);
  EXPECT_NE(sandbox_.sandboxCheck(nobody.token(), read, "/var/mobile/missing.ttf"), 0);
  EXPECT_EQ(sandbox_.sandboxCheck(rootProcess.token(), read, "/var/mobile/secret.ttf"), 0);
}

TEST_F(LinuxIdentityTest, ExtensionTokensOpenOnePathToOneProcess) {
  Program holder(install("fonts", "com.example.fonts"));
  Program other(install("other", "com.example.other"));
  const std::string path = "/var/mobile/Library/UserFonts/FontFiles/a;b.ttf";

  auto token = sandbox_.issueReadOnlyExtension(path, holder.token());
  ASSERT_TRUE(token.has_value());
  EXPECT_EQ(token->find('\0'), std::string::npos);
  EXPECT_EQ(sandbox_.verifyExtension(*token, holder.token()), path);
  EXPECT_EQ(sandbox_.verifyExtension(*token, other.token()), std::nullopt);

  std::string longer = *token + "x";
  std::string shortened = token->substr(0, token->size() - 1);
  std::string forged = *token;
  forged[forged.find(';', 2) + 1] ^= 1;  // another start time
  for (const std::string& altered : {longer, shortened, forged, std::string("1;2;3")})
    EXPECT_EQ(sandbox_.verifyExtension(altered, holder.token()), std::nullopt) << altered;

  // The key outlives the broker, and only its owner may read it.
  LinuxSandboxBroker later(root_.path(), manifests_);
  EXPECT_EQ(later.verifyExtension(*token, holder.token()), path);
  struct stat info {};
  ASSERT_EQ(stat((root_.path() + "/etc/typhora/sandbox.key").c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 0777, 0600u);

  EXPECT_FALSE(sandbox_.issueReadOnlyExtension(path, AuditToken{}));
  EXPECT_FALSE(sandbox_.issueReadOnlyExtension("relative/path", holder.token()));
  holder.stop();
  EXPECT_FALSE(sandbox_.issueReadOnlyExtension(path, holder.token()));
}

}  // namespace
}  // namespace typhora
