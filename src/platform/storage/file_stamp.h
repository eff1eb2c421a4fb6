// What tells one version of a file from another without reading it. A file replaced by rename
// has another inode; one written in place has another size or other times.
#pragma once

#include <cstdint>

namespace typhora {

struct FileStamp {
  std::uint64_t device = 0;
  std::uint64_t inode = 0;
  std::int64_t size = 0;
  std::int64_t modifiedSeconds = 0;
  std::int64_t modifiedNanoseconds = 0;
  std::int64_t changedSeconds = 0;
  std::int64_t changedNanoseconds = 0;

  friend bool operator==(const FileStamp&, const FileStamp&) = default;
};

}  // namespace typhora
