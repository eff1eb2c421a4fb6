// The building pass of the fast CBOR decoder: turns bytes that CborScanner took into Values. The
// containers the scanner listed stay encoded, as LazyContainers sharing the bytes, each read one
// level at a time when first opened. The bytes were validated: reading never meets an error but
// an endpoint index without a descriptor.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string_view>
#include <vector>

#include "platform/value/cbor_scanner.h"
#include "platform/value/value.h"
#include "platform/value/value_codec.h"

namespace typhora {

class CborReader {
 public:
  // Scanned bytes, kept alive by the values still encoded in them.
  struct Source {
    std::shared_ptr<const void> owner;  // holds `bytes`
    std::span<const std::uint8_t> bytes;
    std::vector<CborScanner::Container> lazy;  // in the order they begin
  };

  // The item filling `bytes`, with the containers of `source` (when given, over the same bytes)
  // left encoded. nullopt for an endpoint index the hooks know no descriptor for.
  static std::optional<Value> read(std::span<const std::uint8_t> bytes,
                                   const std::shared_ptr<const Source>& source,
                                   const EndpointHooks* hooks);
  // The items of `source->lazy[index]`, an array or a dictionary.
  static ValueArray readArray(const std::shared_ptr<const Source>& source, std::size_t index);
  static Dictionary readDictionary(const std::shared_ptr<const Source>& source, std::size_t index);
  // The value under `key` in `source->lazy[index]`, a dictionary, read without the rest of it;
  // a null Value when it has no such key.
  static Value readValueAt(const std::shared_ptr<const Source>& source, std::size_t index,
                           std::string_view key);

 private:
  CborReader(std::span<const std::uint8_t> bytes, const std::shared_ptr<const Source>* source,
             const EndpointHooks* hooks);

  Value item();
  std::uint64_t argument();
  std::string text();
  ValueArray array();
  std::vector<DictionaryEntry> entries();
  bool lazyAt(std::size_t offset, Value* value);
  Value tagged();
  double number();
  Value simple();
  void seek(std::size_t index);
  void skip();

  const std::uint8_t* base_;
  const std::uint8_t* at_;
  const std::shared_ptr<const Source>* source_;  // null: nothing stays encoded
  std::size_t next_ = 0;                         // the next of the source's containers
  const EndpointHooks* hooks_;
  bool failed_ = false;
};

}  // namespace typhora
