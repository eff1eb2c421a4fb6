#include "platform/linux/sandbox/sandbox_extension_client.h"

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <vector>

#include "platform/linux/lumo/transport/scm_rights.h"
#include "platform/linux/sandbox/sandbox_extension_protocol.h"

namespace typhora {

UniqueFd SandboxExtensionClient::connect(std::string* error) const {
  const std::string path = runtimeDir_ + "/" + sandboxexchange::kSocketName;
  UniqueFd fd(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) {
    *error = "socket path too long: " + path;
    return {};
  }
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  if (!fd.valid() || ::connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address)) {
    *error = "cannot connect to " + path + ": " + std::strerror(errno);
    return {};
  }
  return fd;
}

SandboxExtensionResult SandboxExtensionClient::exchange(int socket, const std::string& token,
                                                        int seconds) {
  SandboxExtensionResult result;
  // The writer's credentials go with the token; the kernel checks they are this process's.
  ucred self{getpid(), getuid(), getgid()};
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(ucred))> credentials{};
  iovec part{const_cast<char*>(token.data()), token.size()};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = credentials.data();
  message.msg_controllen = credentials.size();
  cmsghdr* header = CMSG_FIRSTHDR(&message);
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_CREDENTIALS;
  header->cmsg_len = CMSG_LEN(sizeof self);
  std::memcpy(CMSG_DATA(header), &self, sizeof self);
  if (sendmsg(socket, &message, MSG_NOSIGNAL) < 0) {
    result.error = std::string("cannot send the token: ") + std::strerror(errno);
    return result;
  }
  timeval timeout{seconds, 0};
  setsockopt(socket, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
  std::array<char, 512> answer{};
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int) * 4)> control{};
  iovec into{answer.data(), answer.size()};
  msghdr reply{};
  reply.msg_iov = &into;
  reply.msg_iovlen = 1;
  reply.msg_control = control.data();
  reply.msg_controllen = control.size();
  const ssize_t n = recvmsg(socket, &reply, MSG_CMSG_CLOEXEC);
  std::vector<UniqueFd> descriptors = takeDescriptors(&reply);
  if (n <= 0) {
    result.error = n == 0 ? "the daemon closed the connection without an answer"
                          : std::string("no answer: ") + std::strerror(errno);
    return result;
  }
  const std::string text(answer.data(), static_cast<std::size_t>(n));
  const bool granted = text == sandboxexchange::kFile || text == sandboxexchange::kDirectory;
  if (!granted || descriptors.size() != 1) {
    result.error = text.starts_with(sandboxexchange::kRefused)
                       ? text.substr(std::strlen(sandboxexchange::kRefused))
                       : "unexpected answer: " + text;
    return result;
  }
  result.fd = std::move(descriptors[0]);
  result.kind = text;
  return result;
}

SandboxExtensionResult SandboxExtensionClient::open(const std::string& token,
                                                    const std::string& beneath) const {
  SandboxExtensionResult result;
  UniqueFd socket = connect(&result.error);
  if (!socket.valid()) return result;
  return exchange(socket.get(), beneath.empty() ? token : token + '\0' + beneath);
}

}  // namespace typhora
