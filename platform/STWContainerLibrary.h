// The platform's container library: which standard subdirectories a new container of
// each class gets. The lists below are the defaults; etc/stowly/stowlyd.plist may replace
// the list of any class under "ContainerSubdirectories", a dictionary from the class
// number (as a string, "2") to an array of relative paths.
#pragma once

#include "common/STWError.h"

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

class STWContainerLibrary {
public:
    // The subdirectories of `containerClass` in creation order (parents before children),
    // or nullopt with `error` set to EINVAL (not logged) for a class the platform has no
    // list for, its only failure.
    static std::optional<std::vector<std::string>> subdirectoriesForContainerClass(uint64_t containerClass,
                                                                                   STWErrorRef* error);
};
