// Writes the daemon's and the platform's state files in a storm, through the same writers the
// daemon uses, until it is killed. Step N writes every file with N; after each file is committed
// it prints "<file> N". Every state carries filler whose length follows from N, so a reader can
// tell a state that was written from one torn or mixed.
//   state_writer ROOT FIRST_STEP
#include <unistd.h>

#include <iostream>
#include <string>

#include "platform/value/cbor_codec.h"
#include "platform/linux/files/atomic_file.h"
#include "platform/linux/files/device_root.h"
#include "platform/linux/identity/linux_app_state_monitor.h"
#include "platform/linux/files/preferences_file_store.h"

using namespace typhora;

namespace {

std::string filler(std::int64_t step) {
  return std::string(static_cast<std::size_t>(step * 7919 % 20000), 'f');
}

bool writeRegistryFile(const std::string& path, std::int64_t step) {
  Value info = Value::dictionary(
      {{"/var/mobile/Library/UserFonts/FontFiles/com.example.shop/A.otf",
        Value::dictionary({{"familyName", Value::dictionary({{"A-Regular", "A"}})},
                           {"step", step},
                           {"filler", filler(step)}})}});
  std::string error;
  return AtomicFile::write(path, CborCodec::encode(info), 0644, &error);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 3) return 2;
  const std::string root = argv[1];
  const DeviceRoot device(root);
  PreferencesFileStore preferences(PreferencesFileStore::pathFor(root, "com.zorvane.typhorad"));
  const LinuxAppStateMonitor appStates(root);
  for (std::int64_t step = std::stoll(argv[2]);; ++step) {
    preferences.setValue("issues", Value::dictionary({{"com.example.app", Value::array({step})}}));
    preferences.setValue("delete", Value::dictionary({{"/var/x", step}}));
    preferences.setValue("missed", step);
    preferences.setValue("resolved", step);
    preferences.setValue("version", filler(step));
    if (preferences.synchronize()) std::cout << "preferences " << step << std::endl;
    if (writeRegistryFile(device.onDisk("/var/mobile/Library/UserFonts/UserFonts.plist"), step))
      std::cout << "userfonts " << step << std::endl;
    if (writeRegistryFile(device.onDisk("/var/mobile/Library/UserFonts/FontAssets.plist"), step))
      std::cout << "assets " << step << std::endl;
    std::string error;
    if (appStates.setState(getpid(), static_cast<int>(step), &error))
      std::cout << "appstates " << step << std::endl;
  }
}
