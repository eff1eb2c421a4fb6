// Descriptors passed beside bytes on Unix sockets (SCM_RIGHTS).
#pragma once

#include <sys/socket.h>

#include <vector>

#include "platform/linux/unique_fd.h"

namespace typhora {

// Points `message` at `control`, filled with `fds` to send.
void attachDescriptors(msghdr* message, std::vector<char>* control, const std::vector<int>& fds);
// Takes ownership of every descriptor a received message carries.
std::vector<UniqueFd> takeDescriptors(msghdr* message);

}  // namespace typhora
