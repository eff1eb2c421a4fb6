// Everything the daemon reaches the platform through, handed to it at construction.
#pragma once

#include "platform/clock.h"
#include "platform/file_system.h"
#include "platform/ipc_listener.h"
#include "platform/preferences_store.h"
#include "platform/serial_queue.h"
#include "platform/ty_user_font_manager.h"

namespace typhora {

struct Platform {
  IpcService& ipc;
  PreferencesStore& preferences;
  FileSystem& fileSystem;
  TYUserFontManager& fontManager;
  Clock& clock;
  SerialQueue& mainQueue;
};

}  // namespace typhora
