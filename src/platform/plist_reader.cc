#include "platform/plist_reader.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/cbor_codec.h"
#include "platform/json_codec.h"

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
  FileBytes(const FileBytes&) = delete;
  FileBytes& operator=(const FileBytes&) = delete;

  bool valid() const { return size_ == 0 || data_ != nullptr; }
  std::span<std::uint8_t> span() const { return {data_, size_}; }

 private:
  std::uint8_t* data_ = nullptr;
  std::size_t size_ = 0;
};

}  // namespace

std::optional<Value> PlistReader::readFile(const std::string& path, const DecodeLimits& limits,
                                           std::string* error) {
  auto failWith = [error](std::string why) -> std::optional<Value> {
    if (error != nullptr) *error = std::move(why);
    return std::nullopt;
  };
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return failWith(std::string("cannot open: ") + std::strerror(errno));
  struct stat info {};
  if (fstat(fd, &info) != 0) {
    const int savedErrno = errno;
    close(fd);
    return failWith(std::string("cannot read: ") + std::strerror(savedErrno));
  }
  if (static_cast<std::uint64_t>(info.st_size) > limits.maxBytes) {
    close(fd);
    return failWith("file larger than the size limit");
  }
  FileBytes buffer(static_cast<std::size_t>(info.st_size));
  if (!buffer.valid()) {
    close(fd);
    return failWith("cannot read: out of memory");
  }
  std::span<std::uint8_t> bytes = buffer.span();
  std::size_t done = 0;
  bool ok = true;
  while (done < bytes.size()) {
    ssize_t n = ::read(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      ok = n == 0;  // the file shrank while being read: decode what is there
      break;
    }
    done += static_cast<std::size_t>(n);
  }
  const int savedErrno = errno;
  close(fd);
  if (!ok) return failWith(std::string("cannot read: ") + std::strerror(savedErrno));
  std::string why;
  auto value = read(bytes.first(done), limits, &why);
  if (!value) return failWith("cannot decode: " + why);
  return value;
}

}  // namespace typhora
