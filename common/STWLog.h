// The daemon's logging facade.
//
// Every line goes to the system log (journald when the service manager connected us to
// it, standard error otherwise) and, once the daemon has opened it, to the rotating file
// "stowlyd.log". Each line carries its level, its category and the name of the function
// that logged it. Messages are formatted with STWFormat, so "%@" prints descriptions.
#pragma once

#include "common/STWFormat.h"

#include <filesystem>
#include <string>
#include <string_view>

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
    static void write(STWLogLevel level, STWLogCategory category, std::string_view function,
                      std::string_view message);
    static void flush();

    // Logs a fault, flushes, prints the message to standard error and aborts: for broken
    // invariants and for start-up failures after which the daemon must not serve.
    [[noreturn]] static void fatal(std::string_view function, std::string_view message);
};

#define STW_LOG_FN(function, level, category, ...)                                                           \
    do {                                                                                                     \
        if (STWLog::isEnabled(level))                                                                        \
            STWLog::write(level, category, function, STWFormat(__VA_ARGS__));                                \
    } while (0)

#define STW_LOG(level, category, ...) STW_LOG_FN(__func__, level, category, __VA_ARGS__)
#define STW_LOG_FAULT(category, ...) STW_LOG(STWLogLevel::Fault, category, __VA_ARGS__)
#define STW_LOG_ERROR(category, ...) STW_LOG(STWLogLevel::Error, category, __VA_ARGS__)
#define STW_LOG_DEFAULT(category, ...) STW_LOG(STWLogLevel::Default, category, __VA_ARGS__)
#define STW_LOG_NOTICE(category, ...) STW_LOG(STWLogLevel::Notice, category, __VA_ARGS__)
#define STW_LOG_INFO(category, ...) STW_LOG(STWLogLevel::Info, category, __VA_ARGS__)
#define STW_LOG_DEBUG(category, ...) STW_LOG(STWLogLevel::Debug, category, __VA_ARGS__)
#define STW_FATAL(...) STWLog::fatal(__func__, STWFormat(__VA_ARGS__))
