// One installed application as the platform knows it, from its manifest file
// (<root>/etc/typhora/apps/<name>.plist, JSON or CBOR):
//
//   {
//     "identifier": "com.example.fonts",           signing identifier (string)
//     "executable": "/usr/lib/example/fonts",      the machine path of its program
//     "sha256": "<64 hex digits>",                 the program's SHA-256
//     "entitlements": { ... },                     any property-list values (optional)
//     "shortVersionString": "2.1",                 (optional)
//     "sandbox": { "readOnlyPaths": ["/var/mobile/Documents/"] }   (optional: unsandboxed)
//   }
//
// "readOnlyPaths" are the daemon's paths; a sandboxed application may read each of them and
// everything below a directory among them.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/value/value.h"

namespace typhora {

struct AppManifest {
  std::string identifier;
  std::string executable;
  std::string sha256;  // lower-case hex
  Value entitlements;  // a dictionary, or null
  std::optional<std::string> shortVersionString;
  bool sandboxed = false;
  std::vector<std::string> readOnlyPaths;

  // The manifest in `plist`, or nullopt with `error` set when a required key is missing or of
  // the wrong type.
  static std::optional<AppManifest> fromValue(const Value& plist, std::string* error);
};

}  // namespace typhora
