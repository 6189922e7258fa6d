// Data: an immutable byte buffer with cheap copies (shared storage).
//
// A Data either owns a heap copy of its bytes or adopts a malloc'ed buffer that it frees when the
// last copy goes away (for buffers handed over by C-style libraries). "No data" is expressed as
// std::optional<Data>, never as an empty Data.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace platform {

class Data {
 public:
  Data() = default;
  // Data copies `length` bytes from `bytes`, which may be null only when `length` is 0.
  Data(const void* bytes, size_t length);
  // Data takes over `bytes` without copying them.
  explicit Data(std::vector<uint8_t> bytes);
  // Data copies the bytes of the span.
  explicit Data(std::span<const uint8_t> bytes) : Data(bytes.data(), bytes.size()) {}
  // fromString copies the bytes of `text` (no terminating NUL).
  static Data fromString(std::string_view text) { return Data(text.data(), text.size()); }

  // adoptMalloc takes ownership of `bytes`, allocated with malloc, without copying; free() releases
  // it with the last copy. A null `bytes` gives an empty Data.
  static Data adoptMalloc(void* bytes, size_t length);

  // Views of the bytes, valid while this Data or a copy of it lives: bytes() is null for a Data
  // made empty, length() counts bytes; toVector() copies them.
  const uint8_t* bytes() const { return bytes_; }
  size_t length() const { return length_; }
  bool empty() const { return length_ == 0; }
  std::span<const uint8_t> span() const { return {bytes_, length_}; }
  std::string_view view() const { return {reinterpret_cast<const char*>(bytes_), length_}; }
  std::vector<uint8_t> toVector() const { return {bytes_, bytes_ + length_}; }

  // Two Data are equal when they hold the same bytes.
  friend bool operator==(const Data& a, const Data& b);

  // description renders the bytes for logs: "{length = 3, bytes = 0x010203}"; long buffers show their first and last
  // bytes only.
  std::string description() const;

 private:
  std::shared_ptr<const void> owner_;
  const uint8_t* bytes_ = nullptr;
  size_t length_ = 0;
};

}  // namespace platform
