// An array or dictionary still in its CBOR encoding. It is read one level, once, when first
// opened, by whichever thread opens it first, and encoded again by copying its bytes, which are
// exactly what the encoder would write for it (CborScanner lists no other).
#pragma once

#include <atomic>
#include <cstddef>
#include <memory>
#include <mutex>
#include <span>
#include <string_view>

#include "platform/value/cbor_reader.h"
#include "platform/value/value.h"

namespace typhora {

class LazyContainer {
 public:
  LazyContainer(std::shared_ptr<const CborReader::Source> source, std::size_t index)
      : source_(std::move(source)), index_(index) {}

  bool isDictionary() const { return container().dictionary; }
  std::span<const std::uint8_t> encoding() const;
  // Levels of nesting below the container, as the encoder counts them.
  std::size_t height() const { return container().height; }

  const ValueArray* array() const;       // nullptr for a dictionary
  const Dictionary* dictionary() const;  // nullptr for an array
  // The value under `key` of a dictionary, read alone while the container is still unopened: a
  // caller after one field of thousands of records need not build them all.
  Value valueAt(std::string_view key) const;

 private:
  const CborScanner::Container& container() const { return source_->lazy[index_]; }
  void open() const;

  std::shared_ptr<const CborReader::Source> source_;
  std::size_t index_;
  mutable std::once_flag once_;
  mutable std::atomic<bool> opened_{false};  // spares call_once's call once open
  mutable ValueArray array_;
  mutable Dictionary dictionary_;
};

}  // namespace typhora
