// What the same traffic costs on bare Unix sockets: the floor each typhora figure is held to.
#pragma once

#include <cstddef>

namespace typhora::bench {

// Seconds per round trip of `bytes` each way between two threads over a socket pair.
double rawRoundTrip(std::size_t bytes, int rounds);

// Seconds per exchange of a `requestBytes` request answered by `replyBytes`.
double rawTransfer(std::size_t requestBytes, std::size_t replyBytes, int rounds);

// Seconds from the first write until `readers` threads have each read `bytes` from every one of
// their share of `sockets` socket pairs, written one after another by one thread.
double rawFanout(int sockets, int readers, std::size_t bytes);

}  // namespace typhora::bench
