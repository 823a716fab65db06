#include "base/QRVUUID.h"

#include <sys/random.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <string_view>

QRVUUID QRVUUID::random() {
  Bytes b;
  size_t got = 0;
  while (got < b.size()) {
    ssize_t n = getrandom(b.data() + got, b.size() - got, 0);
    if (n < 0) {
      if (errno == EINTR) continue;
      // Without randomness every container name could collide; nothing
      // sensible can go on.
      abort();
    }
    got += static_cast<size_t>(n);
  }
  b[6] = (b[6] & 0x0F) | 0x40;
  b[8] = (b[8] & 0x3F) | 0x80;
  return QRVUUID(b);
}

std::optional<QRVUUID> QRVUUID::fromString(std::string_view text) {
  if (text.size() != 36) return std::nullopt;
  Bytes b{};
  size_t out = 0;
  for (size_t i = 0; i < text.size();) {
    if (i == 8 || i == 13 || i == 18 || i == 23) {
      if (text[i] != '-') return std::nullopt;
      i++;
      continue;
    }
    auto nibble = [](char c) -> int {
      if (c >= '0' && c <= '9') return c - '0';
      if (c >= 'a' && c <= 'f') return c - 'a' + 10;
      if (c >= 'A' && c <= 'F') return c - 'A' + 10;
      return -1;
    };
    int hi = nibble(text[i]), lo = i + 1 < text.size() ? nibble(text[i + 1]) : -1;
    if (hi < 0 || lo < 0) return std::nullopt;
    b[out++] = static_cast<uint8_t>(hi << 4 | lo);
    i += 2;
  }
  return QRVUUID(b);
}

std::optional<QRVUUID> QRVUUID::fromData(const uint8_t* data, size_t length) {
  if (!data || length != 16) return std::nullopt;
  Bytes b;
  memcpy(b.data(), data, 16);
  return QRVUUID(b);
}

bool QRVUUID::isNull() const {
  for (uint8_t c : bytes_)
    if (c) return false;
  return true;
}

std::string QRVUUID::string() const {
  static const char kHex[] = "0123456789ABCDEF";
  std::string s;
  s.reserve(36);
  for (size_t i = 0; i < 16; i++) {
    if (i == 4 || i == 6 || i == 8 || i == 10) s += '-';
    s += kHex[bytes_[i] >> 4];
    s += kHex[bytes_[i] & 0xF];
  }
  return s;
}

size_t std::hash<QRVUUID>::operator()(const QRVUUID& u) const noexcept {
  return std::hash<std::string_view>()(
      std::string_view(reinterpret_cast<const char*>(u.bytes().data()), 16));
}
