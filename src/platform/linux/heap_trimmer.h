// Gives the heap's free pages back to the kernel after a burst. The allocator returns memory only
// from the top of each arena: a crowd of connections that came and went leaves megabytes free in
// the middle of the heap, resident for good, behind one small block still in use above them
// (129 MB free of 129 MB after a churn of 80,000 connections). A periodic check trims the heaps
// once their free bytes pass a slack worth the trim's pass over them.
#pragma once

#include <cstddef>

#include "platform/dispatch/clock.h"

namespace typhora {

class HeapTrimmer {
 public:
  // From now on, every `period` on a queue of its own: trims when more than `slackBytes` of the
  // heaps are free. Call once.
  static void start(Duration period, std::size_t slackBytes);
  // Trims now when more than `slackBytes` are free; whether it did.
  static bool trimIfSlack(std::size_t slackBytes);
};

}  // namespace typhora
