// Reads a property-list file written either as CBOR or as JSON, told apart by the first byte.
#pragma once

#include <optional>
#include <span>
#include <string>

#include "platform/value/value.h"
#include "platform/value/value_codec.h"

namespace typhora {

class PlistReader {
 public:
  enum class Format { Cbor, Json };

  // JSON when the first non-blank byte is '{', '[', '"', a digit, '-', 't', 'f' or 'n';
  // CBOR otherwise.
  static Format detect(std::span<const std::uint8_t> bytes);

  static std::optional<Value> read(std::span<const std::uint8_t> bytes,
                                   const DecodeLimits& limits = {}, std::string* error = nullptr);
  // Whether `bytes` decode, as read() would decide, without building what a CBOR input's large
  // arrays and dictionaries hold.
  static bool decodes(std::span<const std::uint8_t> bytes, const DecodeLimits& limits = {},
                      std::string* error = nullptr);
  // nullopt when the file cannot be opened or read, or does not decode; `error` says which. A
  // large CBOR file (a catalog) keeps its records encoded in the file's buffer until read.
  static std::optional<Value> readFile(const std::string& path, const DecodeLimits& limits = {},
                                       std::string* error = nullptr);
};

}  // namespace typhora
