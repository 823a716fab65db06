// A property-list value: the one type the daemon uses for its files, its
// database blobs and its wire messages.
//
// A value is one of none, boolean, unsigned integer, real, string, data,
// date, array or dictionary. Typed reads are lenient on purpose: a value of
// the wrong type, or a dictionary key that is absent, reads as 0, false or
// empty, so callers decide what absence means and never trip over a type.
//
// Values are plain C++ values (copyable, movable, comparable). Serialisation
// to and from XML and binary ("bplist00") goes through libplist.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

class QRVPlist {
 public:
  enum class Type { None, Boolean, UInteger, Real, String, Data, Date, Array, Dictionary };
  using Bytes = std::vector<uint8_t>;
  using Array = std::vector<QRVPlist>;
  using Dictionary = std::map<std::string, QRVPlist, std::less<>>;
  // Seconds since 2001-01-01 00:00:00 UTC, the property-list epoch.
  struct Date {
    double seconds = 0;
    bool operator==(const Date&) const = default;
  };

  QRVPlist() = default;
  static QRVPlist boolean(bool v) { return QRVPlist(v); }
  static QRVPlist uinteger(uint64_t v) { return QRVPlist(v); }
  static QRVPlist real(double v) { return QRVPlist(v); }
  static QRVPlist string(std::string v) { return QRVPlist(std::move(v)); }
  static QRVPlist data(Bytes v) { return QRVPlist(std::move(v)); }
  static QRVPlist date(Date v) { return QRVPlist(v); }
  static QRVPlist array(Array v = {}) { return QRVPlist(std::move(v)); }
  static QRVPlist dictionary(Dictionary v = {}) { return QRVPlist(std::move(v)); }

  Type type() const { return static_cast<Type>(value_.index()); }
  bool isNone() const { return type() == Type::None; }
  bool isDictionary() const { return type() == Type::Dictionary; }
  bool isArray() const { return type() == Type::Array; }
  bool isString() const { return type() == Type::String; }

  // Lenient typed reads.
  bool boolValue() const;
  uint64_t uint64Value() const;
  double realValue() const;
  const std::string& stringValue() const;
  const Bytes& dataValue() const;
  const Array& arrayValue() const;
  const Dictionary& dictionaryValue() const;
  // A boolean or a number read as a truth value (nonzero = true); false for
  // anything else. This is how entitlements are read.
  bool truthValue() const;

  // Dictionary access. `get` returns null when this is not a dictionary or
  // the key is absent.
  const QRVPlist* get(std::string_view key) const;
  bool boolForKey(std::string_view key) const;
  uint64_t uint64ForKey(std::string_view key) const;
  const std::string& stringForKey(std::string_view key) const;
  const Bytes& dataForKey(std::string_view key) const;
  const Array& arrayForKey(std::string_view key) const;
  const Dictionary& dictionaryForKey(std::string_view key) const;

  // Mutation. `set` and `remove` turn a none value into an empty dictionary
  // first; `append` likewise into an empty array. On a value of another type
  // they replace it.
  QRVPlist& set(std::string key, QRVPlist value);
  void remove(std::string_view key);
  void append(QRVPlist value);
  Dictionary& mutableDictionary();
  Array& mutableArray();

  bool operator==(const QRVPlist& other) const = default;

  // Serialisation. The readers return nothing for bytes that are not a
  // well-formed property list, and refuse documents nested deeper than
  // `kMaxDepth`. The binary reader also refuses documents expanding to more
  // than `kMaxNodes` values (a shared sub-object counts at every place it is
  // referenced), so hostile input can exhaust neither the stack nor memory.
  // A property list has no null: a none value is written as an empty
  // dictionary. Strings are written up to their first NUL character (data
  // keeps every byte). XML keeps dates to the whole second only.
  static constexpr int kMaxDepth = 128;
  static constexpr uint64_t kMaxNodes = 4'000'000;
  Bytes toBinary() const;
  std::string toXML() const;
  static std::optional<QRVPlist> fromBinary(const uint8_t* bytes, size_t length);
  static std::optional<QRVPlist> fromXML(std::string_view xml);
  // Binary or XML, told apart by the "bplist00" signature.
  static std::optional<QRVPlist> fromBytes(const uint8_t* bytes, size_t length);

  // A compact, human-readable rendering for log lines:
  // {Key = value; List = (1, 2);} with strings quoted and data in hex.
  std::string description() const;

 private:
  template <typename T>
  explicit QRVPlist(T v) : value_(std::move(v)) {}

  std::variant<std::monostate, bool, uint64_t, double, std::string, Bytes, Date, Array, Dictionary>
      value_;
};
