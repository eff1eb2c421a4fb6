#include "platform/value/plist_reader.h"

#include <sys/mman.h>

#include <memory>
#include <utility>

#include "platform/fd/regular_file.h"
#include "platform/value/cbor_codec.h"
#include "platform/value/json_codec.h"

namespace typhora {

PlistReader::Format PlistReader::detect(std::span<const std::uint8_t> bytes) {
  for (std::uint8_t b : bytes) {
    if (b == ' ' || b == '\t' || b == '\n' || b == '\r') continue;
    if (b == '{' || b == '[' || b == '"' || b == '-' || b == 't' || b == 'f' || b == 'n' ||
        (b >= '0' && b <= '9')) {
      return Format::Json;
    }
    return Format::Cbor;
  }
  return Format::Cbor;
}

std::optional<Value> PlistReader::read(std::span<const std::uint8_t> bytes,
                                       const DecodeLimits& limits, std::string* error) {
  if (detect(bytes) == Format::Json) {
    std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
    return JsonCodec::decode(text, limits, error);
  }
  return CborCodec::decode(bytes, limits, nullptr, error);
}

bool PlistReader::decodes(std::span<const std::uint8_t> bytes, const DecodeLimits& limits,
                          std::string* error) {
  if (detect(bytes) == Format::Json) return read(bytes, limits, error).has_value();
  // The value is dropped before `bytes` can go: an owner that owns nothing is enough.
  const std::shared_ptr<const void> borrowed(std::shared_ptr<const void>(), bytes.data());
  return CborCodec::decodeLazily(borrowed, bytes, limits, nullptr, error).has_value();
}

namespace {

// The bytes of a file, in memory mapped and populated in one call: a large file read into a
// fresh buffer would otherwise fault in page by page, which dominates reading a few MB in a
// process that has just started.
class FileBytes {
 public:
  explicit FileBytes(std::size_t size) : size_(size) {
    if (size_ == 0) return;
    void* mapped = mmap(nullptr, size_, PROT_READ | PROT_WRITE,
                        MAP_PRIVATE | MAP_ANONYMOUS | MAP_POPULATE, -1, 0);
    data_ = mapped == MAP_FAILED ? nullptr : static_cast<std::uint8_t*>(mapped);
  }
  ~FileBytes() {
    if (data_ != nullptr) munmap(data_, size_);
  }
  FileBytes(FileBytes&& other) noexcept
      : data_(std::exchange(other.data_, nullptr)), size_(std::exchange(other.size_, 0)) {}
  FileBytes(const FileBytes&) = delete;
  FileBytes& operator=(const FileBytes&) = delete;

  bool valid() const { return size_ == 0 || data_ != nullptr; }
  std::span<std::uint8_t> span() const { return {data_, size_}; }

 private:
  std::uint8_t* data_ = nullptr;
  std::size_t size_ = 0;
};

// Files from this size on keep their containers of kEncodedRecordBytes or more encoded.
constexpr std::size_t kEncodedRecordsFileBytes = 256 * 1024;
constexpr std::size_t kEncodedRecordBytes = 64;

}  // namespace

std::optional<Value> PlistReader::readFile(const std::string& path, const DecodeLimits& limits,
                                           std::string* error) {
  auto failWith = [error](std::string why) -> std::optional<Value> {
    if (error != nullptr) *error = std::move(why);
    return std::nullopt;
  };
  std::size_t size = 0;
  UniqueFd fd = RegularFile::open(path, limits.maxBytes, &size, error);
  if (!fd.valid()) return std::nullopt;
  FileBytes buffer(size);
  if (!buffer.valid()) return failWith("cannot read: out of memory");
  std::size_t done = 0;
  if (!RegularFile::readInto(fd.get(), buffer.span(), &done, error)) return std::nullopt;
  const std::span<const std::uint8_t> bytes = buffer.span().first(done);
  std::string why;
  std::optional<Value> value;
  if (bytes.size() >= kEncodedRecordsFileBytes && detect(bytes) == Format::Cbor) {
    // A large file is a catalog of records (the user-fonts information): they stay encoded in
    // the file's buffer, smaller than built, until read, and are copied as they stand into the
    // answers that carry them. One field of each (a record's disabled state) is read alone.
    auto owner = std::make_shared<const FileBytes>(std::move(buffer));
    value = CborCodec::decodeLazily(owner, bytes, limits, nullptr, &why, kEncodedRecordBytes);
  } else {
    // Decoded whole: a small file's value is walked in full, and a part left encoded would keep
    // the file's buffer with it.
    value = read(bytes, limits, &why);
  }
  if (!value) return failWith("cannot decode: " + why);
  return value;
}

}  // namespace typhora
