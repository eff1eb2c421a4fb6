// Encodings kept for large values that many messages carry unchanged (the user-fonts records that
// every enumerating client receives at check-in): the CBOR encoder copies the kept bytes instead
// of walking the value again.
//
// A value is kept by identity, not by content: the memo holds a reference to it, so the address
// of its array or dictionary names that one value for as long as the memo keeps it, and a value
// built anew (another caller's filtered copy, the records read after a font change) is never
// mistaken for it. Values are immutable, so a kept encoding never goes stale. The memo keeps at
// most kCapacity values; keeping one more forgets the oldest.
#pragma once

#include <cstddef>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/value/value.h"

namespace typhora {

class CborEncodingMemo {
 public:
  static constexpr std::size_t kCapacity = 4;
  // Arrays and dictionaries smaller than this are never looked up: walking them is cheap.
  static constexpr std::size_t kMinimumItems = 64;

  // The one memo of the process, which CborCodec consults.
  static CborEncodingMemo& shared();

  // Keeps the encoding of `value` (an array or dictionary) from its next encoding on.
  void keep(const Value& value);
  // Forgets `value` and its encoding.
  void forget(const Value& value);

  struct Encoding {
    std::shared_ptr<const Bytes> bytes;  // null until first encoded
    std::size_t height = 0;              // levels of nesting below the value itself
  };
  // The container at `address` when kept: `*known` is set, with its encoding once there is one.
  bool find(const void* address, Encoding* known) const;
  // Stores the encoding of the kept container at `address` (ignored when it is no longer kept).
  void store(const void* address, Encoding encoding);

 private:
  struct Entry {
    Value value;  // holds the container alive, so that its address stays its own
    const void* address = nullptr;
    Encoding encoding;
  };
  static const void* addressOf(const Value& value);

  mutable std::mutex mutex_;
  std::vector<Entry> entries_;  // oldest first
};

}  // namespace typhora
