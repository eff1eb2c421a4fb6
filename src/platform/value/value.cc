#include "platform/value/value.h"

#include <algorithm>
#include <cmath>
#include <limits>

#include "platform/value/json_codec.h"
#include "platform/value/lazy_container.h"

namespace typhora {
namespace {

bool keyLess(const DictionaryEntry& a, const DictionaryEntry& b) {
  return a.first < b.first;
}

}  // namespace

Dictionary::Dictionary(std::vector<DictionaryEntry> entries) : entries_(std::move(entries)) {
  // Entries already in strictly increasing order (every decoded or derived dictionary) are kept
  // as they are, after one comparison per pair.
  const bool strictlyIncreasing =
      std::adjacent_find(entries_.begin(), entries_.end(), [](const auto& a, const auto& b) {
        return !keyLess(a, b);
      }) == entries_.end();
  if (strictlyIncreasing) return;
  if (!std::is_sorted(entries_.begin(), entries_.end(), keyLess)) {
    std::stable_sort(entries_.begin(), entries_.end(), keyLess);
  }
  // Keep the last entry of each run of equal keys.
  auto out = entries_.begin();
  for (auto it = entries_.begin(); it != entries_.end(); ++it) {
    auto next = std::next(it);
    if (next != entries_.end() && next->first == it->first) continue;
    if (out != it) *out = std::move(*it);
    ++out;
  }
  entries_.erase(out, entries_.end());
}

const Value* Dictionary::find(std::string_view key) const {
  auto it =
      std::lower_bound(entries_.begin(), entries_.end(), key,
                       [](const DictionaryEntry& e, std::string_view k) { return e.first < k; });
  if (it == entries_.end() || it->first != key) return nullptr;
  return &it->second;
}

bool operator==(const Dictionary& a, const Dictionary& b) {
  return a.entries_ == b.entries_;
}

Value::Value(Bytes data) : v_(std::make_shared<const Bytes>(std::move(data))) {}
Value::Value(ValueArray array) : v_(std::make_shared<const ValueArray>(std::move(array))) {}
Value::Value(Dictionary dict) : v_(std::make_shared<const Dictionary>(std::move(dict))) {}
Value::Value(std::shared_ptr<const IpcEndpoint> endpoint) {
  if (endpoint) v_ = std::move(endpoint);
}

Value::Value(std::shared_ptr<const LazyContainer> encoded) {
  if (encoded) v_ = std::move(encoded);
}

void Value::setUnsigned(std::uint64_t u) {
  if (u <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
    v_ = static_cast<std::int64_t>(u);
  } else {
    v_ = u;
  }
}

Value::Type Value::lazyType() const {
  return lazyContainer()->isDictionary() ? Type::Dictionary : Type::Array;
}

bool Value::isNumber() const {
  Type t = type();
  return t == Type::Int || t == Type::UInt || t == Type::Double;
}

std::optional<bool> Value::asBool() const {
  if (auto* b = std::get_if<bool>(&v_)) return *b;
  return std::nullopt;
}

std::optional<std::int64_t> Value::asInt() const {
  if (auto* i = std::get_if<std::int64_t>(&v_)) return *i;
  return std::nullopt;  // UInt only holds values above INT64_MAX
}

std::optional<std::uint64_t> Value::asUInt() const {
  if (auto* i = std::get_if<std::int64_t>(&v_); i && *i >= 0) return static_cast<std::uint64_t>(*i);
  if (auto* u = std::get_if<std::uint64_t>(&v_)) return *u;
  return std::nullopt;
}

std::optional<double> Value::asDouble() const {
  if (auto* d = std::get_if<double>(&v_)) return *d;
  if (auto* i = std::get_if<std::int64_t>(&v_)) return static_cast<double>(*i);
  if (auto* u = std::get_if<std::uint64_t>(&v_)) return static_cast<double>(*u);
  return std::nullopt;
}

const std::string* Value::asString() const {
  return std::get_if<std::string>(&v_);
}

const Bytes* Value::asData() const {
  auto* p = std::get_if<std::shared_ptr<const Bytes>>(&v_);
  return p ? p->get() : nullptr;
}

std::optional<Date> Value::asDate() const {
  if (auto* d = std::get_if<Date>(&v_)) return *d;
  return std::nullopt;
}

const ValueArray* Value::asArray() const {
  if (auto* p = std::get_if<std::shared_ptr<const ValueArray>>(&v_)) return p->get();
  const LazyContainer* lazy = lazyContainer();
  return lazy ? lazy->array() : nullptr;
}

const Dictionary* Value::asDictionary() const {
  if (auto* p = std::get_if<std::shared_ptr<const Dictionary>>(&v_)) return p->get();
  const LazyContainer* lazy = lazyContainer();
  return lazy ? lazy->dictionary() : nullptr;
}

const std::shared_ptr<const IpcEndpoint>* Value::asEndpoint() const {
  return std::get_if<std::shared_ptr<const IpcEndpoint>>(&v_);
}

const Value& nullValue() {
  static const Value null;
  return null;
}

const Value& Value::get(std::string_view key) const {
  const Dictionary* dict = asDictionary();
  const Value* found = dict ? dict->find(key) : nullptr;
  return found ? *found : nullValue();
}

Value Value::peek(std::string_view key) const {
  if (const LazyContainer* lazy = lazyContainer()) return lazy->valueAt(key);
  return get(key);
}

const Value& Value::at(std::size_t index) const {
  const ValueArray* array = asArray();
  return array && index < array->size() ? (*array)[index] : nullValue();
}

Value Value::with(std::string_view key, Value value) const {
  std::vector<DictionaryEntry> entries;
  if (const Dictionary* dict = asDictionary()) entries = dict->entries();
  auto it =
      std::lower_bound(entries.begin(), entries.end(), key,
                       [](const DictionaryEntry& e, std::string_view k) { return e.first < k; });
  const bool present = it != entries.end() && it->first == key;
  if (value.isNull()) {
    if (present) entries.erase(it);
  } else if (present) {
    it->second = std::move(value);
  } else {
    entries.emplace(it, std::string(key), std::move(value));
  }
  return Value(Dictionary(std::move(entries)));
}

std::string Value::description() const {
  if (const std::string* s = asString()) return *s;
  if (isNull()) return "(null)";
  return JsonCodec::encode(*this);
}

bool operator==(const Value& a, const Value& b) {
  if (a.type() != b.type()) return false;
  const LazyContainer* encodedA = a.lazyContainer();
  const LazyContainer* encodedB = b.lazyContainer();
  if (encodedA != nullptr && encodedB != nullptr &&
      std::ranges::equal(encodedA->encoding(), encodedB->encoding())) {
    return true;  // the same bytes decode to the same value
  }
  switch (a.type()) {
    case Value::Type::Data:
      return *a.asData() == *b.asData();
    case Value::Type::Array:
      return a.asArray() == b.asArray() || *a.asArray() == *b.asArray();
    case Value::Type::Dictionary:
      return a.asDictionary() == b.asDictionary() || *a.asDictionary() == *b.asDictionary();
    case Value::Type::Double: {
      double x = *a.asDouble();
      double y = *b.asDouble();
      return x == y || (std::isnan(x) && std::isnan(y));
    }
    default:
      return a.v_ == b.v_;  // scalars by value, endpoints by identity
  }
}

}  // namespace typhora
