// The font registry on Linux. Its files, under the device root:
//   /var/mobile/Library/UserFonts/UserFonts.plist     user-fonts information: font file path ->
//                                                      {"familyName": {PostScript: family},
//                                                       "disabled": bool, ...}
//   /var/mobile/Library/UserFonts/ProfileFonts.plist  the same, for fonts of configuration profiles
//   /var/mobile/Library/UserFonts/FontProviders.plist the provider directories found last time
//   /var/mobile/Library/UserFonts/FontFiles/<provider identifier>/   installed fonts
//   /var/mobile/Library/UserFonts/FontAssets/<asset>/                the mirror of font assets
// The asset store holds <asset>/AssetData/<font file> under
// /private/var/Cargell/AssetsV2/com_zorvane_Cargell_Font6/.
//
// Every change to the registry's files is made under one lock, shared with other processes that
// change them, and written atomically.
#pragma once

#include <memory>
#include <mutex>
#include <string>

#include "platform/dispatch/serial_queue.h"
#include "platform/linux/files/device_root.h"
#include "platform/linux/files/linux_file_system.h"
#include "platform/storage/ty_user_font_manager.h"

namespace typhora {

class LinuxUserFontManager final : public TYUserFontManager {
 public:
  explicit LinuxUserFontManager(std::string root);

  // Lays out the registry's directories (font files and font assets) under the root.
  void reset() override;
  // A provider's directory is named after its identifier; names that cannot be one directory
  // ("", ".", "..", anything with "/") have none.
  std::optional<std::string> directoryNameFromIdentifier(const std::string& identifier) override;
  // The identifier of a provider whose directory exists under FontFiles/, else none.
  std::optional<std::string> identifierFromDirectoryName(const std::string& name) override;
  Value profileFontsInfo() override;
  Value userFontsInfo() override;
  void enableOrDisablePersistentURLs(const std::vector<std::string>& urls, bool enabled) override;
  // Runs on the registry's own queue; the completion runs there too.
  void unregisterAndRemoveFontFilesForIdentifier(const std::string& identifier,
                                                 UnregisterCompletion completionHandler) override;
  void synchronizeFontProviders() override;
  // Synchronous: the completion has run when this returns.
  void synchronizeFontAssets(std::function<void(bool success)> completion) override;

  // Copies font files (machine paths) into the provider's directory and records their faces,
  // enabled, as a font provider's installation does. Every file is read and checked before any
  // is copied: when one is not a complete font, none is installed. Answers the registry paths
  // recorded, in the order given; nullopt with `error` set otherwise.
  std::optional<std::vector<std::string>> installFontFiles(
      const std::string& provider, const std::vector<std::string>& machinePaths,
      std::string* error);
  // Forgets the records of registry paths and deletes their files; a path the registry does not
  // know refuses them all. The paths' directories stay.
  bool removeFontFiles(const std::vector<std::string>& paths, std::string* error);

 private:
  Value readInfo(const char* path) const;
  bool writeInfoLocked(const Value& info, std::string* error);
  std::optional<std::string> removeProviderLocked(const std::string& identifier);
  bool mirrorAssetsLocked();

  DeviceRoot root_;
  LinuxFileSystem files_;  // removals beneath the root, never through a link
  std::mutex mutex_;       // every change to the registry's files, with lockFile_
  std::string lockFile_;   // the registry's lock between processes
  std::shared_ptr<SerialQueue> queue_;
};

}  // namespace typhora
