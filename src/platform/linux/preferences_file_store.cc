#include "platform/linux/preferences_file_store.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "platform/cbor_codec.h"
#include "platform/linux/unique_fd.h"
#include "platform/log.h"
#include "platform/plist_reader.h"

namespace typhora {
namespace {

bool writeAll(int fd, const Bytes& bytes) {
  std::size_t done = 0;
  while (done < bytes.size()) {
    ssize_t n = write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<std::size_t>(n);
  }
  return true;
}

}  // namespace

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

  const std::filesystem::path target(path_);
  std::error_code ec;
  std::filesystem::create_directories(target.parent_path(), ec);
  const std::string temporary = path_ + ".tmp-" + std::to_string(getpid());
  UniqueFd fd(open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  bool ok = fd.valid() && writeAll(fd.get(), bytes) && fsync(fd.get()) == 0;
  fd.reset();
  ok = ok && rename(temporary.c_str(), path_.c_str()) == 0;
  if (ok) {
    UniqueFd dir(open(target.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (dir.valid()) fsync(dir.get());
  } else {
    TYLog_Error(kTYLogTyphoraDaemon, "cannot write preferences %@: %@", path_,
                std::strerror(errno));
    unlink(temporary.c_str());
  }
  return ok;
}

}  // namespace typhora
