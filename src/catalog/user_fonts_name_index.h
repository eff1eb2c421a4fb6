// The names of one loaded generation of the user-fonts information, indexed: a look-up costs a
// hash probe instead of a walk over every record. Answers are exactly those of walking the
// information in its order (by path): the first matching file decides a name's enabled state, and
// every matching file is listed in that order. The index holds the information it was built
// from, so the paths it hands out stay valid as long as the index does.
#pragma once

#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/value/value.h"

namespace typhora {

class UserFontsNameIndex {
 public:
  struct File {
    std::string_view path;
    std::string_view family;  // for a PostScript name: the family it maps to in this file
    bool enabled = true;
  };

  // `info`: the user-fonts information, or null for none. Records and names of unexpected types
  // match nothing, as when walking.
  explicit UserFontsNameIndex(Value info);

  // The files that have a font of `familyName`, in path order; empty when it is unknown.
  const std::vector<File>& filesOfFamily(std::string_view familyName) const;
  // The files that hold the PostScript name, in path order; empty when it is unknown.
  const std::vector<File>& filesOfPostScriptName(std::string_view postScriptName) const;

 private:
  struct Hash {
    using is_transparent = void;
    std::size_t operator()(std::string_view text) const {
      return std::hash<std::string_view>{}(text);
    }
  };
  using Index = std::unordered_map<std::string_view, std::vector<File>, Hash, std::equal_to<>>;

  static const std::vector<File>& lookUp(const Index& index, std::string_view name);

  Value info_;
  Index byFamily_;
  Index byPostScriptName_;
};

}  // namespace typhora
