// Everything the daemon reaches the platform through, handed to it at construction.
#pragma once

#include "platform/analytics_sink.h"
#include "platform/app_registry.h"
#include "platform/app_state_monitor.h"
#include "platform/asset_catalog.h"
#include "platform/build_variant.h"
#include "platform/clock.h"
#include "platform/code_signing_query.h"
#include "platform/file_event_stream.h"
#include "platform/file_system.h"
#include "platform/ipc_listener.h"
#include "platform/launch_event_stream.h"
#include "platform/preferences_store.h"
#include "platform/remote_alert.h"
#include "platform/sandbox_broker.h"
#include "platform/scheduled_activity.h"
#include "platform/serial_queue.h"
#include "platform/system_notify.h"
#include "platform/ty_user_font_manager.h"

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
