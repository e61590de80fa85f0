#include "client/stowlyctl/STWCTLOutput.h"

#include "common/STWError.h"

#include <charconv>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <ctime>

namespace {

void appendJSONString(std::string& out, const std::string& s) {
    out += '"';
    for (char c : s) {
        switch (c) {
        case '"':
            out += "\\\"";
            break;
        case '\\':
            out += "\\\\";
            break;
        case '\n':
            out += "\\n";
            break;
        case '\r':
            out += "\\r";
            break;
        case '\t':
            out += "\\t";
            break;
        default:
            if (static_cast<unsigned char>(c) < 0x20) {
                char escape[8];
                snprintf(escape, sizeof escape, "\\u%04x", static_cast<unsigned char>(c));
                out += escape;
            } else {
                out += c;
            }
        }
    }
    out += '"';
}

std::string rfc3339(const STWDate& date) {
    time_t t = static_cast<time_t>(date.seconds);
    tm parts;
    char buffer[64];
    if (!gmtime_r(&t, &parts) || parts.tm_year + 1900 < 0 || parts.tm_year + 1900 > 9999 ||
        !strftime(buffer, sizeof buffer, "%Y-%m-%dT%H:%M:%S", &parts))
        return date.description(); // outside what RFC 3339 can say
    std::string text = buffer;
    if (date.nanoseconds) {
        snprintf(buffer, sizeof buffer, ".%09" PRIu32, date.nanoseconds % 1000000000);
        text += buffer;
        while (text.back() == '0')
            text.pop_back();
    }
    return text + "Z";
}

void appendJSON(std::string& out, const STWValue& value) {
    switch (value.type()) {
    case STWValue::Type::Null:
        out += "null";
        return;
    case STWValue::Type::Bool:
        out += *value.boolValue() ? "true" : "false";
        return;
    case STWValue::Type::Integer:
    case STWValue::Type::String:
        // Their descriptions are already JSON, apart from the escapes of strings.
        if (const std::string* s = value.string())
            appendJSONString(out, *s);
        else
            out += value.description();
        return;
    case STWValue::Type::Real: {
        double d = *value.realValue();
        if (!std::isfinite(d)) {
            out += "null";
            return;
        }
        char buffer[64];
        auto result = std::to_chars(buffer, buffer + sizeof buffer, d);
        out.append(buffer, result.ptr);
        return;
    }
    case STWValue::Type::Data:
        out += '"' + STWCTLBase64(*value.data()) + '"';
        return;
    case STWValue::Type::Date:
        appendJSONString(out, rfc3339(*value.date()));
        return;
    case STWValue::Type::UUID:
        out += '"' + value.uuid()->string() + '"';
        return;
    case STWValue::Type::Array: {
        out += '[';
        bool first = true;
        for (const STWValue& element : *value.array()) {
            if (!first)
                out += ',';
            appendJSON(out, element);
            first = false;
        }
        out += ']';
        return;
    }
    case STWValue::Type::Dictionary: {
        out += '{';
        bool first = true;
        for (const auto& [key, element] : *value.dictionary()) {
            if (!first)
                out += ',';
            appendJSONString(out, key);
            out += ':';
            appendJSON(out, element);
            first = false;
        }
        out += '}';
        return;
    }
    }
}

} // namespace

std::string STWCTLBase64(const STWData& data) {
    static const char alphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    std::string out;
    out.reserve((data.size() + 2) / 3 * 4);
    size_t i = 0;
    for (; i + 3 <= data.size(); i += 3) {
        uint32_t n = uint32_t(data[i]) << 16 | uint32_t(data[i + 1]) << 8 | data[i + 2];
        out += alphabet[n >> 18];
        out += alphabet[n >> 12 & 63];
        out += alphabet[n >> 6 & 63];
        out += alphabet[n & 63];
    }
    if (size_t left = data.size() - i) {
        uint32_t n = uint32_t(data[i]) << 16 | (left == 2 ? uint32_t(data[i + 1]) << 8 : 0);
        out += alphabet[n >> 18];
        out += alphabet[n >> 12 & 63];
        out += left == 2 ? alphabet[n >> 6 & 63] : '=';
        out += '=';
    }
    return out;
}

std::string STWCTLJSONValue(const STWValue& value) {
    std::string out;
    appendJSON(out, value);
    return out;
}

std::string STWCTLReplyJSON(const STWValue::Dictionary& reply) {
    std::string out;
    appendJSON(out, STWValue(reply));
    return out;
}

std::string STWCTLErrorCodeText(uint64_t code) {
    const char* name = STWErrorCodeName(code);
    if (!name)
        return std::to_string(code) + " (a code this stowlyctl does not know)";
    return std::to_string(code) + " " + name + ": " + STWErrorCodeMeaning(code);
}

std::string STWCTLReplyText(const STWValue::Dictionary& reply) {
    std::string out;
    if (const STWValue* replyError = STWDictionaryFind(reply, "ReplyError")) {
        out += "ReplyError: " + replyError->description();
        if (auto code = replyError->uint64Value(); code && STWErrorCodeName(*code))
            out += std::string(" (") + STWErrorCodeName(*code) + ")";
        out += '\n';
    }
    for (const auto& [key, value] : reply) {
        if (key != "ReplyError")
            out += key + ": " + value.description() + '\n';
    }
    return out;
}
