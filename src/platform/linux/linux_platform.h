// The real platform on Linux, every path under one device root.
#pragma once

#include <string>

#include "platform/linux/app_manifest_store.h"
#include "platform/linux/linux_analytics_sink.h"
#include "platform/linux/linux_app_registry.h"
#include "platform/linux/linux_app_state_monitor.h"
#include "platform/linux/linux_build_variant.h"
#include "platform/linux/linux_code_signing_query.h"
#include "platform/linux/linux_file_system.h"
#include "platform/linux/linux_sandbox_broker.h"
#include "platform/linux/linux_user_font_manager.h"
#include "platform/linux/lumo_service.h"
#include "platform/linux/preferences_file_store.h"
#include "platform/platform.h"

namespace typhora {

class LinuxPlatform {
 public:
  LinuxPlatform(const std::string& root, const std::string& runtimeDir);
  Platform& bundle() { return bundle_; }

 private:
  LumoService ipc_;
  PreferencesFileStore preferences_;
  LinuxFileSystem fileSystem_;
  LinuxUserFontManager fontManager_;
  AppManifestStore manifests_;
  LinuxCodeSigningQuery codeSigning_;
  LinuxSandboxBroker sandbox_;
  LinuxAppRegistry appRegistry_;
  LinuxAppStateMonitor appStates_;
  LinuxAnalyticsSink analytics_;
  LinuxBuildVariant buildVariant_;
  Platform bundle_;
};

}  // namespace typhora
