// Renderings of a reply for people and for programs.
//
// Human form: one "Key = value" line per key, in key order. "ReplyError"
// gets its meaning in parentheses ("ReplyError = 1 (success)"); strings
// print bare at the top level and quoted inside arrays and dictionaries;
// 16-byte data under a key containing "UUID" prints as a UUID, other data as
// hex in angle brackets.
//
// JSON form: one object. Integers are numbers, data is a lower-case hex
// string, dates are ISO 8601 UTC strings, and strings are escaped so that
// the output is valid UTF-8 JSON even when the daemon's strings are not
// valid UTF-8 (such bytes become U+FFFD).
#pragma once

#include <string>
#include <string_view>

#include "base/QRVPlist.h"

namespace QRVReplyFormat {

std::string human(const QRVPlist& reply);

// `indent` 0 renders on one line; otherwise nested values are indented by
// that many spaces per level. Ends without a newline.
std::string json(const QRVPlist& value, int indent = 2);

// `text` as a JSON string literal, quotes included.
std::string jsonString(std::string_view text);

}  // namespace QRVReplyFormat
