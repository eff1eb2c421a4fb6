// Pieces of hostile peers shared by the attack programs: greeted connections, frames built byte
// by byte (whatever their header claims), descriptors sent beside any bytes, and waiting for the
// daemon to hang up.
#pragma once

#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/linux/lumo/transport/scm_rights.h"
#include "support/raw_lumo_client.h"

namespace typhora::raw {

// A connection that answered the daemon's hello, or -1.
inline int connectedAndGreeted(const std::string& socket) {
  int fd = connectTo(socket);
  if (fd < 0) return -1;
  if (!handshake(fd)) {
    close(fd);
    return -1;
  }
  return fd;
}

// True when the daemon closes the connection within `ms` (reading and dropping anything).
inline bool closedWithinMs(int fd, int ms) {
  const auto until = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
  std::uint8_t buffer[4096];
  while (std::chrono::steady_clock::now() < until) {
    pollfd p{fd, POLLIN, 0};
    if (poll(&p, 1, 20) <= 0) continue;
    if (recv(fd, buffer, sizeof buffer, MSG_DONTWAIT) <= 0) return true;
  }
  return false;
}

inline void putLe32(std::vector<std::uint8_t>* out, std::uint32_t v) {
  for (int i = 0; i < 4; ++i) out->push_back(static_cast<std::uint8_t>(v >> (8 * i)));
}

// A frame header claiming `length` payload bytes and `descriptors` descriptors.
inline std::vector<std::uint8_t> headerOf(std::uint32_t length, std::uint32_t descriptors = 0,
                                          std::uint32_t magic = kLumoMagic) {
  std::vector<std::uint8_t> out;
  putLe32(&out, magic);
  putLe32(&out, length);
  putLe32(&out, descriptors);
  return out;
}

// A frame around an arbitrary payload.
inline std::vector<std::uint8_t> frameAround(const std::vector<std::uint8_t>& payload,
                                             std::uint32_t descriptors = 0) {
  std::vector<std::uint8_t> out = headerOf(static_cast<std::uint32_t>(payload.size()), descriptors);
  out.insert(out.end(), payload.begin(), payload.end());
  return out;
}

// A well-formed message of any kind (replies and errors included).
inline std::vector<std::uint8_t> messageFrame(LumoMessage::Kind kind, std::uint64_t id,
                                              const std::string& text, std::vector<Value> values) {
  std::vector<std::uint8_t> frame;
  std::vector<int> fds;
  std::string error;
  encodeLumoFrame(LumoMessage{kind, id, text, std::move(values)}, &frame, &fds, nullptr, &error);
  return frame;
}

// Sends `bytes` with `fds` beside them in one message; the caller keeps its descriptors.
inline bool sendWithDescriptors(int fd, const std::vector<std::uint8_t>& bytes,
                                const std::vector<int>& fds) {
  std::vector<std::uint8_t> copy = bytes;
  iovec iov{copy.data(), copy.size()};
  msghdr msg{};
  msg.msg_iov = &iov;
  msg.msg_iovlen = 1;
  std::vector<char> control;
  if (!fds.empty()) attachDescriptors(&msg, &control, fds);
  return sendmsg(fd, &msg, MSG_NOSIGNAL) > 0;
}

}  // namespace typhora::raw
