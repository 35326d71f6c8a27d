#include "base/Uuid.h"

#include <uuid/uuid.h>

#include <cstring>

namespace vantrel::base {

Uuid Uuid::random() {
  Bytes b;
  uuid_generate_random(b.data());
  return Uuid(b);
}

std::optional<Uuid> Uuid::parse(std::string_view text) {
  if (text.size() != 36) return std::nullopt;
  char buf[37];
  std::memcpy(buf, text.data(), 36);
  buf[36] = '\0';
  Bytes b;
  if (uuid_parse(buf, b.data()) != 0) return std::nullopt;
  return Uuid(b);
}

std::optional<Uuid> Uuid::fromBytes(const uint8_t* data, size_t size) {
  if (data == nullptr || size != 16) return std::nullopt;
  Bytes b;
  std::memcpy(b.data(), data, 16);
  return Uuid(b);
}

std::string Uuid::string() const {
  char buf[37];
  uuid_unparse_upper(bytes_.data(), buf);
  return std::string(buf, 36);
}

bool Uuid::isNil() const {
  return uuid_is_null(bytes_.data()) != 0;
}

size_t Uuid::hash() const {
  uint64_t a, b;
  std::memcpy(&a, bytes_.data(), 8);
  std::memcpy(&b, bytes_.data() + 8, 8);
  return static_cast<size_t>(a ^ (b * 0x9E3779B97F4A7C15ull));
}

std::string describe(const Uuid& uuid) {
  return uuid.string();
}

}  // namespace vantrel::base
