#include "platform/linux/identity/pinned_processes.h"

#include <algorithm>

namespace typhora {

PinnedProcesses& PinnedProcesses::shared() {
  static PinnedProcesses* registry = new PinnedProcesses;  // used until exit, never destroyed
  return *registry;
}

void PinnedProcesses::add(const AuditToken& token,
                          const std::shared_ptr<const UniqueFd>& directory) {
  if (token.isZero() || !directory || !directory->valid()) return;
  std::lock_guard lock(mutex_);
  // One instance pinned by several connections keeps the directory of any live one.
  std::weak_ptr<const UniqueFd>& slot = directories_[keyOf(token)];
  if (slot.expired()) slot = directory;
  if (directories_.size() >= sweepAt_) sweepLocked();
}

std::shared_ptr<const UniqueFd> PinnedProcesses::directoryOf(const AuditToken& token) const {
  if (token.isZero()) return nullptr;
  std::lock_guard lock(mutex_);
  auto it = directories_.find(keyOf(token));
  return it == directories_.end() ? nullptr : it->second.lock();
}

std::size_t PinnedProcesses::sizeForTesting() const {
  std::lock_guard lock(mutex_);
  return directories_.size();
}

// Entries of released pins are dropped in sweeps, whose spacing grows with the live count, so
// the map stays within twice the pinned processes at a constant cost per registration.
void PinnedProcesses::sweepLocked() {
  std::erase_if(directories_, [](const auto& entry) { return entry.second.expired(); });
  sweepAt_ = std::max<std::size_t>(64, directories_.size() * 2);
}

}  // namespace typhora
