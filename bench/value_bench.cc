// Encoding and decoding a user-fonts dictionary of 10,000 records in CBOR and JSON; decoding
// CBOR with large containers left encoded, and decoding then reading every value.
#include <benchmark/benchmark.h>

#include "platform/value/cbor_codec.h"
#include "platform/value/cbor_stream_decoder.h"
#include "platform/value/json_codec.h"

namespace typhora {
namespace {

Value userFonts() {
  std::vector<DictionaryEntry> records;
  for (int i = 0; i < 10'000; ++i) {
    std::vector<DictionaryEntry> names;
    const std::string family = "Font " + std::to_string(i);
    const char* styles[] = {"Regular", "Bold", "Italic", "BoldItalic"};
    for (int k = 0; k < 1 + i % 4; ++k) {
      names.emplace_back("Font" + std::to_string(i) + "-" + styles[k], family);
    }
    records.emplace_back("/var/mobile/Library/UserFonts/FontFiles/com.example.provider" +
                             std::to_string(i % 40) + "/Font" + std::to_string(i) + "-Regular.otf",
                         Value::dictionary({{"familyName", Value(Dictionary(std::move(names)))},
                                            {"disabled", Value(i % 5 == 0)},
                                            {"fontAssetName", Value(family)},
                                            {"installDate", Value(Date{1.7e9 + i * 60.0})},
                                            {"fileSize", Value(40'000 + i)}}));
  }
  return Value(Dictionary(std::move(records)));
}

const Value& fonts() {
  static const Value v = userFonts();
  return v;
}

void report(benchmark::State& state, std::size_t bytes) {
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * bytes));
  state.counters["bytes"] = static_cast<double>(bytes);
}

void BM_CborEncode(benchmark::State& state) {
  std::size_t size = 0;
  for (auto _ : state) {
    Bytes out = CborCodec::encode(fonts());
    size = out.size();
    benchmark::DoNotOptimize(out.data());
  }
  report(state, size);
}

void BM_CborDecode(benchmark::State& state) {
  const Bytes encoded = CborCodec::encode(fonts());
  DecodeLimits limits;
  for (auto _ : state) {
    auto v = CborCodec::decode(encoded, limits);
    benchmark::DoNotOptimize(v);
  }
  report(state, encoded.size());
}

void BM_CborDecodeStream(benchmark::State& state) {
  const Bytes encoded = CborCodec::encode(fonts());
  DecodeLimits limits;
  for (auto _ : state) {
    auto v = CborStreamDecoder::decode(encoded, limits, nullptr, nullptr);
    benchmark::DoNotOptimize(v);
  }
  report(state, encoded.size());
}

void BM_CborDecodeLazy(benchmark::State& state) {
  const auto encoded = std::make_shared<const Bytes>(CborCodec::encode(fonts()));
  DecodeLimits limits;
  for (auto _ : state) {
    auto v = CborCodec::decodeLazily(encoded, *encoded, limits);
    benchmark::DoNotOptimize(v);
  }
  report(state, encoded->size());
}

// Opens every array and dictionary and touches every scalar.
std::size_t walk(const Value& value) {
  std::size_t seen = 1;
  if (const Dictionary* dictionary = value.asDictionary()) {
    for (const auto& [key, item] : *dictionary) seen += key.size() + walk(item);
  } else if (const ValueArray* array = value.asArray()) {
    for (const Value& item : *array) seen += walk(item);
  } else if (const std::string* text = value.asString()) {
    seen += text->size();
  }
  return seen;
}

template <bool kLazy>
void BM_CborDecodeThenWalk(benchmark::State& state) {
  const auto encoded = std::make_shared<const Bytes>(CborCodec::encode(fonts()));
  DecodeLimits limits;
  for (auto _ : state) {
    auto v = kLazy ? CborCodec::decodeLazily(encoded, *encoded, limits)
                   : CborCodec::decode(*encoded, limits);
    benchmark::DoNotOptimize(walk(*v));
  }
  report(state, encoded->size());
}

void BM_JsonEncode(benchmark::State& state) {
  std::size_t size = 0;
  for (auto _ : state) {
    std::string out = JsonCodec::encode(fonts());
    size = out.size();
    benchmark::DoNotOptimize(out.data());
  }
  report(state, size);
}

void BM_JsonDecode(benchmark::State& state) {
  const std::string encoded = JsonCodec::encode(fonts());
  for (auto _ : state) {
    auto v = JsonCodec::decode(encoded);
    benchmark::DoNotOptimize(v);
  }
  report(state, encoded.size());
}

BENCHMARK(BM_CborEncode)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_CborDecode)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_CborDecodeStream)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_CborDecodeLazy)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_CborDecodeThenWalk<false>)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_CborDecodeThenWalk<true>)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_JsonEncode)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_JsonDecode)->Unit(benchmark::kMillisecond);

}  // namespace
}  // namespace typhora

BENCHMARK_MAIN();
