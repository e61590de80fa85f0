#include "client/stowlyctl/STWCTLArguments.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWFileIO.h"
#include "common/STWFormat.h"
#include "common/STWPropertyList.h"

#include <cctype>
#include <cerrno>
#include <charconv>
#include <cstdlib>
#include <cstring>

namespace {

std::optional<STWValue> refuse(std::string* reason, std::string why) {
    if (reason)
        *reason = std::move(why);
    return std::nullopt;
}

std::vector<std::string_view> splitCommas(std::string_view text) {
    std::vector<std::string_view> parts;
    if (text.empty())
        return parts; // an empty list, not a list of one empty string
    size_t start = 0;
    for (;;) {
        size_t comma = text.find(',', start);
        parts.push_back(text.substr(start, comma == std::string_view::npos ? comma : comma - start));
        if (comma == std::string_view::npos)
            return parts;
        start = comma + 1;
    }
}

std::optional<std::string> utf8(std::string_view text) {
    if (text.empty())
        return std::string();
    return stringWithFileSystemRepresentation(text.data(), text.size());
}

} // namespace

std::optional<uint64_t> STWCTLParseUInt64(std::string_view text) {
    uint64_t value = 0;
    if (text.empty() || text.front() < '0' || text.front() > '9')
        return std::nullopt;
    auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value, 10);
    if (ec != std::errc() || end != text.data() + text.size())
        return std::nullopt;
    return value;
}

std::optional<int64_t> STWCTLParseInt64(std::string_view text) {
    int64_t value = 0;
    std::string_view digits = !text.empty() && text.front() == '-' ? text.substr(1) : text;
    if (digits.empty() || digits.front() < '0' || digits.front() > '9')
        return std::nullopt;
    auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value, 10);
    if (ec != std::errc() || end != text.data() + text.size())
        return std::nullopt;
    return value;
}

std::optional<STWValue> STWCTLParseTypedValue(std::string_view type, std::string_view text,
                                              std::string* reason) {
    std::string quoted = "\"" + std::string(text) + "\"";
    if (type == "str") {
        std::optional<std::string> s = utf8(text);
        if (!s)
            return refuse(reason, "string is not UTF-8");
        return STWValue(std::move(*s));
    }
    if (type == "u64") {
        if (auto v = STWCTLParseUInt64(text))
            return STWValue(*v);
        return refuse(reason, quoted + " is not an unsigned 64-bit integer");
    }
    if (type == "i64") {
        if (auto v = STWCTLParseInt64(text))
            return STWValue(*v);
        return refuse(reason, quoted + " is not a signed 64-bit integer");
    }
    if (type == "bool") {
        if (text == "true" || text == "yes" || text == "1")
            return STWValue(true);
        if (text == "false" || text == "no" || text == "0")
            return STWValue(false);
        return refuse(reason, quoted + " is not a boolean (true, false, yes, no, 1, 0)");
    }
    if (type == "real") {
        // strtod rather than from_chars: it also takes hexadecimal floats, inf and nan.
        std::string copy(text);
        if (copy.empty() || isspace(static_cast<unsigned char>(copy[0])))
            return refuse(reason, quoted + " is not a real number");
        char* end = nullptr;
        errno = 0;
        double v = strtod(copy.c_str(), &end);
        if (*end != '\0' || errno == ERANGE)
            return refuse(reason, quoted + " is not a real number");
        return STWValue(v);
    }
    if (type == "uuid") {
        if (auto u = STWUUID::fromString(text))
            return STWValue(*u);
        return refuse(reason, quoted + " is not a UUID");
    }
    if (type == "data") {
        if (text.size() % 2 != 0)
            return refuse(reason, "hex data of odd length");
        STWData data;
        data.reserve(text.size() / 2);
        for (size_t i = 0; i < text.size(); i += 2) {
            int hi = STWHexDigit(text[i]), lo = STWHexDigit(text[i + 1]);
            if (hi < 0 || lo < 0)
                return refuse(reason, quoted + " is not hexadecimal");
            data.push_back(static_cast<uint8_t>(hi << 4 | lo));
        }
        return STWValue(std::move(data));
    }
    if (type == "plist") {
        std::string contents;
        if (int e = STWReadFileContents(std::string(text), &contents))
            return refuse(reason, "cannot read " + std::string(text) + ": " + strerror(e));
        if (auto v = STWPropertyList::parse(contents))
            return v;
        return refuse(reason, std::string(text) + " is not a property list");
    }
    if (type == "strarr" || type == "u64arr") {
        STWValue::Array array;
        for (std::string_view part : splitCommas(text)) {
            std::optional<STWValue> element =
                STWCTLParseTypedValue(type == "strarr" ? "str" : "u64", part, reason);
            if (!element)
                return std::nullopt;
            array.push_back(std::move(*element));
        }
        return STWValue(std::move(array));
    }
    return refuse(reason, "unknown type \"" + std::string(type) +
                              "\" (str, u64, i64, bool, real, uuid, data, plist, strarr, u64arr)");
}

std::optional<std::pair<std::string, STWValue>> STWCTLParseTypedArgument(std::string_view argument,
                                                                         std::string* reason) {
    size_t equals = argument.find('=');
    size_t colon = equals == std::string_view::npos ? equals : argument.find(':', equals + 1);
    if (equals == 0 || colon == std::string_view::npos) {
        if (reason)
            *reason = "\"" + std::string(argument) + "\" is not KEY=TYPE:VALUE";
        return std::nullopt;
    }
    std::optional<std::string> key = utf8(argument.substr(0, equals));
    if (!key) {
        if (reason)
            *reason = "key is not UTF-8";
        return std::nullopt;
    }
    std::string_view type = argument.substr(equals + 1, colon - equals - 1);
    std::optional<STWValue> value = STWCTLParseTypedValue(type, argument.substr(colon + 1), reason);
    if (!value) {
        if (reason)
            *reason = *key + ": " + *reason;
        return std::nullopt;
    }
    return std::make_pair(std::move(*key), std::move(*value));
}

std::optional<STWValue::Dictionary>
STWCTLMessageWithArguments(uint64_t command, const std::vector<std::string>& arguments, std::string* reason) {
    STWValue::Dictionary message{{"Command", STWValue(command)}};
    for (const std::string& argument : arguments) {
        auto parsed = STWCTLParseTypedArgument(argument, reason);
        if (!parsed)
            return std::nullopt;
        if (!message.emplace(std::move(parsed->first), std::move(parsed->second)).second) {
            if (reason)
                *reason = "key \"" + argument.substr(0, argument.find('=')) + "\" given twice";
            return std::nullopt;
        }
    }
    return message;
}
