// The one property-list value type of the daemon and its platform layer.
//
// A Value is null (absent), a boolean, a signed or unsigned 64-bit integer, a double, a UTF-8
// string, data (bytes), a date, an array, a dictionary, or an IPC endpoint (only inside IPC
// messages). Arrays, dictionaries and data are immutable and shared: copying a Value never copies
// their contents, and a changed record is a new Value built from the old one.
//
// Dictionaries keep their entries sorted by key (byte-wise), so iteration order, and with it every
// "first match", is the same on every run.
//
// A large array or dictionary decoded from CBOR may still be in its encoding (a LazyContainer):
// it is read when first opened, and nothing else about it differs.
#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <variant>
#include <vector>

namespace typhora {

class IpcEndpoint;
class LazyContainer;
class Value;

// A point in time, as seconds since 1970-01-01T00:00:00Z.
struct Date {
  double secondsSince1970 = 0;
  friend bool operator==(const Date&, const Date&) = default;
  friend auto operator<=>(const Date&, const Date&) = default;
};

using Bytes = std::vector<std::uint8_t>;
using ValueArray = std::vector<Value>;
using DictionaryEntry = std::pair<std::string, Value>;

class Dictionary;

class Value {
 public:
  enum class Type {
    Null,
    Bool,
    Int,   // signed 64-bit
    UInt,  // unsigned 64-bit above INT64_MAX; smaller unsigned values are stored as Int
    Double,
    String,
    Data,
    Date,
    Array,
    Dictionary,
    Endpoint,
  };

  Value() = default;
  Value(std::nullptr_t) {}  // NOLINT(google-explicit-constructor)

  // Booleans only from a real bool (a pointer or an int never becomes a boolean).
  template <class T, std::enable_if_t<std::is_same_v<T, bool>, int> = 0>
  Value(T b) : v_(b) {}  // NOLINT(google-explicit-constructor)
  template <class T, std::enable_if_t<std::is_integral_v<T> && !std::is_same_v<T, bool> &&
                                          !std::is_same_v<T, char>,
                                      int> = 0>
  Value(T i) {  // NOLINT(google-explicit-constructor)
    if constexpr (std::is_signed_v<T>) {
      v_ = static_cast<std::int64_t>(i);
    } else {
      setUnsigned(static_cast<std::uint64_t>(i));
    }
  }
  Value(double d) : v_(d) {}                           // NOLINT
  Value(const char* s) : v_(std::string(s)) {}         // NOLINT
  Value(std::string s) : v_(std::move(s)) {}           // NOLINT
  Value(std::string_view s) : v_(std::string(s)) {}    // NOLINT
  Value(Bytes data);                                   // NOLINT
  Value(Date d) : v_(d) {}                             // NOLINT
  Value(ValueArray array);                             // NOLINT
  Value(Dictionary dict);                              // NOLINT
  Value(std::shared_ptr<const IpcEndpoint> endpoint);  // NOLINT
  // An array or dictionary still encoded (made by the CBOR decoder).
  explicit Value(std::shared_ptr<const LazyContainer> encoded);

  // Builders: Value::array({1, "two"}), Value::dictionary({{"a", 1}, {"b", true}}).
  static Value array(std::initializer_list<Value> items);
  static Value dictionary(std::initializer_list<DictionaryEntry> entries);
  static Value data(std::span<const std::uint8_t> bytes) {
    return Value(Bytes(bytes.begin(), bytes.end()));
  }

  Type type() const {
    // Every index but the last is its type; the last is a container still encoded.
    return v_.index() + 1 == std::variant_size_v<decltype(v_)> ? lazyType()
                                                               : static_cast<Type>(v_.index());
  }
  bool isNull() const { return type() == Type::Null; }
  bool isNumber() const;  // Int, UInt or Double

  // Typed accessors answer "absent" (nullopt / nullptr) for a wrong type.
  std::optional<bool> asBool() const;
  // Int, or UInt within range. Doubles are not integers here.
  std::optional<std::int64_t> asInt() const;
  std::optional<std::uint64_t> asUInt() const;  // non-negative Int or UInt
  // Any number, as a double.
  std::optional<double> asDouble() const;
  const std::string* asString() const;
  const Bytes* asData() const;
  std::optional<Date> asDate() const;
  const ValueArray* asArray() const;
  const Dictionary* asDictionary() const;
  const std::shared_ptr<const IpcEndpoint>* asEndpoint() const;
  // The container when it is still encoded (opened or not), for the encoder to copy.
  const LazyContainer* lazyContainer() const {
    auto* p = std::get_if<std::shared_ptr<const LazyContainer>>(&v_);
    return p ? p->get() : nullptr;
  }

  // Dictionary lookup: the value under `key`, or a null Value when this is not a dictionary or
  // the key is missing. Chains: info.get("familyName").get("Foo-Bold").asString().
  const Value& get(std::string_view key) const;
  // As get(), by value: a dictionary still encoded is read no further than `key`, and stays so.
  Value peek(std::string_view key) const;
  // Array element, or a null Value when out of range or not an array.
  const Value& at(std::size_t index) const;

  // A new dictionary: this one (or an empty one when this is not a dictionary) with `key` set to
  // `value`, or removed when `value` is null.
  Value with(std::string_view key, Value value) const;
  Value without(std::string_view key) const { return with(key, Value()); }

  // What "%@" prints: a string as itself, anything else as compact JSON in the conventions of
  // the JSON codec ({"$data": ...}, {"$date": ...}); null prints "(null)".
  std::string description() const;

  friend bool operator==(const Value& a, const Value& b);

 private:
  void setUnsigned(std::uint64_t u);
  Type lazyType() const;  // Array or Dictionary

  std::variant<std::monostate, bool, std::int64_t, std::uint64_t, double, std::string,
               std::shared_ptr<const Bytes>, Date, std::shared_ptr<const ValueArray>,
               std::shared_ptr<const Dictionary>, std::shared_ptr<const IpcEndpoint>,
               std::shared_ptr<const LazyContainer>>
      v_;
};

// A shared null Value, for accessors that return references.
const Value& nullValue();

// Immutable dictionary: entries sorted by key, unique keys.
class Dictionary {
 public:
  Dictionary() = default;
  // Sorts the entries by key; when a key repeats, the last entry for it wins.
  explicit Dictionary(std::vector<DictionaryEntry> entries);

  // The value for `key`, or nullptr when there is none.
  const Value* find(std::string_view key) const;
  bool contains(std::string_view key) const { return find(key) != nullptr; }
  std::size_t size() const { return entries_.size(); }
  bool empty() const { return entries_.empty(); }
  auto begin() const { return entries_.begin(); }
  auto end() const { return entries_.end(); }
  const std::vector<DictionaryEntry>& entries() const { return entries_; }

  friend bool operator==(const Dictionary&, const Dictionary&);

 private:
  std::vector<DictionaryEntry> entries_;
};

inline Value Value::array(std::initializer_list<Value> items) {
  return Value(ValueArray(items));
}
inline Value Value::dictionary(std::initializer_list<DictionaryEntry> entries) {
  return Value(Dictionary(std::vector<DictionaryEntry>(entries)));
}

}  // namespace typhora
