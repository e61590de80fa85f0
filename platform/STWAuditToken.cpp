#include "platform/STWAuditToken.h"

#include "common/STWFileIO.h"
#include "common/STWFormat.h"

#include <cstdlib>
#include <string_view>

namespace {

// Fields of /proc/PID/stat after the command name, which may itself hold spaces and
// parentheses; `field` counts from 1 as in proc(5).
std::optional<uint64_t> statField(std::string_view stat, int field) {
    size_t close = stat.rfind(')');
    if (close == std::string_view::npos)
        return std::nullopt;
    std::string_view rest = stat.substr(close + 1);
    int index = 2; // the field after ")" is field 3
    size_t pos = 0;
    while (pos < rest.size()) {
        while (pos < rest.size() && rest[pos] == ' ')
            pos++;
        size_t end = rest.find(' ', pos);
        if (end == std::string_view::npos)
            end = rest.size();
        if (end > pos && ++index == field) {
            std::string token(rest.substr(pos, end - pos));
            char* endp = nullptr;
            errno = 0;
            unsigned long long v = strtoull(token.c_str(), &endp, 10);
            if (errno || !endp || *endp)
                return std::nullopt;
            return v;
        }
        pos = end;
    }
    return std::nullopt;
}

// "Uid:\treal\teffective\t..." lines of /proc/PID/status.
std::optional<uint32_t> statusFirstValue(std::string_view status, std::string_view key) {
    size_t pos = status.find(key);
    while (pos != std::string_view::npos && pos != 0 && status[pos - 1] != '\n')
        pos = status.find(key, pos + 1);
    if (pos == std::string_view::npos)
        return std::nullopt;
    pos += key.size();
    while (pos < status.size() && (status[pos] == '\t' || status[pos] == ' '))
        pos++;
    uint64_t v = 0;
    size_t digits = 0;
    for (; pos < status.size() && status[pos] >= '0' && status[pos] <= '9'; pos++, digits++)
        v = v * 10 + static_cast<uint64_t>(status[pos] - '0');
    if (digits == 0 || v > UINT32_MAX)
        return std::nullopt;
    return static_cast<uint32_t>(v);
}

} // namespace

std::optional<STWAuditToken> STWAuditToken::forProcess(pid_t pid, uid_t euid, gid_t egid) {
    std::string proc = "/proc/" + std::to_string(pid);
    std::string stat, status, loginuid;
    if (STWReadFileContents(proc + "/stat", &stat, STWReadDefault, 4096) != 0 ||
        STWReadFileContents(proc + "/status", &status, STWReadDefault, 64 * 1024) != 0)
        return std::nullopt;
    auto session = statField(stat, 6);
    auto startTime = statField(stat, 22);
    auto ruid = statusFirstValue(status, "Uid:");
    auto rgid = statusFirstValue(status, "Gid:");
    if (!session || !startTime || !ruid || !rgid)
        return std::nullopt;
    // Without audit support in the kernel there is no loginuid; -1 is "unset" there too.
    uint32_t auid = UINT32_MAX;
    if (STWReadFileContents(proc + "/loginuid", &loginuid, STWReadDefault, 64) == 0)
        auid = static_cast<uint32_t>(strtoul(loginuid.c_str(), nullptr, 10));

    STWAuditToken token;
    token.words = {auid,
                   static_cast<uint32_t>(euid),
                   static_cast<uint32_t>(egid),
                   *ruid,
                   *rgid,
                   static_cast<uint32_t>(pid),
                   static_cast<uint32_t>(*session),
                   static_cast<uint32_t>(*startTime & 0xffffffffu)};
    return token;
}

bool STWAuditToken::isZero() const {
    for (uint32_t w : words)
        if (w)
            return false;
    return true;
}

std::string STWAuditToken::description() const {
    return STWFormat("<%u %u %u %u %u %u %u %u>", words[0], words[1], words[2], words[3], words[4], words[5],
                     words[6], words[7]);
}
