// The state files the daemon and the platform write are replaced whole, so a crash never tears
// them; one found undecodable at start-up was damaged some other way (a disk fault, a hand edit,
// a copy cut short). Rather than have each reader quietly start empty and the next write bury the
// evidence, the file is renamed aside with a ".corrupt-<unix time>" suffix, logged, and the
// daemon starts without it.
#pragma once

#include <optional>
#include <string>

namespace typhora {

class CorruptFileQuarantine {
 public:
  // Sets aside every state file under `root` that does not decode.
  static void sweep(const std::string& root);
  // Sets `path` aside when it is a regular file that is empty or does not decode as a property
  // list; the new path when it did. A missing or unreadable file is left alone.
  static std::optional<std::string> setAsideIfUndecodable(const std::string& path);
};

}  // namespace typhora
