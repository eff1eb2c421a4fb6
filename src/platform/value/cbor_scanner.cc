#include "platform/value/cbor_scanner.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <limits>
#include <string_view>

#include "platform/value/utf8.h"

namespace typhora {
namespace {

constexpr std::uint64_t kDateTag = 1;
// Recursion bound of the scanner and the reader; deeper limits are left to the stream decoder.
constexpr std::size_t kMaxRecursion = 256;

std::uint64_t bigEndian(const std::uint8_t* at, std::size_t width) {
  std::uint64_t value = 0;
  for (std::size_t i = 0; i < width; ++i) value = (value << 8) | at[i];
  return value;
}

bool finiteFloat(std::uint8_t initial, const std::uint8_t* at) {
  if (initial == 0xf9) return ((bigEndian(at, 2) >> 10) & 0x1f) != 0x1f;
  if (initial == 0xfa) return ((bigEndian(at, 4) >> 23) & 0xff) != 0xff;
  return ((bigEndian(at, 8) >> 52) & 0x7ff) != 0x7ff;
}

bool byteLess(const std::uint8_t* a, std::size_t aSize, const std::uint8_t* b, std::size_t bSize) {
  const int order = std::memcmp(a, b, std::min(aSize, bSize));
  return order < 0 || (order == 0 && aSize < bSize);
}

}  // namespace

CborScanner::CborScanner(std::span<const std::uint8_t> input, const DecodeLimits& limits,
                         bool endpoints, std::size_t lazyBytes, std::vector<Container>* lazy)
    : data_(input.data()),
      size_(input.size()),
      limits_(limits),
      endpoints_(endpoints),
      lazyBytes_(lazyBytes),
      lazy_(lazy) {}

bool CborScanner::scan(std::span<const std::uint8_t> input, const DecodeLimits& limits,
                       bool endpoints, std::size_t lazyBytes, std::vector<Container>* lazy) {
  if (input.empty() || input.size() > limits.maxBytes) return false;
  const std::size_t before = lazy->size();
  CborScanner scanner(input, limits, endpoints, lazyBytes, lazy);
  std::size_t height = 0;
  if (!scanner.item(0, &height) || scanner.at_ != input.size()) return false;
  // Containers were listed as they closed, inner ones first; the reader meets them as they open.
  std::sort(lazy->begin() + static_cast<std::ptrdiff_t>(before), lazy->end(),
            [](const Container& a, const Container& b) { return a.begin < b.begin; });
  return true;
}

bool CborScanner::count(std::size_t items) {
  items_ += items;
  return items_ <= limits_.maxItems;
}

bool CborScanner::take(std::uint64_t size) {
  if (size > size_ - at_) return false;
  at_ += size;
  return true;
}

// Reads the head at the cursor (not of major type 7): its argument; a longer head than needed
// marks the container as not the encoder's.
bool CborScanner::head(std::uint64_t* argument) {
  const std::uint8_t info = data_[at_++] & 0x1f;
  if (info < 24) {
    *argument = info;
    return true;
  }
  if (info > 27) return false;  // reserved, or an indefinite length
  const std::size_t width = std::size_t{1} << (info - 24);
  if (width > size_ - at_) return false;
  *argument = bigEndian(data_ + at_, width);
  at_ += width;
  const std::uint64_t shortest = info == 24 ? 24 : std::uint64_t{1} << (4 * width);
  if (*argument < shortest) canonical_ = false;
  return true;
}

bool CborScanner::text(std::uint64_t size) {
  const std::size_t begin = at_;
  if (!take(size)) return false;
  return isValidUtf8(
      {reinterpret_cast<const char*>(data_ + begin), static_cast<std::size_t>(size)});
}

bool CborScanner::item(std::size_t depth, std::size_t* height) {
  *height = 0;
  if (at_ >= size_) return false;
  const std::size_t begin = at_;
  const std::uint8_t initial = data_[at_];
  const unsigned major = initial >> 5;
  if (major == 7) return simple(initial) && count(1);
  std::uint64_t argument = 0;
  const bool outer = canonical_;
  canonical_ = true;
  if (!head(&argument)) return false;
  const bool shortest = canonical_;
  canonical_ = outer && shortest;
  switch (major) {
    case 0:
      return count(1);
    case 1:
      return argument <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max()) &&
             count(1);
    case 2:
      return take(argument) && count(1);
    case 3:
      return text(argument) && count(1);
    case 4:
    case 5:
      return container(argument, major == 5, shortest, begin, depth, height);
    default:
      return tag(argument, initial, depth);
  }
}

bool CborScanner::simple(std::uint8_t initial) {
  ++at_;
  switch (initial) {
    case 0xf4:  // false
    case 0xf5:  // true
    case 0xf6:  // null
      return true;
    case 0xf9:
    case 0xfa:
      canonical_ = false;  // the encoder writes every double in eight bytes
      return take(initial == 0xf9 ? 2 : 4);
    case 0xfb:
      if (!take(8)) return false;
      if (!finiteFloat(initial, data_ + at_ - 8) && bigEndian(data_ + at_ - 8, 8) << 12 != 0) {
        canonical_ = false;  // a NaN's payload need not survive encoding
      }
      return true;
    default:
      return false;  // undefined, unassigned simple values, a break
  }
}

bool CborScanner::tag(std::uint64_t number, std::uint8_t initial, std::size_t depth) {
  if (depth >= limits_.maxDepth || at_ >= size_) return false;
  const std::uint8_t content = data_[at_];
  if (number == kCborEndpointTag && endpoints_) {
    if ((content >> 5) != 0) return false;
    holdsEndpoint_ = true;
    std::uint64_t index = 0;
    return head(&index) && count(2);
  }
  if (number != kDateTag) return false;
  if (initial != 0xc1) canonical_ = false;
  if (content == 0xf9 || content == 0xfa || content == 0xfb) {
    const std::size_t width = content == 0xf9 ? 2 : content == 0xfa ? 4 : 8;
    if (content != 0xfb) canonical_ = false;
    ++at_;
    if (!take(width) || !finiteFloat(content, data_ + at_ - width)) return false;
    return count(2);
  }
  // An integer number of seconds: the encoder writes a double.
  if ((content >> 5) > 1) return false;
  canonical_ = false;
  std::uint64_t seconds = 0;
  if (!head(&seconds)) return false;
  return ((content >> 5) == 0 ||
          seconds <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) &&
         count(2);
}

// A dictionary key: definite text; keys out of strictly increasing order are the encoder's no more.
bool CborScanner::key(const std::uint8_t** previous, std::size_t* previousSize) {
  if (at_ >= size_ || (data_[at_] >> 5) != 3) return false;
  std::uint64_t size = 0;
  if (!head(&size)) return false;
  const std::uint8_t* key = data_ + at_;
  if (!text(size) || !count(1)) return false;
  if (*previous != nullptr && !byteLess(*previous, *previousSize, key, size)) canonical_ = false;
  *previous = key;
  *previousSize = size;
  return true;
}

bool CborScanner::container(std::uint64_t count, bool dictionary, bool shortest, std::size_t begin,
                            std::size_t depth, std::size_t* height) {
  if (depth >= limits_.maxDepth || depth >= kMaxRecursion) return false;
  // Every item takes a byte at least: a longer declared count is truncated input.
  if (count > size_ - at_ || (dictionary ? count * 2 : count) > limits_.maxItems) return false;
  const bool outerCanonical = canonical_;
  const bool outerEndpoint = holdsEndpoint_;
  canonical_ = shortest;
  holdsEndpoint_ = false;
  const std::uint8_t* previous = nullptr;
  std::size_t previousSize = 0;
  for (std::uint64_t i = 0; i < count; ++i) {
    if (dictionary && !key(&previous, &previousSize)) return false;
    std::size_t below = 0;
    if (!item(depth + 1, &below)) return false;
    *height = std::max(*height, below + 1);
  }
  if (!this->count(1)) return false;
  if (lazyBytes_ > 0 && canonical_ && !holdsEndpoint_ && at_ - begin >= lazyBytes_) {
    lazy_->push_back({begin, at_, *height, dictionary});
  }
  canonical_ = canonical_ && outerCanonical;
  holdsEndpoint_ = holdsEndpoint_ || outerEndpoint;
  return true;
}

}  // namespace typhora
