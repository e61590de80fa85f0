#include "common/STWDictionaryUtilities.h"

#include "common/STWPropertyList.h"

#include <cstring>

bool STW_writeToURL(const STWValue::Dictionary& dictionary, const std::filesystem::path& url,
                    unsigned options, STWErrorRef* error) {
    std::string bytes = STWPropertyList::serializeBinary(STWValue(dictionary));
    bool durable = options & STWWriteDurable;
    int e = (options & STWWriteAtomic) ? STWWriteFileAtomically(url, bytes, 0644, durable)
                                       : STWWriteFile(url, bytes, 0644, durable);
    if (e) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(e, "Could not write property list to %@", url));
        return false;
    }
    return true;
}

std::optional<STWValue::Dictionary> STW_dictionaryWithContentsOfURL(const std::filesystem::path& url,
                                                                    unsigned options, STWErrorRef* error) {
    std::string bytes;
    if (int e = STWReadFileContents(url, &bytes, options)) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(e, "Could not read property list at %@", url));
        return std::nullopt;
    }
    std::optional<STWValue> root = STWPropertyList::parse(bytes);
    if (!root || !root->isDictionary()) {
        STWSetError(error, STWErrorCreate(STWGenericErrorDomain, STWGenericErrorCorruptFile, __func__,
                                          __LINE__, nullptr, false,
                                          root ? "Property list at %@ is not a dictionary"
                                               : "Property list at %@ is corrupt",
                                          url));
        return std::nullopt;
    }
    return std::move(*root->mutableDictionary());
}

bool containsDotDotPathComponents(std::string_view path) {
    size_t start = 0;
    while (start <= path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string_view::npos)
            end = path.size();
        if (path.substr(start, end - start) == "..")
            return true;
        start = end + 1;
    }
    return false;
}

std::optional<std::string> stringWithFileSystemRepresentation(const char* bytes, size_t length) {
    if (!bytes)
        return std::nullopt;
    const auto* p = reinterpret_cast<const unsigned char*>(bytes);
    size_t i = 0;
    while (i < length) {
        unsigned char c = p[i];
        if (c == 0)
            return std::nullopt;
        size_t extra;
        uint32_t min;
        if (c < 0x80) {
            ++i;
            continue;
        } else if ((c & 0xe0) == 0xc0) {
            extra = 1;
            min = 0x80;
        } else if ((c & 0xf0) == 0xe0) {
            extra = 2;
            min = 0x800;
        } else if ((c & 0xf8) == 0xf0) {
            extra = 3;
            min = 0x10000;
        } else {
            return std::nullopt;
        }
        if (length - i <= extra)
            return std::nullopt;
        uint32_t cp = c & (0x3f >> extra);
        for (size_t k = 1; k <= extra; ++k) {
            if ((p[i + k] & 0xc0) != 0x80)
                return std::nullopt;
            cp = cp << 6 | (p[i + k] & 0x3f);
        }
        if (cp < min || cp > 0x10ffff || (cp >= 0xd800 && cp <= 0xdfff))
            return std::nullopt;
        i += extra + 1;
    }
    return std::string(bytes, length);
}

std::optional<std::string> stringWithFileSystemRepresentation(const char* bytes) {
    return bytes ? stringWithFileSystemRepresentation(bytes, strlen(bytes)) : std::nullopt;
}
