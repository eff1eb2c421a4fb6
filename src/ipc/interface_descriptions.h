// The IPC interfaces the daemon exports and calls, as descriptions for the IPC layer.
// Each description is built once per process, on first use, and shared.
#pragma once

#include <memory>

#include "platform/ipc/ipc_interface.h"

namespace typhora {

// Wire names of the operations, as they travel and as interface descriptions list them.
namespace op {
// TyphoraProtocol
inline constexpr const char* kCheckin = "checkin:";
inline constexpr const char* kCheckinForFontPicker = "checkinForFontPicker:";
inline constexpr const char* kRequestFonts = "requestFonts:reply:";
inline constexpr const char* kRequestFontsForClient = "requestFonts:forClient:reply:";
inline constexpr const char* kFontChanged = "fontChanged:reply:";
inline constexpr const char* kUpdatingUserFonts = "updatingUserFonts:";
inline constexpr const char* kScheduleFontFilesDeletion = "scheduleFontFilesDeletion:";
inline constexpr const char* kSynchronizeFontAssets = "synchronizeFontAssets:reply:";
inline constexpr const char* kResetIssuedFontsFor = "resetIssuedFontsFor:reply:";
// TyphoraBrisvelSupportProtocol
inline constexpr const char* kCheckinForBrisvelProcess = "checkinForBrisvelProcess:reply:";
inline constexpr const char* kSendFonts = "sendFonts:reply:";
// TyphoraClientProtocol
inline constexpr const char* kFontAddedInfo = "fontAddedInfo:addedURLStrings:removedURLStrings:";
// TyphoraFontPickerClientSupportProtocol
inline constexpr const char* kPing = "ping:reply:";
inline constexpr const char* kActivateFontsForFontPickerClient =
    "activateFontsForFontPickerClient:reply:";
// TyphoraBrisvelSupportServerProtocol
inline constexpr const char* kBrisvelPing = "ping:";
inline constexpr const char* kUserInstalledFontsInfo = "userInstalledFontsInfo:reply:";
// FontInstallViewServiceProtocol
inline constexpr const char* kDoneWithInstallFonts = "doneWithInstallFonts:";
inline constexpr const char* kDoneWithMissingFonts = "doneWithMissingFonts:";
inline constexpr const char* kDoneWithDeleteAppFonts = "doneWithDeleteAppFonts:";
}  // namespace op

// Exported on every client connection: TyphoraProtocol and TyphoraBrisvelSupportProtocol.
std::shared_ptr<const IpcInterface> typhoraDaemonProtocol();
// Exported by every client on its own connection to the daemon.
std::shared_ptr<const IpcInterface> typhoraClientProtocol();
// Exported by a font-picker client on the endpoint it hands over.
std::shared_ptr<const IpcInterface> typhoraFontPickerClientSupportProtocol();
// Exported by a web-content process on the endpoint its application hands over.
std::shared_ptr<const IpcInterface> typhoraBrisvelSupportServerProtocol();
// Exported by the missing-fonts dialog handler for the font-install view service.
std::shared_ptr<const IpcInterface> fontInstallViewServiceProtocol();

}  // namespace typhora
