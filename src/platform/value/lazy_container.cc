#include "platform/value/lazy_container.h"

namespace typhora {

std::span<const std::uint8_t> LazyContainer::encoding() const {
  const CborScanner::Container& c = container();
  return source_->bytes.subspan(c.begin, c.end - c.begin);
}

void LazyContainer::open() const {
  if (opened_.load(std::memory_order_acquire)) return;
  std::call_once(once_, [this] {
    if (isDictionary()) {
      dictionary_ = CborReader::readDictionary(source_, index_);
    } else {
      array_ = CborReader::readArray(source_, index_);
    }
    opened_.store(true, std::memory_order_release);
  });
}

const ValueArray* LazyContainer::array() const {
  if (isDictionary()) return nullptr;
  open();
  return &array_;
}

Value LazyContainer::valueAt(std::string_view key) const {
  if (!isDictionary()) return Value();
  if (opened_.load(std::memory_order_acquire)) {
    const Value* found = dictionary_.find(key);
    return found != nullptr ? *found : Value();
  }
  return CborReader::readValueAt(source_, index_, key);
}

const Dictionary* LazyContainer::dictionary() const {
  if (!isDictionary()) return nullptr;
  open();
  return &dictionary_;
}

}  // namespace typhora
