#include "platform/linux/lumo/transport/scm_rights.h"

#include <cstring>

namespace typhora {

void attachDescriptors(msghdr* message, std::vector<char>* control, const std::vector<int>& fds) {
  if (fds.empty()) return;
  control->assign(CMSG_SPACE(sizeof(int) * fds.size()), 0);
  message->msg_control = control->data();
  message->msg_controllen = control->size();
  cmsghdr* cmsg = CMSG_FIRSTHDR(message);
  cmsg->cmsg_level = SOL_SOCKET;
  cmsg->cmsg_type = SCM_RIGHTS;
  cmsg->cmsg_len = CMSG_LEN(sizeof(int) * fds.size());
  std::memcpy(CMSG_DATA(cmsg), fds.data(), sizeof(int) * fds.size());
}

std::vector<UniqueFd> takeDescriptors(msghdr* message) {
  std::vector<UniqueFd> received;
  for (cmsghdr* c = CMSG_FIRSTHDR(message); c != nullptr; c = CMSG_NXTHDR(message, c)) {
    if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_RIGHTS) continue;
    const std::size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (std::size_t i = 0; i < count; ++i) {
      int fd;
      std::memcpy(&fd, CMSG_DATA(c) + i * sizeof(int), sizeof fd);
      received.emplace_back(fd);
    }
  }
  return received;
}

std::optional<ucred> takeCredentials(msghdr* message) {
  for (cmsghdr* c = CMSG_FIRSTHDR(message); c != nullptr; c = CMSG_NXTHDR(message, c)) {
    if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_CREDENTIALS) continue;
    if (c->cmsg_len < CMSG_LEN(sizeof(ucred))) continue;
    ucred cred{};
    std::memcpy(&cred, CMSG_DATA(c), sizeof cred);
    return cred;
  }
  return std::nullopt;
}

}  // namespace typhora
