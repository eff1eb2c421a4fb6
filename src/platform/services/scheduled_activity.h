// Background activities that the platform runs when due. An activity registered with the
// check-in marker takes its schedule and conditions from the daemon's launch configuration.
#pragma once

#include <functional>
#include <string>

namespace typhora {

enum class ScheduledActivityState {
  checkIn,  // the first call, made at registration
  run,      // the activity is due and runs now
};

class ScheduledActivity {
 public:
  using Handler = std::function<void(ScheduledActivityState state)>;
  virtual ~ScheduledActivity() = default;
  // Registers `identifier` with the check-in marker. `handler` is called once in the check-in
  // state, then in the run state each time the activity is due, on the main queue.
  virtual void registerActivity(const std::string& identifier, Handler handler) = 0;
};

}  // namespace typhora
