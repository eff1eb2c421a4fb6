// Everything the daemon reaches the platform through, handed to it at construction.
#pragma once

#include "platform/dispatch/clock.h"
#include "platform/dispatch/serial_queue.h"
#include "platform/ipc/ipc_listener.h"
#include "platform/services/analytics_sink.h"
#include "platform/services/app_registry.h"
#include "platform/services/app_state_monitor.h"
#include "platform/services/asset_catalog.h"
#include "platform/services/build_variant.h"
#include "platform/services/code_signing_query.h"
#include "platform/services/launch_event_stream.h"
#include "platform/services/remote_alert.h"
#include "platform/services/sandbox_broker.h"
#include "platform/services/scheduled_activity.h"
#include "platform/services/system_notify.h"
#include "platform/storage/file_event_stream.h"
#include "platform/storage/file_system.h"
#include "platform/storage/preferences_store.h"
#include "platform/storage/ty_user_font_manager.h"

namespace typhora {

struct Platform {
  IpcService& ipc;
  PreferencesStore& preferences;
  FileSystem& fileSystem;
  TYUserFontManager& fontManager;
  CodeSigningQuery& codeSigning;
  SandboxBroker& sandbox;
  AppRegistry& appRegistry;
  AppStateMonitor& appStates;
  AnalyticsSink& analytics;
  BuildVariant& buildVariant;
  LaunchEventStream& launchEvents;
  ScheduledActivity& activities;
  AssetCatalog& assetCatalog;
  SystemNotify& systemNotify;
  FileEventStreamFactory& fileEvents;
  RemoteAlert& remoteAlert;
  Clock& clock;
  SerialQueue& mainQueue;
};

}  // namespace typhora
