#include "platform/linux/linux_platform.h"

namespace typhora {

LinuxPlatform::LinuxPlatform(const std::string& root, const std::string& runtimeDir)
    : ipc_(runtimeDir),
      preferences_(PreferencesFileStore::pathFor(root, "com.zorvane.typhorad")),
      fileSystem_(root),
      fontManager_(root),
      manifests_(root),
      codeSigning_(manifests_),
      sandbox_(root, manifests_),
      appRegistry_(manifests_),
      appStates_(root),
      analytics_(root, Clock::system()),
      buildVariant_(root),
      bundle_{ipc_,         preferences_,  fileSystem_,     fontManager_,
              codeSigning_, sandbox_,      appRegistry_,    appStates_,
              analytics_,   buildVariant_, Clock::system(), SerialQueue::main()} {}

}  // namespace typhora
