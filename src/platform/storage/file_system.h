// The file operations of the daemon. Paths are the daemon's absolute paths as written
// ("/var/mobile/..."); the platform decides where they live on the machine.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/storage/file_stamp.h"
#include "platform/value/value.h"

namespace typhora {

class FileSystem {
 public:
  virtual ~FileSystem() = default;
  // Whether `path` names one entry by plain components: absolute, with no empty, "." or ".."
  // component and no zero byte. A path a client names is used only when this holds; others are
  // refused, never normalised.
  static bool isPlainAbsolutePath(std::string_view path);

  virtual bool fileExists(const std::string& path) const = 0;
  // One property list (CBOR or JSON) read from the file; nullopt with `error` set on failure.
  virtual std::optional<Value> readPropertyList(const std::string& path,
                                                std::string* error) const = 0;
  // The stamp of the regular file at `path`: a later stamp equal to it means the same bytes.
  // nullopt when there is no such file, when the file changed so recently that a write in place
  // could still leave its times as they are, or when the file system cannot tell.
  virtual std::optional<FileStamp> stampOf(const std::string& /*path*/) const {
    return std::nullopt;
  }
  // Removes the file or directory at `path`, with everything below a directory; false with
  // `error` set when it could not.
  virtual bool removeItem(const std::string& path, std::string* error) = 0;
  // Removes the directory at `path` only when it is empty; false with `error` set otherwise.
  virtual bool removeEmptyDirectory(const std::string& path, std::string* error) = 0;
  // The names of the entries of directory `path`, in no set order; nullopt when it cannot be
  // listed.
  virtual std::optional<std::vector<std::string>> contentsOfDirectory(
      const std::string& path) const = 0;
};

}  // namespace typhora
