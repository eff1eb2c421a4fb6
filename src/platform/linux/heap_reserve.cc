#include "platform/linux/heap_reserve.h"

#include <malloc.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>

namespace typhora {

namespace {

#ifndef MADV_POPULATE_WRITE
constexpr int MADV_POPULATE_WRITE = 23;  // Linux 5.14; older kernels refuse it, harmlessly
#endif

constexpr int kDefaultMmapThreshold = 128 * 1024;

}  // namespace

void HeapReserve::prefault(std::size_t bytes) {
  const auto page = static_cast<std::uintptr_t>(sysconf(_SC_PAGESIZE));
  if (bytes < 4 * page) {
    // A fixed threshold all the same: glibc otherwise raises it to the largest block freed, and
    // from then on every large frame a client sends is carved from a thread's arena, which keeps
    // the pages after the frame is gone (a few MiB for each arena, for good).
    mallopt(M_MMAP_THRESHOLD, kDefaultMmapThreshold);
    return;
  }
  // One block from the heap proper (not a mapping of its own), kept after it is freed: its
  // pages then serve the many small allocations that follow.
  mallopt(M_MMAP_THRESHOLD, static_cast<int>(bytes + page));
  mallopt(M_TRIM_THRESHOLD, static_cast<int>(2 * bytes));
  mallopt(M_TOP_PAD, static_cast<int>(bytes / 4));
  void* block = std::malloc(bytes);
  if (block != nullptr) {
    const auto first = (reinterpret_cast<std::uintptr_t>(block) + page - 1) & ~(page - 1);
    const auto last = (reinterpret_cast<std::uintptr_t>(block) + bytes) & ~(page - 1);
    if (last > first) {
      // Huge pages where the kernel offers them on request: fewer, larger pages to populate.
      madvise(reinterpret_cast<void*>(first), last - first, MADV_HUGEPAGE);
      madvise(reinterpret_cast<void*>(first), last - first, MADV_POPULATE_WRITE);
    }
    std::free(block);
  }
  mallopt(M_MMAP_THRESHOLD, kDefaultMmapThreshold);
}

}  // namespace typhora
