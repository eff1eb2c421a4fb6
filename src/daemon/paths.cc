#include "daemon/paths.h"

#include <vector>

#include "daemon/typhora_daemon.h"

namespace typhora {

std::string normalisedDirectoryPath(std::string_view path) {
  std::vector<std::string_view> parts;
  std::size_t start = 0;
  while (start <= path.size()) {
    std::size_t end = path.find('/', start);
    if (end == std::string_view::npos) end = path.size();
    std::string_view part = path.substr(start, end - start);
    if (part == "..") {
      if (!parts.empty()) parts.pop_back();
    } else if (!part.empty() && part != ".") {
      parts.push_back(part);
    }
    start = end + 1;
  }
  std::string out;
  for (std::string_view part : parts) {
    out += '/';
    out += part;
  }
  return out.empty() ? std::string("/") : out;
}

namespace {

std::string prefixOf(std::string_view directory) {
  std::string prefix = normalisedDirectoryPath(directory);
  if (prefix.back() != '/') prefix += '/';
  return prefix;
}

}  // namespace

// Function-local statics: made once, safely against concurrent first use.
const std::string& fontFilesDirectoryPrefix() {
  static const std::string prefix = prefixOf(kFontFilesDirectory);
  return prefix;
}

const std::string& fontAssetsDirectoryPrefix() {
  static const std::string prefix = prefixOf(kFontAssetsDirectory);
  return prefix;
}

bool isFontFilePath(std::string_view path) {
  return path.starts_with(kFontFilesDirectory);
}
bool isFontAssetPath(std::string_view path) {
  return path.starts_with(kFontAssetsDirectory);
}
bool isAssetStorePath(std::string_view path) {
  return path.starts_with(kAssetStoreDirectory);
}

// The update queue serialises every update of the user-fonts information: the reading of the
// file and the replies to clients' updatingUserFonts: calls.
SerialQueue& TyphoraDaemon::updateQueue() {
  std::call_once(updateQueueOnce_, [this] {
    updateQueue_ = SerialQueue::create(kUpdatingUserFontsQueueLabel, &platform_.clock);
  });
  return *updateQueue_;
}

void TyphoraDaemon::updatingUserFonts(const std::function<void()>& reply) {
  // A job already on the update queue must never come back here: sync() would abort on it.
  updateQueue().sync([&reply] {
    if (reply) reply();
  });
}

std::string_view parentDirectoryPath(std::string_view path) {
  const std::size_t last = path.rfind('/');
  return last == std::string_view::npos ? std::string_view() : path.substr(0, last);
}

namespace {

// Takes the last path component off `rest` and answers it. Components are those of a URL's path:
// empty ones, from "//" or a trailing "/", do not count.
std::string_view takeLastComponent(std::string_view* rest) {
  while (!rest->empty() && rest->back() == '/') rest->remove_suffix(1);
  const std::size_t slash = rest->rfind('/');
  const std::string_view last = slash == std::string_view::npos ? *rest : rest->substr(slash + 1);
  *rest = slash == std::string_view::npos ? std::string_view() : rest->substr(0, slash);
  return last;
}

}  // namespace

std::string_view containingDirectoryName(std::string_view path) {
  takeLastComponent(&path);
  return takeLastComponent(&path);
}

}  // namespace typhora
