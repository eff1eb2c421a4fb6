// Shared pieces of the property-list codecs: limits and the endpoint hooks of the IPC layer.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>

namespace typhora {

class IpcEndpoint;

// Limits every decoder enforces; anything beyond them is refused with a clear error.
struct DecodeLimits {
  std::size_t maxBytes = 64u << 20;  // whole input
  std::size_t maxDepth = 64;         // nesting of arrays and dictionaries
  std::size_t maxItems = 4u << 20;   // array elements + dictionary entries, all levels together
};

// How IPC endpoints cross an encoding: the IPC layer turns an endpoint into an index into the
// descriptors it passes beside the message, and back. Without hooks, an endpoint cannot be
// encoded and the private tag is refused when decoding.
struct EndpointHooks {
  std::function<std::optional<std::uint64_t>(const std::shared_ptr<const IpcEndpoint>&)> toIndex;
  std::function<std::shared_ptr<const IpcEndpoint>(std::uint64_t)> fromIndex;
};

// CBOR tag of an endpoint (its content is the descriptor's index). In the private range.
inline constexpr std::uint64_t kCborEndpointTag = 0x7479'0001;  // "ty" 1

}  // namespace typhora
