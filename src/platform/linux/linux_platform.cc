#include "platform/linux/linux_platform.h"

namespace typhora {

LinuxPlatform::LinuxPlatform(const std::string& root, const std::string& runtimeDir)
    : ipc_(runtimeDir),
      preferences_(PreferencesFileStore::pathFor(root, "com.zorvane.typhorad")),
      fileSystem_(root),
      fontManager_(root),
      bundle_{ipc_, preferences_, fileSystem_, fontManager_, Clock::system(), SerialQueue::main()} {
}

}  // namespace typhora
