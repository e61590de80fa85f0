#include "Daemon/Lifecycle/STWBuildUpgrade.h"

#include <mutex>

namespace {
std::mutex installedLock;
std::shared_ptr<STWBuildUpgrade> installedUpgrade; // guarded by installedLock
} // namespace

void STWBuildUpgrade::install(std::shared_ptr<STWBuildUpgrade> upgrade) {
    std::lock_guard guard(installedLock);
    installedUpgrade = std::move(upgrade);
}

std::shared_ptr<STWBuildUpgrade> STWBuildUpgrade::installed() {
    std::lock_guard guard(installedLock);
    return installedUpgrade;
}
