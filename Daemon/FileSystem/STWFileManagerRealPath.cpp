// Real paths of paths that clients send, and whether they lie inside a container.
#include "Daemon/FileSystem/STWFileManager.h"

#include "Daemon/FileSystem/STWFileSystemPrimitives.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <unistd.h>

namespace fs = std::filesystem;
using namespace STWFileSystemPrimitives;

namespace {

std::string joinComponents(const std::vector<std::string>& components, size_t begin, size_t end) {
    std::string path;
    for (size_t i = begin; i < end; ++i) {
        if (components[i] == "/")
            path = "/";
        else
            path = path.empty() || path.back() == '/' ? path + components[i] : path + "/" + components[i];
    }
    return path;
}

// The root prefix as given and as the kernel resolves it; paths the daemon sees begin
// with one of them.
struct RootPrefix {
    std::string given;
    std::string real;
};

RootPrefix currentRootPrefix() {
    RootPrefix root;
    root.given = pathString(STWPlatformConfiguration::sharedInstance()->rootPrefix());
    char buffer[PATH_MAX] = {};
    root.real = realpath(root.given.c_str(), buffer) ? std::string(buffer) : root.given;
    return root;
}

bool isBelow(const std::string& path, const std::string& directory) {
    if (directory == "/")
        return hasPrefix(path, "/");
    return hasPrefix(path, directory) && (path.size() == directory.size() || path[directory.size()] == '/');
}

// Drops "/private" from the front of the part of `path` below the root prefix.
std::string strippingPrivate(const std::string& path, const RootPrefix& root) {
    size_t at = 0;
    if (root.given != "/" && isBelow(path, root.given))
        at = root.given.size();
    else if (root.real != "/" && isBelow(path, root.real))
        at = root.real.size();
    if (path.compare(at, 9, "/private/") == 0)
        return path.substr(0, at) + path.substr(at + 8);
    return path;
}

} // namespace

std::optional<fs::path> STWFileManager::_realPathForURL(const fs::path& url,
                                                        bool allowNonExistentPathComponents) const {
    std::string path = pathString(url);
    char buffer[PATH_MAX] = {};
    if (realpath(path.c_str(), buffer))
        return fs::path(buffer);
    int e = errno;
    if (e == ENOENT && allowNonExistentPathComponents)
        return _realPathWhatExistsInPath(path);
    // glibc leaves the part it resolved in the buffer.
    STW_LOG_ERROR(STWLogCategory::FS, "Failed to realpath %s : %s at %s", path, strerror(e), buffer);
    return std::nullopt;
}

std::optional<fs::path> STWFileManager::_realPathWhatExistsInPath(const std::string& path) const {
    std::vector<std::string> components = pathComponents(path);
    for (size_t count = components.size(); count >= 2; --count) {
        std::string prefix = joinComponents(components, 0, count);
        if (!itemExistsAtURL(prefix))
            continue;
        auto real = _realPathForURL(prefix, false);
        if (!real)
            continue;
        std::string rest = joinComponents(components, count, components.size());
        STW_LOG_DEBUG(STWLogCategory::FS, "Realpathed %@ ; appending non-existing components %@", *real, rest);
        return rest.empty() ? *real : *real / rest;
    }
    return std::nullopt;
}

bool STWFileManager::_validateSymlink(std::string_view path, int32_t withStartingDepth, int32_t* andEndingDepth) {
    int32_t depth = withStartingDepth;
    size_t start = 0;
    while (start <= path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string_view::npos)
            end = path.size();
        std::string_view component = path.substr(start, end - start);
        start = end + 1;
        if (component == "..")
            --depth;
        else if (!component.empty() && component != ".")
            ++depth;
        if (depth < withStartingDepth)
            return false;
    }
    if (andEndingDepth)
        *andEndingDepth = depth;
    return true;
}

std::optional<fs::path> STWFileManager::realPathForURL(const fs::path& url, const fs::path& ifChildOfURL) const {
    if (url.empty() || ifChildOfURL.empty()) {
        STW_LOG_ERROR(STWLogCategory::FS, "The base path %@ and/or suspicious path %@ were nil", ifChildOfURL, url);
        return std::nullopt;
    }
    RootPrefix root = currentRootPrefix();
    std::string suspiciousGiven = pathString(url);
    std::string baseGiven = pathString(ifChildOfURL);
    std::string suspicious = strippingPrivate(suspiciousGiven, root);
    std::string base = strippingPrivate(baseGiven, root);
    if (!hasPrefix(suspicious, base)) {
        STW_LOG_ERROR(STWLogCategory::FS, "supiscious path %@ does not contain base path %@ as a prefix", suspicious,
                      base);
        return std::nullopt;
    }
    if (containsDotDotPathComponents(suspicious)) {
        STW_LOG_ERROR(STWLogCategory::FS, "The suspicious path %@ contains '..' paths, which are invalid", suspicious);
        return std::nullopt;
    }

    // The string tests above work on the stripped forms; the file system is asked about the
    // paths as given, which name the same items where /var leads to /private/var and are
    // the only ones that exist where it does not.
    char link[1024] = {};
    ssize_t length = readlink(suspiciousGiven.c_str(), link, sizeof link - 1);
    if (length < 0) {
        if (errno != EINVAL && errno != ENOENT) {
            STW_LOG_ERROR(STWLogCategory::FS, "Readlink failed: %s", strerror(errno));
            return std::nullopt;
        }
    } else {
        std::string target(link, static_cast<size_t>(length));
        if (hasPrefix(target, "/")) {
            STW_LOG_ERROR(STWLogCategory::FS, "Rejecting %@ -> %s, as absolute symlinks are not allowed", suspicious,
                          target);
            return std::nullopt;
        }
        int32_t baseDepth = 0;
        if (!_validateSymlink(base, 0, &baseDepth)) {
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to retrieve depth of %@", base);
            return std::nullopt;
        }
        std::string belowBase = suspicious.substr(base.size());
        size_t slash = belowBase.rfind('/');
        std::string resolved = (slash == std::string::npos ? std::string() : belowBase.substr(0, slash)) + "/" + target;
        if (!_validateSymlink(resolved, baseDepth, nullptr)) {
            STW_LOG_ERROR(STWLogCategory::FS, "Rejecting %@ -> %@, as it is points outside or to the base %@",
                          suspicious, resolved, base);
            return std::nullopt;
        }
    }

    auto baseReal = _realPathForURL(baseGiven, false);
    if (!baseReal) {
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to retrieve realpath for base path %@ ", base);
        return std::nullopt;
    }
    auto suspiciousReal = _realPathForURL(suspiciousGiven, true);
    if (!suspiciousReal) {
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to retrieve realpath for suspicious path %@", suspicious);
        return std::nullopt;
    }

    // A relative link that passed the lexical test above is compared too: a link further up
    // the path (resolved by realpath, not seen by readlink) could still have led it out.
    std::vector<std::string> baseComponents = pathComponents(baseReal->native());
    std::vector<std::string> childComponents = pathComponents(suspiciousReal->native());
    if (baseComponents.size() < 2 || childComponents.size() < 2) {
        STW_LOG_ERROR(STWLogCategory::FS,
                      "Rejecting %@ with base %@ because real component counts don't make sense (reals %@ ; %@)",
                      suspicious, base, *suspiciousReal, *baseReal);
        return std::nullopt;
    }
    // Both sides are compared below the root prefix, each skipping a leading "private".
    std::vector<std::string> rootComponents = pathComponents(root.real);
    auto startIndex = [&](const std::vector<std::string>& components) -> std::optional<size_t> {
        for (size_t i = 0; i < rootComponents.size(); ++i)
            if (i >= components.size() || components[i] != rootComponents[i])
                return std::nullopt;
        size_t start = rootComponents.size();
        return start < components.size() && components[start] == "private" ? start + 1 : start;
    };
    auto baseStart = startIndex(baseComponents);
    auto childStart = startIndex(childComponents);
    if (!baseStart || !childStart) {
        STW_LOG_ERROR(STWLogCategory::FS, "Rejecting %@ with base %@ (reals %@ ; %@) because it lies outside %@",
                      suspicious, base, *suspiciousReal, *baseReal, root.real);
        return std::nullopt;
    }
    // Real paths of one place agree on "/private" (realpath resolves /var through it); on
    // Linux, where /var may be a directory of its own, a disagreement means two places.
    if ((*baseStart > rootComponents.size()) != (*childStart > rootComponents.size())) {
        STW_LOG_ERROR(STWLogCategory::FS, "Rejecting %@ with base %@ (reals %@ ; %@) because only one is in /private",
                      suspicious, base, *suspiciousReal, *baseReal);
        return std::nullopt;
    }
    size_t baseLeft = baseComponents.size() - *baseStart;
    size_t childLeft = childComponents.size() - *childStart;
    if (baseLeft > childLeft) {
        STW_LOG_ERROR(STWLogCategory::FS,
                      "Rejecting %@ with base %@ because base component count is greater than child component count "
                      "(reals %@ ; %@)",
                      suspicious, base, *suspiciousReal, *baseReal);
        return std::nullopt;
    }
    for (size_t i = 0; i < baseLeft; ++i) {
        const std::string& expected = baseComponents[*baseStart + i];
        const std::string& actual = childComponents[*childStart + i];
        if (expected != actual) {
            STW_LOG_ERROR(STWLogCategory::FS,
                          "Rejecting %@ with base %@ (reals %@ ; %@) because components diverge at %@ != %@",
                          suspicious, base, *suspiciousReal, *baseReal, expected, actual);
            return std::nullopt;
        }
    }
    return suspiciousReal;
}
