// Reading and writing property-list dictionaries as files, and the string helpers that
// go with paths.
#pragma once

#include "common/STWError.h"
#include "common/STWFileIO.h"
#include "common/STWValue.h"

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

enum STWWriteOptions : unsigned {
    STWWriteDefault = 0,
    // Write a temporary file, fsync it and rename it over the target.
    STWWriteAtomic = 1u << 0,
    // Also fsync the directory after the rename (or the file, without STWWriteAtomic),
    // for files whose acknowledged contents must survive a power cut.
    STWWriteDurable = 1u << 1,
    // The file itself carries no data-protection class. Files get none unless asked;
    // the option records the intent at the call site.
    STWWriteNoFileProtection = 1u << 2,
};

// Serialises `dictionary` as a binary property list and writes it to `url` (mode 0644).
// On failure returns false with a POSIX-domain error carrying the errno.
bool STW_writeToURL(const STWValue::Dictionary& dictionary, const std::filesystem::path& url,
                    unsigned options, STWErrorRef* error);

// Reads a property list whose root must be a dictionary. A file that is not a property
// list, or whose root is something else, fails with STWGenericErrorDomain code 2048; a
// file that cannot be read fails with its errno in the POSIX domain. `options` are
// STWReadOptions.
std::optional<STWValue::Dictionary> STW_dictionaryWithContentsOfURL(const std::filesystem::path& url,
                                                                    unsigned options, STWErrorRef* error);

// True when a path component of `path` is exactly "..".
bool containsDotDotPathComponents(std::string_view path);

// A string from file-system bytes (UTF-8); nullopt when the bytes are not valid UTF-8 or
// contain a NUL.
std::optional<std::string> stringWithFileSystemRepresentation(const char* bytes, size_t length);
std::optional<std::string> stringWithFileSystemRepresentation(const char* bytes);
