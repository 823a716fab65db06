#include "codesigning/QRVCodeSigningEntry.h"

#include <fmt/format.h>

#include <functional>
#include <utility>

namespace {

constexpr const char* kCodeSigningInfoKey = "CodeSigningInfo";
constexpr const char* kChildBundleIdsKey = "ChildBundleIds";
constexpr const char* kInvalidKey = "Invalid";
constexpr const char* kPlaceholderKey = "Placeholder";
constexpr const char* kAdvanceCopyKey = "AdvanceCopy";
constexpr const char* kRegisteredByCallerKey = "RegisteredByCaller";
constexpr const char* kDataContainerClassKey = "DataContainerClass";

size_t combine(size_t seed, size_t h) {
  return seed ^ (h + 0x9e3779b97f4a7c15ULL + (seed << 6) + (seed >> 2));
}

// A content hash that agrees with QRVPlist's operator==: the type is mixed in
// so that, say, the string "1" and the number 1 differ, and dictionaries are
// ordered maps, so equal dictionaries are visited in the same order.
size_t hashValue(const QRVPlist& v) {
  size_t h = std::hash<int>()(static_cast<int>(v.type()));
  switch (v.type()) {
    case QRVPlist::Type::None:
      return 0;
    case QRVPlist::Type::Boolean:
      return combine(h, std::hash<bool>()(v.boolValue()));
    case QRVPlist::Type::UInteger:
      return combine(h, std::hash<uint64_t>()(v.uint64Value()));
    case QRVPlist::Type::Real:
    case QRVPlist::Type::Date:
      return combine(h, std::hash<double>()(v.realValue()));
    case QRVPlist::Type::String:
      return combine(h, std::hash<std::string>()(v.stringValue()));
    case QRVPlist::Type::Data: {
      const auto& d = v.dataValue();
      std::string_view bytes(reinterpret_cast<const char*>(d.data()), d.size());
      return combine(h, std::hash<std::string_view>()(bytes));
    }
    case QRVPlist::Type::Array:
      for (const auto& item : v.arrayValue()) h = combine(h, hashValue(item));
      return h;
    case QRVPlist::Type::Dictionary:
      for (const auto& [key, item] : v.dictionaryValue()) {
        h = combine(h, std::hash<std::string>()(key));
        h = combine(h, hashValue(item));
      }
      return h;
  }
  return h;
}

QRVPlist childArray(const QRVCodeSigningEntry::ChildIdentifiers& children) {
  QRVPlist::Array a;
  a.reserve(children.size());
  for (const auto& child : children) a.push_back(QRVPlist::string(child));
  return QRVPlist::array(std::move(a));
}

// Flags are shown as the digits 0 and 1 rather than as raw character codes
// 0 and 1, which would put NUL and SOH bytes into log lines.
char flagChar(bool flag) { return flag ? '1' : '0'; }

}  // namespace

QRVCodeSigningEntry::QRVCodeSigningEntry(QRVPlist codeSigningInfo, uint64_t dataContainerClass)
    : dataContainerClass_(dataContainerClass) {
  setCodeSigningInfo(std::move(codeSigningInfo));
}

void QRVCodeSigningEntry::setCodeSigningInfo(QRVPlist codeSigningInfo) {
  // Storing only dictionaries keeps "absent" a single state, so equality and
  // the database never meet a code-signing value of another type.
  if (codeSigningInfo.isDictionary()) {
    codeSigningInfo_ = std::move(codeSigningInfo);
  } else {
    codeSigningInfo_ = QRVPlist();
  }
}

QRVCodeSigningEntry QRVCodeSigningEntry::initWithSerializedDictionary(const QRVPlist& serialized) {
  QRVCodeSigningEntry entry;
  if (const QRVPlist* info = serialized.get(kCodeSigningInfoKey)) entry.setCodeSigningInfo(*info);
  if (const QRVPlist* children = serialized.get(kChildBundleIdsKey);
      children && children->isArray()) {
    ChildIdentifiers ids;
    for (const auto& child : children->arrayValue())
      if (child.isString()) ids.push_back(child.stringValue());
    entry.children_ = std::move(ids);
  }
  entry.invalid_ = serialized.boolForKey(kInvalidKey);
  entry.placeholder_ = serialized.boolForKey(kPlaceholderKey);
  entry.advanceCopy_ = serialized.boolForKey(kAdvanceCopyKey);
  entry.registeredByCaller_ = serialized.boolForKey(kRegisteredByCallerKey);
  entry.dataContainerClass_ = serialized.uint64ForKey(kDataContainerClassKey);
  return entry;
}

QRVPlist QRVCodeSigningEntry::serialize() const {
  QRVPlist d = QRVPlist::dictionary();
  if (hasCodeSigningInfo()) d.set(kCodeSigningInfoKey, codeSigningInfo_);
  if (children_) d.set(kChildBundleIdsKey, childArray(*children_));
  d.set(kInvalidKey, QRVPlist::boolean(invalid_));
  d.set(kPlaceholderKey, QRVPlist::boolean(placeholder_));
  d.set(kAdvanceCopyKey, QRVPlist::boolean(advanceCopy_));
  d.set(kRegisteredByCallerKey, QRVPlist::boolean(registeredByCaller_));
  d.set(kDataContainerClassKey, QRVPlist::uinteger(dataContainerClass_));
  return d;
}

size_t QRVCodeSigningEntry::hash() const {
  size_t h = hashValue(codeSigningInfo_) ^ (children_ ? hashValue(childArray(*children_)) : 0);
  if (invalid_) h += 2;
  if (placeholder_) h += 4;
  if (registeredByCaller_) h += 8;
  if (dataContainerClass_ != 0) h += 16;
  if (advanceCopy_) h += 32;
  return h;
}

std::string QRVCodeSigningEntry::description() const {
  return fmt::format(
      "<QRVCodeSigningEntry invalid: {}, placeholder: {}, advanceCopy: {}, regByCaller: {}, "
      "dataClass: {}, childBundles: {}, CSinfo: {}>",
      flagChar(invalid_), flagChar(placeholder_), flagChar(advanceCopy_),
      flagChar(registeredByCaller_), dataContainerClass_,
      children_ ? childArray(*children_).description() : "(null)", codeSigningInfo_.description());
}
