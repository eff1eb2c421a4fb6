#include "platform/linux/linux_file_system.h"

#include <sys/stat.h>

#include "platform/plist_reader.h"

namespace typhora {

LinuxFileSystem::LinuxFileSystem(std::string root) : root_(std::move(root)) {
  while (!root_.empty() && root_.back() == '/') root_.pop_back();
}

std::string LinuxFileSystem::onDisk(const std::string& path) const {
  return root_ + path;
}

bool LinuxFileSystem::fileExists(const std::string& path) const {
  struct stat info {};
  return stat(onDisk(path).c_str(), &info) == 0;
}

std::optional<Value> LinuxFileSystem::readPropertyList(const std::string& path,
                                                       std::string* error) const {
  return PlistReader::readFile(onDisk(path), {}, error);
}

}  // namespace typhora
