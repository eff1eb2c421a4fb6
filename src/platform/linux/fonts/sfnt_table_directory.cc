#include "platform/linux/fonts/sfnt_table_directory.h"

namespace typhora {

namespace {

constexpr std::uint32_t kTrueType = 0x00010000;
constexpr std::uint32_t kOpenType = 0x4F54544F;    // 'OTTO'
constexpr std::uint32_t kAppleTrue = 0x74727565;   // 'true'
constexpr std::uint32_t kCollection = 0x74746366;  // 'ttcf'
constexpr std::size_t kOffsetTableBytes = 12;
constexpr std::size_t kTableRecordBytes = 16;
constexpr std::size_t kCollectionHeaderBytes = 12;
// More fonts than this in one collection is a damaged header, not a collection.
constexpr std::uint32_t kMaxCollectionFonts = 4096;

bool readU32(std::span<const std::uint8_t> bytes, std::size_t at, std::uint32_t* value) {
  if (at > bytes.size() || bytes.size() - at < 4) return false;
  *value = (std::uint32_t{bytes[at]} << 24) | (std::uint32_t{bytes[at + 1]} << 16) |
           (std::uint32_t{bytes[at + 2]} << 8) | std::uint32_t{bytes[at + 3]};
  return true;
}

bool isFontSignature(std::uint32_t tag) {
  return tag == kTrueType || tag == kOpenType || tag == kAppleTrue;
}

bool fontIsComplete(std::span<const std::uint8_t> bytes, std::size_t at, std::string* error) {
  std::uint32_t tag = 0;
  std::uint32_t counts = 0;
  if (!readU32(bytes, at, &tag) || !readU32(bytes, at + 4, &counts)) {
    *error = "its table directory is cut off";
    return false;
  }
  if (!isFontSignature(tag)) {
    *error = "a font of the collection has no font signature";
    return false;
  }
  const std::size_t tables = counts >> 16;
  for (std::size_t i = 0; i < tables; ++i) {
    const std::size_t record = at + kOffsetTableBytes + i * kTableRecordBytes;
    std::uint32_t offset = 0;
    std::uint32_t length = 0;
    if (!readU32(bytes, record + 8, &offset) || !readU32(bytes, record + 12, &length)) {
      *error = "its table directory is cut off";
      return false;
    }
    if (offset > bytes.size() || length > bytes.size() - offset) {
      *error = "it is truncated: a table ends " +
               std::to_string(std::uint64_t{offset} + length - bytes.size()) +
               " bytes past the end of the file";
      return false;
    }
  }
  return true;
}

}  // namespace

bool SfntTableDirectory::isSfnt(std::span<const std::uint8_t> bytes) {
  std::uint32_t tag = 0;
  return readU32(bytes, 0, &tag) && (isFontSignature(tag) || tag == kCollection);
}

bool SfntTableDirectory::isComplete(std::span<const std::uint8_t> bytes, std::string* error) {
  std::uint32_t tag = 0;
  if (!readU32(bytes, 0, &tag)) {
    *error = "it is too short to be a font";
    return false;
  }
  if (tag != kCollection) return fontIsComplete(bytes, 0, error);
  std::uint32_t fonts = 0;
  if (bytes.size() < kCollectionHeaderBytes || !readU32(bytes, 8, &fonts) || fonts == 0 ||
      fonts > kMaxCollectionFonts) {
    *error = "its collection header is damaged";
    return false;
  }
  for (std::uint32_t i = 0; i < fonts; ++i) {
    std::uint32_t offset = 0;
    if (!readU32(bytes, kCollectionHeaderBytes + std::size_t{i} * 4, &offset)) {
      *error = "its collection header is cut off";
      return false;
    }
    if (!fontIsComplete(bytes, offset, error)) return false;
  }
  return true;
}

}  // namespace typhora
