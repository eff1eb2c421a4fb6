// The platform's listening Unix sockets: taken from systemd's socket activation when it hands
// one over by name, otherwise bound in the runtime directory.
#pragma once

#include <sys/types.h>

#include <string>

#include "platform/fd/unique_fd.h"

namespace typhora {

class UnixSocketFile {
 public:
  // The activated socket named `name`, or an invalid descriptor. Each is handed out once; a
  // single socket handed over without a name goes to the first listener that asks.
  static UniqueFd activated(const std::string& name);
  // A new socket of `type` listening at `path` with file mode `mode`, non-blocking, replacing a
  // stale one; invalid with `error` set when it cannot be made.
  static UniqueFd bindListening(const std::string& path, int type, mode_t mode, std::string* error);
};

}  // namespace typhora
