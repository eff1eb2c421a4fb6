#include "platform/linux/fonts/font_face_names.h"

#include <ft2build.h>
#include FT_FREETYPE_H
#include FT_MULTIPLE_MASTERS_H

#include <map>
#include <memory>
#include <string_view>

#include "platform/linux/fonts/sfnt_table_directory.h"
#include "platform/fd/regular_file.h"

namespace typhora {

namespace {

// A collection with more faces (or a font with more named instances) than this is not a font
// file anyone installs.
constexpr FT_Long kMaxFaces = 256;

struct LibraryDeleter {
  void operator()(FT_Library library) const { FT_Done_FreeType(library); }
};
struct FaceDeleter {
  void operator()(FT_Face face) const { FT_Done_Face(face); }
};
using LibraryPtr = std::unique_ptr<std::remove_pointer_t<FT_Library>, LibraryDeleter>;
using FacePtr = std::unique_ptr<std::remove_pointer_t<FT_Face>, FaceDeleter>;

FacePtr openFace(FT_Library library, std::span<const std::uint8_t> bytes, FT_Long index) {
  FT_Face face = nullptr;
  if (FT_New_Memory_Face(library, bytes.data(), static_cast<FT_Long>(bytes.size()), index, &face) !=
      0)
    return nullptr;
  return FacePtr(face);
}

// A face whose name table has no valid PostScript name is known by its family name, with
// every character PostScript names do not allow made a hyphen.
std::string postScriptNameFromFamily(const char* family) {
  std::string name = family;
  for (char& c : name) {
    const bool allowed =
        c > ' ' && c < 0x7f && std::string_view("[](){}<>/%").find(c) == std::string_view::npos;
    if (!allowed) c = '-';
  }
  return name;
}

void addNames(FT_Face face, std::map<std::string, std::string>* names) {
  if (face->family_name == nullptr) return;
  const char* postScript = FT_Get_Postscript_Name(face);
  names->emplace(
      postScript != nullptr ? std::string(postScript) : postScriptNameFromFamily(face->family_name),
      face->family_name);
}

// A variable font's named instances: each is the face at the instance's design coordinates,
// named as those coordinates name it ("<prefix>_700wght"); the instance at the default
// coordinates is the face itself.
void addNamedInstances(FT_Library library, FT_Face face,
                       std::map<std::string, std::string>* names) {
  FT_MM_Var* variations = nullptr;
  if (!FT_HAS_MULTIPLE_MASTERS(face) || FT_Get_MM_Var(face, &variations) != 0) return;
  const FT_UInt instances = std::min<FT_UInt>(variations->num_namedstyles, kMaxFaces);
  for (FT_UInt i = 0; i < instances; ++i) {
    if (FT_Set_Var_Design_Coordinates(face, variations->num_axis,
                                      variations->namedstyle[i].coords) == 0)
      addNames(face, names);
  }
  FT_Done_MM_Var(library, variations);
}

}  // namespace

std::optional<Value> FontFaceNames::read(const std::string& machinePath) {
  // Read first, without blocking: FreeType would open whatever stands at the path.
  const std::optional<std::vector<std::uint8_t>> bytes =
      RegularFile::read(machinePath, kMaxFontBytes, nullptr);
  if (!bytes) return std::nullopt;
  std::string ignored;
  return fromBytes(*bytes, &ignored);
}

std::optional<Value> FontFaceNames::fromBytes(std::span<const std::uint8_t> bytes,
                                              std::string* error) {
  if (SfntTableDirectory::isSfnt(bytes) && !SfntTableDirectory::isComplete(bytes, error))
    return std::nullopt;
  // One library per call: FreeType libraries are not to be shared between threads.
  FT_Library raw = nullptr;
  if (FT_Init_FreeType(&raw) != 0) {
    *error = "FreeType cannot start";
    return std::nullopt;
  }
  LibraryPtr library(raw);
  FacePtr first = openFace(library.get(), bytes, 0);
  if (!first) {
    *error = "it is not a font file FreeType can open";
    return std::nullopt;
  }
  const FT_Long faces = std::min<FT_Long>(first->num_faces, kMaxFaces);
  std::map<std::string, std::string> names;
  for (FT_Long index = 0; index < faces; ++index) {
    FacePtr face = index == 0 ? std::move(first) : openFace(library.get(), bytes, index);
    if (!face) continue;
    addNames(face.get(), &names);
    addNamedInstances(library.get(), face.get(), &names);
  }
  if (names.empty()) {
    *error = "none of its faces has a PostScript and a family name";
    return std::nullopt;
  }
  std::vector<DictionaryEntry> entries;
  for (auto& [postScript, family] : names) entries.emplace_back(postScript, Value(family));
  return Value(Dictionary(std::move(entries)));
}

}  // namespace typhora
