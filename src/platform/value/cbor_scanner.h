// The validating pass of the fast CBOR decoder: walks an encoding once, building nothing, and says
// whether the reader may build it and which large arrays and dictionaries may stay encoded.
//
// It takes a subset of what the stream decoder takes, under the same limits: definite lengths,
// dictionary keys that are text, the date tag and (with hooks) the endpoint tag, no undefined or
// unassigned simple values. Anything else, malformed or merely unusual, is left to the stream
// decoder, which also words every refusal: what the scanner takes, the stream decoder takes too.
//
// A container may stay encoded when its bytes are exactly what the encoder writes for it (shortest
// heads, doubles in eight bytes, keys in strictly increasing byte order, no NaN) and it holds no
// endpoint: its encoding can then be copied as it stands, and reading it later cannot fail.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

#include "platform/value/value_codec.h"

namespace typhora {

class CborScanner {
 public:
  // A container that may stay encoded: its bytes are [begin, end) of the input.
  struct Container {
    std::size_t begin = 0;
    std::size_t end = 0;
    std::size_t height = 0;  // levels of nesting below it, as the encoder counts them
    bool dictionary = false;
  };

  // True when the reader may build `input`. Containers of at least `lazyBytes` bytes that may stay
  // encoded are appended to `lazy` in the order they begin (none when `lazyBytes` is 0).
  static bool scan(std::span<const std::uint8_t> input, const DecodeLimits& limits, bool endpoints,
                   std::size_t lazyBytes, std::vector<Container>* lazy);

 private:
  CborScanner(std::span<const std::uint8_t> input, const DecodeLimits& limits, bool endpoints,
              std::size_t lazyBytes, std::vector<Container>* lazy);

  bool item(std::size_t depth, std::size_t* height);
  bool atom(std::uint8_t initial);
  bool head(std::uint64_t* argument, bool* shortest);
  bool container(std::uint64_t count, bool dictionary, bool shortest, std::size_t begin,
                 std::size_t depth, std::size_t* height);
  bool key(const std::uint8_t** previous, std::size_t* previousSize);
  bool tag(std::uint64_t number, std::uint8_t initial, std::size_t depth);
  bool simple(std::uint8_t initial);
  bool text(std::uint64_t size);
  bool take(std::uint64_t size);
  bool count(std::uint64_t items);

  const std::uint8_t* data_;
  std::size_t size_;
  std::size_t at_ = 0;
  const DecodeLimits& limits_;
  bool endpoints_;
  std::size_t lazyBytes_;
  std::vector<Container>* lazy_;
  std::size_t items_ = 0;
  // Of the innermost open container: whether it is still as the encoder writes it, and whether
  // it holds an endpoint.
  bool canonical_ = true;
  bool holdsEndpoint_ = false;
};

}  // namespace typhora
