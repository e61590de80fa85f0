// The libFuzzer initializer of the targets that run the daemon's own readers: they log
// every refusal, and a run should print libFuzzer's lines and its findings, not those.
// Faults still reach standard error.
#include "common/STWLog.h"

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    STWLog::setSystemLogLevel(STWLogLevel::Fault);
    return 0;
}
