// A writer killed between creating its temporary file and renaming it over the target leaves
// "<target>.tmp-<pid>" behind. Each is as large as the state file it was to replace, and a daemon
// restarted after crashes would gather them for good; they are removed at start-up once their
// writer is gone. A file whose pid names a live process is left alone: it may be that writer
// (typhoractl beside the daemon) mid-write.
#pragma once

#include <string>

namespace typhora {

class StaleTemporaryFiles {
 public:
  // Removes the temporary files of `target` whose writers have ended; returns how many.
  static int removeBeside(const std::string& target);
};

}  // namespace typhora
