// Where the daemon's absolute paths ("/var/mobile/...") live on this machine: under one device
// root directory, "/" in production and a temporary directory in tests and the demo.
#pragma once

#include <string>
#include <string_view>

namespace typhora {

class DeviceRoot {
 public:
  explicit DeviceRoot(std::string root) : prefix_(std::move(root)) {
    while (!prefix_.empty() && prefix_.back() == '/') prefix_.pop_back();
  }
  // The root directory's machine path.
  std::string path() const { return prefix_.empty() ? std::string("/") : prefix_; }
  // The machine path of the daemon's absolute path `path`.
  std::string onDisk(std::string_view path) const { return prefix_ + std::string(path); }
  // Whether `name` can stand for exactly one entry of a directory: not empty, not "." or "..",
  // no "/" and no zero byte. Names that come from outside become file names only if this holds.
  static bool isSingleComponent(std::string_view name) {
    return !name.empty() && name != "." && name != ".." &&
           name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
  }
  // The daemon's path of a machine path under the root, or "" when it is not under it.
  std::string fromDisk(std::string_view machinePath) const {
    if (!machinePath.starts_with(prefix_)) return {};
    std::string_view rest = machinePath.substr(prefix_.size());
    if (!rest.empty() && rest.front() != '/') return {};
    return std::string(rest.empty() ? "/" : rest);
  }

 private:
  std::string prefix_;  // without a trailing "/"; empty for "/"
};

}  // namespace typhora
