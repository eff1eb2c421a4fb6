#include "platform/linux/inotify_tree.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>

#include "platform/log.h"

namespace typhora {

namespace fs = std::filesystem;

namespace {

constexpr std::uint32_t kTreeEvents = IN_CREATE | IN_DELETE | IN_MODIFY | IN_CLOSE_WRITE |
                                      IN_MOVED_FROM | IN_MOVED_TO | IN_ATTRIB | IN_DELETE_SELF |
                                      IN_MOVE_SELF | IN_ONLYDIR | IN_EXCL_UNLINK;

std::string trimmed(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

bool isWithin(const std::string& path, const std::string& directory) {
  return path == directory ||
         (path.starts_with(directory) && (directory == "/" || path[directory.size()] == '/'));
}

}  // namespace

InotifyTree::InotifyTree(std::vector<std::string> roots)
    : fd_(inotify_init1(IN_NONBLOCK | IN_CLOEXEC)) {
  for (std::string& root : roots) roots_.push_back(trimmed(std::move(root)));
  if (!fd_.valid()) {
    TYLog_Error(kTYLogTyphoraDaemon, "file events: inotify: %s", std::strerror(errno));
    return;
  }
  for (const std::string& root : roots_) watchRoot(root);
}

bool InotifyTree::isUnderRoot(const std::string& path) const {
  for (const std::string& root : roots_)
    if (isWithin(path, root)) return true;
  return false;
}

void InotifyTree::watchRoot(const std::string& root) {
  std::error_code ec;
  if (fs::is_directory(root, ec)) {
    waitingRoots_.erase(root);
    watchTree(root, nullptr);
    return;
  }
  // Wait for it from the nearest ancestor that exists; that watch reports only the way down.
  waitingRoots_.insert(root);
  for (fs::path ancestor = fs::path(root).parent_path();; ancestor = ancestor.parent_path()) {
    // IN_MASK_ADD: the ancestor may be watched already, as part of another root's tree.
    int wd = inotify_add_watch(fd_.get(), ancestor.c_str(),
                               IN_CREATE | IN_MOVED_TO | IN_ONLYDIR | IN_MASK_ADD);
    if (wd >= 0) {
      directories_[wd] = ancestor.string();
      return;
    }
    if (ancestor == ancestor.parent_path()) return;
  }
}

void InotifyTree::watchTree(const std::string& directory, std::vector<std::string>* found) {
  int wd = inotify_add_watch(fd_.get(), directory.c_str(), kTreeEvents);
  if (wd < 0) {
    if (errno == ENOSPC && !warnedLimit_) {
      warnedLimit_ = true;
      TYLog_Error(kTYLogTyphoraDaemon, "file events: watch limit reached at %@", directory);
    }
    return;
  }
  directories_[wd] = directory;
  std::error_code ec;
  for (fs::directory_iterator it(directory, ec), end; !ec && it != end; it.increment(ec)) {
    const std::string path = it->path().string();
    if (found != nullptr) found->push_back(path);
    if (it->is_directory(ec) && !it->is_symlink(ec)) watchTree(path, found);
  }
}

void InotifyTree::handle(int wd, std::uint32_t mask, const std::string& name,
                         std::vector<std::string>* out) {
  auto it = directories_.find(wd);
  if (it == directories_.end()) return;
  const std::string directory = it->second;
  if (mask & IN_IGNORED) {
    directories_.erase(it);
    // A root that went away is waited for again.
    for (const std::string& root : roots_)
      if (root == directory) watchRoot(root);
    return;
  }
  const std::string path = name.empty() ? directory : directory + "/" + name;
  if (!isUnderRoot(path)) {
    // A watch on the way down to a root that does not exist yet.
    for (const std::string& root : std::set<std::string>(waitingRoots_)) {
      if (!isWithin(root, path)) continue;
      std::error_code ec;
      if (fs::is_directory(root, ec)) {
        waitingRoots_.erase(root);
        out->push_back(root);
        watchTree(root, out);
      } else {
        watchRoot(root);  // one level further down
      }
    }
    return;
  }
  out->push_back(path);
  if ((mask & IN_ISDIR) && (mask & (IN_CREATE | IN_MOVED_TO))) watchTree(path, out);
}

std::vector<std::string> InotifyTree::readChanges() {
  std::vector<std::string> changes;
  alignas(inotify_event) std::array<char, 64 * 1024> buffer{};
  for (;;) {
    ssize_t n = read(fd_.get(), buffer.data(), buffer.size());
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    for (ssize_t offset = 0; offset < n;) {
      const auto* event = reinterpret_cast<const inotify_event*>(buffer.data() + offset);
      offset += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
      if (event->mask & IN_Q_OVERFLOW) {
        changes.insert(changes.end(), roots_.begin(), roots_.end());
        continue;
      }
      handle(event->wd, event->mask, event->len > 0 ? std::string(event->name) : std::string(),
             &changes);
    }
  }
  return changes;
}

}  // namespace typhora
