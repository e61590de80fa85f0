// Whatever goes wrong with the daemon under test (it does not start, it exits uncleanly,
// it refuses a connection or a hello) fails the test that was running.
#include "tests/support/STWDaemonProcess.h"

#include <gtest/gtest.h>

static const bool installed = [] {
    STWDaemonProcess::setFailureHandler([](const std::string& message) { ADD_FAILURE() << message; });
    return true;
}();
