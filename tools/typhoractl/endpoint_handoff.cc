#include "endpoint_handoff.h"

#include <sys/socket.h>

#include <cerrno>
#include <cstring>
#include <vector>

#include "platform/linux/lumo/transport/scm_rights.h"

namespace typhora::ctl {

bool EndpointHandoff::send(int socket, const IpcEndpoint& endpoint, std::string* error) {
  const auto* lumo = dynamic_cast<const LumoEndpoint*>(&endpoint);
  if (lumo == nullptr) {
    *error = "not a lumo endpoint";
    return false;
  }
  char byte = 'E';
  iovec data{&byte, 1};
  msghdr message{};
  message.msg_iov = &data;
  message.msg_iovlen = 1;
  std::vector<char> control;
  attachDescriptors(&message, &control, {lumo->fd()});
  if (sendmsg(socket, &message, MSG_NOSIGNAL) != 1) {
    *error = std::string("sendmsg: ") + std::strerror(errno);
    return false;
  }
  return true;
}

std::shared_ptr<const LumoEndpoint> EndpointHandoff::receive(int socket, std::string* error) {
  char byte = 0;
  iovec data{&byte, 1};
  std::vector<char> control(CMSG_SPACE(sizeof(int)));
  msghdr message{};
  message.msg_iov = &data;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  ssize_t n = -1;
  do {
    n = recvmsg(socket, &message, MSG_CMSG_CLOEXEC);
  } while (n < 0 && errno == EINTR);
  std::vector<UniqueFd> fds = n > 0 ? takeDescriptors(&message) : std::vector<UniqueFd>{};
  if (fds.size() != 1) {
    *error =
        n < 0 ? std::string("recvmsg: ") + std::strerror(errno) : "no endpoint was handed over";
    return nullptr;
  }
  return std::make_shared<const LumoEndpoint>(std::move(fds[0]));
}

}  // namespace typhora::ctl
