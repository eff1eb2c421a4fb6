#include "platform/linux/files/preferences_file_store.h"

#include <filesystem>

#include "platform/linux/files/atomic_file.h"
#include "platform/log/log.h"
#include "platform/value/cbor_codec.h"
#include "platform/value/plist_reader.h"

namespace typhora {

PreferencesFileStore::PreferencesFileStore(std::string path) : path_(std::move(path)) {}

std::string PreferencesFileStore::pathFor(const std::string& root, const std::string& domain) {
  std::string base = root;
  while (!base.empty() && base.back() == '/') base.pop_back();
  return base + "/var/mobile/Library/Preferences/" + domain + ".plist";
}

void PreferencesFileStore::loadLocked() const {
  if (values_) return;
  values_.emplace();
  if (!std::filesystem::exists(path_)) return;
  std::string error;
  std::optional<Value> read = PlistReader::readFile(path_, {}, &error);
  const Dictionary* dict = read ? read->asDictionary() : nullptr;
  if (dict == nullptr) {
    TYLog_Error(kTYLogTyphoraDaemon, "preferences %@ unreadable, starting empty: %@", path_,
                read ? std::string("not a dictionary") : error);
    return;
  }
  for (const auto& [key, v] : *dict) (*values_)[key] = v;
}

Value PreferencesFileStore::value(const std::string& key) const {
  std::lock_guard lock(mutex_);
  loadLocked();
  auto it = values_->find(key);
  return it == values_->end() ? Value() : it->second;
}

void PreferencesFileStore::setValue(const std::string& key, Value value) {
  std::lock_guard lock(mutex_);
  loadLocked();
  if (value.isNull()) {
    values_->erase(key);
  } else {
    (*values_)[key] = std::move(value);
  }
}

bool PreferencesFileStore::synchronize() {
  std::lock_guard lock(mutex_);
  loadLocked();
  std::vector<DictionaryEntry> entries(values_->begin(), values_->end());
  Bytes bytes = CborCodec::encode(Value(Dictionary(std::move(entries))));

  std::string error;
  bool ok = AtomicFile::write(path_, bytes, 0600, &error);
  if (!ok) TYLog_Error(kTYLogTyphoraDaemon, "cannot write preferences %@: %@", path_, error);
  return ok;
}

}  // namespace typhora
