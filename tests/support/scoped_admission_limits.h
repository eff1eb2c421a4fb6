// Changes the process-wide admission limits for one test and puts the old ones back when it
// ends, also when an assertion ends it early.
#pragma once

#include "platform/linux/lumo/lumo_admission.h"

namespace typhora::testing {

class ScopedAdmissionLimits {
 public:
  template <class Change>
  explicit ScopedAdmissionLimits(Change change) : saved_(LumoAdmission::shared().limits()) {
    LumoAdmissionLimits limits = saved_;
    change(limits);
    LumoAdmission::shared().setLimits(limits);
  }
  ~ScopedAdmissionLimits() { LumoAdmission::shared().setLimits(saved_); }
  ScopedAdmissionLimits(const ScopedAdmissionLimits&) = delete;
  ScopedAdmissionLimits& operator=(const ScopedAdmissionLimits&) = delete;

 private:
  LumoAdmissionLimits saved_;
};

}  // namespace typhora::testing
