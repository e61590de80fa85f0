#include "common/STWException.h"

#include "common/STWLog.h"

#include <cxxabi.h>
#include <exception>
#include <execinfo.h>
#include <pthread.h>
#include <typeinfo>

namespace {

std::string demangledName(const std::type_info& type) {
    int status = 0;
    char* demangled = abi::__cxa_demangle(type.name(), nullptr, nullptr, &status);
    std::string name = status == 0 && demangled ? demangled : type.name();
    free(demangled);
    return name;
}

} // namespace

std::string STWUncaughtExceptionReport(const std::string& name, const std::string& reason) {
    std::string report = "** INTERNAL ERROR: Uncaught Exception **\nException: ";
    char threadName[64] = {};
    if (pthread_getname_np(pthread_self(), threadName, sizeof threadName) == 0 && threadName[0])
        report += STWFormat("<%s> ", threadName);
    if (!name.empty())
        report += name + ": ";
    report += reason;
    report += "\nStack:\n";
    void* frames[64];
    int count = backtrace(frames, 64);
    if (char** symbols = backtrace_symbols(frames, count)) {
        for (int i = 0; i < count; ++i)
            report += std::string(symbols[i]) + (i + 1 < count ? "\n" : "");
        free(symbols);
    }
    return report;
}

STWExceptionReport STWExceptionReportForImage(bool internalImage) {
    return internalImage ? STWExceptionReport::Terminate : STWExceptionReport::None;
}

STWErrorRef STWErrorForCurrentException(const char* function, uint64_t line, STWExceptionReport report) {
    std::string name = "unknown exception";
    std::string reason;
    try {
        throw;
    } catch (const std::exception& e) {
        name = demangledName(typeid(e));
        reason = e.what();
    } catch (...) {
    }
    if (report == STWExceptionReport::Terminate)
        STWLog::fatal(function, STWUncaughtExceptionReport(name, reason));
    if (report == STWExceptionReport::Log)
        STW_LOG_FN(function, STWLogLevel::Error, STWLogCategory::Unspecified, "%@",
                   STWUncaughtExceptionReport(name, reason));
    return STWErrorCreate(STWErrorDomain, STWErrorException, function, line, nullptr, true, "Got exception: %@ : %@",
                          name, reason);
}
