// Descriptors passed beside bytes on Unix sockets (SCM_RIGHTS), and the writer's credentials the
// kernel passes with them (SCM_CREDENTIALS).
#pragma once

#include <sys/socket.h>

#include <optional>
#include <vector>

#include "platform/fd/unique_fd.h"

namespace typhora {

// Points `message` at `control`, filled with `fds` to send.
void attachDescriptors(msghdr* message, std::vector<char>* control, const std::vector<int>& fds);
// Takes ownership of every descriptor a received message carries.
std::vector<UniqueFd> takeDescriptors(msghdr* message);
// The kernel's credentials of the writer of a received message (SO_PASSCRED), if it has them.
std::optional<ucred> takeCredentials(msghdr* message);

}  // namespace typhora
