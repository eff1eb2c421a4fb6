// One fake of every platform interface, and the Platform bundle over them.
#pragma once

#include "platform/manual_clock.h"
#include "platform/platform.h"
#include "support/fake_file_system.h"
#include "support/fake_font_manager.h"
#include "support/fake_ipc_service.h"
#include "support/fake_preferences_store.h"

namespace typhora::testing {

struct FakePlatform {
  FakeIpcService ipc;
  FakePreferencesStore preferences;
  FakeFileSystem fileSystem;
  FakeFontManager fontManager;
  ManualClock clock;
  std::shared_ptr<SerialQueue> mainQueue = SerialQueue::createManual("test.main-queue", &clock);
  Platform platform{ipc, preferences, fileSystem, fontManager, clock, *mainQueue};
};

}  // namespace typhora::testing
