#include "base/QRVResultCode.h"

#include <algorithm>
#include <array>

namespace QRVResultCode {
namespace {

constexpr Entry kEntries[] = {
#define QRV_RESULT_CODE_ENTRY(name, number, text, meaning) {name, #name, text, meaning},
    QRV_RESULT_CODES(QRV_RESULT_CODE_ENTRY)
#undef QRV_RESULT_CODE_ENTRY
};

// An unscoped enumeration accepts two names for one number without a word,
// and the look-up below relies on the order: keeping the list strictly
// increasing rules out both.
constexpr bool strictlyIncreasing() {
  for (size_t i = 1; i < std::size(kEntries); i++)
    if (kEntries[i - 1].code >= kEntries[i].code) return false;
  return true;
}
static_assert(strictlyIncreasing(), "result codes must be listed once each, in increasing order");

}  // namespace

std::span<const Entry> all() { return kEntries; }

const Entry* find(uint64_t code) {
  const Entry* end = std::end(kEntries);
  const Entry* it = std::lower_bound(std::begin(kEntries), end, code,
                                     [](const Entry& entry, uint64_t number) { return entry.code < number; });
  return it != end && it->code == code ? it : nullptr;
}

std::string_view text(uint64_t code) {
  const Entry* entry = find(code);
  return entry ? entry->text : std::string_view();
}

}  // namespace QRVResultCode
