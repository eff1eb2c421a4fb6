// The PostScript and family names of the faces in a font file, read with FreeType: every face of
// a collection, and every named instance of a variable font.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>

#include "platform/value/value.h"

namespace typhora {

class FontFaceNames {
 public:
  // A dictionary from each face's PostScript name to its family name; nullopt when the file is
  // not a font FreeType can open or no face has both names.
  static std::optional<Value> read(const std::string& machinePath);
  // The same for a font file's bytes; nullopt with `error` saying why the bytes are no font (a
  // truncated sfnt file is refused even where FreeType would open it).
  static std::optional<Value> fromBytes(std::span<const std::uint8_t> bytes, std::string* error);
  // The most bytes a font file may have.
  static constexpr std::size_t kMaxFontBytes = 256u << 20;
};

}  // namespace typhora
