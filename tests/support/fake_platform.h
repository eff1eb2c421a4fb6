// One fake of every platform interface, and the Platform bundle over them.
#pragma once

#include "platform/dispatch/manual_clock.h"
#include "platform/platform.h"
#include "support/fake_analytics_sink.h"
#include "support/fake_app_registry.h"
#include "support/fake_app_state_monitor.h"
#include "support/fake_asset_catalog.h"
#include "support/fake_build_variant.h"
#include "support/fake_code_signing_query.h"
#include "support/fake_file_event_stream_factory.h"
#include "support/fake_file_system.h"
#include "support/fake_font_manager.h"
#include "support/fake_ipc_service.h"
#include "support/fake_launch_event_stream.h"
#include "support/fake_preferences_store.h"
#include "support/fake_remote_alert.h"
#include "support/fake_sandbox_broker.h"
#include "support/fake_scheduled_activity.h"
#include "support/fake_system_notify.h"

namespace typhora::testing {

struct FakePlatform {
  FakeIpcService ipc;
  FakePreferencesStore preferences;
  FakeFileSystem fileSystem;
  FakeFontManager fontManager;
  FakeCodeSigningQuery codeSigning;
  FakeSandboxBroker sandbox;
  FakeAppRegistry appRegistry;
  FakeAppStateMonitor appStates;
  FakeRemoteAlert remoteAlert;
  FakeAnalyticsSink analytics;
  FakeFileEventStreamFactory fileEvents;
  FakeLaunchEventStream launchEvents;
  FakeScheduledActivity activities;
  FakeAssetCatalog assetCatalog;
  FakeSystemNotify systemNotify;
  FakeBuildVariant buildVariant;
  ManualClock clock;
  std::shared_ptr<SerialQueue> mainQueue = SerialQueue::createManual("test.main-queue", &clock);
  Platform platform{ipc,          preferences,  fileSystem, fontManager,  codeSigning,  sandbox,
                    appRegistry,  appStates,    analytics,  buildVariant, launchEvents, activities,
                    assetCatalog, systemNotify, fileEvents, remoteAlert,  clock,        *mainQueue};
};

}  // namespace typhora::testing
