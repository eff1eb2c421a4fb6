// Records the registry calls the daemon makes. reset() can be held until the test releases it.
#pragma once

#include <atomic>

#include "platform/semaphore.h"
#include "platform/ty_user_font_manager.h"

namespace typhora::testing {

class FakeFontManager final : public TYUserFontManager {
 public:
  void reset() override {
    ++resets_;
    if (holdReset_) {
      resetEntered_.signal();
      resetRelease_.wait();
    }
  }
  int resets() const { return resets_; }

  // The next reset() calls wait inside until releaseReset().
  void holdReset() { holdReset_ = true; }
  void waitUntilResetEntered() { resetEntered_.wait(); }
  void releaseReset() { resetRelease_.signal(); }

 private:
  std::atomic<int> resets_{0};
  std::atomic<bool> holdReset_{false};
  Semaphore resetEntered_;
  Semaphore resetRelease_;
};

}  // namespace typhora::testing
