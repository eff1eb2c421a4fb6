// The cached user-fonts information: loaded from the user-fonts file on first read, dropped when
// fonts change, and read again by the first reader after that.
#include <string>
#include <utility>

#include "catalog/font_record.h"
#include "daemon/typhora_daemon.h"
#include "platform/log/log.h"
#include "platform/value/cbor_encoding_memo.h"

namespace typhora {
namespace {

constexpr const char* kMobileHomeFormat = "/var/mobile/%@";
constexpr const char* kUserFontsFile = "Library/UserFonts/UserFonts.plist";
constexpr const char* kErrorReading = "error reading %@";
constexpr const char* kUnchanged = "%@ unchanged since it was read: not decoded again";

// The enabled records and their kept encoding go together.
void dropEnabledRecords(Value* enabled) {
  CborEncodingMemo::shared().forget(*enabled);
  *enabled = Value();
}

}  // namespace

const Value& TyphoraDaemon::loadedUserFontsInfoLocked() {
  if (userFontsInfo_.isNull()) {
    userFontsInfo_ = _userFontsInfoFromDisk();
    if (userFontsInfo_.isNull()) userFontsInfo_ = Value(Dictionary());
  }
  return userFontsInfo_;
}

bool TyphoraDaemon::isUserFontInstalled() {
  std::lock_guard lock(userFontsInfoMutex_);
  const Dictionary* info = loadedUserFontsInfoLocked().asDictionary();
  return info != nullptr && !info->empty();
}

Value TyphoraDaemon::userFontsInfo() {
  std::lock_guard lock(userFontsInfoMutex_);
  const Value& info = loadedUserFontsInfoLocked();
  const Dictionary* entries = info.asDictionary();
  // An empty information is never handed out: readers see absent instead.
  return entries != nullptr && !entries->empty() ? info : Value();
}

void TyphoraDaemon::setUserFontsInfo(Value info) {
  std::lock_guard lock(userFontsInfoMutex_);
  userFontsInfo_ = std::move(info);
  userFontsNameIndex_.reset();
  dropEnabledRecords(&enabledUserFontsInfo_);
}

Value TyphoraDaemon::invalidateUserFonts() {
  std::lock_guard lock(userFontsInfoMutex_);
  Value dropped = std::exchange(userFontsInfo_, Value());
  userFontsNameIndex_.reset();
  dropEnabledRecords(&enabledUserFontsInfo_);
  ++userFontsGeneration_;
  return dropped;
}

std::uint64_t TyphoraDaemon::userFontsGeneration() {
  std::lock_guard lock(userFontsInfoMutex_);
  return userFontsGeneration_;
}

bool TyphoraDaemon::isUserFontsInfoCached() {
  std::lock_guard lock(userFontsInfoMutex_);
  return !userFontsInfo_.isNull();
}

std::shared_ptr<const UserFontsNameIndex> TyphoraDaemon::userFontsNameIndex() {
  std::lock_guard lock(userFontsInfoMutex_);
  if (!userFontsNameIndex_) {
    userFontsNameIndex_ = std::make_shared<const UserFontsNameIndex>(loadedUserFontsInfoLocked());
  }
  return userFontsNameIndex_;
}

Value TyphoraDaemon::enabledUserFontsInfo() {
  std::lock_guard lock(userFontsInfoMutex_);
  if (enabledUserFontsInfo_.isNull()) {
    std::vector<DictionaryEntry> enabled;
    if (const Dictionary* entries = loadedUserFontsInfoLocked().asDictionary()) {
      enabled.reserve(entries->size());
      for (const auto& entry : *entries) {
        if (!FontRecord::isDisabled(entry.second)) enabled.push_back(entry);
      }
    }
    enabledUserFontsInfo_ = Value(Dictionary(std::move(enabled)));
    // Every enumerating client's check-in carries these records as they are: their encoding is
    // made once per load and copied into each answer.
    CborEncodingMemo::shared().keep(enabledUserFontsInfo_);
  }
  return enabledUserFontsInfo_;
}

std::string TyphoraDaemon::userFontsFilePath() {
  return formatLog(kMobileHomeFormat, {kUserFontsFile});
}

Value TyphoraDaemon::_userFontsInfoFromDisk() {
  Value slot;
  updatingUserFonts([this, &slot] {
    const std::string path = userFontsFilePath();
    const std::optional<FileStamp> stamp = platform_.fileSystem.stampOf(path);
    // The registry replaces the file by rename: the same stamp is the same bytes, already decoded.
    if (stamp && lastRead_.stamp == stamp) {
      TYLog_Debug(kTYLogTyphoraDaemon, kUnchanged, path);
      slot = lastRead_.info;
      return;
    }
    lastRead_ = {};
    if (!platform_.fileSystem.fileExists(path)) return;
    std::string error;
    std::optional<Value> read = platform_.fileSystem.readPropertyList(path, &error);
    // A root that is not a dictionary is as unreadable as a file that does not parse: the rest of
    // the daemon reads the information as a dictionary of records.
    if (read && read->asDictionary() != nullptr) {
      slot = std::move(*read);
      // Kept only when the file was the same before and after the read.
      if (stamp && platform_.fileSystem.stampOf(path) == stamp) lastRead_ = {slot, stamp};
    } else {
      TYLog_Error(kTYLogTyphoraDaemon, kErrorReading, path);
    }
  });
  return slot;
}

}  // namespace typhora
