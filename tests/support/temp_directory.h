// A directory of its own for one test, removed with everything in it at the end.
#pragma once

#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

namespace typhora::testing {

class TempDirectory {
 public:
  TempDirectory() {
    std::string pattern = std::filesystem::temp_directory_path().string() + "/typhora-test-XXXXXX";
    path_ = mkdtemp(pattern.data());
    // Other users' processes in a test must be able to walk into it.
    chmod(path_.c_str(), 0755);
  }
  ~TempDirectory() {
    std::error_code ec;
    std::filesystem::remove_all(path_, ec);
  }
  TempDirectory(const TempDirectory&) = delete;
  TempDirectory& operator=(const TempDirectory&) = delete;

  const std::string& path() const { return path_; }
  // Writes `contents` to `relative` (made with its parent directories); answers the full path.
  std::string write(const std::string& relative, const std::string& contents) const {
    std::filesystem::path file = path_ + "/" + relative;
    std::filesystem::create_directories(file.parent_path());
    std::ofstream(file, std::ios::binary) << contents;
    return file.string();
  }

 private:
  std::string path_;
};

}  // namespace typhora::testing
