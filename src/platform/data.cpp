#include "platform/data.h"

#include <cstdlib>
#include <cstring>

namespace platform {

namespace {
constexpr char kHex[] = "0123456789abcdef";

void appendHex(std::string& out, const uint8_t* p, size_t n) {
  for (size_t i = 0; i < n; ++i) {
    out += kHex[p[i] >> 4];
    out += kHex[p[i] & 0xF];
  }
}
}  // namespace

Data::Data(const void* bytes, size_t length) {
  if (length == 0) return;
  // One allocation for the control block and the bytes.
  std::shared_ptr<uint8_t[]> storage = std::make_shared_for_overwrite<uint8_t[]>(length);
  std::memcpy(storage.get(), bytes, length);
  bytes_ = storage.get();
  length_ = length;
  owner_ = std::move(storage);
}

Data::Data(std::vector<uint8_t> bytes) {
  if (bytes.empty()) return;
  auto storage = std::make_shared<std::vector<uint8_t>>(std::move(bytes));
  bytes_ = storage->data();
  length_ = storage->size();
  owner_ = std::move(storage);
}

Data Data::adoptMalloc(void* bytes, size_t length) {
  Data d;
  if (bytes == nullptr) return d;
  d.owner_ = std::shared_ptr<void>(bytes, [](void* p) { std::free(p); });
  d.bytes_ = static_cast<const uint8_t*>(bytes);
  d.length_ = length;
  return d;
}

bool operator==(const Data& a, const Data& b) {
  return a.length_ == b.length_ && (a.length_ == 0 || std::memcmp(a.bytes_, b.bytes_, a.length_) == 0);
}

std::string Data::description() const {
  std::string out = "{length = " + std::to_string(length_) + ", bytes = 0x";
  constexpr size_t kShown = 24;
  if (length_ <= 2 * kShown) {
    appendHex(out, bytes_, length_);
  } else {
    appendHex(out, bytes_, kShown);
    out += " ... ";
    appendHex(out, bytes_ + length_ - kShown / 3, kShown / 3);
  }
  out += "}";
  return out;
}

}  // namespace platform
