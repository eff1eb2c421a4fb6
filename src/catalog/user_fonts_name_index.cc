#include "catalog/user_fonts_name_index.h"

namespace typhora {

UserFontsNameIndex::UserFontsNameIndex(Value info) : info_(std::move(info)) {
  const Dictionary* files = info_.asDictionary();
  if (files == nullptr) return;
  for (const auto& [path, record] : *files) {
    const Dictionary* names = record.get("familyName").asDictionary();
    if (names == nullptr) continue;
    const bool enabled = record.get("disabled").asBool() != true;
    for (const auto& [postScriptName, value] : *names) {
      const std::string* family = value.asString();
      if (family == nullptr) continue;
      byPostScriptName_[postScriptName].push_back({path, *family, enabled});
      // A file with several fonts of one family is listed once for it.
      std::vector<File>& familyFiles = byFamily_[*family];
      if (familyFiles.empty() || familyFiles.back().path.data() != path.data())
        familyFiles.push_back({path, *family, enabled});
    }
  }
}

const std::vector<UserFontsNameIndex::File>& UserFontsNameIndex::lookUp(const Index& index,
                                                                        std::string_view name) {
  static const std::vector<File> none;
  const auto found = index.find(name);
  return found != index.end() ? found->second : none;
}

const std::vector<UserFontsNameIndex::File>& UserFontsNameIndex::filesOfFamily(
    std::string_view familyName) const {
  return lookUp(byFamily_, familyName);
}

const std::vector<UserFontsNameIndex::File>& UserFontsNameIndex::filesOfPostScriptName(
    std::string_view postScriptName) const {
  return lookUp(byPostScriptName_, postScriptName);
}

}  // namespace typhora
