// The fast and the lazy CBOR decoding against the stream decoder: the same values, the same
// encodings, the same refusals, and containers left encoded only where reading them later is safe.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cmath>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <limits>
#include <thread>

#include "platform/ipc/ipc_endpoint.h"
#include "platform/value/cbor_codec.h"
#include "platform/value/cbor_stream_decoder.h"
#include "platform/value/lazy_container.h"
#include "platform/value/plist_reader.h"
#include "platform/value/value.h"

namespace typhora {
namespace {

using ::testing::HasSubstr;

// Records like the user fonts', `count` of them: an encoding of count * ~150 bytes.
Value records(int count, const std::string& prefix = "/fonts/F") {
  std::vector<DictionaryEntry> entries;
  for (int i = 0; i < count; ++i) {
    const std::string family = "Font " + std::to_string(i);
    entries.emplace_back(prefix + std::to_string(i) + ".otf",
                         Value::dictionary({{"familyName", Value::dictionary({{family, family}})},
                                            {"disabled", Value(i % 5 == 0)},
                                            {"installDate", Value(Date{1.7e9 + i})},
                                            {"fileSize", Value(40'000 + i)},
                                            {"delta", Value(-i)},
                                            {"scale", Value(i * 0.5)},
                                            {"digest", Value(Bytes(4, static_cast<uint8_t>(i)))},
                                            {"tags", Value::array({"a", Value(), i})}}));
  }
  return Value(Dictionary(std::move(entries)));
}

// Every scalar kind and the edges of the integers, in a container large enough to stay encoded.
Value scalars() {
  ValueArray items = {Value(),
                      true,
                      false,
                      std::numeric_limits<std::int64_t>::min(),
                      std::numeric_limits<std::int64_t>::max(),
                      std::numeric_limits<std::uint64_t>::max(),
                      23,
                      24,
                      255,
                      256,
                      65'536,
                      -25,
                      -0.0,
                      1e300,
                      std::numeric_limits<double>::infinity(),
                      "Ünïcødé ✓",
                      "",
                      Value(Bytes{}),
                      Value(Date{-86'400.5}),
                      Value(ValueArray{}),
                      Value(Dictionary())};
  for (int i = 0; i < 300; ++i) items.push_back("padding " + std::to_string(i));
  return Value(std::move(items));
}

Bytes concat(std::initializer_list<Bytes> parts) {
  Bytes out;
  for (const Bytes& part : parts) out.insert(out.end(), part.begin(), part.end());
  return out;
}

struct Decodings {
  std::optional<Value> reference, fast, lazy;
  std::string referenceError, fastError, lazyError;
};

// Decodes `input` by the stream decoder, the fast decoder and lazily (every container that may
// stay encoded does, from `lazyBytes` up), the lazy one from a copy released at once.
Decodings decodeAllWays(const Bytes& input, const DecodeLimits& limits = {},
                        const EndpointHooks* hooks = nullptr, std::size_t lazyBytes = 1) {
  Decodings d;
  d.reference = CborStreamDecoder::decode(input, limits, hooks, &d.referenceError);
  d.fast = CborCodec::decode(input, limits, hooks, &d.fastError);
  auto copy = std::make_shared<const Bytes>(input);
  d.lazy = CborCodec::decodeLazily(copy, *copy, limits, hooks, &d.lazyError, lazyBytes);
  return d;
}

void expectSameDecodings(const Bytes& input, const DecodeLimits& limits = {}) {
  const Decodings d = decodeAllWays(input, limits);
  ASSERT_EQ(d.fast.has_value(), d.reference.has_value()) << d.referenceError;
  ASSERT_EQ(d.lazy.has_value(), d.reference.has_value()) << d.referenceError;
  if (!d.reference) {
    EXPECT_EQ(d.fastError, d.referenceError);
    EXPECT_EQ(d.lazyError, d.referenceError);
    return;
  }
  // Encoding a lazy value first copies the bytes it still holds; comparing then opens it all.
  EXPECT_EQ(CborCodec::encode(*d.lazy), CborCodec::encode(*d.reference));
  EXPECT_EQ(CborCodec::encode(*d.fast), CborCodec::encode(*d.reference));
  EXPECT_EQ(*d.fast, *d.reference);
  EXPECT_EQ(*d.lazy, *d.reference);
  EXPECT_EQ(*d.reference, *d.lazy);
  EXPECT_EQ(d.lazy->description(), d.reference->description());
}

Bytes fileBytes(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  return Bytes(std::istreambuf_iterator<char>(in), {});
}

TEST(CborLazyDecoding, EncoderOutputDecodesAlikeAndStaysEncodedWhereLarge) {
  const Value fonts = records(200);
  const Bytes encoded = CborCodec::encode(Value::array({1, "checkin:", fonts, scalars()}));
  expectSameDecodings(encoded);

  auto owner = std::make_shared<const Bytes>(encoded);
  const std::optional<Value> lazy = CborCodec::decodeLazily(owner, *owner);
  ASSERT_TRUE(lazy);
  EXPECT_NE(lazy->lazyContainer(), nullptr);
  EXPECT_EQ(lazy->type(), Value::Type::Array);
  EXPECT_EQ(lazy->at(2).type(), Value::Type::Dictionary);
  EXPECT_NE(lazy->at(2).lazyContainer(), nullptr);
  EXPECT_EQ(lazy->at(2).asDictionary()->size(), 200u);
  EXPECT_EQ(lazy->at(2).get("/fonts/F7.otf").get("fileSize"), Value(40'007));
  EXPECT_EQ(lazy->at(2).with("/fonts/F7.otf", Value()).asDictionary()->size(), 199u);
  EXPECT_EQ(lazy->at(3).at(5), Value(std::numeric_limits<std::uint64_t>::max()));
  // Small records are built whole when their dictionary opens.
  EXPECT_EQ(lazy->at(2).get("/fonts/F7.otf").lazyContainer(), nullptr);
  // Without an owner, or from the stream decoder, nothing stays encoded.
  EXPECT_EQ(CborCodec::decode(encoded)->lazyContainer(), nullptr);
}

// Encodings the encoder would not write (longer heads, short floats, keys out of order or
// repeated, integer dates, indefinite lengths) decode to the same values, and a container
// holding one is built, so that encoding it again writes the encoder's bytes.
TEST(CborLazyDecoding, OtherEncodingsDecodeAlikeAndAreNotCopiedAsTheyStand) {
  const Bytes big = CborCodec::encode(records(40));
  const std::vector<Bytes> odd = {
      {0x18, 0x05},                                            // 5 in a longer head
      {0x19, 0x00, 0x05},                                      // and longer still
      {0xf9, 0x3c, 0x00},                                      // 1.0 in half precision
      {0xf9, 0x7e, 0x01},                                      // a half NaN
      {0xfa, 0x7f, 0xc0, 0x00, 0x01},                          // a single NaN with a payload
      {0xfb, 0x7f, 0xf8, 0x00, 0x00, 0x00, 0x00, 0x00, 0x01},  // a double NaN with a payload
      {0xc1, 0x1a, 0x65, 0x00, 0x00, 0x00},                    // a date in integer seconds
      {0xc1, 0x38, 0x10},                                      // a negative one
      {0xc1, 0xf9, 0x3c, 0x00},                                // in half precision
      {0xd8, 0x01, 0xfb, 0, 0, 0, 0, 0, 0, 0, 0},              // the date tag in a longer head
      {0xa2, 0x61, 0x62, 0x01, 0x61, 0x61, 0x02},              // keys out of order
      {0xa2, 0x61, 0x61, 0x01, 0x61, 0x61, 0x02},              // a repeated key
      {0xa1, 0x78, 0x01, 0x61, 0x01},                          // a key in a longer head
      {0x98, 0x01, 0x01},                                      // an array in a longer head
      // Indefinite lengths are left to the stream decoder, which builds the whole input.
      {0x9f, 0x01, 0x02, 0xff},              // an indefinite array
      {0xbf, 0x61, 0x61, 0x01, 0xff},        // an indefinite map
      {0x7f, 0x61, 0x61, 0x61, 0x62, 0xff},  // an indefinite text
      {0x5f, 0x41, 0x01, 0xff},              // indefinite bytes
  };
  for (const Bytes& item : odd) {
    SCOPED_TRACE(::testing::PrintToString(item));
    expectSameDecodings(item);
    // [item, big] and {"a": item, "b": big}: the outer container is built, big stays encoded.
    const Bytes inArray = concat({{0x82}, item, big});
    const Bytes inMap = concat({{0xa2, 0x61, 0x61}, item, {0x61, 0x62}, big});
    expectSameDecodings(inArray);
    expectSameDecodings(inMap);
    auto owner = std::make_shared<const Bytes>(inArray);
    const std::optional<Value> lazy = CborCodec::decodeLazily(owner, *owner);
    ASSERT_TRUE(lazy);
    EXPECT_EQ(lazy->lazyContainer(), nullptr);
    const bool indefinite = item.back() == 0xff;
    EXPECT_EQ(lazy->at(1).lazyContainer() != nullptr, !indefinite);
  }
}

// Everything the stream decoder refuses is refused up front, with its words, wherever in a large
// container the fault sits.
TEST(CborLazyDecoding, RefusalsAreTheStreamDecodersAndUpFront) {
  const Bytes big = CborCodec::encode(records(40));
  const std::vector<Bytes> bad = {
      {0x62, 0xc3, 0x28},                    // invalid UTF-8
      {0x62, 0xed, 0xa0},                    // a surrogate, truncated
      {0x63, 0xed, 0xa0, 0x80},              // a surrogate
      {0xa1, 0x01, 0x02},                    // a key that is not text
      {0xd8, 0x20, 0x00},                    // an unknown tag
      {0xda, 0x74, 0x79, 0x00, 0x01, 0x00},  // an endpoint without hooks
      {0xc1, 0x61, 0x61},                    // a date of text
      {0xc1, 0xf9, 0x7c, 0x00},              // an infinite date
      {0xc1, 0xc1, 0x00},                    // a date of a date
      {0x3b, 0x80, 0, 0, 0, 0, 0, 0, 0},     // below the 64-bit range
      {0xf7},                                // undefined
      {0xf0},                                // an unassigned simple value
      {0xf8, 0x20},                          // a one-byte simple value
      {0xff},                                // a lone break
      {0x1c},                                // a reserved head
      {0x9f, 0x01},                          // an unterminated indefinite array
  };
  for (const Bytes& item : bad) {
    SCOPED_TRACE(::testing::PrintToString(item));
    expectSameDecodings(item);
    expectSameDecodings(concat({{0x82}, big, item}));
    expectSameDecodings(concat({{0xa2, 0x61, 0x61}, big, {0x61, 0x62}, item}));
  }
  // Every cut of a large encoding, and trailing bytes.
  const Bytes whole = CborCodec::encode(Value::array({records(30), scalars()}));
  for (std::size_t cut = 0; cut < whole.size(); cut += 1 + cut / 16) {
    expectSameDecodings(Bytes(whole.begin(), whole.begin() + static_cast<std::ptrdiff_t>(cut)));
  }
  expectSameDecodings(concat({whole, {0x00}}));
  // A declared length far beyond the input.
  expectSameDecodings({0x9b, 0x7f, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0x00});
  expectSameDecodings({0xbb, 0x7f, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0x00});
}

TEST(CborLazyDecoding, LimitsHoldExactlyAsForTheStreamDecoder) {
  const Bytes encoded = CborCodec::encode(Value::array({records(20), scalars()}));
  // The largest item count refused and the smallest taken, found on the stream decoder.
  DecodeLimits limits;
  std::size_t low = 1;
  std::size_t high = 100'000;
  while (low < high) {
    limits.maxItems = (low + high) / 2;
    if (CborStreamDecoder::decode(encoded, limits, nullptr, nullptr)) {
      high = limits.maxItems;
    } else {
      low = limits.maxItems + 1;
    }
  }
  for (std::size_t maxItems : {low - 1, low}) {
    limits.maxItems = maxItems;
    expectSameDecodings(encoded, limits);
  }
  limits = {};
  for (std::size_t depth : {2, 3, 4, 5}) {
    limits.maxDepth = depth;
    expectSameDecodings(encoded, limits);
    // A date counts as a level while it is read.
    expectSameDecodings({0x81, 0x81, 0xc1, 0x00}, limits);
  }
  limits = {};
  limits.maxBytes = encoded.size() - 1;
  expectSameDecodings(encoded, limits);
}

// A container left encoded is copied when encoded again, under the same depth limit as a walk.
TEST(CborLazyDecoding, AnEncodedContainerIsCopiedUnderTheDepthLimit) {
  const Value message = Value::array({1, Value::dictionary({{"fontsInfo", records(50)}})});
  const Bytes encoded = CborCodec::encode(message);
  auto owner = std::make_shared<const Bytes>(encoded);
  const Value lazy = *CborCodec::decodeLazily(owner, *owner, {}, nullptr, nullptr, 64);
  owner.reset();  // the value keeps its bytes
  ASSERT_NE(lazy.at(1).get("fontsInfo").lazyContainer(), nullptr);
  const Value wrapped = Value::array({lazy.at(1).get("fontsInfo")});
  // The names in a record sit four levels below the records' dictionary.
  for (std::size_t maxDepth : {4, 5}) {
    Bytes fromLazy;
    Bytes fromBuilt;
    std::string error;
    const bool lazyOk = CborCodec::encode(wrapped, &fromLazy, nullptr, &error, maxDepth);
    const bool builtOk =
        CborCodec::encode(Value::array({records(50)}), &fromBuilt, nullptr, &error, maxDepth);
    EXPECT_EQ(lazyOk, builtOk) << maxDepth;
    EXPECT_EQ(fromLazy, fromBuilt);
  }
  EXPECT_EQ(CborCodec::encode(lazy), encoded);
}

class TestEndpoint final : public IpcEndpoint {
 public:
  std::string description() const override { return "test"; }
};

// Endpoints are taken while decoding, never left for later: a container holding one is built.
TEST(CborLazyDecoding, EndpointsAreTakenAtDecodeTime) {
  int taken = 0;
  EndpointHooks hooks;
  hooks.fromIndex = [&taken](std::uint64_t index) -> std::shared_ptr<const IpcEndpoint> {
    if (index > 0) return nullptr;
    ++taken;
    return std::make_shared<TestEndpoint>();
  };
  const Bytes big = CborCodec::encode(records(40));
  const Bytes endpoint = {0xda, 0x74, 0x79, 0x00, 0x01, 0x00};
  const Bytes message = concat({{0x82}, big, {0x82}, big, endpoint});
  auto owner = std::make_shared<const Bytes>(message);
  std::string error;
  const std::optional<Value> lazy = CborCodec::decodeLazily(owner, *owner, {}, &hooks, &error);
  ASSERT_TRUE(lazy) << error;
  EXPECT_EQ(taken, 1);
  EXPECT_EQ(lazy->lazyContainer(), nullptr);
  EXPECT_EQ(lazy->at(1).lazyContainer(), nullptr);
  EXPECT_NE(lazy->at(1).at(0).lazyContainer(), nullptr);
  EXPECT_NE(lazy->at(1).at(1).asEndpoint(), nullptr);

  const Bytes unknown = concat({{0x82}, big, {0xda, 0x74, 0x79, 0x00, 0x01, 0x01}});
  const Decodings d = decodeAllWays(unknown, {}, &hooks);
  EXPECT_FALSE(d.reference);
  EXPECT_FALSE(d.fast);
  EXPECT_FALSE(d.lazy);
  EXPECT_THAT(d.lazyError, HasSubstr("no descriptor"));
}

// Values are shared between threads: the first opening of a container, raced from several
// threads, builds it once and every thread sees the same entries.
TEST(CborLazyDecoding, ConcurrentFirstOpeningsBuildOnce) {
  const Value source = Value::array({records(300, "/a/"), records(300, "/b/")});
  const Bytes encoded = CborCodec::encode(source);
  for (int round = 0; round < 20; ++round) {
    auto owner = std::make_shared<const Bytes>(encoded);
    const Value lazy = *CborCodec::decodeLazily(owner, *owner);
    owner.reset();
    std::vector<const Dictionary*> seen(8, nullptr);
    std::vector<std::size_t> walked(8, 0);
    std::vector<std::thread> threads;
    for (std::size_t t = 0; t < seen.size(); ++t) {
      threads.emplace_back([&, t] {
        const Value& half = lazy.at(t % 2);
        seen[t] = half.asDictionary();
        for (const auto& [key, record] : *seen[t]) {
          walked[t] += key.size() + record.get("familyName").asDictionary()->size();
        }
      });
    }
    for (std::thread& thread : threads) thread.join();
    for (std::size_t t = 0; t < seen.size(); ++t) {
      EXPECT_EQ(seen[t], seen[t % 2]);
      EXPECT_EQ(walked[t], walked[t % 2]);
    }
    EXPECT_EQ(lazy, source);
  }
}

// The fuzzers' corpora: whatever they hold decodes alike all three ways.
TEST(CborLazyDecoding, FuzzCorporaDecodeAlike) {
  const std::filesystem::path corpora = std::filesystem::path(TYPHORA_SOURCE_DIR) / "fuzz/corpus";
  int inputs = 0;
  for (const char* name : {"cbor_decode", "cbor_lazy_decode", "plist_reader", "user_fonts"}) {
    if (!std::filesystem::is_directory(corpora / name)) continue;
    for (const auto& entry : std::filesystem::directory_iterator(corpora / name)) {
      SCOPED_TRACE(entry.path().string());
      expectSameDecodings(fileBytes(entry.path()));
      ++inputs;
    }
  }
  EXPECT_GT(inputs, 10);
}

// A file's value is kept and walked whole by its readers: a part left encoded would keep the whole
// file's buffer in memory for as long.
// A large catalog file keeps its records encoded. One field read alone from a record still
// encoded is the field of the record built, for keys before, among and after its own, missing or
// not, past a nested container left encoded too; and so it stays once the record is opened.
TEST(CborLazyDecoding, ALargeFileKeepsItsRecordsEncodedAndAFieldIsReadAlone) {
  std::vector<DictionaryEntry> entries = records(2000).asDictionary()->entries();
  std::vector<DictionaryEntry> nested;
  for (int i = 0; i < 20; ++i) nested.emplace_back("name" + std::to_string(i), "Family");
  for (std::size_t i = 0; i < entries.size(); i += 7) {
    entries[i].second = entries[i].second.with("aaNested", Value(Dictionary(nested)));
  }
  const Value catalog = Value(Dictionary(std::move(entries)));
  const Bytes bytes = CborCodec::encode(catalog);
  ASSERT_GE(bytes.size(), 256u * 1024);
  auto writeFile = [](const std::string& path, std::span<const std::uint8_t> content) {
    std::ofstream(path, std::ios::binary)
        .write(reinterpret_cast<const char*>(content.data()),
               static_cast<std::streamsize>(content.size()));
  };
  const std::string path = ::testing::TempDir() + "/typhora-catalog.cbor";
  writeFile(path, bytes);
  std::string error;
  const std::optional<Value> read = PlistReader::readFile(path, {}, &error);
  ASSERT_TRUE(read) << error;
  const char* keys[] = {"",         "aaNested",  "b",          "delta",    "digest",
                        "disabled", "disabledX", "familyName", "fileSize", "installDate",
                        "scale",    "tags",      "zzz"};
  for (int pass = 0; pass < 2; ++pass) {
    int encoded = 0;
    for (const auto& [key, record] : *read->asDictionary()) {
      encoded += record.lazyContainer() != nullptr;
      const Value& built = catalog.get(key);
      for (const char* field : keys) {
        ASSERT_EQ(record.peek(field), built.get(field)) << key << " " << field << " " << pass;
      }
    }
    EXPECT_EQ(encoded, 2000);
    EXPECT_EQ(*read, catalog);  // opens every record for the second pass
  }
  std::filesystem::remove(path);
}

// A file below a catalog's size is built whole.
TEST(CborLazyDecoding, PlistFilesAreDecodedWhole) {
  const std::string path = ::testing::TempDir() + "/typhora-lazy.plist";
  const Value fonts = records(100);
  const Bytes bytes = CborCodec::encode(fonts);
  std::ofstream(path, std::ios::binary)
      .write(reinterpret_cast<const char*>(bytes.data()),
             static_cast<std::streamsize>(bytes.size()));
  const std::optional<Value> read = PlistReader::readFile(path);
  std::filesystem::remove(path);
  ASSERT_TRUE(read);
  EXPECT_EQ(read->lazyContainer(), nullptr);
  EXPECT_EQ(*read, fonts);
}

}  // namespace
}  // namespace typhora
