#include "platform/linux/fonts/font_face_names.h"

#include <ft2build.h>
#include FT_FREETYPE_H

#include <map>
#include <memory>

#include "platform/fd/regular_file.h"

namespace typhora {

namespace {

// A collection with more faces than this is not a font file anyone installs.
constexpr FT_Long kMaxFaces = 256;
constexpr std::size_t kMaxFontBytes = 256u << 20;

struct LibraryDeleter {
  void operator()(FT_Library library) const { FT_Done_FreeType(library); }
};
struct FaceDeleter {
  void operator()(FT_Face face) const { FT_Done_Face(face); }
};
using LibraryPtr = std::unique_ptr<std::remove_pointer_t<FT_Library>, LibraryDeleter>;
using FacePtr = std::unique_ptr<std::remove_pointer_t<FT_Face>, FaceDeleter>;

FacePtr openFace(FT_Library library, const std::vector<std::uint8_t>& bytes, FT_Long index) {
  FT_Face face = nullptr;
  if (FT_New_Memory_Face(library, bytes.data(), static_cast<FT_Long>(bytes.size()), index, &face) !=
      0)
    return nullptr;
  return FacePtr(face);
}

}  // namespace

std::optional<Value> FontFaceNames::read(const std::string& machinePath) {
  // Read first, without blocking: FreeType would open whatever stands at the path.
  const std::optional<std::vector<std::uint8_t>> bytes =
      RegularFile::read(machinePath, kMaxFontBytes, nullptr);
  if (!bytes) return std::nullopt;
  // One library per call: FreeType libraries are not to be shared between threads.
  FT_Library raw = nullptr;
  if (FT_Init_FreeType(&raw) != 0) return std::nullopt;
  LibraryPtr library(raw);
  FacePtr first = openFace(library.get(), *bytes, 0);
  if (!first) return std::nullopt;
  FT_Long faces = std::min<FT_Long>(first->num_faces, kMaxFaces);
  std::map<std::string, std::string> names;
  for (FT_Long index = 0; index < faces; ++index) {
    FacePtr face = index == 0 ? std::move(first) : openFace(library.get(), *bytes, index);
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
