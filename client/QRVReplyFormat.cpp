#include "client/QRVReplyFormat.h"

#include <fmt/format.h>

#include <cmath>
#include <ctime>

#include "base/QRVResultCode.h"
#include "base/QRVUUID.h"
#include "client/QRVProtocol.h"

namespace QRVReplyFormat {

namespace {

std::string hex(const QRVPlist::Bytes& bytes) {
  static const char kHex[] = "0123456789abcdef";
  std::string s;
  s.reserve(bytes.size() * 2);
  for (uint8_t b : bytes) {
    s += kHex[b >> 4];
    s += kHex[b & 0xF];
  }
  return s;
}

// Property-list dates count seconds from 2001-01-01T00:00:00Z.
std::string isoDate(double seconds) {
  constexpr double kEpochOffset = 978307200.0;
  double unixSeconds = std::floor(seconds + kEpochOffset);
  time_t t = static_cast<time_t>(unixSeconds);
  tm utc{};
  if (!std::isfinite(unixSeconds) || !gmtime_r(&t, &utc)) return "invalid date";
  char buffer[64];
  strftime(buffer, sizeof(buffer), "%Y-%m-%dT%H:%M:%SZ", &utc);
  return buffer;
}

// Length of the well-formed UTF-8 sequence starting at s[i], or 0 when the
// bytes there are not one (overlong forms, surrogates and values past
// U+10FFFF included).
size_t utf8SequenceLength(std::string_view s, size_t i) {
  auto byte = [&](size_t k) { return static_cast<unsigned char>(s[k]); };
  unsigned char c = byte(i);
  if (c < 0x80) return 1;
  size_t n = (c >= 0xC2 && c <= 0xDF)   ? 2
             : (c >= 0xE0 && c <= 0xEF) ? 3
             : (c >= 0xF0 && c <= 0xF4) ? 4
                                        : 0;
  if (n == 0) return 0;
  uint32_t cp = c & (0x7Fu >> n);  // the lead byte's payload bits
  if (i + n > s.size()) return 0;
  for (size_t k = 1; k < n; k++) {
    if ((byte(i + k) & 0xC0) != 0x80) return 0;
    cp = cp << 6 | (byte(i + k) & 0x3F);
  }
  if ((n == 3 && cp < 0x800) || (n == 4 && cp < 0x10000) || cp > 0x10FFFF ||
      (cp >= 0xD800 && cp <= 0xDFFF))
    return 0;
  return n;
}

bool isUUIDKey(std::string_view key) { return key.find("UUID") != std::string_view::npos; }

std::string humanValue(const QRVPlist& value, bool uuidKey, bool topLevel) {
  switch (value.type()) {
    case QRVPlist::Type::String: {
      // Bare at the top level reads best, unless that would hide an empty
      // string or break the one-line-per-key layout.
      const std::string& s = value.stringValue();
      bool plain = topLevel && !s.empty();
      for (char c : s) plain = plain && static_cast<unsigned char>(c) >= 0x20 && c != 0x7F;
      return plain ? s : jsonString(s);
    }
    case QRVPlist::Type::Data:
      if (uuidKey && value.dataValue().size() == 16)
        return QRVUUID::fromData(value.dataValue().data(), 16)->string();
      return "<" + hex(value.dataValue()) + ">";
    case QRVPlist::Type::Array: {
      std::string s = "(";
      bool first = true;
      for (const auto& item : value.arrayValue()) {
        s += first ? "" : ", ";
        s += humanValue(item, uuidKey, false);
        first = false;
      }
      return s + ")";
    }
    case QRVPlist::Type::Dictionary: {
      std::string s = "{";
      for (const auto& [key, item] : value.dictionaryValue())
        s += fmt::format("{} = {}; ", key, humanValue(item, isUUIDKey(key), false));
      if (s.size() > 1) s.pop_back();
      return s + "}";
    }
    case QRVPlist::Type::Boolean: return value.boolValue() ? "true" : "false";
    case QRVPlist::Type::Date: return isoDate(value.realValue());
    default: return value.description();
  }
}

void appendJSON(std::string& out, const QRVPlist& value, int indent, int depth) {
  auto newline = [&](int level) {
    if (indent <= 0) return;
    out += '\n';
    out.append(static_cast<size_t>(indent * level), ' ');
  };
  switch (value.type()) {
    case QRVPlist::Type::None: out += "null"; return;
    case QRVPlist::Type::Boolean: out += value.boolValue() ? "true" : "false"; return;
    case QRVPlist::Type::UInteger: out += std::to_string(value.uint64Value()); return;
    case QRVPlist::Type::Real: {
      double d = value.realValue();
      // JSON has no NaN or infinity.
      out += std::isfinite(d) ? fmt::format("{}", d) : "null";
      return;
    }
    case QRVPlist::Type::String: out += jsonString(value.stringValue()); return;
    case QRVPlist::Type::Data: out += '"' + hex(value.dataValue()) + '"'; return;
    case QRVPlist::Type::Date: out += jsonString(isoDate(value.realValue())); return;
    case QRVPlist::Type::Array: {
      const auto& items = value.arrayValue();
      if (items.empty()) {
        out += "[]";
        return;
      }
      out += '[';
      for (size_t i = 0; i < items.size(); i++) {
        if (i) out += indent > 0 ? "," : ", ";
        newline(depth + 1);
        appendJSON(out, items[i], indent, depth + 1);
      }
      newline(depth);
      out += ']';
      return;
    }
    case QRVPlist::Type::Dictionary: {
      const auto& entries = value.dictionaryValue();
      if (entries.empty()) {
        out += "{}";
        return;
      }
      out += '{';
      bool first = true;
      for (const auto& [key, item] : entries) {
        if (!first) out += indent > 0 ? "," : ", ";
        first = false;
        newline(depth + 1);
        out += jsonString(key);
        out += ": ";
        appendJSON(out, item, indent, depth + 1);
      }
      newline(depth);
      out += '}';
      return;
    }
  }
}

}  // namespace

std::string jsonString(std::string_view text) {
  std::string out = "\"";
  out.reserve(text.size() + 2);
  for (size_t i = 0; i < text.size();) {
    unsigned char c = static_cast<unsigned char>(text[i]);
    switch (c) {
      case '"':
        out += "\\\"";
        i++;
        continue;
      case '\\':
        out += "\\\\";
        i++;
        continue;
      case '\b':
        out += "\\b";
        i++;
        continue;
      case '\f':
        out += "\\f";
        i++;
        continue;
      case '\n':
        out += "\\n";
        i++;
        continue;
      case '\r':
        out += "\\r";
        i++;
        continue;
      case '\t':
        out += "\\t";
        i++;
        continue;
      default: break;
    }
    if (c < 0x20 || c == 0x7F) {
      out += fmt::format("\\u{:04x}", c);
      i++;
      continue;
    }
    size_t n = utf8SequenceLength(text, i);
    if (n == 0) {
      out += "\\ufffd";
      i++;
      continue;
    }
    out.append(text.substr(i, n));
    i += n;
  }
  out += '"';
  return out;
}

std::string json(const QRVPlist& value, int indent) {
  std::string out;
  appendJSON(out, value, indent, 0);
  return out;
}

std::string human(const QRVPlist& reply) {
  std::string out;
  for (const auto& [key, value] : reply.dictionaryValue()) {
    out += key;
    out += " = ";
    out += humanValue(value, isUUIDKey(key), true);
    if (key == QRVProtocol::kReplyErrorKey && value.type() == QRVPlist::Type::UInteger) {
      std::string_view meaning = QRVResultCode::text(value.uint64Value());
      out += fmt::format(" ({})", meaning.empty() ? "unknown result code" : meaning);
    }
    out += '\n';
  }
  return out;
}

}  // namespace QRVReplyFormat
