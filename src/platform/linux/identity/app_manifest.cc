#include "platform/linux/identity/app_manifest.h"

#include <algorithm>

namespace typhora {

namespace {

bool isHexDigest(const std::string& text) {
  return text.size() == 64 && std::all_of(text.begin(), text.end(), [](char c) {
           return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f');
         });
}

bool readSandbox(const Value& sandbox, AppManifest& manifest, std::string* error) {
  if (sandbox.isNull()) return true;
  const ValueArray* paths = sandbox.get("readOnlyPaths").asArray();
  if (sandbox.asDictionary() == nullptr ||
      (paths == nullptr && !sandbox.get("readOnlyPaths").isNull())) {
    *error = "\"sandbox\" must be a dictionary with an array \"readOnlyPaths\"";
    return false;
  }
  manifest.sandboxed = true;
  for (const Value& path : paths != nullptr ? *paths : ValueArray{}) {
    const std::string* text = path.asString();
    if (text == nullptr || text->empty() || text->front() != '/') {
      *error = "\"readOnlyPaths\" must hold absolute paths";
      return false;
    }
    manifest.readOnlyPaths.push_back(*text);
  }
  return true;
}

}  // namespace

std::optional<AppManifest> AppManifest::fromValue(const Value& plist, std::string* error) {
  std::string ignored;
  if (error == nullptr) error = &ignored;
  const std::string* identifier = plist.get("identifier").asString();
  const std::string* executable = plist.get("executable").asString();
  const std::string* sha256 = plist.get("sha256").asString();
  if (identifier == nullptr || executable == nullptr || sha256 == nullptr) {
    *error = "\"identifier\", \"executable\" and \"sha256\" must be strings";
    return std::nullopt;
  }
  // An application without a name would be granted and ledgered under "", and a relative
  // program path names no one file.
  if (identifier->empty() || !executable->starts_with('/')) {
    *error = "\"identifier\" must not be empty and \"executable\" must be an absolute path";
    return std::nullopt;
  }
  if (!isHexDigest(*sha256)) {
    *error = "\"sha256\" must be 64 lower-case hex digits";
    return std::nullopt;
  }
  AppManifest manifest;
  manifest.identifier = *identifier;
  manifest.executable = *executable;
  manifest.sha256 = *sha256;
  const Value& entitlements = plist.get("entitlements");
  if (!entitlements.isNull() && entitlements.asDictionary() == nullptr) {
    *error = "\"entitlements\" must be a dictionary";
    return std::nullopt;
  }
  manifest.entitlements = entitlements;
  const Value& version = plist.get("shortVersionString");
  if (const std::string* text = version.asString()) manifest.shortVersionString = *text;
  if (!readSandbox(plist.get("sandbox"), manifest, error)) return std::nullopt;
  return manifest;
}

}  // namespace typhora
