// Property-list encoding of STWValue through libplist.
//
// Reading accepts XML and binary property lists; the daemon writes binary ones. A UUID
// has no property-list type and is written as its upper-case string. libplist keeps all
// integers as unsigned 64-bit numbers, so an integer read back above INT64_MAX is taken
// as the negative number with the same bits: negative values round-trip, unsigned ones
// of 2^63 and above do not.
#pragma once

#include "common/STWValue.h"

#include <optional>
#include <string>
#include <string_view>

namespace STWPropertyList {

// Parses XML or binary property-list bytes; nullopt when they are not a property list.
// Binary property lists of the common kinds are read directly; everything else goes
// through libplist, whose answer is the reference, except binary ones with a malformed
// trailer or a string that holds a NUL, which could abort libplist and are refused. A
// string or key that is not UTF-8 or holds a NUL makes the whole list refused: it would
// not survive being written back.
std::optional<STWValue> parse(std::string_view bytes);
// The two routes of parse(), for the tests and the fuzzer that hold them to each other:
// the direct reader of binary property lists (nullopt when it declines the bytes) and
// libplist, the reference whose answer parse() gives.
std::optional<STWValue> _parseBinaryDirectly(std::string_view bytes);
std::optional<STWValue> _parseWithLibplist(std::string_view bytes);
std::string serializeBinary(const STWValue& value);
std::string serializeXML(const STWValue& value);

} // namespace STWPropertyList
