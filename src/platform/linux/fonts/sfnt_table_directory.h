// The table directories of an sfnt font file (TrueType, OpenType, or a collection of them), read
// only far enough to tell whether every table they list lies inside the file. FreeType loads
// tables lazily, so a truncated file still opens and names its faces; this catches it first.
#pragma once

#include <cstdint>
#include <span>
#include <string>

namespace typhora {

class SfntTableDirectory {
 public:
  // True when the bytes start with an sfnt or collection signature.
  static bool isSfnt(std::span<const std::uint8_t> bytes);
  // True when every table directory, and every table it lists, lies inside `bytes`; false with
  // `error` set otherwise.
  static bool isComplete(std::span<const std::uint8_t> bytes, std::string* error);
};

}  // namespace typhora
