#include "requests/request_fonts_gate.h"

#include <utility>

namespace typhora {

std::uint64_t RequestFontsGate::arrive() {
  return waiting_.fetch_add(1);
}

void RequestFontsGate::leave() {
  waiting_.fetch_sub(1);
}

void RequestFontsGate::acquire(Job admitted) {
  {
    std::lock_guard lock(mutex_);
    if (held_) {
      queue_.push_back(std::move(admitted));
      return;
    }
    held_ = true;
  }
  admitted();
}

void RequestFontsGate::release() {
  Job next;
  {
    std::lock_guard lock(mutex_);
    waiting_.fetch_sub(1);
    if (queue_.empty()) {
      held_ = false;
      return;
    }
    next = std::move(queue_.front());
    queue_.pop_front();
  }
  next();
}

}  // namespace typhora
