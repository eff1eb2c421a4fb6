// A client of the lumo wire protocol written by hand, for tests that play a hostile peer: it
// connects, answers the service's hello (or deliberately does not), and writes frames of its
// choosing without the checks a LumoConnection makes.
#pragma once

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <string>
#include <vector>

#include "platform/linux/lumo/transport/lumo_frame.h"

namespace typhora::raw {

// A connected socket to `path`, or -1.
inline int connectTo(const std::string& path) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) return -1;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  if (connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    close(fd);
    return -1;
  }
  return fd;
}

// Reads exactly `size` bytes, waiting at most `timeoutMs` for each piece.
inline bool readExactly(int fd, std::uint8_t* out, std::size_t size, int timeoutMs = 10000) {
  for (std::size_t at = 0; at < size;) {
    pollfd p{fd, POLLIN, 0};
    if (poll(&p, 1, timeoutMs) <= 0) return false;
    ssize_t n = recv(fd, out + at, size - at, 0);
    if (n <= 0) return false;
    at += static_cast<std::size_t>(n);
  }
  return true;
}

// One whole frame as it came (header and payload), or empty.
inline std::vector<std::uint8_t> readFrame(int fd, int timeoutMs = 10000) {
  std::vector<std::uint8_t> frame(kLumoHeaderSize);
  if (!readExactly(fd, frame.data(), kLumoHeaderSize, timeoutMs)) return {};
  std::uint32_t length = 0;
  for (int i = 3; i >= 0; --i) length = (length << 8) | frame[4 + static_cast<std::size_t>(i)];
  frame.resize(kLumoHeaderSize + length);
  if (!readExactly(fd, frame.data() + kLumoHeaderSize, length, timeoutMs)) return {};
  return frame;
}

inline bool writeAll(int fd, const std::vector<std::uint8_t>& bytes) {
  for (std::size_t at = 0; at < bytes.size();) {
    ssize_t n = send(fd, bytes.data() + at, bytes.size() - at, MSG_NOSIGNAL);
    if (n <= 0) return false;
    at += static_cast<std::size_t>(n);
  }
  return true;
}

// Answers the service's hello: its frame, sent back as it is, carries the nonce.
inline bool handshake(int fd) {
  std::vector<std::uint8_t> hello = readFrame(fd);
  return !hello.empty() && writeAll(fd, hello);
}

inline std::vector<std::uint8_t> frameOf(const std::string& op, std::vector<Value> args,
                                         std::uint64_t id) {
  std::vector<std::uint8_t> frame;
  std::vector<int> fds;
  std::string error;
  encodeLumoFrame(LumoMessage{LumoMessage::Kind::Invoke, id, op, std::move(args)}, &frame, &fds,
                  nullptr, &error);
  return frame;
}

// Reads frames until the one answering `id`, which it decodes; nullopt on the connection's end
// or after `timeoutMs` of silence.
inline std::optional<LumoMessage> answerTo(int fd, std::uint64_t id, int timeoutMs = 10000) {
  for (;;) {
    std::vector<std::uint8_t> bytes = readFrame(fd, timeoutMs);
    if (bytes.empty()) return std::nullopt;
    LumoFrameSplitter splitter;
    splitter.addBytes(bytes);
    LumoRawFrame frame;
    std::string error;
    if (splitter.next(&frame, &error) != LumoFrameSplitter::Status::Frame) return std::nullopt;
    if (frame.id != id || frame.kind == LumoMessage::Kind::Invoke) continue;
    return decodeLumoFrame(std::move(frame), LumoLimits{}, nullptr, &error);
  }
}

}  // namespace typhora::raw
