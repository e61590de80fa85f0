// stowlyctl's typed message arguments: "KEY=TYPE:VALUE" words become message keys.
//
// TYPE is str, u64, i64, bool, real, uuid, data (hex), plist (a property-list file whose
// root is the value), strarr or u64arr (comma-separated). Parsing is strict: a number
// with a sign it may not have, trailing text or out of range is refused, not clipped, so
// that a typo never sends the daemon a different request than the one meant.
#pragma once

#include "common/STWValue.h"

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

// Decimal only, the whole text.
std::optional<uint64_t> STWCTLParseUInt64(std::string_view text);
std::optional<int64_t> STWCTLParseInt64(std::string_view text);

// One value of the given TYPE from its text.
std::optional<STWValue> STWCTLParseTypedValue(std::string_view type, std::string_view text,
                                              std::string* reason);

// "KEY=TYPE:VALUE" to (KEY, value).
std::optional<std::pair<std::string, STWValue>> STWCTLParseTypedArgument(std::string_view argument,
                                                                         std::string* reason);

// {"Command": command} plus one key per argument. A key given twice, or "Command" itself,
// is refused.
std::optional<STWValue::Dictionary>
STWCTLMessageWithArguments(uint64_t command, const std::vector<std::string>& arguments, std::string* reason);
