#include "platform/value/cbor_reader.h"

#include <cmath>
#include <cstring>

#include "platform/value/lazy_container.h"

namespace typhora {
namespace {

constexpr std::uint64_t kDateTag = 1;

std::uint64_t bigEndian(const std::uint8_t* at, std::size_t width) {
  std::uint64_t value = 0;
  for (std::size_t i = 0; i < width; ++i) value = (value << 8) | at[i];
  return value;
}

// Half precision as the stream decoder widens it, NaN included.
double halfFloat(std::uint16_t half) {
  const int exponent = (half >> 10) & 0x1f;
  const int mantissa = half & 0x3ff;
  double value = 0;
  if (exponent == 0) {
    value = std::ldexp(mantissa, -24);
  } else if (exponent != 31) {
    value = std::ldexp(mantissa + 1024, exponent - 25);
  } else {
    value = mantissa == 0 ? INFINITY : NAN;
  }
  return static_cast<float>((half & 0x8000) != 0 ? -value : value);
}

double floatAt(std::uint8_t initial, const std::uint8_t* at) {
  if (initial == 0xf9) return halfFloat(static_cast<std::uint16_t>(bigEndian(at, 2)));
  if (initial == 0xfa) {
    const auto bits = static_cast<std::uint32_t>(bigEndian(at, 4));
    float f = 0;
    std::memcpy(&f, &bits, sizeof f);
    return f;
  }
  const std::uint64_t bits = bigEndian(at, 8);
  double d = 0;
  std::memcpy(&d, &bits, sizeof d);
  return d;
}

}  // namespace

CborReader::CborReader(std::span<const std::uint8_t> bytes,
                       const std::shared_ptr<const Source>* source, const EndpointHooks* hooks)
    : base_(bytes.data()), at_(bytes.data()), source_(source), hooks_(hooks) {}

std::optional<Value> CborReader::read(std::span<const std::uint8_t> bytes,
                                      const std::shared_ptr<const Source>& source,
                                      const EndpointHooks* hooks) {
  CborReader reader(bytes, source ? &source : nullptr, hooks);
  Value value = reader.item();
  if (reader.failed_) return std::nullopt;
  return value;
}

void CborReader::seek(std::size_t index) {
  at_ = base_ + (*source_)->lazy[index].begin;
  next_ = index + 1;
}

ValueArray CborReader::readArray(const std::shared_ptr<const Source>& source, std::size_t index) {
  CborReader reader(source->bytes, &source, nullptr);
  reader.seek(index);
  return reader.array();
}

Dictionary CborReader::readDictionary(const std::shared_ptr<const Source>& source,
                                      std::size_t index) {
  CborReader reader(source->bytes, &source, nullptr);
  reader.seek(index);
  return Dictionary(reader.entries());
}

Value CborReader::readValueAt(const std::shared_ptr<const Source>& source, std::size_t index,
                              std::string_view key) {
  CborReader reader(source->bytes, &source, nullptr);
  reader.seek(index);
  const std::uint64_t count = reader.argument();
  for (std::uint64_t i = 0; i < count; ++i) {
    const std::uint64_t size = reader.argument();  // a key: text, as the scanner made sure
    const std::string_view name(reinterpret_cast<const char*>(reader.at_), size);
    reader.at_ += size;
    if (name == key) return reader.item();
    if (name > key) break;  // keys stand in increasing byte order
    reader.skip();
  }
  return Value();
}

// Steps over the item at the cursor, building nothing. Containers left encoded further on are
// still found by lazyAt, which catches up with the cursor.
void CborReader::skip() {
  const std::uint8_t initial = *at_;
  switch (initial >> 5) {
    case 0:
    case 1:
      argument();
      return;
    case 2:
    case 3:
      at_ += argument();
      return;
    case 4:
    case 5: {
      const std::uint64_t items = argument() * ((initial >> 5) == 5 ? 2 : 1);
      for (std::uint64_t i = 0; i < items; ++i) skip();
      return;
    }
    case 6:
      argument();
      skip();
      return;
    default:
      ++at_;
      at_ += initial == 0xf9 ? 2 : initial == 0xfa ? 4 : initial == 0xfb ? 8 : 0;
      return;
  }
}

std::uint64_t CborReader::argument() {
  const std::uint8_t info = *at_++ & 0x1f;
  if (info < 24) return info;
  const std::size_t width = std::size_t{1} << (info - 24);
  const std::uint64_t value = bigEndian(at_, width);
  at_ += width;
  return value;
}

std::string CborReader::text() {
  const std::uint64_t size = argument();
  std::string s(reinterpret_cast<const char*>(at_), size);
  at_ += size;
  return s;
}

Value CborReader::item() {
  const std::size_t offset = static_cast<std::size_t>(at_ - base_);
  switch (*at_ >> 5) {
    case 0:
      return Value(argument());
    case 1:
      return Value(-1 - static_cast<std::int64_t>(argument()));
    case 2: {
      const std::uint64_t size = argument();
      Value data(Bytes(at_, at_ + size));
      at_ += size;
      return data;
    }
    case 3:
      return Value(text());
    case 4:
    case 5: {
      Value lazy;
      if (lazyAt(offset, &lazy)) return lazy;
      if ((*at_ >> 5) == 4) return Value(array());
      return Value(Dictionary(entries()));
    }
    case 6:
      return tagged();
    default:
      return simple();
  }
}

bool CborReader::lazyAt(std::size_t offset, Value* value) {
  if (source_ == nullptr) return false;
  const std::vector<CborScanner::Container>& lazy = (*source_)->lazy;
  while (next_ < lazy.size() && lazy[next_].begin < offset) ++next_;
  if (next_ == lazy.size() || lazy[next_].begin != offset) return false;
  *value = Value(std::make_shared<const LazyContainer>(*source_, next_));
  at_ = base_ + lazy[next_].end;
  ++next_;
  return true;
}

ValueArray CborReader::array() {
  const std::uint64_t count = argument();
  ValueArray items;
  items.reserve(count);
  for (std::uint64_t i = 0; i < count; ++i) items.push_back(item());
  return items;
}

std::vector<DictionaryEntry> CborReader::entries() {
  const std::uint64_t count = argument();
  std::vector<DictionaryEntry> entries;
  entries.reserve(count);
  for (std::uint64_t i = 0; i < count; ++i) {
    std::string key = text();
    entries.emplace_back(std::move(key), item());
  }
  return entries;
}

double CborReader::number() {
  const std::uint8_t initial = *at_;
  switch (initial >> 5) {
    case 0:
      return static_cast<double>(argument());
    case 1:
      return static_cast<double>(-1 - static_cast<std::int64_t>(argument()));
    default: {
      const double value = floatAt(initial, at_ + 1);
      at_ += initial == 0xf9 ? 3 : initial == 0xfa ? 5 : 9;
      return value;
    }
  }
}

Value CborReader::tagged() {
  if (argument() == kDateTag) return Value(Date{number()});
  std::shared_ptr<const IpcEndpoint> endpoint = hooks_->fromIndex(argument());
  if (!endpoint) failed_ = true;
  return Value(std::move(endpoint));
}

Value CborReader::simple() {
  const std::uint8_t initial = *at_++;
  switch (initial) {
    case 0xf4:
      return Value(false);
    case 0xf5:
      return Value(true);
    case 0xf6:
      return Value();
    default: {
      const double value = floatAt(initial, at_);
      at_ += initial == 0xf9 ? 2 : initial == 0xfa ? 4 : 8;
      return Value(value);
    }
  }
}

}  // namespace typhora
