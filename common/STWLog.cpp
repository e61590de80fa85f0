#include "common/STWLog.h"

#include "common/STWError.h"

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <strings.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <syslog.h>

#include <spdlog/sinks/rotating_file_sink.h>
#include <spdlog/spdlog.h>
#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>

namespace {

struct FileLog {
    std::mutex mutex;
    std::filesystem::path path;
    std::string name;
    std::shared_ptr<spdlog::logger> logger; // set once writing is enabled
};

FileLog& fileLog() {
    static FileLog* log = new FileLog; // outlives static destructors of other objects
    return *log;
}

std::atomic<int> fileLevel{0}; // 0: no file, else the most verbose level the file takes
std::atomic<bool> fileOpen{false};

STWLogLevel levelFromEnvironment() {
    const char* env = getenv("STOWLY_LOG_LEVEL");
    // Like the platform's own system log, info and debug lines are kept only when asked for:
    // at info level every request would format and write the caller's whole description.
    if (!env)
        return STWLogLevel::Notice;
    static const std::pair<const char*, STWLogLevel> names[] = {
        {"fault", STWLogLevel::Fault},   {"error", STWLogLevel::Error}, {"default", STWLogLevel::Default},
        {"notice", STWLogLevel::Notice}, {"info", STWLogLevel::Info},   {"debug", STWLogLevel::Debug},
    };
    for (const auto& [name, level] : names)
        if (strcasecmp(env, name) == 0)
            return level;
    return STWLogLevel::Notice;
}

std::atomic<int> systemLevel{static_cast<int>(levelFromEnvironment())};

// journald when our standard error is the journal stream the service manager gave us.
bool useJournal() {
    static const bool journal = [] {
        const char* stream = getenv("JOURNAL_STREAM");
        struct stat st;
        if (!stream || fstat(STDERR_FILENO, &st) != 0)
            return false;
        unsigned long long dev = 0, ino = 0;
        return sscanf(stream, "%llu:%llu", &dev, &ino) == 2 && dev == st.st_dev && ino == st.st_ino;
    }();
    return journal;
}

// A source file as the tree names it ("common/STWLog.cpp"): __FILE__ is whatever path the
// build handed the compiler, absolute under CMake, and says where it was built, not what.
std::string_view sourcePath(std::string_view file) {
    static const std::string_view root = [] {
        std::string_view self = __FILE__, tail = "common/STWLog.cpp";
        return self.ends_with(tail) ? self.substr(0, self.size() - tail.size()) : std::string_view();
    }();
    return !root.empty() && file.starts_with(root) ? file.substr(root.size()) : file;
}

int syslogPriority(STWLogLevel level) {
    switch (level) {
    case STWLogLevel::Fault:
        return LOG_CRIT;
    case STWLogLevel::Error:
        return LOG_ERR;
    case STWLogLevel::Default:
    case STWLogLevel::Notice:
        return LOG_NOTICE;
    case STWLogLevel::Info:
        return LOG_INFO;
    case STWLogLevel::Debug:
        break;
    }
    return LOG_DEBUG;
}

void writeSystemLog(STWLogLevel level, STWLogCategory category, const STWLogSite& site,
                    std::string_view message, const STWError* error, std::span<const std::string> more = {}) {
    if (useJournal()) {
        std::vector<std::string> fields = STWLog::journalFields(level, category, site, message, error, more);
        std::vector<iovec> vector;
        vector.reserve(fields.size());
        for (std::string& field : fields)
            vector.push_back({field.data(), field.size()});
        sd_journal_sendv(vector.data(), static_cast<int>(vector.size()));
        return;
    }
    std::string line = "stowlyd <" + std::string(STWLog::levelName(level)) + "> [" +
                       STWLog::categoryName(category) + "] " + std::string(site.function) + ": " +
                       std::string(message) + "\n";
    fwrite(line.data(), 1, line.size(), stderr);
}

} // namespace

const char* STWLog::levelName(STWLogLevel level) {
    switch (level) {
    case STWLogLevel::Fault:
        return "Fault";
    case STWLogLevel::Error:
        return "Error";
    case STWLogLevel::Default:
        return "Default";
    case STWLogLevel::Notice:
        return "Notice";
    case STWLogLevel::Info:
        return "Info";
    case STWLogLevel::Debug:
        break;
    }
    return "Debug";
}

const char* STWLog::categoryName(STWLogCategory category) {
    switch (category) {
    case STWLogCategory::Unspecified:
        return "unspecified";
    case STWLogCategory::Cache:
        return "cache";
    case STWLogCategory::Sandbox:
        return "sandbox";
    case STWLogCategory::Tolvan:
        return "tolvan";
    case STWLogCategory::Locking:
        return "locking";
    case STWLogCategory::Database:
        return "database";
    case STWLogCategory::Upcall:
        return "upcall";
    case STWLogCategory::Lifecycle:
        return "lifecycle";
    case STWLogCategory::FS:
        return "fs";
    case STWLogCategory::Startup:
        return "startup";
    case STWLogCategory::Test:
        return "test";
    case STWLogCategory::Metadata:
        return "metadata";
    case STWLogCategory::CodeSignMapping:
        break;
    }
    return "codesignmapping";
}

bool STWLog::openLogFile(const std::filesystem::path& path, std::string_view name, STWLogLevel level) {
    FileLog& log = fileLog();
    std::lock_guard guard(log.mutex);
    // Probe that the file can be created before promising anything.
    FILE* probe = fopen(path.c_str(), "a");
    if (!probe) {
        writeSystemLog(STWLogLevel::Error, STWLogCategory::Unspecified, {"openLogFile", "", 0},
                       STWFormat("Failed to set up rotating logs at path %s", path.c_str()), nullptr);
        return false;
    }
    fclose(probe);
    log.path = path;
    log.name = name;
    log.logger.reset();
    fileLevel = static_cast<int>(level);
    fileOpen = true;
    return true;
}

void STWLog::enableFileWriting(int diskLevel, size_t sizeParameter) {
    FileLog& log = fileLog();
    std::lock_guard guard(log.mutex);
    if (!fileOpen)
        return;
    try {
        auto sink = std::make_shared<spdlog::sinks::rotating_file_sink_mt>(
            log.path.string(), sizeParameter, static_cast<size_t>(diskLevel > 0 ? diskLevel : 1));
        auto logger = std::make_shared<spdlog::logger>(log.name, sink);
        logger->set_pattern("%Y-%m-%d %H:%M:%S.%f [%t] %v");
        logger->set_level(spdlog::level::trace);
        logger->flush_on(spdlog::level::err);
        std::atomic_store(&log.logger, logger);
    } catch (const spdlog::spdlog_ex& e) {
        writeSystemLog(STWLogLevel::Error, STWLogCategory::Unspecified, {"enableFileWriting", "", 0},
                       STWFormat("Failed to set up rotating logs at path %s", log.path.c_str()), nullptr);
    }
}

void STWLog::closeLogFile() {
    FileLog& log = fileLog();
    std::lock_guard guard(log.mutex);
    if (auto logger = std::atomic_load(&log.logger))
        logger->flush();
    std::atomic_store(&log.logger, std::shared_ptr<spdlog::logger>());
    fileLevel = 0;
    fileOpen = false;
}

bool STWLog::fileIsOpen() {
    return fileOpen;
}

void STWLog::setSystemLogLevel(STWLogLevel level) {
    systemLevel = static_cast<int>(level);
}

bool STWLog::isEnabled(STWLogLevel level) {
    int l = static_cast<int>(level);
    return l <= systemLevel.load(std::memory_order_relaxed) || l <= fileLevel.load(std::memory_order_relaxed);
}

std::vector<std::string> STWLog::journalFields(STWLogLevel level, STWLogCategory category,
                                               const STWLogSite& site, std::string_view message,
                                               const STWError* error, std::span<const std::string> more) {
    std::vector<std::string> fields;
    fields.reserve(10 + more.size());
    fields.push_back("MESSAGE=" + std::string(site.function) + ": " + std::string(message));
    fields.push_back("PRIORITY=" + std::to_string(syslogPriority(level)));
    fields.push_back("SYSLOG_IDENTIFIER=stowlyd");
    fields.push_back("STOWLY_SUBSYSTEM=" + std::string(subsystem));
    fields.push_back("STOWLY_CATEGORY=" + std::string(categoryName(category)));
    if (error) {
        // The error's own site: the file it was made in is not recorded, so there is no
        // CODE_FILE rather than the logging call's file beside another file's line.
        fields.push_back("CODE_FUNC=" + error->functionName());
        fields.push_back("CODE_LINE=" + std::to_string(error->sourceFileLine()));
        if (error->domain() == STWErrorDomain) {
            fields.push_back("STOWLY_RESULT_CODE=" + std::to_string(error->code()));
        } else if (error->domain() == STWPOSIXErrorDomain) {
            fields.push_back("ERRNO=" + std::to_string(error->code()));
        } else {
            fields.push_back("STOWLY_ERROR_DOMAIN=" + std::string(error->domain()));
            fields.push_back("STOWLY_ERROR_CODE=" + std::to_string(error->code()));
        }
    } else {
        fields.push_back("CODE_FUNC=" + std::string(site.function));
        if (!site.file.empty())
            fields.push_back("CODE_FILE=" + std::string(sourcePath(site.file)));
        if (site.line)
            fields.push_back("CODE_LINE=" + std::to_string(site.line));
    }
    fields.insert(fields.end(), more.begin(), more.end());
    return fields;
}

void STWLog::write(STWLogLevel level, STWLogCategory category, const STWLogSite& site,
                   std::string_view message, const STWError* error, std::span<const std::string> fields) {
    int l = static_cast<int>(level);
    if (l <= systemLevel.load(std::memory_order_relaxed))
        writeSystemLog(level, category, site, message, error, fields);
    if (l <= fileLevel.load(std::memory_order_relaxed)) {
        if (auto logger = std::atomic_load(&fileLog().logger)) {
            logger->log(level <= STWLogLevel::Error ? spdlog::level::err : spdlog::level::info,
                        "<{}> [{}] {}: {}", levelName(level), categoryName(category), site.function, message);
        }
    }
}

void STWLog::writev(STWLogLevel level, STWLogCategory category, const STWLogSite& site,
                    std::string_view format, std::initializer_list<STWFormatArg> args) {
    const STWError* error = nullptr;
    for (const STWFormatArg& arg : args)
        if ((error = arg.error()))
            break;
    write(level, category, site, STWFormatv(format, args), error);
}

void STWLog::flush() {
    if (auto logger = std::atomic_load(&fileLog().logger))
        logger->flush();
    fflush(stderr);
}

void STWLog::fatal(std::string_view function, std::string_view message) {
    write(STWLogLevel::Fault, STWLogCategory::Unspecified, {function, "", 0}, message);
    flush();
    if (useJournal() || systemLevel < static_cast<int>(STWLogLevel::Fault))
        fprintf(stderr, "stowlyd: fatal: %.*s\n", static_cast<int>(message.size()), message.data());
    abort();
}
