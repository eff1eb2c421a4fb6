// JSON: a small writer, and simdjson's on-demand parser building Values as it goes.
#include "platform/value/json_codec.h"

#include <simdjson.h>
#include <sodium.h>

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <ctime>

namespace typhora {
namespace {

constexpr std::string_view kDataKey = "$data";
constexpr std::string_view kDateKey = "$date";

// ---- Dates in RFC 3339 ----

// RFC 3339 has years 0000 to 9999; a date a peer sent may lie anywhere a double reaches, and
// converting one past time_t is undefined. Such dates are written as the nearest year that can be.
constexpr double kFirstSecond = -62'167'219'200.0;  // 0000-01-01T00:00:00Z
constexpr double kLastSecond = 253'402'300'799.0;   // 9999-12-31T23:59:59Z

std::string formatDate(Date date) {
  const double seconds = std::isnan(date.secondsSince1970)
                             ? 0.0
                             : std::clamp(date.secondsSince1970, kFirstSecond, kLastSecond);
  double whole = std::floor(seconds);
  double fraction = seconds - whole;
  std::time_t t = static_cast<std::time_t>(whole);
  std::tm tm{};
  gmtime_r(&t, &tm);
  char buffer[64];
  // Four-digit years, zero-padded, as RFC 3339 has them.
  std::snprintf(buffer, sizeof buffer, "%04d-%02d-%02dT%02d:%02d:%02d", tm.tm_year + 1900,
                tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec);
  std::string out(buffer);
  if (fraction > 0) {
    char frac[32];
    std::snprintf(frac, sizeof frac, "%.9f", fraction);  // "0.123456789"
    std::string digits(frac + 1);
    while (!digits.empty() && digits.back() == '0') digits.pop_back();
    if (digits.size() > 1) out += digits;
  }
  return out + "Z";
}

bool digitsAt(std::string_view s, std::size_t at, std::size_t count, int* out) {
  if (at + count > s.size()) return false;
  int v = 0;
  for (std::size_t i = at; i < at + count; ++i) {
    if (s[i] < '0' || s[i] > '9') return false;
    v = v * 10 + (s[i] - '0');
  }
  *out = v;
  return true;
}

std::optional<Date> parseDate(std::string_view s) {
  int year, month, day, hour, minute, second;
  if (!digitsAt(s, 0, 4, &year) || s.size() < 19 || s[4] != '-' || !digitsAt(s, 5, 2, &month) ||
      s[7] != '-' || !digitsAt(s, 8, 2, &day) || (s[10] != 'T' && s[10] != 't') ||
      !digitsAt(s, 11, 2, &hour) || s[13] != ':' || !digitsAt(s, 14, 2, &minute) || s[16] != ':' ||
      !digitsAt(s, 17, 2, &second)) {
    return std::nullopt;
  }
  if (month < 1 || month > 12 || day < 1 || day > 31 || hour > 23 || minute > 59 || second > 60) {
    return std::nullopt;
  }
  std::size_t at = 19;
  double fraction = 0;
  if (at < s.size() && s[at] == '.') {
    double scale = 0.1;
    std::size_t start = ++at;
    for (; at < s.size() && s[at] >= '0' && s[at] <= '9'; ++at, scale /= 10) {
      fraction += (s[at] - '0') * scale;
    }
    if (at == start) return std::nullopt;
  }
  int offsetSeconds = 0;
  if (at < s.size() && (s[at] == 'Z' || s[at] == 'z')) {
    ++at;
  } else if (at < s.size() && (s[at] == '+' || s[at] == '-')) {
    int oh, om;
    if (!digitsAt(s, at + 1, 2, &oh) || at + 3 >= s.size() || s[at + 3] != ':' ||
        !digitsAt(s, at + 4, 2, &om)) {
      return std::nullopt;
    }
    offsetSeconds = (oh * 3600 + om * 60) * (s[at] == '-' ? -1 : 1);
    at += 6;
  } else {
    return std::nullopt;
  }
  if (at != s.size()) return std::nullopt;
  std::tm tm{};
  tm.tm_year = year - 1900;
  tm.tm_mon = month - 1;
  tm.tm_mday = day;
  tm.tm_hour = hour;
  tm.tm_min = minute;
  tm.tm_sec = second;
  double seconds = static_cast<double>(timegm(&tm)) - offsetSeconds;
  return Date{seconds + fraction};
}

// ---- Writer ----

class Writer {
 public:
  explicit Writer(bool pretty) : pretty_(pretty) {}
  std::string take() { return std::move(out_); }

  void write(const Value& value, int depth) {
    switch (value.type()) {
      case Value::Type::Null:
        out_ += "null";
        return;
      case Value::Type::Bool:
        out_ += *value.asBool() ? "true" : "false";
        return;
      case Value::Type::Int:
        out_ += std::to_string(*value.asInt());
        return;
      case Value::Type::UInt:
        out_ += std::to_string(*value.asUInt());
        return;
      case Value::Type::Double:
        return number(*value.asDouble());
      case Value::Type::String:
        return string(*value.asString());
      case Value::Type::Data:
        return special(kDataKey, base64(*value.asData()), depth);
      case Value::Type::Date:
        return special(kDateKey, formatDate(*value.asDate()), depth);
      case Value::Type::Endpoint:
        out_ += "{\"$endpoint\": null}";
        return;
      case Value::Type::Array:
        return array(*value.asArray(), depth);
      case Value::Type::Dictionary:
        return object(*value.asDictionary(), depth);
    }
  }

 private:
  void newline(int depth) {
    if (!pretty_) return;
    out_ += '\n';
    out_.append(static_cast<std::size_t>(depth) * 2, ' ');
  }

  void number(double d) {
    if (!std::isfinite(d)) {
      out_ += "null";  // JSON has no infinities or NaN
      return;
    }
    char buffer[32];
    auto [end, ec] = std::to_chars(buffer, buffer + sizeof buffer, d);
    std::string_view text(buffer, static_cast<std::size_t>(end - buffer));
    out_ += text;
    // Keep integral doubles doubles when read back.
    if (text.find_first_of(".eE") == std::string_view::npos) out_ += ".0";
  }

  void string(std::string_view s) {
    out_ += '"';
    for (char ch : s) {
      auto c = static_cast<unsigned char>(ch);
      switch (c) {
        case '"':
          out_ += "\\\"";
          break;
        case '\\':
          out_ += "\\\\";
          break;
        case '\n':
          out_ += "\\n";
          break;
        case '\r':
          out_ += "\\r";
          break;
        case '\t':
          out_ += "\\t";
          break;
        case '\b':
          out_ += "\\b";
          break;
        case '\f':
          out_ += "\\f";
          break;
        default:
          if (c < 0x20) {
            char escape[8];
            std::snprintf(escape, sizeof escape, "\\u%04x", c);
            out_ += escape;
          } else {
            out_ += ch;
          }
      }
    }
    out_ += '"';
  }

  static std::string base64(const Bytes& data) {
    std::string out(sodium_base64_ENCODED_LEN(data.size(), sodium_base64_VARIANT_ORIGINAL), '\0');
    sodium_bin2base64(out.data(), out.size(), data.data(), data.size(),
                      sodium_base64_VARIANT_ORIGINAL);
    out.resize(std::strlen(out.c_str()));
    return out;
  }

  void special(std::string_view key, const std::string& text, int /*depth*/) {
    out_ += '{';
    string(key);
    out_ += pretty_ ? ": " : ":";
    string(text);
    out_ += '}';
  }

  void array(const ValueArray& array, int depth) {
    out_ += '[';
    for (std::size_t i = 0; i < array.size(); ++i) {
      if (i > 0) out_ += ',';
      newline(depth + 1);
      write(array[i], depth + 1);
    }
    if (!array.empty()) newline(depth);
    out_ += ']';
  }

  void object(const Dictionary& dict, int depth) {
    out_ += '{';
    bool first = true;
    for (const auto& [key, item] : dict) {
      if (!first) out_ += ',';
      first = false;
      newline(depth + 1);
      string(key);
      out_ += pretty_ ? ": " : ":";
      write(item, depth + 1);
    }
    if (!dict.empty()) newline(depth);
    out_ += '}';
  }

  bool pretty_;
  std::string out_;
};

// ---- Reader ----

class Reader {
 public:
  explicit Reader(const DecodeLimits& limits) : limits_(limits) {}
  const std::string& error() const { return error_; }

  template <class V>
  std::optional<Value> read(V& value, std::size_t depth) {
    simdjson::ondemand::json_type type;
    if (value.type().get(type)) return fail("malformed JSON");
    switch (type) {
      case simdjson::ondemand::json_type::array:
        return readArray(value, depth);
      case simdjson::ondemand::json_type::object:
        return readObject(value, depth);
      case simdjson::ondemand::json_type::string: {
        std::string_view s;
        if (value.get_string().get(s)) return fail("a malformed string");
        return count(Value(std::string(s)));
      }
      case simdjson::ondemand::json_type::boolean: {
        bool b;
        if (value.get_bool().get(b)) return fail("a malformed boolean");
        return count(Value(b));
      }
      case simdjson::ondemand::json_type::null: {
        bool isNull = false;
        if (value.is_null().get(isNull) || !isNull) return fail("a malformed null");
        return count(Value());
      }
      case simdjson::ondemand::json_type::number:
        return readNumber(value);
    }
    return fail("an unknown JSON type");
  }

 private:
  std::optional<Value> fail(std::string why) {
    if (error_.empty()) error_ = std::move(why);
    return std::nullopt;
  }

  std::optional<Value> count(Value v) {
    if (++items_ > limits_.maxItems) return fail("too many items");
    return v;
  }

  template <class V>
  std::optional<Value> readNumber(V& value) {
    simdjson::ondemand::number_type kind;
    if (value.get_number_type().get(kind)) return fail("a malformed number");
    if (kind == simdjson::ondemand::number_type::signed_integer) {
      std::int64_t i;
      if (!value.get_int64().get(i)) return count(Value(i));
    } else if (kind == simdjson::ondemand::number_type::unsigned_integer) {
      std::uint64_t u;
      if (!value.get_uint64().get(u)) return count(Value(u));
    }
    double d;
    if (value.get_double().get(d)) return fail("a malformed number");
    return count(Value(d));
  }

  template <class V>
  std::optional<Value> readArray(V& value, std::size_t depth) {
    if (depth >= limits_.maxDepth) return fail("nesting deeper than the limit");
    simdjson::ondemand::array array;
    if (value.get_array().get(array)) return fail("a malformed array");
    ValueArray items;
    for (auto element : array) {
      simdjson::ondemand::value item;
      if (element.get(item)) return fail("a malformed array element");
      auto v = read(item, depth + 1);
      if (!v) return std::nullopt;
      items.push_back(std::move(*v));
    }
    return count(Value(std::move(items)));
  }

  template <class V>
  std::optional<Value> readObject(V& value, std::size_t depth) {
    if (depth >= limits_.maxDepth) return fail("nesting deeper than the limit");
    simdjson::ondemand::object object;
    if (value.get_object().get(object)) return fail("a malformed object");
    std::vector<DictionaryEntry> entries;
    for (auto field : object) {
      std::string_view key;
      if (field.unescaped_key().get(key)) return fail("a malformed key");
      std::string ownedKey(key);
      simdjson::ondemand::value item;
      if (field.value().get(item)) return fail("a malformed value");
      auto v = read(item, depth + 1);
      if (!v) return std::nullopt;
      entries.emplace_back(std::move(ownedKey), std::move(*v));
    }
    if (entries.size() == 1) {
      if (auto special = specialForm(entries[0])) return special;
      if (!error_.empty()) return std::nullopt;
    }
    return count(Value(Dictionary(std::move(entries))));
  }

  // {"$data": "<base64>"} and {"$date": "<RFC 3339>"}.
  std::optional<Value> specialForm(const DictionaryEntry& entry) {
    const std::string* text = entry.second.asString();
    if (text == nullptr) return std::nullopt;
    if (entry.first == kDataKey) {
      if (text->empty()) return Value(Bytes{});
      Bytes bytes(text->size());
      std::size_t length = 0;
      if (sodium_base642bin(bytes.data(), bytes.size(), text->data(), text->size(), nullptr,
                            &length, nullptr, sodium_base64_VARIANT_ORIGINAL) != 0) {
        return fail("a $data value that is not base64");
      }
      bytes.resize(length);
      return Value(std::move(bytes));
    }
    if (entry.first == kDateKey) {
      auto date = parseDate(*text);
      if (!date) return fail("a $date value that is not an RFC 3339 date");
      return Value(*date);
    }
    return std::nullopt;
  }

  const DecodeLimits& limits_;
  std::size_t items_ = 0;
  std::string error_;
};

}  // namespace

std::string JsonCodec::encode(const Value& value, bool pretty) {
  Writer writer(pretty);
  writer.write(value, 0);
  return writer.take();
}

std::optional<Value> JsonCodec::decode(std::string_view text, const DecodeLimits& limits,
                                       std::string* error) {
  auto failWith = [error](std::string why) -> std::optional<Value> {
    if (error != nullptr) *error = std::move(why);
    return std::nullopt;
  };
  if (text.size() > limits.maxBytes) return failWith("input larger than the size limit");
  simdjson::padded_string padded(text);
  simdjson::ondemand::parser parser;
  simdjson::ondemand::document document;
  if (auto code = parser.iterate(padded).get(document)) {
    return failWith(std::string("malformed JSON: ") + simdjson::error_message(code));
  }
  Reader reader(limits);
  std::optional<Value> value;
  simdjson::ondemand::json_type type;
  if (auto code = document.type().get(type)) {
    return failWith(std::string("malformed JSON: ") + simdjson::error_message(code));
  }
  if (type == simdjson::ondemand::json_type::array ||
      type == simdjson::ondemand::json_type::object) {
    simdjson::ondemand::value root;
    if (document.get_value().get(root)) return failWith("malformed JSON");
    value = reader.read(root, 0);
  } else {
    value = reader.read(document, 0);
  }
  if (!value) return failWith(reader.error().empty() ? "malformed JSON" : reader.error());
  // Past the end of the document there is no current location; anywhere else there is more text.
  const char* rest = nullptr;
  if (document.current_location().get(rest) == simdjson::SUCCESS) {
    return failWith("trailing content after the JSON value");
  }
  return value;
}

}  // namespace typhora
