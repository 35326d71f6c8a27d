#pragma once
// A 128-bit UUID value. Text is the canonical 36-character upper-case form
// (groups 8-4-4-4-12); parsing accepts either letter case.

#include <array>
#include <compare>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace vantrel::base {

class Uuid {
 public:
  using Bytes = std::array<uint8_t, 16>;

  // The nil UUID (all zero bytes).
  Uuid() : bytes_{} {}
  explicit Uuid(const Bytes& bytes) : bytes_(bytes) {}

  // A fresh random (version 4) UUID.
  static Uuid random();
  // Parses the 36-character textual form; nullopt when it is not one.
  static std::optional<Uuid> parse(std::string_view text);
  // From exactly 16 raw bytes; nullopt for any other length.
  static std::optional<Uuid> fromBytes(const uint8_t* data, size_t size);

  const Bytes& bytes() const { return bytes_; }
  std::string string() const;
  bool isNil() const;
  size_t hash() const;

  auto operator<=>(const Uuid&) const = default;

 private:
  Bytes bytes_;
};

std::string describe(const Uuid& uuid);

}  // namespace vantrel::base

template <>
struct std::hash<vantrel::base::Uuid> {
  size_t operator()(const vantrel::base::Uuid& u) const { return u.hash(); }
};
