#include "client/QRVRequestArguments.h"

#include <fmt/format.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <iterator>

#include "base/QRVUUID.h"
#include "client/QRVProtocol.h"

namespace QRVRequestArguments {

namespace {

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

std::vector<std::string_view> splitCommas(std::string_view text) {
  std::vector<std::string_view> parts;
  if (text.empty()) return parts;  // "KEY:strs=" is the empty array, not [""]
  size_t start = 0;
  for (;;) {
    size_t comma = text.find(',', start);
    parts.push_back(text.substr(start, comma - start));
    if (comma == std::string_view::npos) break;
    start = comma + 1;
  }
  return parts;
}

std::optional<bool> parseBool(std::string_view text) {
  if (text == "true" || text == "yes" || text == "1") return true;
  if (text == "false" || text == "no" || text == "0") return false;
  return std::nullopt;
}

std::optional<QRVPlist> parseHex(std::string_view text) {
  if (text.size() % 2) return std::nullopt;
  QRVPlist::Bytes bytes;
  bytes.reserve(text.size() / 2);
  for (size_t i = 0; i < text.size(); i += 2) {
    int hi = hexDigit(text[i]), lo = hexDigit(text[i + 1]);
    if (hi < 0 || lo < 0) return std::nullopt;
    bytes.push_back(static_cast<uint8_t>(hi << 4 | lo));
  }
  return QRVPlist::data(std::move(bytes));
}

std::optional<QRVPlist> parsePlist(std::string_view text, std::string* why) {
  if (!text.empty() && text.front() == '@') {
    std::string path(text.substr(1));
    std::ifstream in(path, std::ios::binary);
    if (!in) {
      *why = fmt::format("cannot read {}: {}", path, strerror(errno));
      return std::nullopt;
    }
    std::vector<uint8_t> bytes((std::istreambuf_iterator<char>(in)),
                               std::istreambuf_iterator<char>());
    auto value = QRVPlist::fromBytes(bytes.data(), bytes.size());
    if (!value) *why = fmt::format("{} is not a property list", path);
    return value;
  }
  auto value = QRVPlist::fromXML(text);
  if (!value) *why = "not an XML property list (use @FILE to read one from a file)";
  return value;
}

// The value of `text` under an explicit `type`; on failure fills `why`.
std::optional<QRVPlist> parseTyped(std::string_view type, std::string_view text, std::string* why) {
  if (type == "str") return QRVPlist::string(std::string(text));
  if (type == "uint") {
    if (auto n = parseUnsigned(text)) return QRVPlist::uinteger(*n);
    *why = "not an unsigned integer";
    return std::nullopt;
  }
  if (type == "bool") {
    if (auto b = parseBool(text)) return QRVPlist::boolean(*b);
    *why = "not a boolean (true/false, yes/no, 1/0)";
    return std::nullopt;
  }
  if (type == "data") {
    if (auto d = parseHex(text)) return d;
    *why = "not an even number of hex digits";
    return std::nullopt;
  }
  if (type == "uuid") {
    auto uuid = QRVUUID::fromString(text);
    if (!uuid) {
      *why = "not a UUID (8-4-4-4-12 hex digits)";
      return std::nullopt;
    }
    return QRVPlist::data(QRVPlist::Bytes(uuid->bytes().begin(), uuid->bytes().end()));
  }
  if (type == "strs") {
    QRVPlist array = QRVPlist::array();
    for (auto part : splitCommas(text)) array.append(QRVPlist::string(std::string(part)));
    return array;
  }
  if (type == "uints") {
    QRVPlist array = QRVPlist::array();
    for (auto part : splitCommas(text)) {
      auto n = parseUnsigned(part);
      if (!n) {
        *why = fmt::format("element \"{}\" is not an unsigned integer", part);
        return std::nullopt;
      }
      array.append(QRVPlist::uinteger(*n));
    }
    return array;
  }
  if (type == "plist") return parsePlist(text, why);
  *why = fmt::format("unknown type \"{}\" (known: uint, bool, str, data, uuid, strs, uints, plist)",
                     type);
  return std::nullopt;
}

// Untyped values: digits are numbers, true/false booleans, the rest text.
QRVPlist guess(std::string_view text, std::string* why, bool* ok) {
  *ok = true;
  if (text == "true") return QRVPlist::boolean(true);
  if (text == "false") return QRVPlist::boolean(false);
  bool digits = !text.empty();
  for (char c : text) digits = digits && c >= '0' && c <= '9';
  if (!digits) return QRVPlist::string(std::string(text));
  if (auto n = parseUnsigned(text)) return QRVPlist::uinteger(*n);
  // Silently sending a string where a number was meant would only move the
  // confusion to the daemon's reply.
  *ok = false;
  *why = "number too large for an unsigned 64-bit integer (write KEY:str=... for text)";
  return {};
}

}  // namespace

std::optional<uint64_t> parseUnsigned(std::string_view text) {
  int base = 10;
  if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    text.remove_prefix(2);
  }
  if (text.empty()) return std::nullopt;
  uint64_t value = 0;
  for (char c : text) {
    int digit = hexDigit(c);
    if (digit < 0 || digit >= base) return std::nullopt;
    if (value > (UINT64_MAX - static_cast<uint64_t>(digit)) / static_cast<uint64_t>(base))
      return std::nullopt;
    value = value * static_cast<uint64_t>(base) + static_cast<uint64_t>(digit);
  }
  return value;
}

std::optional<std::pair<std::string, QRVPlist>> parseArgument(std::string_view word,
                                                              std::string* error) {
  auto failed = [&](std::string_view why) -> std::optional<std::pair<std::string, QRVPlist>> {
    if (error) *error = fmt::format("bad argument \"{}\": {}", word, why);
    return std::nullopt;
  };
  size_t equals = word.find('=');
  if (equals == std::string_view::npos) return failed("expected KEY=VALUE or KEY:TYPE=VALUE");
  std::string_view key = word.substr(0, equals);
  std::string_view text = word.substr(equals + 1);
  std::optional<std::string_view> type;
  if (size_t colon = key.find(':'); colon != std::string_view::npos) {
    type = key.substr(colon + 1);
    key = key.substr(0, colon);
  }
  if (key.empty()) return failed("empty key");

  std::string why;
  if (type) {
    auto value = parseTyped(*type, text, &why);
    if (!value) return failed(why);
    return std::make_pair(std::string(key), std::move(*value));
  }
  bool ok = false;
  QRVPlist value = guess(text, &why, &ok);
  if (!ok) return failed(why);
  return std::make_pair(std::string(key), std::move(value));
}

std::optional<QRVPlist> buildRequest(uint64_t command, const std::vector<std::string>& words,
                                     std::string* error) {
  QRVPlist request = QRVPlist::dictionary();
  request.set(std::string(QRVProtocol::kCommandKey), QRVPlist::uinteger(command));
  for (const auto& word : words) {
    auto argument = parseArgument(word, error);
    if (!argument) return std::nullopt;
    if (request.get(argument->first)) {
      if (error) *error = fmt::format("key \"{}\" given more than once", argument->first);
      return std::nullopt;
    }
    request.set(std::move(argument->first), std::move(argument->second));
  }
  return request;
}

}  // namespace QRVRequestArguments
