#include "common/STWFormat.h"

#include <cinttypes>
#include <cstdio>

int64_t STWFormatArg::signedValue() const {
    switch (_kind) {
    case Kind::Signed:
        return _signed;
    case Kind::Unsigned:
        return static_cast<int64_t>(_unsigned);
    case Kind::Real:
        return static_cast<int64_t>(_real);
    default:
        return 0;
    }
}

uint64_t STWFormatArg::unsignedValue() const {
    switch (_kind) {
    case Kind::Signed:
        return static_cast<uint64_t>(_signed);
    case Kind::Unsigned:
        return _unsigned;
    case Kind::Real:
        return static_cast<uint64_t>(_real);
    case Kind::Pointer:
    case Kind::Object:
        return reinterpret_cast<uintptr_t>(pointer());
    default:
        return 0;
    }
}

std::string STWFormatArg::description() const {
    char buffer[64];
    switch (_kind) {
    case Kind::Signed:
        snprintf(buffer, sizeof buffer, "%" PRId64, _signed);
        return buffer;
    case Kind::Unsigned:
        snprintf(buffer, sizeof buffer, "%" PRIu64, _unsigned);
        return buffer;
    case Kind::Real:
        snprintf(buffer, sizeof buffer, "%g", _real);
        return buffer;
    case Kind::Text:
        return std::string(_text);
    case Kind::Object:
        return _describe(_object);
    case Kind::Pointer:
        snprintf(buffer, sizeof buffer, "%p", _pointer);
        return buffer;
    case Kind::Null:
        break;
    }
    return "(null)";
}

namespace {

// Truncates an integer to the width its length modifier names, as printf would.
int64_t truncateSigned(int64_t v, std::string_view length) {
    if (length == "hh")
        return static_cast<signed char>(v);
    if (length == "h")
        return static_cast<short>(v);
    if (length.empty())
        return static_cast<int>(v);
    return v;
}

uint64_t truncateUnsigned(uint64_t v, std::string_view length) {
    if (length == "hh")
        return static_cast<unsigned char>(v);
    if (length == "h")
        return static_cast<unsigned short>(v);
    if (length.empty())
        return static_cast<unsigned>(v);
    return v;
}

void appendPadded(std::string& out, const std::string& text, std::string_view flags, int width) {
    if (width <= 0 || static_cast<size_t>(width) <= text.size()) {
        out += text;
        return;
    }
    std::string pad(static_cast<size_t>(width) - text.size(), ' ');
    if (flags.find('-') != std::string_view::npos)
        out += text + pad;
    else
        out += pad + text;
}

} // namespace

std::string STWFormatv(std::string_view format, std::initializer_list<STWFormatArg> args) {
    std::string out;
    out.reserve(format.size() + 32 * args.size());
    const STWFormatArg* next = args.begin();
    size_t i = 0;
    while (i < format.size()) {
        char c = format[i];
        if (c != '%') {
            size_t end = format.find('%', i);
            if (end == std::string_view::npos)
                end = format.size();
            out.append(format.substr(i, end - i));
            i = end;
            continue;
        }
        size_t start = i++;
        if (i < format.size() && format[i] == '%') {
            out += '%';
            ++i;
            continue;
        }
        if (i < format.size() && format[i] == '{') {
            size_t close = format.find('}', i);
            i = close == std::string_view::npos ? format.size() : close + 1;
        }
        size_t flagsStart = i;
        while (i < format.size() && std::string_view("-+ #0'").find(format[i]) != std::string_view::npos)
            ++i;
        std::string_view flags = format.substr(flagsStart, i - flagsStart);
        int width = 0;
        while (i < format.size() && format[i] >= '0' && format[i] <= '9' && width < 10000)
            width = width * 10 + (format[i++] - '0');
        int precision = -1;
        if (i < format.size() && format[i] == '.') {
            ++i;
            precision = 0;
            while (i < format.size() && format[i] >= '0' && format[i] <= '9' && precision < 10000)
                precision = precision * 10 + (format[i++] - '0');
        }
        size_t lengthStart = i;
        while (i < format.size() && std::string_view("hlzjtqL").find(format[i]) != std::string_view::npos)
            ++i;
        std::string_view length = format.substr(lengthStart, i - lengthStart);
        if (i >= format.size()) {
            out.append(format.substr(start));
            break;
        }
        char conversion = format[i++];
        if (std::string_view("@sdiuxXocpfeEgG").find(conversion) == std::string_view::npos) {
            out.append(format.substr(start, i - start));
            continue;
        }
        if (next == args.end()) {
            out += "(missing)";
            continue;
        }
        const STWFormatArg& arg = *next++;
        using Kind = STWFormatArg::Kind;
        bool numeric = arg.kind() == Kind::Signed || arg.kind() == Kind::Unsigned || arg.kind() == Kind::Real;
        std::string spec = "%" + std::string(flags);
        if (width > 0)
            spec += std::to_string(width);
        if (precision >= 0)
            spec += "." + std::to_string(precision);
        char buffer[128];
        switch (conversion) {
        case '@':
        case 's': {
            std::string text = arg.description();
            if (precision >= 0 && static_cast<size_t>(precision) < text.size())
                text.resize(static_cast<size_t>(precision));
            appendPadded(out, text, flags, width);
            break;
        }
        case 'd':
        case 'i':
            if (!numeric) {
                appendPadded(out, arg.description(), flags, width);
                break;
            }
            snprintf(buffer, sizeof buffer, (spec + PRId64).c_str(),
                     truncateSigned(arg.signedValue(), length));
            out += buffer;
            break;
        case 'u':
        case 'x':
        case 'X':
        case 'o': {
            if (!numeric && arg.kind() != Kind::Pointer) {
                appendPadded(out, arg.description(), flags, width);
                break;
            }
            const char* conv = conversion == 'u'   ? PRIu64
                               : conversion == 'x' ? PRIx64
                               : conversion == 'X' ? PRIX64
                                                   : PRIo64;
            snprintf(buffer, sizeof buffer, (spec + conv).c_str(),
                     truncateUnsigned(arg.unsignedValue(), length));
            out += buffer;
            break;
        }
        case 'c':
            if (numeric)
                out += static_cast<char>(arg.unsignedValue());
            else
                out += arg.description();
            break;
        case 'p':
            snprintf(buffer, sizeof buffer, "%p", arg.pointer());
            out += buffer;
            break;
        default: // f e E g G
            if (!numeric) {
                appendPadded(out, arg.description(), flags, width);
                break;
            }
            snprintf(buffer, sizeof buffer, (spec + conversion).c_str(),
                     arg.kind() == Kind::Real     ? arg.realValue()
                     : arg.kind() == Kind::Signed ? static_cast<double>(arg.signedValue())
                                                  : static_cast<double>(arg.unsignedValue()));
            out += buffer;
            break;
        }
    }
    return out;
}

std::string STWHexString(const unsigned char* bytes, size_t length) {
    static const char* digits = "0123456789abcdef";
    std::string text;
    text.reserve(length * 2);
    for (size_t i = 0; i < length; i++) {
        text += digits[bytes[i] >> 4];
        text += digits[bytes[i] & 15];
    }
    return text;
}
