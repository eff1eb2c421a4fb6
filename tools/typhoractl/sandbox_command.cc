#include "sandbox_command.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <iostream>

#include "ipc/interface_descriptions.h"
#include "platform/linux/files/device_root.h"
#include "platform/linux/sandbox/sandbox_extension_client.h"
#include "platform/linux/sandbox/sandbox_launcher.h"
#include "platform/value/json_codec.h"
#include "service_session.h"

namespace typhora::ctl {
namespace {

constexpr const char* kExecUsage =
    "usage: typhoractl [--root DIR] sandbox-exec [--root DIR] -- PROGRAM [ARGS...]\n"
    "\n"
    "Runs PROGRAM, a sandboxed application of the device root, under the kernel's sandbox\n"
    "(Landlock): it may read beneath its manifest's read-only paths and what any program needs\n"
    "to run (/usr, /lib*, /etc, its own /proc entries), write nowhere, make no TCP connections,\n"
    "and reach no abstract Unix socket nor signal any process outside its sandbox. Refuses when\n"
    "no manifest names PROGRAM with its SHA-256, when it is not sandboxed, or when the kernel\n"
    "has no Landlock.\n";

constexpr const char* kOpenUsage =
    "usage: typhoractl sandbox-open TOKEN [--beneath ENTRY] [--read]\n"
    "       typhoractl sandbox-open --checkin [--read] [--direct] [--beneath ENTRY]... [--alter "
    "PATH]\n"
    "                               [--also TOKEN]... [--child] [--handed]\n"
    "\n"
    "Exchanges a read-only extension token for a descriptor on the daemon's sandbox socket and\n"
    "prints one JSON line {\"via\": ..., \"path\": ..., \"kind\": \"file\"|\"directory\"} or\n"
    "{..., \"error\": REASON}; with --read, the file's first bytes (\"head\") or the directory's\n"
    "entries (\"entries\"). With TOKEN alone it exits 1 when the token is refused. --beneath\n"
    "ENTRY asks for the entry at the relative path ENTRY beneath the directory a token names\n"
    "(\"via\": \"beneath\"): in a sandbox, a directory's descriptor lists it but opens nothing.\n"
    "\n"
    "--checkin checks in first as the application this program is signed as, prints the tokens\n"
    "it got ({\"event\": \"checkin\", \"tokens\": [...]}) and exchanges each of them. Then:\n"
    "  --direct      opens each font file directly instead (\"errno\" when it cannot)\n"
    "  --alter PATH  the first token with its path replaced by PATH (a daemon path)\n"
    "  --forge       the first token with its MAC replaced by zeros\n"
    "  --also TOKEN  any token text\n"
    "  --child       a forked child exchanges the first token on a connection of its own\n"
    "  --handed      a forked child sends the first token on its parent's connection\n";

struct Token {
  std::string path;
  std::string text;
};

// The path a token names: what follows its sixth ';'.
std::string pathOf(const std::string& token) {
  std::size_t start = 0;
  for (int field = 0; field < 6; ++field) {
    const std::size_t semicolon = token.find(';', start);
    if (semicolon == std::string::npos) return {};
    start = semicolon + 1;
  }
  return token.substr(start);
}

std::string textOf(const Value& data) {
  const Bytes* bytes = data.asData();
  if (bytes == nullptr) return {};
  std::string text(bytes->begin(), bytes->end());
  if (!text.empty() && text.back() == '\0') text.pop_back();
  return text;
}

// The first bytes of a file, or a directory's entries.
Value contents(const SandboxExtensionResult& result) {
  if (result.kind == "file") {
    char buffer[64];
    const ssize_t n = pread(result.fd.get(), buffer, sizeof buffer, 0);
    std::string head;
    for (ssize_t i = 0; i < n; ++i)
      head += (buffer[i] >= 0x20 && buffer[i] < 0x7f) ? buffer[i] : '.';
    return Value(head);
  }
  ValueArray entries;
  DIR* directory = fdopendir(dup(result.fd.get()));
  if (directory == nullptr) return Value(std::string("cannot list: ") + std::strerror(errno));
  while (dirent* entry = readdir(directory)) {
    const std::string name = entry->d_name;
    if (name != "." && name != "..") entries.push_back(Value(name));
  }
  closedir(directory);
  return Value(std::move(entries));
}

void print(const std::string& via, const std::string& token, const SandboxExtensionResult& result,
           bool read, const std::string& beneath = "") {
  std::vector<DictionaryEntry> fields{{"via", via}, {"path", pathOf(token)}};
  if (!beneath.empty()) fields.emplace_back("beneath", beneath);
  if (!result.fd.valid()) {
    fields.emplace_back("error", result.error);
  } else {
    fields.emplace_back("kind", result.kind);
    if (read) fields.emplace_back(result.kind == "file" ? "head" : "entries", contents(result));
  }
  std::cout << JsonCodec::encode(Value(Dictionary(std::move(fields)))) << std::endl;
}

std::vector<Token> tokensOfCheckin(const Value& reply) {
  std::vector<Token> tokens;
  if (const Dictionary* fonts = reply.get("fontsInfo").asDictionary()) {
    for (const auto& [path, record] : fonts->entries()) {
      if (std::string text = textOf(record.get("data")); !text.empty())
        tokens.push_back({path, text});
    }
  }
  if (const Dictionary* fields = reply.asDictionary()) {
    for (const auto& [key, value] : fields->entries()) {
      if (!key.starts_with("extension")) continue;
      if (std::string text = textOf(value); !text.empty()) tokens.push_back({pathOf(text), text});
    }
  }
  return tokens;
}

// `exchange` run in a forked child, which prints its own result; waits for it.
template <typename Exchange>
void inChild(Exchange exchange) {
  std::cout.flush();
  const pid_t child = fork();
  if (child == 0) {
    exchange();
    std::cout.flush();
    _exit(0);
  }
  int status = 0;
  if (child > 0) waitpid(child, &status, 0);
}

struct OpenOptions {
  bool checkin = false;
  bool read = false;
  bool direct = false;
  bool child = false;
  bool handed = false;
  bool forge = false;
  std::string alter;
  std::vector<std::string> also;
  std::vector<std::string> beneath;
  std::string token;
};

void openDirectly(const std::string& root, const std::string& path) {
  const int fd = ::open(DeviceRoot(root).onDisk(path).c_str(), O_RDONLY | O_CLOEXEC);
  const int error = fd >= 0 ? 0 : errno;
  if (fd >= 0) ::close(fd);
  std::cout << JsonCodec::encode(Value::dictionary({{"via", "direct"},
                                                    {"path", path},
                                                    {"errno", static_cast<std::int64_t>(error)}}))
            << std::endl;
}

// `token` altered in this process (its path, its MAC), and used by forked children.
void misuse(const SandboxExtensionClient& client, const std::string& token,
            const OpenOptions& open) {
  const std::size_t pathStart = token.size() - pathOf(token).size();
  if (!open.alter.empty()) {
    const std::string altered = token.substr(0, pathStart) + open.alter;
    print("altered", altered, client.open(altered), open.read);
  }
  if (open.forge) {
    // The MAC is the field before the path.
    const std::size_t macStart = token.rfind(';', pathStart - 2) + 1;
    std::string forged = token;
    forged.replace(macStart, pathStart - 1 - macStart, pathStart - 1 - macStart, '0');
    print("forged", forged, client.open(forged), open.read);
  }
  if (open.child) inChild([&] { print("child", token, client.open(token), open.read); });
  if (open.handed) {
    std::string error;
    UniqueFd socket = client.connect(&error);
    inChild([&] {
      print("handed", token, SandboxExtensionClient::exchange(socket.get(), token), open.read);
    });
  }
}

int checkedIn(const ClientOptions& options, const std::string& root, const OpenOptions& open) {
  ServiceSession session(options, typhoraDaemonProtocol());
  CallResult checkin = session.call(op::kCheckin, {});
  if (!checkin.ok || checkin.reply.empty()) return printCall(checkin);
  const std::vector<Token> tokens = tokensOfCheckin(checkin.reply[0]);
  ValueArray listed;
  for (const Token& token : tokens)
    listed.push_back(Value::dictionary({{"path", token.path}, {"token", token.text}}));
  std::cout << JsonCodec::encode(Value::dictionary({{"event", "checkin"},
                                                    {"pid", static_cast<std::int64_t>(getpid())},
                                                    {"tokens", Value(std::move(listed))}}))
            << std::endl;
  const SandboxExtensionClient client(options.runtimeDir);
  for (const Token& token : tokens) {
    if (open.direct) openDirectly(root, token.path);
    print("token", token.text, client.open(token.text), open.read);
    for (const std::string& entry : open.beneath) {
      const std::string below = token.path + (token.path.ends_with('/') ? "" : "/") + entry;
      if (open.direct) openDirectly(root, below);
      print("beneath", token.text, client.open(token.text, entry), open.read, entry);
    }
  }
  for (const std::string& text : open.also) print("also", text, client.open(text), open.read);
  if (!tokens.empty()) misuse(client, tokens.front().text, open);
  return 0;
}

}  // namespace

int runSandboxExecCommand(const std::string& root, const std::vector<std::string>& args) {
  std::string deviceRoot = root;
  std::size_t i = 0;
  for (; i < args.size() && args[i] != "--"; ++i) {
    if (args[i] == "--help" || args[i] == "-h") {
      std::cout << kExecUsage;
      return 0;
    }
    if (args[i] == "--root" && i + 1 < args.size()) {
      deviceRoot = args[++i];
    } else {
      break;
    }
  }
  if (i < args.size() && args[i] == "--") ++i;
  if (i >= args.size()) {
    std::cerr << kExecUsage;
    return 2;
  }
  std::string error;
  SandboxLauncher(deviceRoot)
      .exec({args.begin() + static_cast<std::ptrdiff_t>(i), args.end()}, &error);
  std::cerr << "typhoractl sandbox-exec: " << error << "\n";
  return 1;
}

int runSandboxOpenCommand(const ClientOptions& options, const std::string& root,
                          const std::vector<std::string>& args) {
  OpenOptions open;
  for (std::size_t i = 0; i < args.size(); ++i) {
    const bool hasValue = i + 1 < args.size();
    if (args[i] == "--help" || args[i] == "-h") {
      std::cout << kOpenUsage;
      return 0;
    }
    if (args[i] == "--checkin") {
      open.checkin = true;
    } else if (args[i] == "--read") {
      open.read = true;
    } else if (args[i] == "--direct") {
      open.direct = true;
    } else if (args[i] == "--child") {
      open.child = true;
    } else if (args[i] == "--handed") {
      open.handed = true;
    } else if (args[i] == "--forge") {
      open.forge = true;
    } else if (args[i] == "--alter" && hasValue) {
      open.alter = args[++i];
    } else if (args[i] == "--also" && hasValue) {
      open.also.push_back(args[++i]);
    } else if (args[i] == "--beneath" && hasValue) {
      open.beneath.push_back(args[++i]);
    } else if (open.token.empty() && !args[i].starts_with("--")) {
      open.token = args[i];
    } else {
      std::cerr << "typhoractl: unexpected argument '" << args[i] << "'\n" << kOpenUsage;
      return 2;
    }
  }
  if (open.checkin) return checkedIn(options, root, open);
  if (open.token.empty()) {
    std::cerr << kOpenUsage;
    return 2;
  }
  const std::string entry = open.beneath.empty() ? "" : open.beneath.front();
  SandboxExtensionResult result =
      SandboxExtensionClient(options.runtimeDir).open(open.token, entry);
  print(entry.empty() ? "token" : "beneath", open.token, result, open.read, entry);
  return result.fd.valid() ? 0 : 1;
}

}  // namespace typhora::ctl
