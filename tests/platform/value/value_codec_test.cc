// Values and their two encodings.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <limits>

#include "platform/value/cbor_codec.h"
#include "platform/value/cbor_encoding_memo.h"
#include "platform/value/json_codec.h"
#include "platform/value/plist_reader.h"
#include "platform/value/value.h"

namespace typhora {
namespace {

using ::testing::HasSubstr;

Bytes allByteValues() {
  Bytes bytes;
  for (int i = 0; i < 256; ++i) bytes.push_back(static_cast<std::uint8_t>(i));
  return bytes;
}

// One value of every kind, nested, with empty and absent side by side.
Value everything() {
  return Value::dictionary({
      {"absent", Value()},
      {"bool", true},
      {"false", false},
      {"int", -42},
      {"min", std::numeric_limits<std::int64_t>::min()},
      {"max", std::numeric_limits<std::int64_t>::max()},
      {"umax", std::numeric_limits<std::uint64_t>::max()},
      {"double", 2.5},
      {"integralDouble", 3.0},
      {"tiny", 1e-300},
      {"string", "Ünïcødé ✓ \"quoted\" \\ \n\t\x01"},
      {"empty string", ""},
      {"data", Value(allByteValues())},
      {"empty data", Value(Bytes{})},
      {"date", Value(Date{1'700'000'000.25})},
      {"old date", Value(Date{-86'400.5})},
      {"array", Value::array({1, "two", Value(), Value::array({})})},
      {"empty array", Value(ValueArray{})},
      {"empty dict", Value(Dictionary())},
      {"nested", Value::dictionary({{"familyName", Value::dictionary({{"A-Bold", "A"}})}})},
  });
}

TEST(Value, DictionariesKeepOneSortedEntryPerKey) {
  Dictionary d({{"b", 1}, {"a", 2}, {"b", 3}, {"A", 4}});
  ASSERT_EQ(d.size(), 3u);
  std::vector<std::string> keys;
  for (const auto& [k, v] : d) keys.push_back(k);
  EXPECT_EQ(keys, (std::vector<std::string>{"A", "a", "b"}));
  EXPECT_EQ(*d.find("b"), Value(3));
  EXPECT_EQ(d.find("B"), nullptr);
}

TEST(Value, AccessorsAnswerAbsentForMissingKeysAndWrongTypes) {
  Value v = everything();
  EXPECT_EQ(v.get("int").asInt(), -42);
  EXPECT_FALSE(v.get("int").asString());
  EXPECT_FALSE(v.get("string").asInt());
  EXPECT_FALSE(v.get("double").asInt());  // a double is not an integer
  EXPECT_EQ(v.get("int").asDouble(), -42.0);
  EXPECT_FALSE(v.get("int").asUInt());
  EXPECT_EQ(v.get("umax").asUInt(), std::numeric_limits<std::uint64_t>::max());
  EXPECT_TRUE(v.get("missing").isNull());
  EXPECT_TRUE(v.get("absent").isNull());
  EXPECT_TRUE(v.get("int").get("x").isNull());
  EXPECT_EQ(v.get("nested").get("familyName").get("A-Bold"), Value("A"));
  EXPECT_TRUE(v.get("array").at(9).isNull());
  // Empty is not absent.
  EXPECT_NE(v.get("empty array"), Value());
  EXPECT_NE(v.get("empty dict"), Value());
  EXPECT_NE(v.get("empty string"), Value());
}

TEST(Value, UnsignedValuesInRangeAreIntegers) {
  EXPECT_EQ(Value(5u), Value(5));
  EXPECT_EQ(Value(std::uint64_t{5}).type(), Value::Type::Int);
  EXPECT_EQ(Value(std::numeric_limits<std::uint64_t>::max()).type(), Value::Type::UInt);
  EXPECT_NE(Value(1), Value(1.0));
  EXPECT_NE(Value(true), Value(1));
}

TEST(Value, ChangedRecordsAreNewValuesAndTheOldOnesStay) {
  Value record = Value::dictionary({{"disabled", true}, {"familyName", Value(Dictionary())}});
  Value copy = record.without("disabled").with("data", Value(Bytes{1, 2}));
  EXPECT_EQ(record.get("disabled"), Value(true));
  EXPECT_TRUE(copy.get("disabled").isNull());
  EXPECT_EQ(copy.get("data"), Value(Bytes{1, 2}));
  // Copies share their contents.
  Value shared = record;
  EXPECT_EQ(shared.asDictionary(), record.asDictionary());
}

TEST(Value, DescriptionsPrintStringsAsThemselvesAndTheRestAsJson) {
  EXPECT_EQ(Value("/var/mobile/x").description(), "/var/mobile/x");
  EXPECT_EQ(Value().description(), "(null)");
  EXPECT_EQ(Value::dictionary({{"b", 1}, {"a", Value::array({true})}}).description(),
            R"({"a":[true],"b":1})");
}

TEST(Codecs, EveryTypeRoundTripsThroughBoth) {
  Value v = everything();
  auto fromCbor = CborCodec::decode(CborCodec::encode(v));
  ASSERT_TRUE(fromCbor);
  EXPECT_EQ(*fromCbor, v);
  std::string error;
  auto fromJson = JsonCodec::decode(JsonCodec::encode(v), {}, &error);
  ASSERT_TRUE(fromJson) << error;
  EXPECT_EQ(*fromJson, v);
  auto fromPretty = JsonCodec::decode(JsonCodec::encode(v, true));
  ASSERT_TRUE(fromPretty);
  EXPECT_EQ(*fromPretty, v);
  EXPECT_EQ(*fromJson->get("data").asData(), allByteValues());
  EXPECT_EQ(fromJson->get("integralDouble").type(), Value::Type::Double);
}

TEST(Codecs, JsonSpecialFormsAndDates) {
  auto v = JsonCodec::decode(
      R"({"d": {"$date": "2026-10-02T09:30:00.5+02:00"}, "b": {"$data": "AAEC"},
          "notSpecial": {"$data": "AAEC", "other": 1}, "big": 18446744073709551616})");
  ASSERT_TRUE(v);
  // 09:30:00.5 at +02:00 is 07:30:00.5 UTC.
  EXPECT_EQ(v->get("d").asDate()->secondsSince1970, 1'790'933'400.5 - 7200);
  EXPECT_EQ(*v->get("b").asData(), (Bytes{0, 1, 2}));
  EXPECT_EQ(v->get("notSpecial").type(), Value::Type::Dictionary);
  EXPECT_EQ(v->get("big").type(), Value::Type::Double);
  EXPECT_EQ(JsonCodec::encode(Value(Date{0})), R"({"$date":"1970-01-01T00:00:00Z"})");
  // Dates no calendar of four-digit years holds, as a peer may send them, are written as the
  // nearest one that can be (logging such a value once meant an undefined conversion).
  EXPECT_EQ(JsonCodec::encode(Value(Date{-1.8e165})), R"({"$date":"0000-01-01T00:00:00Z"})");
  EXPECT_EQ(JsonCodec::encode(Value(Date{HUGE_VAL})), R"({"$date":"9999-12-31T23:59:59Z"})");
  EXPECT_EQ(JsonCodec::encode(Value(Date{std::nan("")})), R"({"$date":"1970-01-01T00:00:00Z"})");
  std::string error;
  EXPECT_FALSE(JsonCodec::decode(R"({"$date": "yesterday"})", {}, &error));
  EXPECT_THAT(error, HasSubstr("$date"));
  EXPECT_FALSE(JsonCodec::decode(R"({"$data": "!!!"})", {}, &error));
}

// Heads in their shortest form at every width's edge, and the other encodings byte for byte.
TEST(Codecs, CborEncodingsAreTheStandardsOwn) {
  auto hex = [](const Value& v) {
    std::string out;
    char byte[3];
    for (std::uint8_t b : CborCodec::encode(v)) {
      std::snprintf(byte, sizeof byte, "%02x", b);
      out += byte;
    }
    return out;
  };
  EXPECT_EQ(hex(Value(0)), "00");
  EXPECT_EQ(hex(Value(23)), "17");
  EXPECT_EQ(hex(Value(24)), "1818");
  EXPECT_EQ(hex(Value(255)), "18ff");
  EXPECT_EQ(hex(Value(256)), "190100");
  EXPECT_EQ(hex(Value(65536)), "1a00010000");
  EXPECT_EQ(hex(Value(std::int64_t{1'000'000'000'000})), "1b000000e8d4a51000");
  EXPECT_EQ(hex(Value(std::numeric_limits<std::uint64_t>::max())), "1bffffffffffffffff");
  EXPECT_EQ(hex(Value(-1)), "20");
  EXPECT_EQ(hex(Value(-1000)), "3903e7");
  EXPECT_EQ(hex(Value(std::numeric_limits<std::int64_t>::min())), "3b7fffffffffffffff");
  EXPECT_EQ(hex(Value(1.1)), "fb3ff199999999999a");
  EXPECT_EQ(hex(Value(Date{0})), "c1fb0000000000000000");
  EXPECT_EQ(hex(Value(false)), "f4");
  EXPECT_EQ(hex(Value(true)), "f5");
  EXPECT_EQ(hex(Value()), "f6");
  EXPECT_EQ(hex(Value("a")), "6161");
  EXPECT_EQ(hex(Value(Bytes{1, 2})), "420102");
  EXPECT_EQ(hex(Value::array({1, Value::array({})})), "820180");
  EXPECT_EQ(hex(Value::dictionary({{"a", 1}})), "a1616101");
}

TEST(Codecs, NestingIsLimitedExactlyAtTheLimit) {
  DecodeLimits limits;
  limits.maxDepth = 8;
  auto nest = [](int depth) {
    Value v = Value::array({});
    for (int i = 1; i < depth; ++i) v = Value::array({v});
    return v;
  };
  EXPECT_TRUE(CborCodec::decode(CborCodec::encode(nest(8)), limits));
  EXPECT_TRUE(JsonCodec::decode(JsonCodec::encode(nest(8)), limits));
  std::string error;
  EXPECT_FALSE(CborCodec::decode(CborCodec::encode(nest(9)), limits, nullptr, &error));
  EXPECT_THAT(error, HasSubstr("nesting"));
  EXPECT_FALSE(JsonCodec::decode(JsonCodec::encode(nest(9)), limits, &error));
  EXPECT_THAT(error, HasSubstr("nesting"));
}

// A kept dictionary's encoding is copied into every later message that carries it, wherever it
// sits: the bytes are those of a walk, the depth limit still counts its levels, and a forgotten
// or equal but distinct dictionary is walked again.
TEST(Codecs, AKeptEncodingIsTheWalkedOneAtAnyPlaceAndDepth) {
  std::vector<DictionaryEntry> records;
  for (int i = 0; i < 100; ++i) {
    records.emplace_back(
        "/fonts/F" + std::to_string(i) + ".otf",
        Value::dictionary({{"familyName", Value::dictionary({{"F-Bold", "F"}})}, {"size", i}}));
  }
  const Value fonts = Value(Dictionary(records));
  const Value twin = Value(Dictionary(records));
  auto message = [](const Value& info, const char* token) {
    return Value::array(
        {1, "checkin:", Value::dictionary({{"fontsInfo", info}, {"extension", token}})});
  };
  const Bytes walked = CborCodec::encode(message(fonts, "a"));
  auto& memo = CborEncodingMemo::shared();
  memo.keep(fonts);
  EXPECT_EQ(CborCodec::encode(message(fonts, "a")), walked);  // walked, then kept
  EXPECT_EQ(CborCodec::encode(message(fonts, "a")), walked);  // copied
  EXPECT_EQ(CborCodec::encode(message(twin, "a")), walked);
  const Bytes other = CborCodec::encode(message(fonts, "b"));
  EXPECT_NE(other, walked);
  EXPECT_EQ(CborCodec::decode(other)->at(2).get("extension"), Value("b"));
  EXPECT_EQ(CborCodec::decode(other)->at(2).get("fontsInfo"), fonts);

  // fontsInfo sits at level 2 and the names in its records at level 5.
  for (const Value& info : {twin, fonts}) {
    Bytes out;
    std::string error;
    EXPECT_TRUE(CborCodec::encode(message(info, "a"), &out, nullptr, &error, 5));
    EXPECT_FALSE(CborCodec::encode(message(info, "a"), &out, nullptr, &error, 4));
    EXPECT_THAT(error, HasSubstr("nesting"));
  }
  memo.forget(fonts);
  EXPECT_EQ(CborCodec::encode(message(fonts, "a")), walked);
}

// A large kept encoding can be left out of the output and listed where it belongs: the first
// time it is encoded apart into the buffer the memo then keeps, later times that buffer is listed
// again. Put back, the pieces are the walked bytes; a refused encoding leaves output and list as
// they were.
TEST(Codecs, ASplicedEncodingPutBackIsTheWalkedOne) {
  std::vector<DictionaryEntry> records;
  for (int i = 0; i < 3000; ++i) {
    records.emplace_back("/fonts/F" + std::to_string(i) + ".otf",
                         Value::dictionary({{"familyName", "F"}, {"size", i}}));
  }
  const Value fonts = Value(Dictionary(std::move(records)));
  const Value message = Value::array({1, Value::dictionary({{"a", fonts}, {"b", fonts}}), "end"});
  const Bytes walked = CborCodec::encode(message);
  auto putBack = [](const Bytes& out, const std::vector<CborSplice>& splices) {
    Bytes whole;
    std::size_t from = 1;  // past the byte written before
    for (const CborSplice& splice : splices) {
      whole.insert(whole.end(), out.begin() + static_cast<std::ptrdiff_t>(from),
                   out.begin() + static_cast<std::ptrdiff_t>(splice.at));
      whole.insert(whole.end(), splice.bytes->begin(), splice.bytes->end());
      from = splice.at;
    }
    whole.insert(whole.end(), out.begin() + static_cast<std::ptrdiff_t>(from), out.end());
    return whole;
  };
  auto& memo = CborEncodingMemo::shared();
  memo.keep(fonts);
  std::vector<const Bytes*> buffers;
  for (int time = 0; time < 2; ++time) {
    Bytes out = {0xAA};
    std::vector<CborSplice> splices;
    ASSERT_TRUE(CborCodec::encode(message, &out, nullptr, nullptr, 64, &splices));
    ASSERT_EQ(splices.size(), 2u);
    EXPECT_EQ(putBack(out, splices), walked);
    EXPECT_LT(out.size(), 100u);
    for (const CborSplice& splice : splices) buffers.push_back(splice.bytes.get());
  }
  EXPECT_THAT(buffers, ::testing::Each(buffers[0]));
  EXPECT_EQ(CborCodec::encode(message), walked);  // copied from the same buffer

  // Refused after a splice (nested past the limit): nothing of it stays in either.
  Bytes out = {0xAA};
  std::vector<CborSplice> splices = {{1, std::make_shared<const Bytes>()}};
  const Value tooDeep = Value::array({fonts, Value::array({Value::array({1})})});
  std::string error;
  EXPECT_FALSE(CborCodec::encode(tooDeep, &out, nullptr, &error, 2, &splices));
  EXPECT_THAT(error, HasSubstr("nesting"));
  EXPECT_EQ(out, Bytes{0xAA});
  EXPECT_EQ(splices.size(), 1u);
  memo.forget(fonts);
}

TEST(Codecs, MalformedTruncatedAndOversizedInputsAreRefusedWithAReason) {
  Bytes good = CborCodec::encode(everything());
  std::string error;
  for (std::size_t cut : {std::size_t{0}, std::size_t{1}, good.size() / 2, good.size() - 1}) {
    EXPECT_FALSE(CborCodec::decode({good.data(), cut}, {}, nullptr, &error)) << cut;
    EXPECT_FALSE(error.empty());
  }
  Bytes trailing = good;
  trailing.push_back(0);
  EXPECT_FALSE(CborCodec::decode(trailing, {}, nullptr, &error));
  EXPECT_THAT(error, HasSubstr("trailing"));
  // A byte string declaring 2^63 bytes must not be trusted or allocated.
  Bytes huge = {0x5b, 0x7f, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0x00};
  EXPECT_FALSE(CborCodec::decode(huge, {}, nullptr, &error));
  // Non-string keys, invalid UTF-8, unknown tags, endpoints without hooks, undefined.
  for (Bytes bad : {Bytes{0xa1, 0x01, 0x02}, Bytes{0x62, 0xc3, 0x28}, Bytes{0xd8, 0x20, 0x00},
                    Bytes{0xda, 0x74, 0x79, 0x00, 0x01, 0x00}, Bytes{0xf7}, Bytes{0xff}}) {
    EXPECT_FALSE(CborCodec::decode(bad, {}, nullptr, &error));
  }
  DecodeLimits small;
  small.maxBytes = 16;
  EXPECT_FALSE(CborCodec::decode(good, small, nullptr, &error));
  EXPECT_THAT(error, HasSubstr("size limit"));
  small.maxBytes = 1 << 20;
  small.maxItems = 10;
  EXPECT_FALSE(CborCodec::decode(good, small, nullptr, &error));

  for (const char* text : {"", "{", "{\"a\":}", "[1,]", "nul", "{\"a\":1} x", "\"\xff\""}) {
    EXPECT_FALSE(JsonCodec::decode(text, {}, &error)) << text;
    EXPECT_FALSE(error.empty());
  }
}

TEST(PlistReader, ReadsEitherEncodingFromAFile) {
  const std::string dir = ::testing::TempDir();
  const std::string json = dir + "/typhora-plist.json";
  const std::string cbor = dir + "/typhora-plist.cbor";
  std::ofstream(json) << "  " << JsonCodec::encode(everything(), true);
  Bytes bytes = CborCodec::encode(everything());
  std::ofstream(cbor, std::ios::binary)
      .write(reinterpret_cast<const char*>(bytes.data()),
             static_cast<std::streamsize>(bytes.size()));
  EXPECT_EQ(PlistReader::readFile(json), everything());
  EXPECT_EQ(PlistReader::readFile(cbor), everything());
  std::string error;
  EXPECT_FALSE(PlistReader::readFile(dir + "/no-such-file", {}, &error));
  EXPECT_THAT(error, HasSubstr("cannot open"));
  std::remove(json.c_str());
  std::remove(cbor.c_str());
}

// The start-up check of state files: it decides as a read would, also for a fault deep inside a
// large dictionary that it does not build.
TEST(PlistReader, TellsWhetherBytesDecodeAsAReadWould) {
  std::vector<DictionaryEntry> records;
  for (int i = 0; i < 2000; ++i)
    records.emplace_back("/fonts/Font" + std::to_string(i) + ".otf",
                         Value::dictionary({{"familyName", "Font " + std::to_string(i)}}));
  Bytes good = CborCodec::encode(Value(Dictionary(std::move(records))));
  EXPECT_TRUE(PlistReader::decodes(good));
  Bytes bad = good;
  const std::string needle = "Font 1500";
  auto at = std::search(bad.begin(), bad.end(), needle.begin(), needle.end());
  ASSERT_NE(at, bad.end());
  *at = 0xff;  // not UTF-8
  std::string readError, checkError;
  EXPECT_FALSE(PlistReader::read(bad, {}, &readError));
  EXPECT_FALSE(PlistReader::decodes(bad, {}, &checkError));
  EXPECT_EQ(checkError, readError);
  const std::string junk = "{\"open\": ";
  EXPECT_FALSE(
      PlistReader::decodes({reinterpret_cast<const std::uint8_t*>(junk.data()), junk.size()}));
}

}  // namespace
}  // namespace typhora
