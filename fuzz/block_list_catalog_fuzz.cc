// The font-access block list's catalog as the platform reads it from disk: the asset type's
// catalog file, filtered as the daemon asks, each match a dictionary.
#include <unistd.h>

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <string>

#include "platform/linux/events/linux_asset_catalog.h"
#include "platform/services/system_notify.h"

namespace {

constexpr const char* kType = "com.zorvane.Cargell.ScrivaneAssets";

struct NoNotify final : typhora::SystemNotify {
  void post(const std::string&) override {}
};

struct Catalog {
  Catalog() {
    char pattern[] = "/tmp/typhora-catalog-fuzz-XXXXXX";
    root = mkdtemp(pattern);
    file = root + "/var/typhora/assets/" + kType + "/catalog.plist";
    std::filesystem::create_directories(std::filesystem::path(file).parent_path());
    catalog = std::make_unique<typhora::LinuxAssetCatalog>(root, notify);
  }
  std::string root, file;
  NoNotify notify;
  std::unique_ptr<typhora::LinuxAssetCatalog> catalog;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static Catalog c;
  std::ofstream(c.file, std::ios::binary | std::ios::trunc)
      .write(reinterpret_cast<const char*>(data), static_cast<std::streamsize>(size));
  for (const typhora::Value& attributes :
       c.catalog->queryMetadata(kType, {{"_CompatibilityVersion", "1"}, {"type", "FontAccess"}})) {
    if (attributes.asDictionary() == nullptr) __builtin_trap();
    const std::string* type = attributes.get("type").asString();
    if (type == nullptr || *type != "FontAccess") __builtin_trap();
  }
  return 0;
}
