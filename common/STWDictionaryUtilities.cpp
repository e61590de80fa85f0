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
    if (!bytes || memchr(bytes, 0, length) || !STWIsValidUTF8(std::string_view(bytes, length)))
        return std::nullopt;
    return std::string(bytes, length);
}

std::optional<std::string> stringWithFileSystemRepresentation(const char* bytes) {
    return bytes ? stringWithFileSystemRepresentation(bytes, strlen(bytes)) : std::nullopt;
}
