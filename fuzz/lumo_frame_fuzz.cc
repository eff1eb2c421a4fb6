// The frame splitter and message decoder of a lumo connection, fed hostile bytes in arbitrary
// pieces.
#include <cstdint>

#include "platform/linux/lumo/transport/lumo_frame.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const typhora::LumoLimits limits = typhora::LumoLimits::inboundFromClients();
  typhora::LumoFrameSplitter splitter(limits);
  // The first byte picks how the stream is cut into reads.
  const std::size_t piece = size > 0 ? 1 + data[0] % 64 : 1;
  for (std::size_t at = size > 0 ? 1 : 0; at < size; at += piece) {
    splitter.addBytes({data + at, std::min(piece, size - at)});
    for (;;) {
      typhora::LumoRawFrame frame;
      std::string error;
      auto status = splitter.next(&frame, &error);
      if (status == typhora::LumoFrameSplitter::Status::NeedMore) break;
      if (status == typhora::LumoFrameSplitter::Status::Malformed) return 0;
      const auto kind = frame.kind;
      const auto id = frame.id;
      auto message = typhora::decodeLumoFrame(std::move(frame), limits, nullptr, &error);
      // What the I/O thread peeked at is what the message says.
      if (message && (message->kind != kind || message->id != id)) __builtin_trap();
    }
  }
  return 0;
}
