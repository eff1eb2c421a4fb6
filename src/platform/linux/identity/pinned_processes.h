// The /proc directories of the peers the daemon holds pinned, found again by audit token.
// A pinned directory answers for its process instance only, so a query about a token whose
// process is pinned needs no fresh open of /proc/<pid> and no read of its start time: one
// look through the held directory says whether it still runs the same program. Tokens whose
// process is not pinned are answered the long way (`ProcessIdentity`).
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <map>
#include <memory>
#include <mutex>
#include <tuple>

#include "platform/fd/unique_fd.h"
#include "platform/ipc/audit_token.h"

namespace typhora {

class PinnedProcesses {
 public:
  static PinnedProcesses& shared();

  // Registers `directory`, opened on `token`'s process instance and checked against its start
  // time and executable. The entry lives as long as its holders keep the directory.
  void add(const AuditToken& token, const std::shared_ptr<const UniqueFd>& directory);
  // The held directory of the instance the token names (pid, start time and executable all
  // equal), or null.
  std::shared_ptr<const UniqueFd> directoryOf(const AuditToken& token) const;
  std::size_t sizeForTesting() const;

 private:
  using Key = std::tuple<pid_t, std::uint64_t, std::uint64_t, std::uint64_t>;
  static Key keyOf(const AuditToken& token) {
    return {token.pid, token.startTime, token.exeDevice, token.exeInode};
  }
  void sweepLocked();

  mutable std::mutex mutex_;
  std::map<Key, std::weak_ptr<const UniqueFd>> directories_;
  std::size_t sweepAt_ = 64;
};

}  // namespace typhora
