#include "platform/linux/fonts/linux_user_font_manager.h"

#include <sys/stat.h>

#include <filesystem>
#include <map>
#include <set>

#include "platform/fd/regular_file.h"
#include "platform/linux/files/atomic_file.h"
#include "platform/linux/files/device_root.h"
#include "platform/linux/fonts/font_face_names.h"
#include "platform/linux/fonts/registry_lock.h"
#include "platform/log/log.h"
#include "platform/value/cbor_codec.h"
#include "platform/value/plist_reader.h"

namespace typhora {

namespace fs = std::filesystem;

namespace {

constexpr const char* kUserFontsInfo = "/var/mobile/Library/UserFonts/UserFonts.plist";
constexpr const char* kRegistryLockFile = "/var/mobile/Library/UserFonts/.registry.lock";
constexpr const char* kProfileFontsInfo = "/var/mobile/Library/UserFonts/ProfileFonts.plist";
constexpr const char* kProviders = "/var/mobile/Library/UserFonts/FontProviders.plist";
// The mirror paths whose records the user-fonts file holds, written after it: when the asset
// store still matches it, a synchronisation has nothing to do and need not read the big file.
constexpr const char* kMirrorIndex = "/var/mobile/Library/UserFonts/FontAssets.plist";
constexpr const char* kFontFiles = "/var/mobile/Library/UserFonts/FontFiles/";
constexpr const char* kFontAssets = "/var/mobile/Library/UserFonts/FontAssets/";
constexpr const char* kAssetStore = "/private/var/Cargell/AssetsV2/com_zorvane_Cargell_Font6/";
constexpr const char* kFileUrlScheme = "file://";
constexpr std::size_t kMaxMirroredBytes = 256u << 20;

std::vector<DictionaryEntry> entriesOf(const Value& info) {
  const Dictionary* dictionary = info.asDictionary();
  return dictionary != nullptr ? dictionary->entries() : std::vector<DictionaryEntry>{};
}

Value withDisabled(const Value& record, bool disabled) {
  std::vector<DictionaryEntry> fields = entriesOf(record);
  std::erase_if(fields, [](const auto& field) { return field.first == "disabled"; });
  fields.emplace_back("disabled", disabled);
  return Value(Dictionary(std::move(fields)));
}

std::vector<std::string> subdirectories(const std::string& machinePath) {
  std::vector<std::string> names;
  std::error_code ec;
  for (fs::directory_iterator it(machinePath, ec), end; !ec && it != end; it.increment(ec)) {
    if (it->is_directory(ec)) names.push_back(it->path().filename().string());
  }
  return names;
}

}  // namespace

LinuxUserFontManager::LinuxUserFontManager(std::string root)
    : root_(root),
      files_(std::move(root)),
      lockFile_(root_.onDisk(kRegistryLockFile)),
      queue_(SerialQueue::create("com.zorvane.typhora.fontRegistry")) {}

void LinuxUserFontManager::reset() {
  std::error_code ec;
  for (const char* dir : {kFontFiles, kFontAssets}) {
    fs::create_directories(root_.onDisk(dir), ec);
    if (ec)
      TYLog_Error(kTYLogTyphoraDaemon, "font registry: cannot create %@: %@", root_.onDisk(dir),
                  ec.message());
  }
}

std::optional<std::string> LinuxUserFontManager::directoryNameFromIdentifier(
    const std::string& identifier) {
  return DeviceRoot::isSingleComponent(identifier) ? std::optional(identifier) : std::nullopt;
}

std::optional<std::string> LinuxUserFontManager::identifierFromDirectoryName(
    const std::string& name) {
  // Only a provider's own directory: asset, asset-data and other directories name no provider.
  struct stat info {};
  if (!DeviceRoot::isSingleComponent(name) ||
      lstat(root_.onDisk(kFontFiles + name).c_str(), &info) != 0 || !S_ISDIR(info.st_mode))
    return std::nullopt;
  return name;
}

Value LinuxUserFontManager::readInfo(const char* path) const {
  std::optional<Value> info = PlistReader::readFile(root_.onDisk(path), {}, nullptr);
  if (!info || info->asDictionary() == nullptr) return Value::dictionary({});
  return *info;
}

Value LinuxUserFontManager::profileFontsInfo() {
  return readInfo(kProfileFontsInfo);
}

Value LinuxUserFontManager::userFontsInfo() {
  return readInfo(kUserFontsInfo);
}

bool LinuxUserFontManager::writeInfoLocked(const Value& info, std::string* error) {
  return AtomicFile::write(root_.onDisk(kUserFontsInfo), CborCodec::encode(info), 0644, error);
}

void LinuxUserFontManager::enableOrDisablePersistentURLs(const std::vector<std::string>& urls,
                                                         bool enabled) {
  std::set<std::string> paths;
  for (const std::string& url : urls) {
    if (url.starts_with(kFileUrlScheme))
      paths.insert(url.substr(std::string(kFileUrlScheme).size()));
  }
  RegistryLock lock(mutex_, lockFile_);
  std::vector<DictionaryEntry> entries = entriesOf(userFontsInfo());
  bool changed = false;
  for (auto& [path, record] : entries) {
    if (!paths.contains(path) || record.get("disabled").asBool() == !enabled) continue;
    record = withDisabled(record, !enabled);
    changed = true;
  }
  std::string error;
  if (changed && !writeInfoLocked(Value(Dictionary(std::move(entries))), &error))
    TYLog_Error(kTYLogTyphoraDaemon, "font registry: cannot write %@: %@", kUserFontsInfo, error);
}

std::optional<std::string> LinuxUserFontManager::removeProviderLocked(
    const std::string& identifier) {
  std::optional<std::string> directory = directoryNameFromIdentifier(identifier);
  if (!directory) return "no font directory for " + identifier;
  const std::string prefix = std::string(kFontFiles) + *directory + "/";
  std::vector<DictionaryEntry> entries = entriesOf(userFontsInfo());
  std::size_t before = entries.size();
  std::erase_if(entries, [&](const auto& entry) { return entry.first.starts_with(prefix); });
  std::string error;
  if (entries.size() != before && !writeInfoLocked(Value(Dictionary(std::move(entries))), &error))
    return error;
  // The directory itself goes, never what a link in its place points to.
  if (files_.fileExists(kFontFiles + *directory) &&
      !files_.removeItem(kFontFiles + *directory, &error))
    return error;
  return std::nullopt;
}

void LinuxUserFontManager::unregisterAndRemoveFontFilesForIdentifier(
    const std::string& identifier, UnregisterCompletion completionHandler) {
  queue_->async([this, identifier, completionHandler = std::move(completionHandler)] {
    std::optional<std::string> error;
    {
      RegistryLock lock(mutex_, lockFile_);
      error = removeProviderLocked(identifier);
    }
    completionHandler(error);
  });
}

void LinuxUserFontManager::synchronizeFontProviders() {
  RegistryLock lock(mutex_, lockFile_);
  ValueArray providers;
  for (const std::string& name : subdirectories(root_.onDisk(kFontFiles))) {
    if (identifierFromDirectoryName(name)) providers.emplace_back(name);
  }
  std::sort(providers.begin(), providers.end(),
            [](const Value& a, const Value& b) { return *a.asString() < *b.asString(); });
  std::string error;
  if (!AtomicFile::write(root_.onDisk(kProviders), CborCodec::encode(Value(std::move(providers))),
                         0644, &error))
    TYLog_Error(kTYLogTyphoraDaemon, "font registry: cannot write %@: %@", kProviders, error);
}

void LinuxUserFontManager::synchronizeFontAssets(std::function<void(bool success)> completion) {
  bool success = false;
  {
    RegistryLock lock(mutex_, lockFile_);
    success = mirrorAssetsLocked();
  }
  completion(success);
}

std::optional<std::vector<std::string>> LinuxUserFontManager::installFontFiles(
    const std::string& provider, const std::vector<std::string>& machinePaths, std::string* error) {
  std::optional<std::string> directory = directoryNameFromIdentifier(provider);
  if (!directory) {
    *error = "'" + provider + "' cannot name a provider's directory";
    return std::nullopt;
  }
  struct Checked {
    std::string path;  // in the registry
    std::vector<std::uint8_t> bytes;
    Value names;
  };
  std::vector<Checked> checked;
  std::set<std::string> seen;
  for (const std::string& source : machinePaths) {
    const std::string name = fs::path(source).filename().string();
    const std::string path = kFontFiles + *directory + "/" + name;
    if (!DeviceRoot::isSingleComponent(name) || !seen.insert(path).second) {
      *error = source + ": " + (name.empty() ? "names no file" : "is named twice");
      return std::nullopt;
    }
    std::string why;
    std::optional<std::vector<std::uint8_t>> bytes =
        RegularFile::read(source, FontFaceNames::kMaxFontBytes, &why);
    std::optional<Value> names = bytes ? FontFaceNames::fromBytes(*bytes, &why) : std::nullopt;
    if (!names) {
      *error = source + ": " + why;
      return std::nullopt;
    }
    checked.push_back({path, std::move(*bytes), std::move(*names)});
  }

  RegistryLock lock(mutex_, lockFile_);
  std::vector<std::string> written;
  auto undo = [&] {
    std::string ignored;
    for (const std::string& path : written) files_.removeItem(path, &ignored);
  };
  for (const Checked& font : checked) {
    if (!AtomicFile::write(root_.onDisk(font.path), font.bytes, 0644, error)) {
      undo();
      return std::nullopt;
    }
    written.push_back(font.path);
  }
  std::map<std::string, Value> records;
  for (auto& [path, record] : entriesOf(userFontsInfo())) records.emplace(path, record);
  for (const Checked& font : checked)
    records.insert_or_assign(font.path,
                             Value::dictionary({{"disabled", false}, {"familyName", font.names}}));
  if (!writeInfoLocked(Value(Dictionary({records.begin(), records.end()})), error)) {
    undo();
    return std::nullopt;
  }
  return written;
}

bool LinuxUserFontManager::removeFontFiles(const std::vector<std::string>& paths,
                                           std::string* error) {
  RegistryLock lock(mutex_, lockFile_);
  std::vector<DictionaryEntry> entries = entriesOf(userFontsInfo());
  const std::set<std::string> removed(paths.begin(), paths.end());
  for (const std::string& path : removed) {
    if (std::none_of(entries.begin(), entries.end(),
                     [&](const auto& entry) { return entry.first == path; })) {
      *error = path + ": the registry has no such font";
      return false;
    }
  }
  std::erase_if(entries, [&](const auto& entry) { return removed.contains(entry.first); });
  if (!writeInfoLocked(Value(Dictionary(std::move(entries))), error)) return false;
  // The records are gone: a file that cannot be deleted now is only left over, never served.
  for (const std::string& path : removed) {
    std::string why;
    if (files_.fileExists(path) && !files_.removeItem(path, &why))
      TYLog_Error(kTYLogTyphoraDaemon, "font registry: cannot delete %@: %@", path, why);
  }
  return true;
}

bool LinuxUserFontManager::mirrorAssetsLocked() {
  // What the asset store holds now: mirror path -> store file.
  std::map<std::string, std::string> wanted;
  for (const std::string& asset : subdirectories(root_.onDisk(kAssetStore))) {
    const std::string data = root_.onDisk(std::string(kAssetStore) + asset + "/AssetData");
    std::error_code ec;
    for (fs::directory_iterator it(data, ec), end; !ec && it != end; it.increment(ec)) {
      if (it->is_regular_file(ec))
        wanted[std::string(kFontAssets) + asset + "/" + it->path().filename().string()] =
            it->path().string();
    }
  }
  ValueArray index;
  for (const auto& [mirror, store] : wanted) index.emplace_back(mirror);
  const Value wantedIndex(std::move(index));
  if (PlistReader::readFile(root_.onDisk(kMirrorIndex), {}, nullptr) == wantedIndex) return true;

  bool ok = true;
  std::vector<DictionaryEntry> entries = entriesOf(userFontsInfo());
  std::map<std::string, Value> kept;
  for (auto& [path, record] : entries) {
    if (!path.starts_with(kFontAssets) || wanted.contains(path)) kept.emplace(path, record);
  }
  for (const auto& [mirror, store] : wanted) {
    const std::string target = root_.onDisk(mirror);
    std::error_code ec;
    fs::create_directories(fs::path(target).parent_path(), ec);
    if (!fs::exists(target, ec)) {
      std::string error;
      std::optional<std::vector<std::uint8_t>> bytes =
          RegularFile::read(store, kMaxMirroredBytes, &error);
      if (!bytes || !AtomicFile::write(target, *bytes, 0644, &error)) {
        TYLog_Error(kTYLogTyphoraDaemon, "font registry: cannot mirror %@: %@", store, error);
        ok = false;
        continue;
      }
    }
    if (kept.contains(mirror)) continue;
    std::optional<Value> names = FontFaceNames::read(target);
    if (!names) {
      TYLog_Error(kTYLogTyphoraDaemon, "font registry: %@ is not a font", store);
      ok = false;
      continue;
    }
    kept.emplace(mirror, Value::dictionary({{"disabled", false}, {"familyName", *names}}));
  }
  // Mirrored assets that left the store go with their files.
  for (const std::string& asset : subdirectories(root_.onDisk(kFontAssets))) {
    const std::string prefix = std::string(kFontAssets) + asset + "/";
    bool stillWanted = std::any_of(wanted.begin(), wanted.end(), [&](const auto& entry) {
      return entry.first.starts_with(prefix);
    });
    std::string ignored;
    if (!stillWanted) files_.removeItem(kFontAssets + asset, &ignored);
  }
  Value info(Dictionary(std::vector<DictionaryEntry>(kept.begin(), kept.end())));
  std::string error;
  if (info != Value(Dictionary(std::move(entries))) && !writeInfoLocked(info, &error)) {
    TYLog_Error(kTYLogTyphoraDaemon, "font registry: cannot write %@: %@", kUserFontsInfo, error);
    return false;
  }
  // Only a complete mirror is recorded: a failed file is retried by the next synchronisation.
  if (ok &&
      !AtomicFile::write(root_.onDisk(kMirrorIndex), CborCodec::encode(wantedIndex), 0644, &error))
    TYLog_Error(kTYLogTyphoraDaemon, "font registry: cannot write %@: %@", kMirrorIndex, error);
  return ok;
}

}  // namespace typhora
