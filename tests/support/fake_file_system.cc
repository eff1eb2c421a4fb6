#include "support/fake_file_system.h"

#include <algorithm>

#include "platform/value/plist_reader.h"

namespace typhora::testing {

void FakeFileSystem::writeFile(const std::string& path, std::string contents) {
  std::lock_guard lock(mutex_);
  files_[path] = std::move(contents);
  // Like a real file system, the directories on the way stay when the file goes.
  for (std::size_t slash = path.find('/', 1); slash != std::string::npos;
       slash = path.find('/', slash + 1))
    directories_.insert(path.substr(0, slash));
}

void FakeFileSystem::removeFile(const std::string& path) {
  std::lock_guard lock(mutex_);
  files_.erase(path);
}

int FakeFileSystem::reads(const std::string& path) const {
  std::lock_guard lock(mutex_);
  auto it = reads_.find(path);
  return it == reads_.end() ? 0 : it->second;
}

void FakeFileSystem::makeDirectory(const std::string& path) {
  std::lock_guard lock(mutex_);
  directories_.insert(path);
}

void FakeFileSystem::failRemoval(const std::string& path, std::string error) {
  std::lock_guard lock(mutex_);
  removalErrors_[path] = std::move(error);
}

void FakeFileSystem::makeUnlistable(const std::string& path) {
  std::lock_guard lock(mutex_);
  unlistable_.insert(path);
}

std::vector<std::string> FakeFileSystem::removed() const {
  std::lock_guard lock(mutex_);
  return removed_;
}

namespace {

bool isBelow(const std::string& path, const std::string& directory) {
  return path.size() > directory.size() + 1 && path.starts_with(directory) &&
         path[directory.size()] == '/';
}

}  // namespace

bool FakeFileSystem::isDirectoryLocked(const std::string& path) const {
  if (directories_.contains(path)) return true;
  for (const auto& [file, contents] : files_)
    if (isBelow(file, path)) return true;
  for (const auto& directory : directories_)
    if (isBelow(directory, path)) return true;
  return false;
}

bool FakeFileSystem::fileExists(const std::string& path) const {
  std::lock_guard lock(mutex_);
  return files_.contains(path) || isDirectoryLocked(path);
}

bool FakeFileSystem::removeItem(const std::string& path, std::string* error) {
  std::lock_guard lock(mutex_);
  if (auto it = removalErrors_.find(path); it != removalErrors_.end()) {
    if (error != nullptr) *error = it->second;
    return false;
  }
  if (!files_.contains(path) && !isDirectoryLocked(path)) {
    if (error != nullptr) *error = "No such file or directory";
    return false;
  }
  removed_.push_back(path);
  files_.erase(path);
  directories_.erase(path);
  std::erase_if(files_, [&](const auto& entry) { return isBelow(entry.first, path); });
  std::erase_if(directories_, [&](const auto& directory) { return isBelow(directory, path); });
  return true;
}

bool FakeFileSystem::removeEmptyDirectory(const std::string& path, std::string* error) {
  {
    std::lock_guard lock(mutex_);
    const bool hasChildren =
        std::any_of(files_.begin(), files_.end(),
                    [&](const auto& entry) { return isBelow(entry.first, path); }) ||
        std::any_of(directories_.begin(), directories_.end(),
                    [&](const auto& directory) { return isBelow(directory, path); });
    if (!isDirectoryLocked(path) || hasChildren) {
      if (error != nullptr) *error = hasChildren ? "Directory not empty" : "Not a directory";
      return false;
    }
  }
  return removeItem(path, error);
}

std::optional<std::vector<std::string>> FakeFileSystem::contentsOfDirectory(
    const std::string& path) const {
  std::lock_guard lock(mutex_);
  if (unlistable_.contains(path) || !isDirectoryLocked(path)) return std::nullopt;
  std::set<std::string> names;
  auto addChild = [&](const std::string& below) {
    if (!isBelow(below, path)) return;
    std::string rest = below.substr(path.size() + 1);
    names.insert(rest.substr(0, rest.find('/')));
  };
  for (const auto& [file, contents] : files_) addChild(file);
  for (const auto& directory : directories_) addChild(directory);
  return std::vector<std::string>(names.begin(), names.end());
}

std::optional<Value> FakeFileSystem::readPropertyList(const std::string& path,
                                                      std::string* error) const {
  std::string contents;
  {
    std::lock_guard lock(mutex_);
    ++reads_[path];
    auto it = files_.find(path);
    if (it == files_.end()) {
      if (error != nullptr) *error = "cannot open: No such file or directory";
      return std::nullopt;
    }
    contents = it->second;
  }
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(contents.data());
  return PlistReader::read({bytes, contents.size()}, {}, error);
}

}  // namespace typhora::testing
