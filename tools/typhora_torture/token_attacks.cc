// Attacks on the sandbox socket, where tokens are traded for descriptors: tokens replayed by
// another process, pointed at a sibling file, forged or all zero, and messages no client would
// send. Every exchange that hands out a descriptor got through.
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <filesystem>
#include <optional>
#include <random>

#include "attacks.h"
#include "platform/fd/unique_fd.h"
#include "platform/linux/lumo/transport/scm_rights.h"
#include "platform/linux/sandbox/sandbox_extension_client.h"
#include "platform/linux/sandbox/sandbox_extension_protocol.h"
#include "platform/value/json_codec.h"

namespace typhora::torture {

namespace {

struct RealToken {
  std::string path;
  std::string text;
};

// The first token in what `command` prints: an application's check-in lines, as
// `sandbox-open --checkin` prints them.
std::optional<RealToken> tokenFrom(const std::vector<std::string>& command) {
  if (command.empty()) return std::nullopt;
  std::string line;
  for (const std::string& word : command) line += "'" + word + "' ";
  std::FILE* out = popen((line + "2>/dev/null").c_str(), "r");
  if (out == nullptr) return std::nullopt;
  std::optional<RealToken> found;
  std::array<char, 65536> buffer{};
  while (std::fgets(buffer.data(), buffer.size(), out) != nullptr) {
    std::optional<Value> v = JsonCodec::decode(buffer.data());
    if (found || !v || v->get("event") != Value("checkin")) continue;
    const Value& first = v->get("tokens").at(0);
    const std::string* path = first.get("path").asString();
    const std::string* text = first.get("token").asString();
    if (path != nullptr && text != nullptr) found = RealToken{*path, *text};
  }
  pclose(out);
  return found;
}

// The token with its path (what follows the sixth ';') replaced.
std::string withPath(const std::string& token, const std::string& path) {
  std::size_t at = 0;
  for (int field = 0; field < 6 && at != std::string::npos; ++field) at = token.find(';', at + 1);
  return at == std::string::npos ? token : token.substr(0, at + 1) + path;
}

// The token with one character of its MAC (the field before the path) changed.
std::string withMacChanged(const std::string& token) {
  std::size_t at = 0;
  for (int field = 0; field < 6 && at != std::string::npos; ++field) at = token.find(';', at + 1);
  std::string forged = token;
  if (at != std::string::npos && at > 0) forged[at - 1] = forged[at - 1] == '0' ? '1' : '0';
  return forged;
}

// Sends `bytes` (with `fds` beside them, and no credentials) on a fresh connection; true when a
// descriptor came back.
bool rawExchange(const std::string& socketPath, const std::string& bytes,
                 const std::vector<int>& fds) {
  UniqueFd fd(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  socketPath.copy(address.sun_path, sizeof address.sun_path - 1);
  if (!fd.valid() ||
      connect(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    return false;
  }
  iovec part{const_cast<char*>(bytes.data()), bytes.size()};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  std::vector<char> control;
  attachDescriptors(&message, &control, fds);
  sendmsg(fd.get(), &message, MSG_NOSIGNAL);
  timeval limit{5, 0};
  setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
  std::array<char, 512> answer{};
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int) * 4)> received{};
  iovec into{answer.data(), answer.size()};
  msghdr reply{};
  reply.msg_iov = &into;
  reply.msg_iovlen = 1;
  reply.msg_control = received.data();
  reply.msg_controllen = received.size();
  recvmsg(fd.get(), &reply, MSG_CMSG_CLOEXEC);
  return !takeDescriptors(&reply).empty();
}

}  // namespace

AttackOutcome tokenAttacks(const AttackContext& c) {
  AttackOutcome o;
  const std::string runtime = std::filesystem::path(c.socket).parent_path().string();
  const std::string socketPath = runtime + "/" + sandboxexchange::kSocketName;
  const SandboxExtensionClient client(runtime);
  const std::optional<RealToken> real = tokenFrom(c.tokenApp);
  const std::string zero = "1;0;0;0;0;" + std::string(64, '0') + ";/var/mobile/Library/UserFonts";
  std::mt19937 random(7);
  const int devZero = open("/dev/zero", O_RDONLY | O_CLOEXEC);
  auto attempt = [&](bool servedIt) {
    ++o.tries;
    if (servedIt) ++o.gotThrough;
  };
  while (std::chrono::steady_clock::now() < c.until) {
    if (real) {
      // Another process's token, as it was issued and pointed at a sibling.
      attempt(client.open(real->text).fd.valid());
      const std::string sibling =
          std::filesystem::path(real->path).replace_filename("..sibling.otf").string();
      attempt(client.open(withPath(real->text, sibling)).fd.valid());
      attempt(client.open(withMacChanged(real->text)).fd.valid());
      // Out of the token's directory by the entry asked for beneath it.
      attempt(client.open(real->text, "../UserFonts.plist").fd.valid());
      attempt(client.open(real->text, "a/../../UserFonts.plist").fd.valid());
    }
    attempt(client.open(zero).fd.valid());
    std::string noise(1 + random() % 512, '\0');
    for (char& ch : noise) ch = static_cast<char>(random());
    attempt(rawExchange(socketPath, noise, {}));
    attempt(rawExchange(socketPath, std::string(sandboxexchange::kMaxTokenSize * 4, '1'), {}));
    if (devZero >= 0) attempt(rawExchange(socketPath, zero, std::vector<int>(8, devZero)));
  }
  if (devZero >= 0) close(devZero);
  o.note = real ? "a real token replayed by another process, pointed at a sibling, one "
                  "character of its MAC changed, asked for what lies above it; zero, random and "
                  "oversized tokens; descriptors pushed"
                : "no application gave a token to replay (--token-app); zero, random and "
                  "oversized tokens; descriptors pushed";
  return o;
}

}  // namespace typhora::torture
