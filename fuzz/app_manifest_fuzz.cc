// An application manifest as the manifest store reads it: the file's bytes, then the manifest.
#include <cstdint>

#include "platform/linux/identity/app_manifest.h"
#include "platform/value/plist_reader.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string error;
  std::optional<typhora::Value> plist = typhora::PlistReader::read({data, size}, {}, &error);
  if (!plist) return 0;
  std::optional<typhora::AppManifest> manifest = typhora::AppManifest::fromValue(*plist, &error);
  // A manifest names a program and its digest; anything less is refused.
  if (manifest && (manifest->identifier.empty() || manifest->executable.empty())) __builtin_trap();
  return 0;
}
