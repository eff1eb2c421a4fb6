#include "platform/storage/file_system.h"

#include <algorithm>

namespace typhora {

bool FileSystem::isPlainAbsolutePath(std::string_view path) {
  if (!path.starts_with('/') || path.find('\0') != std::string_view::npos) return false;
  std::size_t start = 1;
  for (;;) {
    const std::size_t end = std::min(path.find('/', start), path.size());
    const std::string_view component = path.substr(start, end - start);
    if (component.empty() || component == "." || component == "..") return false;
    if (end == path.size()) return true;
    start = end + 1;
  }
}

}  // namespace typhora
