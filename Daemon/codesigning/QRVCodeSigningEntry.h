// The code-signing record of one identifier: the code-signing dictionary the
// installer handed over (the entitlements live inside it) and the facts the
// daemon keeps beside it.
//
// A plain value. It is built and adjusted as a value, then shared as
// std::shared_ptr<const QRVCodeSigningEntry>, which is how the database hands
// entries out; a shared entry is never changed.
//
// "Absent" matters: an entry without a code-signing dictionary is how the
// mapping says "remove this identifier", and an absent child list is not the
// same value as an empty one.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "base/QRVPlist.h"

class QRVCodeSigningEntry {
 public:
  using ChildIdentifiers = std::vector<std::string>;

  // No dictionary, no children, every flag false, data container class 0.
  QRVCodeSigningEntry() = default;
  // All flags false and no children. `codeSigningInfo` should be a
  // dictionary; any other value (none included) is kept as "absent".
  explicit QRVCodeSigningEntry(QRVPlist codeSigningInfo, uint64_t dataContainerClass = 0);

  // Reads the form written by serialize(). Lenient, as that form comes from
  // a legacy file on disk: a missing or mistyped flag reads as false, a
  // missing class as 0, a "CodeSigningInfo" that is not a dictionary or a
  // "ChildBundleIds" that is not an array as absent, and non-string child
  // identifiers are skipped.
  static QRVCodeSigningEntry initWithSerializedDictionary(const QRVPlist& serialized);

  // {"CodeSigningInfo", "ChildBundleIds", "Invalid", "Placeholder",
  //  "AdvanceCopy", "RegisteredByCaller", "DataContainerClass"}; an absent
  // dictionary or child list leaves its key out.
  QRVPlist serialize() const;

  // None when absent, otherwise a dictionary.
  const QRVPlist& codeSigningInfo() const { return codeSigningInfo_; }
  bool hasCodeSigningInfo() const { return codeSigningInfo_.isDictionary(); }
  const std::optional<ChildIdentifiers>& childBundleIdentifiers() const { return children_; }
  bool isInvalid() const { return invalid_; }
  bool isPlaceholder() const { return placeholder_; }
  bool isAdvanceCopy() const { return advanceCopy_; }
  bool isRegisteredByCaller() const { return registeredByCaller_; }
  uint64_t dataContainerClass() const { return dataContainerClass_; }

  void setCodeSigningInfo(QRVPlist codeSigningInfo);
  void setChildBundleIdentifiers(std::optional<ChildIdentifiers> children) {
    children_ = std::move(children);
  }
  void setInvalid(bool v) { invalid_ = v; }
  void setPlaceholder(bool v) { placeholder_ = v; }
  void setAdvanceCopy(bool v) { advanceCopy_ = v; }
  void setRegisteredByCaller(bool v) { registeredByCaller_ = v; }
  void setDataContainerClass(uint64_t v) { dataContainerClass_ = v; }

  // All seven properties, the dictionary and the child list by content.
  bool operator==(const QRVCodeSigningEntry& other) const = default;

  // hash(dictionary) ^ hash(children), plus 2 if invalid, 4 if placeholder,
  // 8 if registered by caller, 16 if the class is non-zero and 32 if advance
  // copy. Equal entries hash equally.
  size_t hash() const;

  // "<QRVCodeSigningEntry invalid: 0, placeholder: 1, advanceCopy: 0,
  //  regByCaller: 0, dataClass: 2, childBundles: ("a"), CSinfo: {...}>";
  // an absent dictionary or child list reads "(null)".
  std::string description() const;

 private:
  QRVPlist codeSigningInfo_;
  std::optional<ChildIdentifiers> children_;
  bool invalid_ = false;
  bool placeholder_ = false;
  bool advanceCopy_ = false;
  bool registeredByCaller_ = false;
  uint64_t dataContainerClass_ = 0;
};

template <>
struct std::hash<QRVCodeSigningEntry> {
  size_t operator()(const QRVCodeSigningEntry& e) const noexcept { return e.hash(); }
};
