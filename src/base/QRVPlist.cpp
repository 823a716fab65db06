#include "base/QRVPlist.h"

#include <plist/plist.h>

#include <cstring>
#include <limits>
#include <memory>

#include <fmt/format.h>

namespace {

const std::string kEmptyString;
const QRVPlist::Bytes kEmptyBytes;
const QRVPlist::Array kEmptyArray;
const QRVPlist::Dictionary kEmptyDictionary;

struct PlistFree {
  void operator()(void* p) const { plist_free(static_cast<plist_t>(p)); }
};
using PlistPtr = std::unique_ptr<void, PlistFree>;

// libplist's date accessors pass int32 seconds plus microseconds: writing
// overflows for dates after 2069 (the "distant future" sentinel among them),
// and reading truncates the fraction and loses its sign, so dates before 2001
// came back up to a second late. A binary property list holds a date as a
// big-endian double, so dates cross the libplist boundary as a one-object
// binary document instead: "bplist00", the object (0x33 and the double), a
// one-entry offset table and the 32-byte trailer.
constexpr size_t kDateObjectOffset = 8;
constexpr size_t kDateDocumentSize = 8 + 9 + 1 + 32;

plist_t newDateNode(double seconds) {
  uint8_t doc[kDateDocumentSize] = {'b', 'p', 'l', 'i', 's', 't', '0', '0', 0x33};
  uint64_t bits = 0;
  memcpy(&bits, &seconds, sizeof bits);
  for (int i = 0; i < 8; i++) doc[9 + i] = static_cast<uint8_t>(bits >> (56 - 8 * i));
  doc[17] = kDateObjectOffset;
  uint8_t* trailer = doc + 18;
  trailer[6] = 1;    // offset size
  trailer[7] = 1;    // reference size
  trailer[15] = 1;   // one object; the top object is object 0
  trailer[31] = 17;  // offset table position
  plist_t node = nullptr;
  plist_from_bin(reinterpret_cast<const char*>(doc), sizeof doc, &node);
  return node ? node : plist_new_date(0, 0);
}

double dateSeconds(plist_t node) {
  char* out = nullptr;
  uint32_t len = 0;
  plist_to_bin(node, &out, &len);
  const auto* b = reinterpret_cast<const uint8_t*>(out);
  double seconds = 0;
  if (b && len >= kDateObjectOffset + 9 && b[kDateObjectOffset] == 0x33) {
    uint64_t bits = 0;
    for (int i = 0; i < 8; i++) bits = (bits << 8) | b[kDateObjectOffset + 1 + i];
    memcpy(&seconds, &bits, sizeof seconds);
  } else {
    int32_t sec = 0, usec = 0;
    plist_get_date_val(node, &sec, &usec);
    seconds = sec + usec / 1e6;
  }
  plist_to_bin_free(out);
  return seconds;
}

plist_t toNode(const QRVPlist& v) {
  switch (v.type()) {
    // A property list has no null: none is written as an empty dictionary.
    case QRVPlist::Type::None: return plist_new_dict();
    case QRVPlist::Type::Boolean: return plist_new_bool(v.boolValue());
    case QRVPlist::Type::UInteger: return plist_new_uint(v.uint64Value());
    case QRVPlist::Type::Real: return plist_new_real(v.realValue());
    case QRVPlist::Type::String: return plist_new_string(v.stringValue().c_str());
    case QRVPlist::Type::Data: {
      const auto& d = v.dataValue();
      return plist_new_data(reinterpret_cast<const char*>(d.data()), d.size());
    }
    case QRVPlist::Type::Date: return newDateNode(v.realValue());
    case QRVPlist::Type::Array: {
      plist_t a = plist_new_array();
      for (const auto& item : v.arrayValue()) plist_array_append_item(a, toNode(item));
      return a;
    }
    case QRVPlist::Type::Dictionary: {
      plist_t d = plist_new_dict();
      for (const auto& [key, item] : v.dictionaryValue()) plist_dict_set_item(d, key.c_str(), toNode(item));
      return d;
    }
  }
  return plist_new_dict();
}

// Converts libplist's tree. Fails on nesting deeper than kMaxDepth: the XML
// parser accepts any depth, and a deeper value would exhaust the stack here
// and in every later recursive walk of it (comparison, serialisation,
// destruction).
std::optional<QRVPlist> fromNode(plist_t node, int depth = 0) {
  if (depth > QRVPlist::kMaxDepth) return std::nullopt;
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      uint8_t b = 0;
      plist_get_bool_val(node, &b);
      return QRVPlist::boolean(b != 0);
    }
    case PLIST_UINT:
    case PLIST_UID: {
      uint64_t u = 0;
      if (plist_get_node_type(node) == PLIST_UID)
        plist_get_uid_val(node, &u);
      else
        plist_get_uint_val(node, &u);
      return QRVPlist::uinteger(u);
    }
    case PLIST_REAL: {
      double d = 0;
      plist_get_real_val(node, &d);
      return QRVPlist::real(d);
    }
    case PLIST_STRING:
    case PLIST_KEY: {
      uint64_t len = 0;
      const char* s = plist_get_string_ptr(node, &len);
      return QRVPlist::string(s ? std::string(s, len) : std::string());
    }
    case PLIST_DATA: {
      uint64_t len = 0;
      const char* p = plist_get_data_ptr(node, &len);
      const auto* b = reinterpret_cast<const uint8_t*>(p);
      return QRVPlist::data(p ? QRVPlist::Bytes(b, b + len) : QRVPlist::Bytes());
    }
    case PLIST_DATE: return QRVPlist::date({dateSeconds(node)});
    case PLIST_ARRAY: {
      QRVPlist::Array a;
      uint32_t n = plist_array_get_size(node);
      a.reserve(n);
      for (uint32_t i = 0; i < n; i++) {
        auto item = fromNode(plist_array_get_item(node, i), depth + 1);
        if (!item) return std::nullopt;
        a.push_back(std::move(*item));
      }
      return QRVPlist::array(std::move(a));
    }
    case PLIST_DICT: {
      QRVPlist::Dictionary d;
      plist_dict_iter it = nullptr;
      plist_dict_new_iter(node, &it);
      std::unique_ptr<void, decltype(&free)> iter(it, &free);
      for (;;) {
        char* rawKey = nullptr;
        plist_t val = nullptr;
        plist_dict_next_item(node, it, &rawKey, &val);
        std::unique_ptr<char, decltype(&free)> key(rawKey, &free);
        if (!val) break;
        auto item = fromNode(val, depth + 1);
        if (!item) return std::nullopt;
        d.insert_or_assign(key ? std::string(key.get()) : std::string(), std::move(*item));
      }
      return QRVPlist::dictionary(std::move(d));
    }
    default: return QRVPlist();
  }
}

// Walks the object graph of a binary property list without recursion and
// refuses documents that libplist would turn into a stack overflow (deep
// nesting, reference cycles) or an explosion of nodes (objects shared by
// many references are expanded at each one), and dictionary keys libplist
// would abort on. Layout: "bplist00", objects, an offset table, and a 32-byte
// trailer.
class BinaryPlistGuard {
 public:
  BinaryPlistGuard(const uint8_t* b, size_t n) : b_(b), n_(n) {}

  bool safe() {
    if (n_ < 8 + 32 || memcmp(b_, "bplist00", 8) != 0) return false;
    const uint8_t* t = b_ + n_ - 32;
    offsetSize_ = t[6];
    refSize_ = t[7];
    uint64_t numObjects = be(t + 8, 8), top = be(t + 16, 8), table = be(t + 24, 8);
    if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8) return false;
    if (numObjects == 0 || top >= numObjects || table < 8 || table >= n_ - 32) return false;
    if (numObjects > (n_ - 32 - table) / offsetSize_) return false;
    numObjects_ = numObjects;
    table_ = table;
    keyChecked_.assign(numObjects_, false);

    struct Item { uint64_t object; int depth; };
    std::vector<Item> stack{{top, 0}};
    uint64_t visited = 0;
    while (!stack.empty()) {
      Item item = stack.back();
      stack.pop_back();
      if (++visited > QRVPlist::kMaxNodes || item.depth > QRVPlist::kMaxDepth) return false;
      uint64_t off = 0, count = 0, pos = 0;
      if (!objectOffset(item.object, off)) return false;
      uint8_t kind = b_[off] >> 4;
      if (kind != 0xA && kind != 0xC && kind != 0xD) continue;  // leaves are libplist's to check
      if (!readCount(off, count, pos)) return false;
      // A dictionary lists its keys' references, then its values'.
      uint64_t perEntry = kind == 0xD ? 2 : 1;
      if (count > (table_ - pos) / refSize_ / perEntry) return false;
      for (uint64_t i = 0; i < count * perEntry; i++) {
        uint64_t child = be(b_ + pos + i * refSize_, refSize_);
        if (child >= numObjects_) return false;
        if (kind == 0xD && i < count && !keyIsReadable(child)) return false;
        stack.push_back({child, item.depth + 1});
      }
      if (stack.size() > QRVPlist::kMaxNodes) return false;
    }
    return true;
  }

 private:
  static uint64_t be(const uint8_t* p, unsigned width) {
    uint64_t v = 0;
    for (unsigned i = 0; i < width; i++) v = (v << 8) | p[i];
    return v;
  }

  bool objectOffset(uint64_t object, uint64_t& off) const {
    off = be(b_ + table_ + object * offsetSize_, offsetSize_);
    return off >= 8 && off < table_;
  }

  // The element count of the object at `off` (its marker's low nibble, or
  // the integer object that follows when that is 0xF) and where its contents
  // start.
  bool readCount(uint64_t off, uint64_t& count, uint64_t& pos) const {
    count = b_[off] & 0xF;
    pos = off + 1;
    if (count != 0xF) return true;
    if (pos >= table_ || (b_[pos] >> 4) != 0x1) return false;
    unsigned width = 1u << (b_[pos] & 0xF);
    if (width > 8 || pos + 1 + width > table_) return false;
    count = be(b_ + pos + 1, width);
    pos += 1 + width;
    return true;
  }

  // libplist aborts the process when it hands out a dictionary key holding a
  // NUL character (its key accessor asserts the length matches strlen), so
  // such keys are refused here. Each key object is checked once, however
  // often it is referenced. Keys that are not strings are libplist's to
  // refuse.
  bool keyIsReadable(uint64_t object) {
    if (keyChecked_[object]) return true;
    uint64_t off = 0, count = 0, pos = 0;
    if (!objectOffset(object, off)) return false;
    uint8_t kind = b_[off] >> 4;
    if (kind == 0x5 || kind == 0x6) {
      if (!readCount(off, count, pos)) return false;
      uint64_t unit = kind == 0x6 ? 2 : 1;  // ASCII bytes or UTF-16 code units
      if (count > (table_ - pos) / unit) return false;
      for (uint64_t i = 0; i < count; i++) {
        const uint8_t* c = b_ + pos + i * unit;
        if (c[0] == 0 && (unit == 1 || c[1] == 0)) return false;
      }
    }
    keyChecked_[object] = true;
    return true;
  }

  const uint8_t* b_;
  size_t n_;
  unsigned offsetSize_ = 0, refSize_ = 0;
  uint64_t numObjects_ = 0, table_ = 0;
  std::vector<bool> keyChecked_;
};

// libplist parses XML nested to any depth but frees its tree recursively, so
// a document nested a few hundred thousand deep overflows the stack before
// fromNode() could refuse it. This scan counts <array> and <dict> openings
// against their closings; whatever it misreads (markup inside a comment)
// can at worst refuse a document.
bool xmlNestingWithin(std::string_view xml, int maxDepth) {
  int depth = 0;
  for (size_t i = xml.find('<'); i != std::string_view::npos; i = xml.find('<', i + 1)) {
    std::string_view tag = xml.substr(i + 1);
    bool closing = !tag.empty() && tag[0] == '/';
    if (closing) tag.remove_prefix(1);
    size_t nameLength = tag.starts_with("array") ? 5 : tag.starts_with("dict") ? 4 : 0;
    if (nameLength == 0 || tag.size() == nameLength) continue;
    char next = tag[nameLength];
    if (next != '>' && next != '/' && next != ' ' && next != '\t' && next != '\n' && next != '\r')
      continue;
    if (closing) {
      depth--;
      continue;
    }
    size_t end = tag.find('>');
    if (end != std::string_view::npos && tag[end - 1] == '/') continue;  // <array/>
    if (++depth > maxDepth) return false;
  }
  return true;
}

void describe(const QRVPlist& v, std::string& out) {
  switch (v.type()) {
    case QRVPlist::Type::None: out += "(null)"; break;
    case QRVPlist::Type::Boolean: out += v.boolValue() ? "1" : "0"; break;
    case QRVPlist::Type::UInteger: out += fmt::format("{}", v.uint64Value()); break;
    case QRVPlist::Type::Real: out += fmt::format("{}", v.realValue()); break;
    case QRVPlist::Type::String: out += fmt::format("\"{}\"", v.stringValue()); break;
    case QRVPlist::Type::Data: {
      out += '<';
      for (uint8_t c : v.dataValue()) out += fmt::format("{:02x}", c);
      out += '>';
      break;
    }
    case QRVPlist::Type::Date: out += fmt::format("date({})", v.realValue()); break;
    case QRVPlist::Type::Array: {
      out += '(';
      bool first = true;
      for (const auto& item : v.arrayValue()) {
        if (!first) out += ", ";
        first = false;
        describe(item, out);
      }
      out += ')';
      break;
    }
    case QRVPlist::Type::Dictionary: {
      out += '{';
      for (const auto& [key, item] : v.dictionaryValue()) {
        out += key;
        out += " = ";
        describe(item, out);
        out += "; ";
      }
      if (out.back() == ' ') out.pop_back();
      out += '}';
      break;
    }
  }
}

}  // namespace

bool QRVPlist::boolValue() const {
  const bool* b = std::get_if<bool>(&value_);
  return b && *b;
}

uint64_t QRVPlist::uint64Value() const {
  const uint64_t* u = std::get_if<uint64_t>(&value_);
  return u ? *u : 0;
}

double QRVPlist::realValue() const {
  if (const double* d = std::get_if<double>(&value_)) return *d;
  if (const Date* t = std::get_if<Date>(&value_)) return t->seconds;
  return 0;
}

const std::string& QRVPlist::stringValue() const {
  const std::string* s = std::get_if<std::string>(&value_);
  return s ? *s : kEmptyString;
}

const QRVPlist::Bytes& QRVPlist::dataValue() const {
  const Bytes* b = std::get_if<Bytes>(&value_);
  return b ? *b : kEmptyBytes;
}

const QRVPlist::Array& QRVPlist::arrayValue() const {
  const Array* a = std::get_if<Array>(&value_);
  return a ? *a : kEmptyArray;
}

const QRVPlist::Dictionary& QRVPlist::dictionaryValue() const {
  const Dictionary* d = std::get_if<Dictionary>(&value_);
  return d ? *d : kEmptyDictionary;
}

bool QRVPlist::truthValue() const {
  switch (type()) {
    case Type::Boolean: return boolValue();
    case Type::UInteger: return uint64Value() != 0;
    case Type::Real: return realValue() != 0;
    default: return false;
  }
}

const QRVPlist* QRVPlist::get(std::string_view key) const {
  const Dictionary* d = std::get_if<Dictionary>(&value_);
  if (!d) return nullptr;
  auto it = d->find(key);
  return it == d->end() ? nullptr : &it->second;
}

bool QRVPlist::boolForKey(std::string_view key) const {
  const QRVPlist* v = get(key);
  return v && v->boolValue();
}

uint64_t QRVPlist::uint64ForKey(std::string_view key) const {
  const QRVPlist* v = get(key);
  return v ? v->uint64Value() : 0;
}

const std::string& QRVPlist::stringForKey(std::string_view key) const {
  const QRVPlist* v = get(key);
  return v ? v->stringValue() : kEmptyString;
}

const QRVPlist::Bytes& QRVPlist::dataForKey(std::string_view key) const {
  const QRVPlist* v = get(key);
  return v ? v->dataValue() : kEmptyBytes;
}

const QRVPlist::Array& QRVPlist::arrayForKey(std::string_view key) const {
  const QRVPlist* v = get(key);
  return v ? v->arrayValue() : kEmptyArray;
}

const QRVPlist::Dictionary& QRVPlist::dictionaryForKey(std::string_view key) const {
  const QRVPlist* v = get(key);
  return v ? v->dictionaryValue() : kEmptyDictionary;
}

QRVPlist::Dictionary& QRVPlist::mutableDictionary() {
  if (!std::holds_alternative<Dictionary>(value_)) value_ = Dictionary();
  return std::get<Dictionary>(value_);
}

QRVPlist::Array& QRVPlist::mutableArray() {
  if (!std::holds_alternative<Array>(value_)) value_ = Array();
  return std::get<Array>(value_);
}

QRVPlist& QRVPlist::set(std::string key, QRVPlist value) {
  mutableDictionary().insert_or_assign(std::move(key), std::move(value));
  return *this;
}

void QRVPlist::remove(std::string_view key) {
  Dictionary& d = mutableDictionary();
  auto it = d.find(key);
  if (it != d.end()) d.erase(it);
}

void QRVPlist::append(QRVPlist value) { mutableArray().push_back(std::move(value)); }

QRVPlist::Bytes QRVPlist::toBinary() const {
  PlistPtr node(toNode(*this));
  char* out = nullptr;
  uint32_t len = 0;
  plist_to_bin(node.get(), &out, &len);
  Bytes bytes(reinterpret_cast<uint8_t*>(out), reinterpret_cast<uint8_t*>(out) + (out ? len : 0));
  plist_to_bin_free(out);
  return bytes;
}

std::string QRVPlist::toXML() const {
  PlistPtr node(toNode(*this));
  char* out = nullptr;
  uint32_t len = 0;
  plist_to_xml(node.get(), &out, &len);
  std::string xml(out ? out : "", out ? len : 0);
  plist_to_xml_free(out);
  return xml;
}

std::optional<QRVPlist> QRVPlist::fromBinary(const uint8_t* bytes, size_t length) {
  if (!bytes || length > std::numeric_limits<uint32_t>::max()) return std::nullopt;
  if (!BinaryPlistGuard(bytes, length).safe()) return std::nullopt;
  plist_t raw = nullptr;
  plist_from_bin(reinterpret_cast<const char*>(bytes), static_cast<uint32_t>(length), &raw);
  if (!raw) return std::nullopt;
  PlistPtr node(raw);
  return fromNode(raw);
}

std::optional<QRVPlist> QRVPlist::fromXML(std::string_view xml) {
  if (xml.empty() || xml.size() > std::numeric_limits<uint32_t>::max()) return std::nullopt;
  // The root container is at depth 0 for fromNode() and 1 for the scan.
  if (!xmlNestingWithin(xml, kMaxDepth + 1)) return std::nullopt;
  plist_t raw = nullptr;
  plist_from_xml(xml.data(), static_cast<uint32_t>(xml.size()), &raw);
  if (!raw) return std::nullopt;
  PlistPtr node(raw);
  return fromNode(raw);
}

std::optional<QRVPlist> QRVPlist::fromBytes(const uint8_t* bytes, size_t length) {
  if (bytes && length >= 8 && memcmp(bytes, "bplist00", 8) == 0) return fromBinary(bytes, length);
  return fromXML(std::string_view(reinterpret_cast<const char*>(bytes), bytes ? length : 0));
}

std::string QRVPlist::description() const {
  std::string out;
  describe(*this, out);
  return out;
}
