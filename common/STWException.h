// Exceptions never cross the edge of a client, cache, database or mapping operation: there
// they become the code 40 error "Got exception: %@ : %@". On an internal image an
// exception is a bug to be fixed rather than an error to report: the daemon stops with
// the uncaught-exception report (thread, exception, call stack) as its crash message.
#pragma once

#include "common/STWError.h"

#include <cstdint>
#include <string>

// Call inside a catch block. With `terminateWithReport` the process stops instead.
STWErrorRef STWErrorForCurrentException(const char* function, uint64_t line, bool terminateWithReport);

// "** INTERNAL ERROR: Uncaught Exception **", the thread's name, the exception's name and
// reason, "Stack:" and the call-stack symbols of the caller.
std::string STWUncaughtExceptionReport(const std::string& name, const std::string& reason);
