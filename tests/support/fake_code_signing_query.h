// Signing records handed out by AuditToken, as a test sets them up. Unknown tokens, and the
// all-zero token, have no record.
#pragma once

#include <map>
#include <mutex>
#include <tuple>

#include "platform/services/code_signing_query.h"

namespace typhora::testing {

class FakeCodeSigningQuery final : public CodeSigningQuery {
 public:
  void setRecord(const AuditToken& token, std::optional<std::string> identifier,
                 Value entitlements = {}) {
    std::lock_guard lock(mutex_);
    records_.insert_or_assign(key(token),
                              CodeSigningRecord(std::move(identifier), std::move(entitlements)));
  }
  void removeRecord(const AuditToken& token) {
    std::lock_guard lock(mutex_);
    records_.erase(key(token));
  }

  std::optional<CodeSigningRecord> codeSigningRecord(const AuditToken& token) const override {
    if (token.isZero()) return std::nullopt;
    std::lock_guard lock(mutex_);
    auto it = records_.find(key(token));
    if (it == records_.end()) return std::nullopt;
    return it->second;
  }

 private:
  using Key = std::tuple<pid_t, std::uint64_t, std::uint64_t>;
  static Key key(const AuditToken& t) { return {t.pid, t.startTime, t.exeInode}; }
  mutable std::mutex mutex_;
  std::map<Key, CodeSigningRecord> records_;
};

}  // namespace typhora::testing
