#include "platform/linux/heap_trimmer.h"

#include <malloc.h>

#include <memory>

#include "platform/dispatch/serial_queue.h"

namespace typhora {

namespace {

void checkAfter(const std::shared_ptr<SerialQueue>& queue, Duration period,
                std::size_t slackBytes) {
  queue->asyncAfter(period, [queue, period, slackBytes] {
    HeapTrimmer::trimIfSlack(slackBytes);
    checkAfter(queue, period, slackBytes);
  });
}

}  // namespace

void HeapTrimmer::start(Duration period, std::size_t slackBytes) {
  checkAfter(SerialQueue::create("com.zorvane.typhorad.heap-trim"), period, slackBytes);
}

bool HeapTrimmer::trimIfSlack(std::size_t slackBytes) {
  // Free bytes in every arena, resident or already given back: a trim that finds the pages gone
  // walks the free lists and returns, a fraction of a millisecond a period.
  const struct mallinfo2 info = mallinfo2();
  if (info.fordblks <= slackBytes) return false;
  malloc_trim(0);
  return true;
}

}  // namespace typhora
