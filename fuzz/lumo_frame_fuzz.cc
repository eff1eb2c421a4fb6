// The frame and message decoder of a lumo connection, fed hostile bytes in arbitrary pieces.
#include <cstdint>

#include "platform/linux/lumo_frame.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  typhora::LumoLimits limits;
  limits.maxPayload = 1 << 20;
  typhora::LumoFrameDecoder decoder(limits);
  // The first byte picks how the stream is cut into reads.
  const std::size_t piece = size > 0 ? 1 + data[0] % 64 : 1;
  for (std::size_t at = size > 0 ? 1 : 0; at < size; at += piece) {
    decoder.addBytes({data + at, std::min(piece, size - at)});
    for (;;) {
      typhora::LumoMessage message;
      std::string error;
      auto status = decoder.next(&message, &error, nullptr);
      if (status == typhora::LumoFrameDecoder::Status::NeedMore) break;
      if (status == typhora::LumoFrameDecoder::Status::Malformed) return 0;
    }
  }
  return 0;
}
