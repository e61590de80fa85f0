// Exceptions never cross the edge of a client, cache, database or mapping operation: there
// they become the code 40 error "Got exception: %@ : %@". On an internal image an
// exception is a bug to be fixed rather than an error to report: the daemon stops with
// the uncaught-exception report (thread, exception, call stack) as its crash message.
#pragma once

#include "common/STWError.h"

#include <cstdint>
#include <string>

enum class STWExceptionReport {
    None,      // only the code 40 error
    Log,       // the report goes to the log too, and the operation still fails with 40
    Terminate, // the process stops with the report
};

// Call inside a catch block.
STWErrorRef STWErrorForCurrentException(const char* function, uint64_t line, STWExceptionReport report);
// Terminate on an internal image, else None: what most operation edges want.
STWExceptionReport STWExceptionReportForImage(bool internalImage);

// "** INTERNAL ERROR: Uncaught Exception **", the thread's name, the exception's name and
// reason, "Stack:" and the call-stack symbols of the caller.
std::string STWUncaughtExceptionReport(const std::string& name, const std::string& reason);
