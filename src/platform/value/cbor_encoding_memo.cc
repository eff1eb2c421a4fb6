#include "platform/value/cbor_encoding_memo.h"

#include <algorithm>

namespace typhora {

CborEncodingMemo& CborEncodingMemo::shared() {
  static auto* memo = new CborEncodingMemo();  // lives as long as the process
  return *memo;
}

const void* CborEncodingMemo::addressOf(const Value& value) {
  if (const Dictionary* dictionary = value.asDictionary()) return dictionary;
  return value.asArray();
}

void CborEncodingMemo::keep(const Value& value) {
  const void* address = addressOf(value);
  if (address == nullptr) return;
  Entry oldest;  // released outside the lock: a large value takes a while to free
  std::lock_guard lock(mutex_);
  if (std::any_of(entries_.begin(), entries_.end(),
                  [address](const Entry& entry) { return entry.address == address; }))
    return;
  if (entries_.size() == kCapacity) {
    oldest = std::move(entries_.front());
    entries_.erase(entries_.begin());
  }
  entries_.push_back(Entry{value, address, {}});
}

void CborEncodingMemo::forget(const Value& value) {
  const void* address = addressOf(value);
  if (address == nullptr) return;
  std::vector<Entry> gone;  // released outside the lock: a large value takes a while to free
  {
    std::lock_guard lock(mutex_);
    auto kept = std::stable_partition(entries_.begin(), entries_.end(),
                                      [address](const Entry& e) { return e.address != address; });
    std::move(kept, entries_.end(), std::back_inserter(gone));
    entries_.erase(kept, entries_.end());
  }
}

bool CborEncodingMemo::find(const void* address, Encoding* known) const {
  std::lock_guard lock(mutex_);
  for (const Entry& entry : entries_) {
    if (entry.address != address) continue;
    *known = entry.encoding;
    return true;
  }
  return false;
}

void CborEncodingMemo::store(const void* address, Encoding encoding) {
  std::lock_guard lock(mutex_);
  for (Entry& entry : entries_) {
    if (entry.address == address && !entry.encoding.bytes) entry.encoding = std::move(encoding);
  }
}

}  // namespace typhora
