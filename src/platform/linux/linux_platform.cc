#include "platform/linux/linux_platform.h"

#include "platform/linux/files/corrupt_file_quarantine.h"

namespace typhora {

LinuxPlatform::LinuxPlatform(const std::string& root, const std::string& runtimeDir)
    : ipc_(runtimeDir),
      preferences_(PreferencesFileStore::pathFor(root, "com.zorvane.typhorad")),
      fileSystem_(root),
      fontManager_(root),
      manifests_(root),
      codeSigning_(manifests_),
      sandbox_(root, manifests_),
      sandboxExchange_(root, runtimeDir, sandbox_),
      appRegistry_(manifests_),
      appStates_(root),
      analytics_(root, Clock::system()),
      buildVariant_(root),
      launchConfiguration_(root),
      launchEvents_(launchConfiguration_),
      eventHub_(std::make_shared<LinuxEventHub>(ipc_, launchEvents_)),
      systemNotify_(*eventHub_),
      activities_(launchConfiguration_, SerialQueue::main()),
      assetCatalog_(root, systemNotify_),
      fileEvents_(root, Clock::system()),
      remoteAlert_(root),
      bundle_{ipc_,          preferences_,    fileSystem_,        fontManager_,  codeSigning_,
              sandbox_,      appRegistry_,    appStates_,         analytics_,    buildVariant_,
              launchEvents_, activities_,     assetCatalog_,      systemNotify_, fileEvents_,
              remoteAlert_,  Clock::system(), SerialQueue::main()} {
  // Before anything reads them: the stores load lazily.
  CorruptFileQuarantine::sweep(root);
  eventHub_->setActivityRunner(
      [this](const std::string& identifier) { return activities_.runNow(identifier); });
}

bool LinuxPlatform::startServices() {
  return eventHub_->start() && sandboxExchange_.start();
}

}  // namespace typhora
