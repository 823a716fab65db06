// Request values written as command-line words, for quorvactl and for
// scripts: "KEY=VALUE" with the type guessed from the value, or
// "KEY:TYPE=VALUE" with the type spelled out.
//
//   KEY=123              unsigned integer (decimal digits only)
//   KEY=true, KEY=false  boolean
//   KEY=anything else    string (also "KEY=" for the empty string)
//   KEY:uint=N           unsigned integer, decimal or 0x-prefixed hex
//   KEY:bool=B           boolean: true/false, yes/no, 1/0
//   KEY:str=S            string, taken literally (use it for "123" or "true")
//   KEY:data=HEX         bytes from an even number of hex digits
//   KEY:uuid=UUID        16 bytes from the 8-4-4-4-12 form
//   KEY:strs=a,b,c       array of strings ("KEY:strs=" is the empty array)
//   KEY:uints=1,2        array of unsigned integers
//   KEY:plist=@FILE      any value read from an XML or binary property list file
//   KEY:plist=<xml...>   any value from inline XML property-list text
//
// Only the first '=' separates key from value, so values may contain '='.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "base/QRVPlist.h"

namespace QRVRequestArguments {

// One parsed word. On failure returns nothing and stores a message naming
// the word in `error` (may be null).
std::optional<std::pair<std::string, QRVPlist>> parseArgument(std::string_view word,
                                                              std::string* error);

// A request dictionary holding "Command" = `command` and every word's
// key and value. A key given twice (including "Command") is an error.
std::optional<QRVPlist> buildRequest(uint64_t command, const std::vector<std::string>& words,
                                     std::string* error);

// The value of a "uint" word: decimal, or hex after "0x". Nothing for
// anything else, including values over 2^64-1.
std::optional<uint64_t> parseUnsigned(std::string_view text);

}  // namespace QRVRequestArguments
