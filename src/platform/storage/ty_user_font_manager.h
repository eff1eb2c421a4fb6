// The font registry library's operations that the daemon calls. The registry registers and
// unregisters fonts and keeps the user-fonts information; the daemon never registers fonts.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "platform/value/value.h"

namespace typhora {

// The system-wide notification the daemon posts when user fonts change.
inline constexpr const char* FontProviderDidChangeDistributedNotification =
    "com.zorvane.Typhora.FontProviderDidChange";

class TYUserFontManager {
 public:
  using UnregisterCompletion = std::function<void(const std::optional<std::string>& error)>;
  virtual ~TYUserFontManager() = default;

  // Brings the registry to its initial state for this version of the daemon's data.
  virtual void reset() = 0;
  // The name of the directory, inside the font-files directory, that holds the fonts of the
  // provider with signing identifier `identifier`; nullopt when there is none.
  virtual std::optional<std::string> directoryNameFromIdentifier(const std::string& identifier) = 0;
  // The inverse: the provider identifier of a directory name, or nullopt.
  virtual std::optional<std::string> identifierFromDirectoryName(const std::string& name) = 0;
  // The information of the fonts installed by configuration profiles, by font file path.
  virtual Value profileFontsInfo() = 0;
  // The registry's current user-fonts information, by font file path.
  virtual Value userFontsInfo() = 0;
  // Marks the fonts of the given file URLs enabled or disabled.
  virtual void enableOrDisablePersistentURLs(const std::vector<std::string>& urls,
                                             bool enabled) = 0;
  // Unregisters the fonts the provider `identifier` installed and deletes their files. The
  // completion runs exactly once, with an error description or none, never on the main thread.
  virtual void unregisterAndRemoveFontFilesForIdentifier(
      const std::string& identifier, UnregisterCompletion completionHandler) = 0;
  // Brings the registry's record of installed font providers up to date.
  virtual void synchronizeFontProviders() = 0;
  // Brings the mirror of font assets in step with the asset store; the completion gets success.
  virtual void synchronizeFontAssets(std::function<void(bool success)> completion) = 0;
};

}  // namespace typhora
