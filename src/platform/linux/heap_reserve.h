// Grows the process's heap once, with every page already in memory. A daemon that decodes a
// large file right after it starts would otherwise take one page fault per fresh heap page,
// which costs more than the decoding itself on virtual machines.
#pragma once

#include <cstddef>

namespace typhora {

class HeapReserve {
 public:
  // Call on the main thread before any other thread starts; the pages stay with the heap and
  // serve the main thread's next allocations.
  static void prefault(std::size_t bytes);
};

}  // namespace typhora
