// The user-fonts file as the daemon's store reads it: the file's bytes, kept only as a
// dictionary of records, then each record's family names and state as name resolution and
// filtering read them.
#include <cstdint>
#include <set>

#include "catalog/font_record.h"
#include "platform/value/plist_reader.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::optional<typhora::Value> info = typhora::PlistReader::read({data, size});
  const typhora::Dictionary* records = info ? info->asDictionary() : nullptr;
  if (records == nullptr) return 0;
  std::set<std::string> seen;
  for (const auto& [path, record] : *records) {
    typhora::FontRecord::isDisabled(record);
    for (const std::string& family : typhora::FontRecord::familyNames(record)) {
      if (!typhora::FontRecord::hasFamily(record, family)) __builtin_trap();
      seen.insert(family);
    }
    if (!seen.empty() && !typhora::FontRecord::familyNames(record).empty() &&
        !typhora::FontRecord::sharesFamily(record, seen)) {
      __builtin_trap();
    }
  }
  return 0;
}
