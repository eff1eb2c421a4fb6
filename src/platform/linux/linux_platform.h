// The real platform on Linux, every path under one device root.
#pragma once

#include <memory>
#include <string>

#include "platform/linux/alerts/linux_remote_alert.h"
#include "platform/linux/events/launch_configuration.h"
#include "platform/linux/events/linux_asset_catalog.h"
#include "platform/linux/events/linux_event_hub.h"
#include "platform/linux/events/linux_launch_event_stream.h"
#include "platform/linux/events/linux_scheduled_activity.h"
#include "platform/linux/events/linux_system_notify.h"
#include "platform/linux/files/linux_analytics_sink.h"
#include "platform/linux/files/linux_file_event_stream_factory.h"
#include "platform/linux/files/linux_file_system.h"
#include "platform/linux/files/preferences_file_store.h"
#include "platform/linux/fonts/linux_user_font_manager.h"
#include "platform/linux/identity/app_manifest_store.h"
#include "platform/linux/identity/linux_app_registry.h"
#include "platform/linux/identity/linux_app_state_monitor.h"
#include "platform/linux/identity/linux_build_variant.h"
#include "platform/linux/identity/linux_code_signing_query.h"
#include "platform/linux/lumo/lumo_service.h"
#include "platform/linux/sandbox/linux_sandbox_broker.h"
#include "platform/linux/sandbox/sandbox_extension_server.h"
#include "platform/platform.h"

namespace typhora {

class LinuxPlatform {
 public:
  LinuxPlatform(const std::string& root, const std::string& runtimeDir);
  Platform& bundle() { return bundle_; }
  // Opens the platform's own sockets (the event socket, the sandbox socket); false when one cannot
  // be opened.
  bool startServices();
  // What the event socket's status and grants operations answer.
  void setReporter(LinuxEventHub::Reporter reporter) {
    eventHub_->setReporter(std::move(reporter));
  }

 private:
  LumoService ipc_;
  PreferencesFileStore preferences_;
  LinuxFileSystem fileSystem_;
  LinuxUserFontManager fontManager_;
  AppManifestStore manifests_;
  LinuxCodeSigningQuery codeSigning_;
  LinuxSandboxBroker sandbox_;
  SandboxExtensionServer sandboxExchange_;
  LinuxAppRegistry appRegistry_;
  LinuxAppStateMonitor appStates_;
  LinuxAnalyticsSink analytics_;
  LinuxBuildVariant buildVariant_;
  LaunchConfiguration launchConfiguration_;
  LinuxLaunchEventStream launchEvents_;
  std::shared_ptr<LinuxEventHub> eventHub_;
  LinuxSystemNotify systemNotify_;
  LinuxScheduledActivity activities_;
  LinuxAssetCatalog assetCatalog_;
  LinuxFileEventStreamFactory fileEvents_;
  LinuxRemoteAlert remoteAlert_;
  Platform bundle_;
};

}  // namespace typhora
