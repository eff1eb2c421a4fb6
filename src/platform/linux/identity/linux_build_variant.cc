#include "platform/linux/identity/linux_build_variant.h"

#include "platform/linux/files/device_root.h"
#include "platform/value/plist_reader.h"

namespace typhora {

LinuxBuildVariant::LinuxBuildVariant(const std::string& root)
    : path_(DeviceRoot(root).onDisk("/etc/typhora/build-variant.plist")) {}

bool LinuxBuildVariant::isInternalBuild(const std::string& subsystem) const {
  std::optional<Value> variant = PlistReader::readFile(path_, {}, nullptr);
  if (!variant || variant->get("internal").asBool() != true) return false;
  const Value& subsystems = variant->get("subsystems");
  if (subsystems.isNull()) return true;
  const ValueArray* listed = subsystems.asArray();
  if (listed == nullptr) return false;
  for (const Value& name : *listed) {
    if (const std::string* text = name.asString(); text != nullptr && *text == subsystem)
      return true;
  }
  return false;
}

}  // namespace typhora
