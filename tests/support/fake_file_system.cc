#include "support/fake_file_system.h"

#include "platform/plist_reader.h"

namespace typhora::testing {

void FakeFileSystem::writeFile(const std::string& path, std::string contents) {
  std::lock_guard lock(mutex_);
  files_[path] = std::move(contents);
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

bool FakeFileSystem::fileExists(const std::string& path) const {
  std::lock_guard lock(mutex_);
  return files_.contains(path);
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
