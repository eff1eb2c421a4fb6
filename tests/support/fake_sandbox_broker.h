// Scripted sandbox answers. By default a process is unsandboxed, may read nothing, and gets a
// token "token:<path>@<pid>" for any path; each of these can be changed per token or path.
#pragma once

#include <map>
#include <mutex>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/services/sandbox_broker.h"

namespace typhora::testing {

class FakeSandboxBroker final : public SandboxBroker {
 public:
  struct Issued {
    std::string path;
    AuditToken token;
  };

  void setSandboxed(pid_t pid, int answer) {
    std::lock_guard lock(mutex_);
    sandboxed_[pid] = answer;
  }
  // The process `pid` may already read exactly `path`.
  void allowRead(pid_t pid, const std::string& path) {
    std::lock_guard lock(mutex_);
    readable_.insert({pid, path});
  }
  // Issuing a token for `path` fails.
  void failIssuing(const std::string& path) {
    std::lock_guard lock(mutex_);
    unissuable_.insert(path);
  }
  std::vector<Issued> issued() const {
    std::lock_guard lock(mutex_);
    return issued_;
  }
  std::vector<std::pair<std::string, std::string>> checks() const {
    std::lock_guard lock(mutex_);
    return checks_;
  }

  int sandboxCheck(const AuditToken& token) const override {
    if (token.isZero()) return -1;
    std::lock_guard lock(mutex_);
    auto it = sandboxed_.find(token.pid);
    return it == sandboxed_.end() ? 0 : it->second;
  }
  int sandboxCheck(const AuditToken& token, const std::string& operation,
                   const std::string& path) const override {
    std::lock_guard lock(mutex_);
    checks_.emplace_back(operation, path);
    if (token.isZero()) return -1;
    return readable_.contains({token.pid, path}) ? 0 : 1;
  }
  std::optional<std::string> issueReadOnlyExtension(const std::string& path,
                                                    const AuditToken& token) override {
    std::lock_guard lock(mutex_);
    if (token.isZero() || unissuable_.contains(path)) return std::nullopt;
    issued_.push_back({path, token});
    return "token:" + path + "@" + std::to_string(token.pid);
  }

 private:
  mutable std::mutex mutex_;
  std::map<pid_t, int> sandboxed_;
  std::set<std::pair<pid_t, std::string>> readable_;
  std::set<std::string> unissuable_;
  std::vector<Issued> issued_;
  mutable std::vector<std::pair<std::string, std::string>> checks_;
};

}  // namespace typhora::testing
