// The missing-fonts dialog: its items, and whether it may be presented at all.
#include <map>
#include <set>

#include "daemon/typhora_daemon.h"
#include "platform/log/log.h"
#include "requests/missing_fonts_dialog_handler.h"

namespace typhora {

namespace {

constexpr const char* kInBackground =
    "An application (pid:%d) tried to show missing fonts dialog in the background.  It's ignored.";

}  // namespace

ValueArray TyphoraDaemon::missingFontsDialogRequestsFromUnknownFontNames(
    const std::vector<std::string>& names) {
  ValueArray items;
  for (const std::string& name : names)
    items.push_back(Value::dictionary({{"displayName", name}, {"providers", Value(ValueArray{})}}));
  return items;
}

ValueArray TyphoraDaemon::missingFontsDialogRequestsFromDisabledFamilyNames(
    const std::vector<std::string>& familyNames) {
  std::map<std::string, std::set<std::string>> providers;  // one item per family
  for (const std::string& family : familyNames) {
    std::set<std::string> found = providerIdentifiersFromFamilyName(family);
    providers[family].insert(found.begin(), found.end());
  }
  ValueArray items;
  for (const auto& [family, identifiers] : providers) {
    items.push_back(
        Value::dictionary({{"displayName", family},
                           {"providers", Value(ValueArray(identifiers.begin(), identifiers.end()))},
                           {"uniqueID", family}}));
  }
  return items;
}

void TyphoraDaemon::showDialog(const ValueArray& items, std::int32_t forPID,
                               std::function<void(const ValueArray& answer)> completionHandler) {
  if (platform_.appStates.mostElevatedApplicationState(forPID) !=
      kApplicationStateForegroundRunning) {
    TYLog(kTYLogTyphoraDaemon, kInBackground, forPID);
    completionHandler({});
    return;
  }
  missingFontsDialogHandler_ =
      std::make_shared<MissingFontsDialogHandler>(weak_from_this(), std::move(completionHandler));
  missingFontsDialogHandler_->showDialogWithUserInfo(Value::dictionary({{"fonts", Value(items)}}));
}

std::shared_ptr<MissingFontsDialogHandler> TyphoraDaemon::missingFontsDialogHandler() const {
  return missingFontsDialogHandler_;
}

}  // namespace typhora
