// A 16-byte UUID. New ones are random (version 4). The text form is the
// upper-case 8-4-4-4-12 form used in container directory names.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

class QRVUUID {
 public:
  using Bytes = std::array<uint8_t, 16>;

  QRVUUID() : bytes_{} {}
  explicit QRVUUID(const Bytes& bytes) : bytes_(bytes) {}

  static QRVUUID random();
  // Accepts either case; refuses anything but exactly 36 characters in the
  // 8-4-4-4-12 form.
  static std::optional<QRVUUID> fromString(std::string_view text);
  // Exactly 16 bytes, as a UUID travels in messages and property lists.
  static std::optional<QRVUUID> fromData(const uint8_t* data, size_t length);

  const Bytes& bytes() const { return bytes_; }
  bool isNull() const;
  std::string string() const;

  bool operator==(const QRVUUID&) const = default;
  auto operator<=>(const QRVUUID&) const = default;

 private:
  Bytes bytes_;
};

template <>
struct std::hash<QRVUUID> {
  size_t operator()(const QRVUUID& u) const noexcept;
};
