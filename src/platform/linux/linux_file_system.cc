#include "platform/linux/linux_file_system.h"

#include <sys/stat.h>

#include <filesystem>

#include "platform/plist_reader.h"

namespace typhora {

LinuxFileSystem::LinuxFileSystem(std::string root) : root_(std::move(root)) {}

std::string LinuxFileSystem::onDisk(const std::string& path) const {
  return root_.onDisk(path);
}

bool LinuxFileSystem::fileExists(const std::string& path) const {
  struct stat info {};
  return stat(onDisk(path).c_str(), &info) == 0;
}

std::optional<Value> LinuxFileSystem::readPropertyList(const std::string& path,
                                                       std::string* error) const {
  return PlistReader::readFile(onDisk(path), {}, error);
}

bool LinuxFileSystem::removeItem(const std::string& path, std::string* error) {
  std::error_code ec;
  // remove_all answers 0 without an error for a path that does not exist; that is a failure
  // to remove it.
  if (std::filesystem::remove_all(onDisk(path), ec) > 0 && !ec) return true;
  if (error != nullptr) {
    *error =
        ec ? ec.message() : std::make_error_code(std::errc::no_such_file_or_directory).message();
  }
  return false;
}

std::optional<std::vector<std::string>> LinuxFileSystem::contentsOfDirectory(
    const std::string& path) const {
  std::error_code ec;
  std::filesystem::directory_iterator it(onDisk(path), ec);
  if (ec) return std::nullopt;
  std::vector<std::string> names;
  for (; it != std::filesystem::directory_iterator(); it.increment(ec)) {
    if (ec) return std::nullopt;
    names.push_back(it->path().filename().string());
  }
  if (ec) return std::nullopt;
  return names;
}

}  // namespace typhora
