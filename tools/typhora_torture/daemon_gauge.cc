#include "daemon_gauge.h"

#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "support/raw_lumo_client.h"

namespace typhora::torture {

pid_t DaemonGauge::pidListeningOn(const std::string& socket) {
  int fd = raw::connectTo(socket);
  if (fd < 0) return -1;
  ucred cred{};
  socklen_t length = sizeof cred;
  const bool ok = getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &length) == 0;
  close(fd);
  return ok && cred.pid > 0 ? cred.pid : -1;
}

bool DaemonGauge::alive() const {
  return kill(pid_, 0) == 0 || errno == EPERM;
}

long DaemonGauge::rssKb() const {
  std::ifstream status("/proc/" + std::to_string(pid_) + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmRSS:", 0) == 0) return std::stol(line.substr(6));
  }
  return -1;
}

long DaemonGauge::descriptors() const {
  std::error_code ec;
  long n = 0;
  for (std::filesystem::directory_iterator it("/proc/" + std::to_string(pid_) + "/fd", ec), end;
       !ec && it != end; it.increment(ec)) {
    ++n;
  }
  return ec ? -1 : n;
}

}  // namespace typhora::torture
