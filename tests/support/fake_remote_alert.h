// Records every alert presented: its definition, configuration and user info.
#pragma once

#include <mutex>
#include <vector>

#include "platform/services/remote_alert.h"

namespace typhora::testing {

class FakeRemoteAlert final : public RemoteAlert {
 public:
  struct Activation {
    RemoteAlertDefinition definition;
    RemoteAlertConfiguration configuration;
    Value userInfo;
    RemoteAlertHandle::EndedHandler ended;
  };

  // Makes every later activation fail as a view service that cannot be started does.
  void failActivations() {
    std::lock_guard lock(mutex_);
    failing_ = true;
  }

  std::vector<Activation> activations() const {
    std::lock_guard lock(mutex_);
    return activations_;
  }

  std::unique_ptr<RemoteAlertHandle> makeHandle(RemoteAlertDefinition definition,
                                                RemoteAlertConfiguration configuration) override {
    return std::make_unique<Handle>(*this, std::move(definition), std::move(configuration));
  }

 private:
  class Handle final : public RemoteAlertHandle {
   public:
    Handle(FakeRemoteAlert& owner, RemoteAlertDefinition d, RemoteAlertConfiguration c)
        : owner_(owner), definition_(std::move(d)), configuration_(std::move(c)) {}
    void activate(const Value& userInfo, EndedHandler ended) override {
      bool failing = false;
      {
        std::lock_guard lock(owner_.mutex_);
        owner_.activations_.push_back({definition_, configuration_, userInfo, ended});
        failing = owner_.failing_;
      }
      if (failing && ended) ended();
    }

   private:
    FakeRemoteAlert& owner_;
    RemoteAlertDefinition definition_;
    RemoteAlertConfiguration configuration_;
  };

  mutable std::mutex mutex_;
  std::vector<Activation> activations_;
  bool failing_ = false;
};

}  // namespace typhora::testing
