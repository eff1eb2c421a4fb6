// The inotify watches over a set of directory trees, with every directory below them watched.
//
// Directories that appear later (made one by one, by `mkdir -p`, or moved in) are watched as
// their events are read, and what they already hold is reported, since it was made before the
// watch existed. A tree that is not there yet is watched through its nearest existing ancestor
// and taken up when it appears; a tree that goes away goes back to that state.
//
// Paths are taken and reported as the daemon's paths; on disk they live under the device root.
// Not thread-safe: one queue owns an instance.
#pragma once

#include <cstdint>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/fd/unique_fd.h"

struct inotify_event;

namespace typhora {

class InotifyTree {
 public:
  // `deviceRoot` is the directory the daemon's "/" maps to; `trees` are daemon paths.
  InotifyTree(std::string deviceRoot, std::vector<std::string> trees);

  // Opens the inotify instance (non-blocking) and watches every tree; reports nothing.
  bool start(std::string* error);
  int fd() const { return fd_.get(); }

  // Reads what is available without blocking (a bounded amount) and appends the daemon paths of
  // the events inside the trees to `paths`. After a queue overflow the trees themselves are
  // reported, so that whoever consumes the paths rescans them.
  void readAvailable(std::vector<std::string>* paths);

 private:
  void handle(const inotify_event& event, std::vector<std::string>* paths);
  void forgetWatch(int wd, std::vector<std::string>* paths);
  void recoverFromOverflow(std::vector<std::string>* paths);
  // Watches the pending trees that exist now, and the nearest ancestors of the others.
  void resolvePending(std::vector<std::string>* paths);
  // Watches `dir` and every directory below it; reports their entries when `paths` is set.
  void watchTree(const std::string& dir, bool isTreeRoot, std::vector<std::string>* paths);
  bool addWatch(const std::string& path, std::uint32_t mask);
  void forgetSubtree(const std::string& dir);
  bool isTreeRoot(const std::string& onDiskPath) const;
  bool inTrees(const std::string& onDiskPath) const;
  std::string onDisk(const std::string& daemonPath) const;
  std::string daemonPath(const std::string& onDiskPath) const;

  std::string deviceRoot_;          // without a trailing "/"; empty for "/"
  std::vector<std::string> trees_;  // on-disk paths
  std::set<std::string> pending_;   // trees not there yet
  UniqueFd fd_;
  std::unordered_map<int, std::string> watches_;  // watch descriptor -> on-disk directory
  bool warnedAboutLimit_ = false;
};

}  // namespace typhora
