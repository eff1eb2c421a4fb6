// In-memory preferences that count their flushes.
#pragma once

#include <map>
#include <mutex>

#include "platform/storage/preferences_store.h"

namespace typhora::testing {

class FakePreferencesStore final : public PreferencesStore {
 public:
  Value value(const std::string& key) const override {
    std::lock_guard lock(mutex_);
    auto it = values_.find(key);
    return it == values_.end() ? Value() : it->second;
  }
  void setValue(const std::string& key, Value value) override {
    std::lock_guard lock(mutex_);
    ++writes_;
    if (value.isNull()) {
      values_.erase(key);
    } else {
      values_[key] = std::move(value);
    }
  }
  bool synchronize() override {
    std::lock_guard lock(mutex_);
    ++synchronizations_;
    return true;
  }
  int writes() const {
    std::lock_guard lock(mutex_);
    return writes_;
  }
  int synchronizations() const {
    std::lock_guard lock(mutex_);
    return synchronizations_;
  }

 private:
  mutable std::mutex mutex_;
  std::map<std::string, Value> values_;
  int writes_ = 0;
  int synchronizations_ = 0;
};

}  // namespace typhora::testing
