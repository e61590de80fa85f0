// Small whole-file I/O primitives shared by every layer that reads or writes files.
// They return 0 or an errno value and never throw.
#pragma once

#include <cstddef>
#include <filesystem>
#include <string>
#include <string_view>
#include <sys/types.h>

enum STWReadOptions : unsigned {
    STWReadDefault = 0,
    // Refuse a symbolic link as the last component (files inside containers are the
    // container owner's to replace).
    STWReadNoFollow = 1u << 0,
};

// Files larger than this are refused with EFBIG: property lists the daemon reads are
// small, and a hostile one must not make it allocate without bound.
inline constexpr size_t STWMaxReadFileSize = 64u << 20;

int STWReadFileContents(const std::filesystem::path& path, std::string* contents,
                        unsigned options = STWReadDefault, size_t maxSize = STWMaxReadFileSize);
// The same for a descriptor already open and checked by the caller, whose fstat gave
// `expectedSize`: reads to the end, EFBIG past `maxSize`.
int STWReadDescriptorContents(int fd, size_t expectedSize, std::string* contents,
                              size_t maxSize = STWMaxReadFileSize);
// Writes all of `contents`, across partial writes and EINTR.
int STWWriteAll(int fd, std::string_view contents);

// Writes through a temporary file in the same directory that is fsynced and renamed over
// `path`, so readers see the old or the new contents, never a mix. With `syncDirectory`
// the directory is fsynced too, which makes the rename itself survive a power cut.
int STWWriteFileAtomically(const std::filesystem::path& path, std::string_view contents, mode_t mode,
                           bool syncDirectory);

// Removes what writes through STWWriteFileAtomically left in `directory` when their process
// died between making the temporary file and renaming it: regular files named
// ".NAME.XXXXXX". Only for a directory whose writers are not running (a start sweeping the
// markers of the last run). Answers how many went, or -errno when the directory cannot be
// read; one that does not exist holds none.
int STWRemoveAbandonedAtomicWrites(const std::filesystem::path& directory);

// Writes in place (create or truncate); fsyncs the file when `sync` is set.
int STWWriteFile(const std::filesystem::path& path, std::string_view contents, mode_t mode, bool sync);

int STWSyncDirectory(const std::filesystem::path& directory);
