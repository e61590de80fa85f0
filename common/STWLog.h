// The daemon's logging facade.
//
// Every line goes to the system log (journald when the service manager connected us to
// it, standard error otherwise) and, once the daemon has opened it, to the rotating file
// "stowlyd.log". Each line carries its level, its category and the name of the function
// that logged it. Messages are formatted with STWFormat, so "%@" prints descriptions.
//
// A journal entry also carries the source line of the call (CODE_FILE, CODE_LINE) as
// fields, so `journalctl STOWLY_CATEGORY=cache` or `CODE_FUNC=...` finds it. When one of
// the formatted arguments is an error object, the entry is filed under that error instead:
// its code (STOWLY_RESULT_CODE for a daemon code, ERRNO for a system call's) and the
// function and line where the error was made, which is where the failure happened. A call
// may add fields of its own: the line that ends each request carries STOWLY_COMMAND and
// the code of its reply as STOWLY_RESULT_CODE, so `journalctl STOWLY_COMMAND=4
// STOWLY_RESULT_CODE=21` finds the death-row requests that answered 21.
#pragma once

#include "common/STWFormat.h"

#include <cstdint>
#include <filesystem>
#include <span>
#include <string>
#include <string_view>
#include <vector>

enum class STWLogLevel : int {
    Fault = 2,
    Error = 3,
    Default = 4,
    Notice = 5,
    Info = 6,
    Debug = 7,
};

enum class STWLogCategory {
    Unspecified,
    Cache,
    Sandbox,
    Tolvan,
    Locking,
    Database,
    Upcall,
    Lifecycle,
    FS,
    Startup,
    Test,
    Metadata,
    CodeSignMapping,
};

// The logging call: its function, and its file and line where known ("" and 0 otherwise).
struct STWLogSite {
    std::string_view function;
    std::string_view file;
    uint64_t line = 0;
};

class STWLog {
public:
    static constexpr std::string_view subsystem = "com.vorlane.stowly";

    static const char* levelName(STWLogLevel level);
    static const char* categoryName(STWLogCategory category);

    // Opens the rotating log file. The file admits calls at `level` or more urgent
    // (a smaller number). Nothing is written to it until enableFileWriting().
    // On failure the system log gets "Failed to set up rotating logs at path %s".
    static bool openLogFile(const std::filesystem::path& path, std::string_view name, STWLogLevel level);
    // Starts writing the file. The file rotates when it reaches `sizeParameter` bytes;
    // `diskLevel` old files are kept beside it.
    static void enableFileWriting(int diskLevel, size_t sizeParameter);
    static void closeLogFile();
    static bool fileIsOpen();

    // The most verbose level the system log takes (default Notice, or STOWLY_LOG_LEVEL:
    // fault, error, default, notice, info or debug).
    static void setSystemLogLevel(STWLogLevel level);

    // True when some destination takes this level; callers skip formatting otherwise.
    static bool isEnabled(STWLogLevel level);
    // `error`, when given, is the error the line reports (see the top of this file);
    // `fields` are further fields of its journal entry, each "NAME=value".
    static void write(STWLogLevel level, STWLogCategory category, const STWLogSite& site,
                      std::string_view message, const STWError* error = nullptr,
                      std::span<const std::string> fields = {});
    // Formats the message and writes it under the first error among `args`.
    static void writev(STWLogLevel level, STWLogCategory category, const STWLogSite& site,
                       std::string_view format, std::initializer_list<STWFormatArg> args);
    // The fields of the journal entry write() sends, each "NAME=value".
    static std::vector<std::string> journalFields(STWLogLevel level, STWLogCategory category,
                                                  const STWLogSite& site, std::string_view message,
                                                  const STWError* error, std::span<const std::string> fields = {});
    static void flush();

    // Logs a fault, flushes, prints the message to standard error and aborts: for broken
    // invariants and for start-up failures after which the daemon must not serve.
    [[noreturn]] static void fatal(std::string_view function, std::string_view message);
};

template <class... Args>
void STWLogFormatted(STWLogLevel level, STWLogCategory category, const STWLogSite& site,
                     std::string_view format, const Args&... args) {
    STWLog::writev(level, category, site, format, {STWFormatArg(args)...});
}

// The level is checked before any argument is formatted or even converted.
#define STW_LOG_FN(function, level, category, ...)                                                           \
    do {                                                                                                     \
        if (STWLog::isEnabled(level))                                                                        \
            STWLogFormatted(level, category, STWLogSite{function, __FILE__, __LINE__}, __VA_ARGS__);         \
    } while (0)

#define STW_LOG(level, category, ...) STW_LOG_FN(__func__, level, category, __VA_ARGS__)
#define STW_LOG_FAULT(category, ...) STW_LOG(STWLogLevel::Fault, category, __VA_ARGS__)
#define STW_LOG_ERROR(category, ...) STW_LOG(STWLogLevel::Error, category, __VA_ARGS__)
#define STW_LOG_DEFAULT(category, ...) STW_LOG(STWLogLevel::Default, category, __VA_ARGS__)
#define STW_LOG_NOTICE(category, ...) STW_LOG(STWLogLevel::Notice, category, __VA_ARGS__)
#define STW_LOG_INFO(category, ...) STW_LOG(STWLogLevel::Info, category, __VA_ARGS__)
#define STW_LOG_DEBUG(category, ...) STW_LOG(STWLogLevel::Debug, category, __VA_ARGS__)
#define STW_FATAL(...) STWLog::fatal(__func__, STWFormat(__VA_ARGS__))
