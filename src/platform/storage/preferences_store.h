// The daemon's own preferences domain: each value read whole, changed on a copy, written back
// whole, and flushed to persistent storage on synchronize.
#pragma once

#include <string>

#include "platform/value/value.h"

namespace typhora {

class PreferencesStore {
 public:
  virtual ~PreferencesStore() = default;
  // The value under `key`, or null when there is none.
  virtual Value value(const std::string& key) const = 0;
  // Sets `key` to `value`; a null value removes the key.
  virtual void setValue(const std::string& key, Value value) = 0;
  // Writes the whole domain to persistent storage; false when that failed.
  virtual bool synchronize() = 0;
};

}  // namespace typhora
