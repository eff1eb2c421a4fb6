// Files held in memory by absolute path, read through the real property-list reader, with a
// count of reads per path.
#pragma once

#include <map>
#include <mutex>
#include <string>

#include "platform/file_system.h"

namespace typhora::testing {

class FakeFileSystem final : public FileSystem {
 public:
  void writeFile(const std::string& path, std::string contents);
  void removeFile(const std::string& path);
  int reads(const std::string& path) const;

  bool fileExists(const std::string& path) const override;
  std::optional<Value> readPropertyList(const std::string& path, std::string* error) const override;

 private:
  mutable std::mutex mutex_;
  std::map<std::string, std::string> files_;
  mutable std::map<std::string, int> reads_;
};

}  // namespace typhora::testing
