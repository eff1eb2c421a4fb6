#include "platform/linux/files/inotify_tree.h"

#include <dirent.h>
#include <sys/inotify.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "platform/log/log.h"

namespace typhora {
namespace {

constexpr std::uint32_t kTreeMask = IN_CREATE | IN_DELETE | IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB |
                                    IN_MOVED_FROM | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF |
                                    IN_ONLYDIR | IN_EXCL_UNLINK;
// An ancestor of a tree not there yet only has to tell when directories appear in it, or when
// it goes away itself.
constexpr std::uint32_t kAncestorMask =
    IN_CREATE | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
// Reads per call, so that a directory busy without pause cannot hold the reader forever.
constexpr int kReadsPerCall = 16;
constexpr int kResolveAttempts = 64;

bool isDirectory(const std::string& path) {
  struct stat info {};
  return stat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
}

std::string join(const std::string& dir, const char* name) {
  // Appended in place: g++ 12 at -O3 takes "/" + std::string(name) for an overlapping copy.
  std::string path = dir == "/" ? std::string() : dir;
  path += '/';
  path += name;
  return path;
}

std::string parentOf(const std::string& path) {
  const auto slash = path.rfind('/');
  return slash == 0 || slash == std::string::npos ? "/" : path.substr(0, slash);
}

std::string nearestExistingAncestor(const std::string& path) {
  std::string dir = parentOf(path);
  while (dir != "/" && !isDirectory(dir)) dir = parentOf(dir);
  return dir;
}

bool entryIsDirectory(const std::string& path, const dirent& entry) {
  if (entry.d_type != DT_UNKNOWN) return entry.d_type == DT_DIR;
  struct stat info {};
  return lstat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
}

}  // namespace

InotifyTree::InotifyTree(std::string deviceRoot, std::vector<std::string> trees)
    : deviceRoot_(std::move(deviceRoot)) {
  while (!deviceRoot_.empty() && deviceRoot_.back() == '/') deviceRoot_.pop_back();
  for (std::string& tree : trees) {
    while (tree.size() > 1 && tree.back() == '/') tree.pop_back();
    trees_.push_back(onDisk(tree));
  }
}

bool InotifyTree::start(std::string* error) {
  fd_.reset(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  if (!fd_.valid()) {
    *error = std::string("inotify_init1: ") + std::strerror(errno);
    return false;
  }
  pending_.insert(trees_.begin(), trees_.end());
  resolvePending(nullptr);
  return true;
}

void InotifyTree::readAvailable(std::vector<std::string>* paths) {
  alignas(inotify_event) char buffer[64 * 1024];
  for (int attempt = 0; attempt < kReadsPerCall; ++attempt) {
    const ssize_t n = ::read(fd_.get(), buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      if (n < 0 && errno != EAGAIN) {
        TYLog_Error(kTYLogTyphoraDaemon, "file events: read: %s", std::strerror(errno));
      }
      return;
    }
    for (ssize_t offset = 0; offset < n;) {
      const auto* event = reinterpret_cast<const inotify_event*>(buffer + offset);
      handle(*event, paths);
      offset += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
    }
  }
}

void InotifyTree::handle(const inotify_event& event, std::vector<std::string>* paths) {
  if ((event.mask & IN_Q_OVERFLOW) != 0) return recoverFromOverflow(paths);
  if ((event.mask & IN_IGNORED) != 0) return forgetWatch(event.wd, paths);
  auto watch = watches_.find(event.wd);
  if (watch == watches_.end()) return;  // a watch dropped since
  const std::string path = event.len > 0 ? join(watch->second, event.name) : watch->second;
  if ((event.mask & IN_MOVE_SELF) != 0 && isTreeRoot(path)) {
    // The tree's directory moved elsewhere: what its watches say is no longer where it is.
    forgetSubtree(path);
    pending_.insert(path);
    resolvePending(paths);
    return;
  }
  const bool isDir = (event.mask & IN_ISDIR) != 0;
  if (isDir && (event.mask & IN_MOVED_FROM) != 0) forgetSubtree(path);
  if (isDir && (event.mask & (IN_CREATE | IN_MOVED_TO)) != 0) {
    if (inTrees(path)) watchTree(path, false, paths);
    if (!pending_.empty()) resolvePending(paths);
  }
  if (inTrees(path)) paths->push_back(daemonPath(path));
}

void InotifyTree::forgetWatch(int wd, std::vector<std::string>* paths) {
  auto watch = watches_.find(wd);
  if (watch == watches_.end()) return;
  const std::string path = watch->second;
  watches_.erase(watch);
  if (isTreeRoot(path)) pending_.insert(path);  // the tree went away: wait for it again
  if (!pending_.empty()) resolvePending(paths);
}

void InotifyTree::recoverFromOverflow(std::vector<std::string>* paths) {
  TYLog_Error(kTYLogTyphoraDaemon, "file events: the event queue overflowed; rescanning");
  // Directories made during the overflow have no watch yet: walk the trees again.
  for (const std::string& tree : trees_) {
    if (pending_.count(tree) == 0) watchTree(tree, true, nullptr);
    paths->push_back(daemonPath(tree));
  }
  if (!pending_.empty()) resolvePending(paths);
}

void InotifyTree::resolvePending(std::vector<std::string>* paths) {
  const std::set<std::string> pending = pending_;
  for (const std::string& tree : pending) {
    // The ancestor's watch is added before looking again, so nothing made meanwhile is missed.
    for (int attempt = 0; attempt < kResolveAttempts; ++attempt) {
      if (isDirectory(tree)) {
        pending_.erase(tree);
        if (paths != nullptr) paths->push_back(daemonPath(tree));
        watchTree(tree, true, paths);
        break;
      }
      const std::string ancestor = nearestExistingAncestor(tree);
      if (!addWatch(ancestor, kAncestorMask)) break;
      if (nearestExistingAncestor(tree) == ancestor && !isDirectory(tree)) break;
    }
  }
}

void InotifyTree::watchTree(const std::string& dir, bool isTreeRoot,
                            std::vector<std::string>* paths) {
  std::vector<std::string> stack{dir};
  while (!stack.empty()) {
    const std::string current = std::move(stack.back());
    stack.pop_back();
    // Below a tree's root, symbolic links are entries, never directories to descend into.
    const std::uint32_t follow = isTreeRoot && current == dir ? 0 : IN_DONT_FOLLOW;
    if (!addWatch(current, kTreeMask | follow)) continue;
    DIR* handle = opendir(current.c_str());
    if (handle == nullptr) continue;
    while (const dirent* entry = readdir(handle)) {
      if (std::strcmp(entry->d_name, ".") == 0 || std::strcmp(entry->d_name, "..") == 0) continue;
      std::string child = join(current, entry->d_name);
      if (paths != nullptr) paths->push_back(daemonPath(child));
      if (entryIsDirectory(child, *entry)) stack.push_back(std::move(child));
    }
    closedir(handle);
  }
}

bool InotifyTree::addWatch(const std::string& path, std::uint32_t mask) {
  const int wd = inotify_add_watch(fd_.get(), path.c_str(), mask | IN_MASK_ADD);
  if (wd >= 0) {
    watches_[wd] = path;
    return true;
  }
  if ((errno == ENOSPC || errno == ENOMEM) && !warnedAboutLimit_) {
    // Keep going with the watches there are; the limit is fs.inotify.max_user_watches.
    warnedAboutLimit_ = true;
    TYLog_Error(kTYLogTyphoraDaemon, "file events: cannot watch %s: %s", daemonPath(path),
                "the limit of inotify watches is reached");
  }
  return false;
}

void InotifyTree::forgetSubtree(const std::string& dir) {
  const std::string below = dir + "/";
  for (auto it = watches_.begin(); it != watches_.end();) {
    if (it->second == dir || it->second.starts_with(below)) {
      inotify_rm_watch(fd_.get(), it->first);
      it = watches_.erase(it);
    } else {
      ++it;
    }
  }
}

bool InotifyTree::isTreeRoot(const std::string& onDiskPath) const {
  for (const std::string& tree : trees_) {
    if (tree == onDiskPath) return true;
  }
  return false;
}

bool InotifyTree::inTrees(const std::string& onDiskPath) const {
  for (const std::string& tree : trees_) {
    if (pending_.count(tree) != 0) continue;
    if (onDiskPath == tree || tree == "/" ||
        (onDiskPath.starts_with(tree) && onDiskPath[tree.size()] == '/')) {
      return true;
    }
  }
  return false;
}

std::string InotifyTree::onDisk(const std::string& daemonPath) const {
  if (daemonPath == "/" && !deviceRoot_.empty()) return deviceRoot_;
  return deviceRoot_ + daemonPath;
}

std::string InotifyTree::daemonPath(const std::string& onDiskPath) const {
  std::string path = onDiskPath.substr(std::min(deviceRoot_.size(), onDiskPath.size()));
  return path.empty() ? "/" : path;
}

}  // namespace typhora
