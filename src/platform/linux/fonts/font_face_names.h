// The PostScript and family names of the faces in a font file, read with FreeType.
#pragma once

#include <optional>
#include <string>

#include "platform/value/value.h"

namespace typhora {

class FontFaceNames {
 public:
  // A dictionary from each face's PostScript name to its family name; nullopt when the file is
  // not a font FreeType can open or no face has both names.
  static std::optional<Value> read(const std::string& machinePath);
};

}  // namespace typhora
