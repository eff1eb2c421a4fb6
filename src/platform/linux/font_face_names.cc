#include "platform/linux/font_face_names.h"

#include <ft2build.h>
#include FT_FREETYPE_H

#include <map>
#include <memory>

namespace typhora {

namespace {

// A collection with more faces than this is not a font file anyone installs.
constexpr FT_Long kMaxFaces = 256;

struct LibraryDeleter {
  void operator()(FT_Library library) const { FT_Done_FreeType(library); }
};
struct FaceDeleter {
  void operator()(FT_Face face) const { FT_Done_Face(face); }
};
using LibraryPtr = std::unique_ptr<std::remove_pointer_t<FT_Library>, LibraryDeleter>;
using FacePtr = std::unique_ptr<std::remove_pointer_t<FT_Face>, FaceDeleter>;

FacePtr openFace(FT_Library library, const std::string& path, FT_Long index) {
  FT_Face face = nullptr;
  if (FT_New_Face(library, path.c_str(), index, &face) != 0) return nullptr;
  return FacePtr(face);
}

}  // namespace

std::optional<Value> FontFaceNames::read(const std::string& machinePath) {
  // One library per call: FreeType libraries are not to be shared between threads.
  FT_Library raw = nullptr;
  if (FT_Init_FreeType(&raw) != 0) return std::nullopt;
  LibraryPtr library(raw);
  FacePtr first = openFace(library.get(), machinePath, 0);
  if (!first) return std::nullopt;
  FT_Long faces = std::min<FT_Long>(first->num_faces, kMaxFaces);
  std::map<std::string, std::string> names;
  for (FT_Long index = 0; index < faces; ++index) {
    FacePtr face = index == 0 ? std::move(first) : openFace(library.get(), machinePath, index);
    if (!face) continue;
    const char* postScript = FT_Get_Postscript_Name(face.get());
    if (postScript != nullptr && face->family_name != nullptr)
      names.emplace(postScript, face->family_name);
  }
  if (names.empty()) return std::nullopt;
  std::vector<DictionaryEntry> entries;
  for (auto& [postScript, family] : names) entries.emplace_back(postScript, Value(family));
  return Value(Dictionary(std::move(entries)));
}

}  // namespace typhora
