// inotify watches over directory trees: every directory below a root is watched, directories
// that appear later are added as they appear, and a root that does not exist yet is waited for
// from its nearest existing ancestor. Not thread-safe: one owner reads its events.
#pragma once

#include <map>
#include <set>
#include <string>
#include <vector>

#include "platform/linux/unique_fd.h"

namespace typhora {

class InotifyTree {
 public:
  // `roots` are machine paths.
  explicit InotifyTree(std::vector<std::string> roots);
  bool valid() const { return fd_.valid(); }
  int fd() const { return fd_.get(); }

  // Reads every pending event and answers the machine paths they concern under the roots:
  // changed files and directories, and everything found in directories that appeared. A lost
  // queue (overflow) answers the roots themselves.
  std::vector<std::string> readChanges();

 private:
  void watchRoot(const std::string& root);
  void watchTree(const std::string& directory, std::vector<std::string>* found);
  bool isUnderRoot(const std::string& path) const;
  void handle(int wd, std::uint32_t mask, const std::string& name, std::vector<std::string>* out);

  std::vector<std::string> roots_;
  UniqueFd fd_;
  std::map<int, std::string> directories_;  // watch descriptor -> machine path
  std::set<std::string> waitingRoots_;      // roots not there yet
  bool warnedLimit_ = false;
};

}  // namespace typhora
