// Files held in memory by absolute path, read through the real property-list reader, with a
// count of reads per path.
#pragma once

#include <map>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "platform/storage/file_system.h"

namespace typhora::testing {

class FakeFileSystem final : public FileSystem {
 public:
  void writeFile(const std::string& path, std::string contents);
  void removeFile(const std::string& path);
  int reads(const std::string& path) const;
  // An empty directory; directories holding files exist without this.
  void makeDirectory(const std::string& path);
  // Removing `path` fails with `error`; listing it fails when `unlistable`.
  void failRemoval(const std::string& path, std::string error);
  void makeUnlistable(const std::string& path);
  std::vector<std::string> removed() const;

  bool fileExists(const std::string& path) const override;
  std::optional<Value> readPropertyList(const std::string& path, std::string* error) const override;
  bool removeItem(const std::string& path, std::string* error) override;
  bool removeEmptyDirectory(const std::string& path, std::string* error) override;
  std::optional<std::vector<std::string>> contentsOfDirectory(
      const std::string& path) const override;

 private:
  mutable std::mutex mutex_;
  bool isDirectoryLocked(const std::string& path) const;
  std::map<std::string, std::string> files_;
  std::set<std::string> directories_;
  std::map<std::string, std::string> removalErrors_;
  std::set<std::string> unlistable_;
  std::vector<std::string> removed_;
  mutable std::map<std::string, int> reads_;
};

}  // namespace typhora::testing
