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

inline bool finiteFloat(std::uint8_t initial, const std::uint8_t* at) {
  if (initial == 0xf9) return ((bigEndian(at, 2) >> 10) & 0x1f) != 0x1f;
  if (initial == 0xfa) return ((bigEndian(at, 4) >> 23) & 0xff) != 0xff;
  return ((bigEndian(at, 8) >> 52) & 0x7ff) != 0x7ff;
}

// Byte-wise order, eight bytes at a time: keys often share long prefixes (paths).
bool byteLess(const std::uint8_t* a, std::size_t aSize, const std::uint8_t* b, std::size_t bSize) {
  const std::size_t common = std::min(aSize, bSize);
  std::size_t i = 0;
  for (; i + 8 <= common; i += 8) {
    std::uint64_t x = 0;
    std::uint64_t y = 0;
    std::memcpy(&x, a + i, 8);
    std::memcpy(&y, b + i, 8);
    if (x != y) return __builtin_bswap64(x) < __builtin_bswap64(y);
  }
  for (; i < common; ++i) {
    if (a[i] != b[i]) return a[i] < b[i];
  }
  return aSize < bSize;
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
  if (!scanner.count(1) || !scanner.item(0, &height) || scanner.at_ != input.size()) return false;
  // Containers were listed as they closed, inner ones first; the reader meets them as they open.
  std::sort(lazy->begin() + static_cast<std::ptrdiff_t>(before), lazy->end(),
            [](const Container& a, const Container& b) { return a.begin < b.begin; });
  return true;
}

// Items are counted as the stream decoder counts them (every value, every key, a tag's content
// besides the tag), by the container that declares them.
[[gnu::always_inline]] inline bool CborScanner::count(std::uint64_t items) {
  if (items > limits_.maxItems - items_) return false;
  items_ += items;
  return true;
}

[[gnu::always_inline]] inline bool CborScanner::take(std::uint64_t size) {
  if (size > size_ - at_) return false;
  at_ += size;
  return true;
}

// Reads the head at the cursor (not of major type 7): its argument, and whether it is as short
// as the encoder writes it.
[[gnu::always_inline]] inline bool CborScanner::head(std::uint64_t* argument, bool* shortest) {
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
  *shortest = *argument >= (info == 24 ? 24 : std::uint64_t{1} << (4 * width));
  return true;
}

[[gnu::always_inline]] inline bool CborScanner::text(std::uint64_t size) {
  const std::size_t begin = at_;
  if (!take(size)) return false;
  return isValidUtf8(
      {reinterpret_cast<const char*>(data_ + begin), static_cast<std::size_t>(size)});
}

// The commonest items in a single byte or a short text, taken without a call: small integers,
// booleans, null, text shorter than 24 bytes. False (and nothing taken) for anything else.
[[gnu::always_inline]] inline bool CborScanner::atom(std::uint8_t initial) {
  if (initial < 0x18 || (initial >= 0x20 && initial < 0x38) || initial == 0xf4 || initial == 0xf5 ||
      initial == 0xf6) {
    ++at_;
    return true;
  }
  if (initial < 0x60 || initial >= 0x78) return false;
  const std::size_t size = initial - 0x60u;
  if (size > size_ - at_ - 1 ||
      !isValidUtf8({reinterpret_cast<const char*>(data_ + at_ + 1), size})) {
    return false;  // item() sees it again and refuses it
  }
  at_ += 1 + size;
  return true;
}

bool CborScanner::item(std::size_t depth, std::size_t* height) {
  *height = 0;
  if (at_ >= size_) return false;
  const std::size_t begin = at_;
  const std::uint8_t initial = data_[at_];
  const unsigned major = initial >> 5;
  if (major == 7) return simple(initial);
  std::uint64_t argument = 0;
  bool shortest = true;
  if (!head(&argument, &shortest)) return false;
  if (major == 4 || major == 5) {
    return container(argument, major == 5, shortest, begin, depth, height);
  }
  canonical_ = canonical_ && shortest;
  switch (major) {
    case 0:
      return true;
    case 1:
      return argument <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());
    case 2:
      return take(argument);
    case 3:
      return text(argument);
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
  if (!count(1)) return false;
  bool shortest = true;
  if (number == kCborEndpointTag && endpoints_) {
    if ((content >> 5) != 0) return false;
    holdsEndpoint_ = true;
    std::uint64_t index = 0;
    return head(&index, &shortest);
  }
  if (number != kDateTag) return false;
  if (initial != 0xc1) canonical_ = false;
  if (content == 0xf9 || content == 0xfa || content == 0xfb) {
    const std::size_t width = content == 0xf9 ? 2 : content == 0xfa ? 4 : 8;
    if (content != 0xfb) canonical_ = false;
    ++at_;
    return take(width) && finiteFloat(content, data_ + at_ - width);
  }
  // An integer number of seconds: the encoder writes a double.
  if ((content >> 5) > 1) return false;
  canonical_ = false;
  std::uint64_t seconds = 0;
  if (!head(&seconds, &shortest)) return false;
  return (content >> 5) == 0 ||
         seconds <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());
}

// A dictionary key: definite text; keys out of strictly increasing order are the encoder's no more.
[[gnu::always_inline]] inline bool CborScanner::key(const std::uint8_t** previous,
                                                    std::size_t* previousSize) {
  if (at_ >= size_ || (data_[at_] >> 5) != 3) return false;
  std::uint64_t size = 0;
  bool shortest = true;
  if (!head(&size, &shortest)) return false;
  canonical_ = canonical_ && shortest;
  const std::uint8_t* key = data_ + at_;
  if (!text(size)) return false;
  if (*previous != nullptr && !byteLess(*previous, *previousSize, key, size)) canonical_ = false;
  *previous = key;
  *previousSize = size;
  return true;
}

bool CborScanner::container(std::uint64_t count, bool dictionary, bool shortest, std::size_t begin,
                            std::size_t depth, std::size_t* height) {
  if (depth >= limits_.maxDepth || depth >= kMaxRecursion) return false;
  // Every item takes a byte at least: a longer declared count is truncated input.
  if (count > size_ - at_ || !this->count(dictionary ? count * 2 : count)) return false;
  const bool outerCanonical = canonical_;
  const bool outerEndpoint = holdsEndpoint_;
  canonical_ = shortest;
  holdsEndpoint_ = false;
  const std::uint8_t* previous = nullptr;
  std::size_t previousSize = 0;
  for (std::uint64_t i = 0; i < count; ++i) {
    if (dictionary && !key(&previous, &previousSize)) return false;
    if (at_ < size_ && atom(data_[at_])) {
      *height = std::max<std::size_t>(*height, 1);
      continue;
    }
    std::size_t below = 0;
    if (!item(depth + 1, &below)) return false;
    *height = std::max(*height, below + 1);
  }
  if (lazyBytes_ > 0 && canonical_ && !holdsEndpoint_ && at_ - begin >= lazyBytes_) {
    lazy_->push_back({begin, at_, *height, dictionary});
  }
  canonical_ = canonical_ && outerCanonical;
  holdsEndpoint_ = holdsEndpoint_ || outerEndpoint;
  return true;
}

}  // namespace typhora
