// The font registry library's operations that the daemon calls.
#pragma once

namespace typhora {

class TYUserFontManager {
 public:
  virtual ~TYUserFontManager() = default;
  // Brings the registry to its initial state for this version of the daemon's data.
  virtual void reset() = 0;
};

}  // namespace typhora
