// stowly_hostile: a real stowlyd on a private root, attacked from the directories an app
// owns. Each round the app (user 501) fills its data container (class 2), its plugin data
// container (class 4), its app-group container (class 7) and the per-user class and
// staging directories with links to a canary tree outside the root and to the daemon's own
// library, link loops, FIFOs where the daemon reads files, hard links to the canary's
// files, trees thousands of levels deep and names longer than a path may be; then, while
// app processes swap directories for links in a tight loop, the installer sends every
// command that touches those containers and the kernel's upcall asks for the app's paths.
// A round ends with a restart, a power cycle or a build upgrade in turn.
//
// A system container (class 12) is attacked the same way by root, standing in for its
// process. After every round the canary, the daemon's configuration and library directories
// and a victim (a system container the app links to and copies the metadata of) must be as
// they were (any difference is an escape), every request must have been answered within
// 10 s (60 s for emptying death row and for the start's cleanups, which remove what the app
// left; otherwise a hang) and the daemon must still run (a crash: it ended by itself, or a
// stop did not end it cleanly; its standard error is shown, and kept in a file when the run
// fails). Prints
//
//   hostile rounds: N, requests: R, escapes: E, crashes: C, hangs: H, slowest: X ms
//     within 10 s: Y ms, command 21 for com.hostile.app (class 2)
//     within 60 s: Z ms, command 4
//
// (the slowest request or cleanup under each bound, and what it was) and exits 1 unless
// E, C and H are 0. SIGINT and SIGTERM end the run after the current request; the root,
// the canary and the app processes go either way.
//
//   stowly_hostile [--rounds N] [--seed S] [--depth D] [--verbose]
#include "Daemon/FileSystem/STWFileManager.h"
#include "client/STWUpcallClient.h"
#include "common/STWError.h"
#include "common/STWFileIO.h"
#include "tests/support/STWDaemonProcess.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <functional>
#include <grp.h>
#include <map>
#include <random>
#include <string>
#include <sys/inotify.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <thread>
#include <unistd.h>
#include <vector>

namespace fs = std::filesystem;

namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

constexpr std::chrono::seconds kBound{10}; // every request is answered within this
// but emptying death row and the start's cleanups, which remove whatever the app left (trees
// thousands of levels deep among it) and take as long as the file system needs for that:
// on two shared cores, seconds for one such tree.
constexpr std::chrono::seconds kRemovalBound{60};
constexpr uid_t kMobile = 501;
constexpr const char* kApp = "com.hostile.app";
constexpr const char* kPlugin = "com.hostile.app.plugin";
constexpr const char* kGroup = "group.com.hostile.app";
constexpr const char* kSystemGroup = "systemgroup.com.hostile.shared";
constexpr const char* kVictim = "com.hostile.victim";

std::atomic<bool> interrupted{false};

// What the kernel asks when the app starts: its container and its group's paths.
STWUpcallClient::Request appUpcall() {
    STWUpcallClient::Request request;
    request.codeSignatureIdentifier = kApp;
    request.containerIdentifier = kApp;
    request.uid = kMobile;
    request.appGroupIdentifiers = {kGroup};
    request.containerType = STWKernContainerTypeApplication;
    request.personaID = STWKernNoPersona;
    return request;
}

STWValue::Dictionary entitled(std::initializer_list<const char*> names) {
    STWValue::Dictionary entitlements;
    for (const char* name : names)
        entitlements[std::string("com.vorlane.private.Stowly.") + name] = STWValue(true);
    return entitlements;
}
// The installer may send every command that acts on an app's containers.
const STWValue::Dictionary installerEntitlements = entitled(
    {"allowed", "wipeContainer", "deleteContainerContent", "userManagedAssets", "dataMigration"});

struct Options {
    unsigned rounds = 40;
    uint64_t seed = 0;
    unsigned depth = 0; // 0: 3,000 to 10,000 levels, drawn each round
    bool verbose = false;
};

bool parse(int argc, char** argv, Options* options) {
    options->seed = std::random_device()();
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        unsigned long long value = 0;
        auto next = [&] {
            char* end = nullptr;
            if (i + 1 >= argc)
                return false;
            value = strtoull(argv[++i], &end, 10);
            return end && *end == 0;
        };
        if (arg == "--rounds" && next() && value > 0)
            options->rounds = unsigned(value);
        else if (arg == "--seed" && next())
            options->seed = value;
        else if (arg == "--depth" && next() && value > 0)
            options->depth = unsigned(value);
        else if (arg == "--verbose")
            options->verbose = true;
        else
            return false;
    }
    return true;
}

// ---- Snapshots ------------------------------------------------------------------------

// One entry's state: type and mode, owner, size, the content's hash, the link target, the
// extended attributes (ACLs and protection classes among them) and the modification time.
// Directories of the daemon's own library (`directoriesOnly`) leave size and time out:
// their files come and go as the daemon runs.
using Snapshot = std::map<std::string, std::string>;

std::string describe(const fs::path& path, const struct stat& st, bool withTimes) {
    std::string state = std::to_string(st.st_mode) + " " + std::to_string(st.st_uid) + ":" + std::to_string(st.st_gid);
    if (withTimes)
        state += " size " + std::to_string(st.st_size) + " mtime " + std::to_string(st.st_mtim.tv_sec) + "." +
                 std::to_string(st.st_mtim.tv_nsec);
    std::string contents;
    if (S_ISREG(st.st_mode) && STWReadFileContents(path, &contents) == 0)
        state += " hash " + std::to_string(std::hash<std::string>()(contents));
    if (S_ISLNK(st.st_mode))
        state += " -> " + fs::read_symlink(path).string();
    char names[4096];
    ssize_t length = llistxattr(path.c_str(), names, sizeof names);
    for (ssize_t at = 0; at < length; at += ssize_t(strlen(names + at)) + 1) {
        char value[1024];
        ssize_t n = lgetxattr(path.c_str(), names + at, value, sizeof value);
        state += std::string(" ") + (names + at) + "=" + std::string(value, n > 0 ? size_t(n) : 0);
    }
    return state;
}

Snapshot snapshot(const fs::path& top, bool directoriesOnly = false, bool withTimes = true) {
    Snapshot entries;
    auto record = [&](const fs::path& path) {
        struct stat st;
        if (lstat(path.c_str(), &st) == 0 && (!directoriesOnly || S_ISDIR(st.st_mode)))
            entries[path.lexically_relative(top).string()] = describe(path, st, withTimes && !directoriesOnly);
    };
    record(top);
    std::error_code ec;
    for (fs::recursive_directory_iterator it(top, ec), end; !ec && it != end; it.increment(ec)) {
        // The daemon's death row holds what apps left in their containers: not its own.
        if (it->path().filename() == "Dead" && it->path().parent_path().filename() == "com.vorlane.stowlyd") {
            it.disable_recursion_pending();
            continue;
        }
        record(it->path());
    }
    return entries;
}

// What changed from `before` to `after`, one line each; entries that only appeared are
// changes unless `additionsAllowed` (the daemon's library grows as it works).
std::vector<std::string> differences(const std::string& name, const Snapshot& before, const Snapshot& after,
                                     bool additionsAllowed = false) {
    std::vector<std::string> found;
    for (const auto& [path, state] : before) {
        auto it = after.find(path);
        if (it == after.end())
            found.push_back(name + "/" + path + ": removed (was " + state + ")");
        else if (it->second != state)
            found.push_back(name + "/" + path + ": " + state + " became " + it->second);
    }
    for (const auto& [path, state] : after)
        if (!additionsAllowed && !before.count(path))
            found.push_back(name + "/" + path + ": appeared (" + state + ")");
    return found;
}

// ---- The app -------------------------------------------------------------------------

// Runs `work` in a child process of the apps' user (or of root, standing in for a system
// process) and answers its pid. The child dies with the driver. `asApp` waits for it and
// answers whether `work` returned true.
pid_t spawnApp(const std::function<bool()>& work, bool asRoot = false) {
    pid_t driver = getpid();
    pid_t pid = fork();
    if (pid == 0) {
        // The app spins; niced, it leaves the daemon the share of the cores a scheduler
        // would give a system daemon on a device, here on two shared cores.
        errno = 0;
        if (nice(10) == -1 && errno != 0)
            _exit(126);
        if (!asRoot && (setgroups(0, nullptr) != 0 || setresgid(kMobile, kMobile, kMobile) != 0 ||
                        setresuid(kMobile, kMobile, kMobile) != 0))
            _exit(126);
        // After the change of user, which clears it; a driver already gone is seen here.
        if (prctl(PR_SET_PDEATHSIG, SIGKILL) != 0 || getppid() != driver)
            _exit(126);
        _exit(work() ? 0 : 1);
    }
    return pid;
}
bool asApp(const std::function<bool()>& work) {
    pid_t pid = spawnApp(work);
    int status = 0;
    return pid > 0 && waitpid(pid, &status, 0) == pid && WIFEXITED(status) && WEXITSTATUS(status) == 0;
}
void stopApp(pid_t pid) {
    if (pid > 0) {
        kill(pid, SIGKILL);
        waitpid(pid, nullptr, 0);
    }
}

// `levels` nested directories named `name` below `top`, made through descriptors (the
// path is far longer than PATH_MAX); the deepest holds a FIFO and a link to `outside`.
bool makeDeepTree(const fs::path& top, const std::string& name, unsigned levels, const fs::path& outside) {
    int fd = open(top.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    for (unsigned i = 0; fd >= 0 && i < levels; ++i) {
        mkdirat(fd, name.c_str(), 0755);
        int next = openat(fd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
        close(fd);
        fd = next;
    }
    if (fd < 0)
        return false;
    mkfifoat(fd, "fifo", 0644);
    symlinkat(outside.c_str(), fd, "out");
    close(fd);
    return true;
}

// The canary: a tree outside the daemon's root that the planted links point at, with the
// kinds of entries an escape would change (a root-only file and directory, a setuid file,
// the user's own file and directory, a sticky directory, a link, extended attributes).
class Canary {
public:
    Canary() {
        char templ[] = "/tmp/stowly-hostile-canary-XXXXXX";
        _path = mkdtemp(templ);
        fs::permissions(_path, fs::perms(0755));
        fs::create_directories(_path / "Library/Preferences");
        fs::create_directories(_path / "Caches");
        fs::create_directories(_path / "mobile");
        fs::create_directories(_path / "shared");
        fs::permissions(_path / "Caches", fs::perms(0700));
        fs::permissions(_path / "shared", fs::perms(01777));
        STWWriteFile(_path / "secret", "root only\n", 0600, false);
        STWWriteFile(_path / "Caches/secret", "root only\n", 0600, false);
        STWWriteFile(_path / "tool", "#!/bin/sh\n", 04755, false);
        chmod((_path / "tool").c_str(), 04755);
        STWWriteFile(_path / "Library/Preferences/com.hostile.app.plist", "<plist/>\n", 0644, false);
        STWWriteFile(_path / "mobile/note", "the user's own\n", 0644, false);
        for (const char* own : {"mobile", "mobile/note"})
            chown((_path / own).c_str(), kMobile, kMobile);
        fs::create_symlink("secret", _path / "link");
        // Extended attributes where the file system has them; an escape that sets or drops
        // a protection class or an ACL shows in the snapshot either way.
        for (const char* entry : {"secret", "Caches"}) {
            setxattr((_path / entry).c_str(), "user.stowly.canary", "1", 1, 0);
            setxattr((_path / entry).c_str(), "trusted.stowly.canary", "1", 1, 0);
        }
    }
    ~Canary() { STWFileManager::defaultManager()->removeItemAtURL(_path); }
    const fs::path& path() const { return _path; }

private:
    fs::path _path;
};

// ---- The run -------------------------------------------------------------------------

uint64_t codeOf(const STWValue::Dictionary& reply) { return STWDictionaryUInt64(reply, "ReplyError").value_or(0); }
fs::path pathOf(const STWValue::Dictionary& reply) {
    const std::string* path = STWDictionaryString(reply, "ReplyPath");
    return path ? fs::path(*path) : fs::path();
}

class Hostile {
public:
    explicit Hostile(const Options& options)
        : _options(options), _random(options.seed),
          _daemon({{"DeveloperMode", STWValue(true)}}, {}, false) {
        _daemon.setStandardErrorFile(_daemon.root() / "stowlyd.stderr");
    }
    int run();

private:
    struct Container {
        const char* identifier;
        uint64_t containerClass;
        fs::path path;
        STWValue uuid;
        STWValue::Dictionary identity() const {
            STWValue::Dictionary keys{{"Identifier", STWValue(identifier)},
                                      {"ContainerClass", STWValue(containerClass)}};
            if (!uuid.isNull())
                keys["UUID"] = uuid;
            return keys;
        }
    };

    bool _connect();
    void _round(unsigned round);
    void _lookUp(Container& container, bool create);
    void _plant(unsigned round);
    pid_t _startSwapper(unsigned round);
    void _restoreAbove();
    pid_t _startStagingWatcher();
    void _drive();
    std::optional<STWValue::Dictionary> _send(STWClient& client, uint64_t command, STWValue::Dictionary keys);
    void _upcall(const STWUpcallClient::Request& request);
    void _cycle(unsigned round);
    void _check(const std::string& when);
    void _baseline();
    // Counts a request that got no answer: a crash when the daemon ended (it is started
    // again, on a power cycle), else a hang.
    void _noAnswer(const std::string& what, std::chrono::seconds bound, const std::string& why);
    void _crashed(const std::string& what);
    void _showStandardError();

    Options _options;
    std::mt19937_64 _random;
    STWDaemonProcess _daemon;
    Canary _canary;
    std::unique_ptr<STWClient> _installer, _app, _stager;
    Container _data{kApp, 2, {}, {}}, _pluginData{kPlugin, 4, {}, {}}, _group{kGroup, 7, {}, {}};
    // The victim: a system container, out of the app's reach, which the app links to and
    // copies the metadata of.
    Container _victim{kVictim, 12, {}, {}};
    // A system container, whose process (root here) is as hostile: recreating its structure
    // walks the whole container to set its ACLs.
    Container _system{"com.hostile.system", 12, {}, {}};
    fs::path _systemGroup;
    fs::path _victimPath;
    bool _buildUpgraded = false;
    Snapshot _canaryBefore, _configurationBefore, _libraryBefore, _victimBefore;
    unsigned _rounds = 0, _requests = 0, _escapes = 0, _crashes = 0, _hangs = 0;
    // The slowest request (or cleanup) under each bound, with what it was: a figure near its
    // bound says which command to look at.
    struct Slowest {
        Clock::duration took{};
        std::string what;
    };
    std::map<std::chrono::seconds, Slowest> _slowest;
    void _took(const std::string& what, std::chrono::seconds bound, Clock::duration took);
    void _printSlowest() const;
};

void Hostile::_took(const std::string& what, std::chrono::seconds bound, Clock::duration took) {
    Slowest& slowest = _slowest[bound];
    if (took > slowest.took)
        slowest = {took, what};
}

// "slowest: X ms" is the slowest of all; then the slowest under each bound and what it was.
void Hostile::_printSlowest() const {
    auto ms = [](Clock::duration d) { return (long long)std::chrono::duration_cast<milliseconds>(d).count(); };
    Clock::duration overall{};
    for (const auto& [bound, slowest] : _slowest)
        overall = std::max(overall, slowest.took);
    printf("slowest: %lld ms\n", ms(overall));
    for (const auto& [bound, slowest] : _slowest)
        printf("  within %lld s: %lld ms, %s\n", (long long)bound.count(), ms(slowest.took), slowest.what.c_str());
}

std::optional<STWValue::Dictionary> Hostile::_send(STWClient& client, uint64_t command, STWValue::Dictionary keys) {
    keys["Command"] = STWValue(command);
    STWErrorRef error;
    auto start = Clock::now();
    std::chrono::seconds bound = command == 4 ? kRemovalBound : kBound;
    auto reply = client.sendMessage(keys, bound, &error);
    auto took = Clock::now() - start;
    std::string what = "command " + std::to_string(command);
    if (const std::string* identifier = STWDictionaryString(keys, "Identifier"))
        what += " for " + *identifier;
    if (auto containerClass = STWDictionaryUInt64(keys, "ContainerClass"))
        what += " (class " + std::to_string(*containerClass) + ")";
    _took(what, bound, took);
    if (_options.verbose)
        printf("command %llu: code %llu in %lld ms\n", (unsigned long long)command,
               (unsigned long long)(reply ? codeOf(*reply) : 0),
               (long long)std::chrono::duration_cast<milliseconds>(took).count());
    ++_requests;
    if (!reply)
        _noAnswer("command " + std::to_string(command), bound, error ? error->description() : "no reply");
    return reply;
}

void Hostile::_upcall(const STWUpcallClient::Request& request) {
    // The upcall socket comes up a little after the request socket.
    STWErrorRef error;
    std::unique_ptr<STWUpcallClient> client;
    auto deadline = Clock::now() + kBound;
    while (!(client = STWUpcallClient::connect(STWUpcallClient::socketPathForRoot(_daemon.root()), &error)) &&
           Clock::now() < deadline)
        std::this_thread::sleep_for(milliseconds(20));
    auto start = Clock::now();
    std::optional<STWUpcallClient::Reply> reply = client ? client->send(request, kBound, &error) : std::nullopt;
    _took("the upcall", kBound, Clock::now() - start);
    ++_requests;
    if (!reply)
        _noAnswer("upcall for " + request.codeSignatureIdentifier.value_or(""), kBound,
                  error ? error->description() : "");
}

void Hostile::_noAnswer(const std::string& what, std::chrono::seconds bound, const std::string& why) {
    if (!_daemon.isRunning())
        return _crashed(what);
    ++_hangs;
    fprintf(stderr, "hang: %s got no answer within %lld s (%s)\n", what.c_str(), (long long)bound.count(),
            why.c_str());
    _showStandardError();
}

void Hostile::_crashed(const std::string& what) {
    ++_crashes;
    std::optional<int> status = _daemon.waitForExit(milliseconds(0));
    fprintf(stderr, "crash: the daemon ended during %s (wait status %d)\n", what.c_str(), status.value_or(-1));
    _showStandardError();
    _daemon.reboot();
    if (!_daemon.start() || !_connect())
        interrupted = true; // nothing more can be driven
}

void Hostile::_showStandardError() {
    std::string text;
    STWReadFileContents(_daemon.root() / "stowlyd.stderr", &text);
    size_t from = text.size() > 8000 ? text.size() - 8000 : 0;
    fprintf(stderr, "--- stowlyd standard error (last %zu bytes) ---\n%s\n---\n", text.size() - from,
            text.c_str() + from);
}

bool Hostile::_connect() {
    _installer = _daemon.connectAs("com.hostile.installer", installerEntitlements);
    _app = _daemon.connectAs(kApp, {});
    _stager = _daemon.connectAs("com.hostile.stager", entitled({"stageSharedContent"}));
    return _installer && _app && _stager;
}

void Hostile::_lookUp(Container& container, bool create) {
    container.path.clear();
    container.uuid = STWValue();
    auto reply = _send(*_installer, 0,
                       {{"Identifier", STWValue(container.identifier)},
                        {"ContainerClass", STWValue(container.containerClass)},
                        {"CreateIfNecessary", STWValue(create)}});
    if (reply && codeOf(*reply) == STWErrorSuccess) {
        container.path = pathOf(*reply);
        container.uuid = reply->count("ReplyUUID") ? reply->at("ReplyUUID") : STWValue();
        // A link the app put in a container's place is never handed out as the container.
        struct stat st;
        if (lstat(container.path.c_str(), &st) == 0 && S_ISLNK(st.st_mode)) {
            fprintf(stderr, "escape: the look-up of %s answered the link %s\n", container.identifier,
                    container.path.c_str());
            ++_escapes;
        }
    }
}

int Hostile::run() {
    printf("hostile: seed %llu, root %s, canary %s\n", (unsigned long long)_options.seed,
           _daemon.root().c_str(), _canary.path().c_str());
    fflush(stdout);
    if (!_daemon.start() || !_connect()) {
        _showStandardError();
        return 1;
    }
    // What the installer tells the daemon about the app (its group) and the stager (the
    // system group it may stage into); the victim, another app of the same user.
    auto install = [&](const char* identifier, const char* key, const char* group) {
        STWValue::Dictionary entitlements{{key, STWValue(STWValue::Array{STWValue(group)})}};
        _send(*_installer, 18,
              {{"Identifier", STWValue(identifier)},
               {"CodeSigningInfo",
                STWValue(STWValue::Dictionary{{"com.vorlane.Stowly.Entitlements", STWValue(entitlements)}})}});
    };
    install(kApp, "com.vorlane.security.application-groups", kGroup);
    install("com.hostile.stager", "com.vorlane.security.system-groups", kSystemGroup);
    _lookUp(_victim, true);
    _victimPath = _victim.path;
    Container system{kSystemGroup, 13, {}, {}};
    _lookUp(system, true);
    _systemGroup = system.path;
    if (_victimPath.empty() || _systemGroup.empty()) {
        fprintf(stderr, "hostile: the victim or the system group container could not be made\n");
        return 1;
    }
    _baseline();

    for (unsigned round = 0; round < _options.rounds && !interrupted; ++round) {
        _round(round);
        ++_rounds;
    }
    printf("hostile rounds: %u, requests: %u, escapes: %u, crashes: %u, hangs: %u, ", _rounds, _requests, _escapes,
           _crashes, _hangs);
    _printSlowest();
    _installer.reset();
    _app.reset();
    _stager.reset();
    if (_daemon.isRunning() && !_daemon.stop()) {
        ++_crashes;
        _showStandardError();
    }
    if (!_escapes && !_crashes && !_hangs)
        return 0;
    // The root goes; the daemon's log stays for a look.
    std::string kept = "/tmp/stowly-hostile-" + std::to_string(getpid()) + ".stderr";
    std::string text;
    if (STWReadFileContents(_daemon.root() / "stowlyd.stderr", &text, STWReadDefault, size_t(1) << 30) == 0 &&
        STWWriteFile(kept, text, 0644, false) == 0)
        fprintf(stderr, "hostile: the daemon's standard error is kept in %s\n", kept.c_str());
    return 1;
}

void Hostile::_baseline() {
    _canaryBefore = snapshot(_canary.path());
    _configurationBefore = snapshot(_daemon.root() / "etc");
    _libraryBefore = snapshot(_daemon.root() / "private/var/root/Library", true);
    // The victim's own tree; its times move when the daemon reads it, not its content.
    _victimBefore = snapshot(_victimPath, false, false);
}

void Hostile::_check(const std::string& when) {
    std::vector<std::string> found = differences("canary", _canaryBefore, snapshot(_canary.path()));
    for (auto& line : differences("etc", _configurationBefore, snapshot(_daemon.root() / "etc")))
        found.push_back(std::move(line));
    for (auto& line : differences("library", _libraryBefore,
                                  snapshot(_daemon.root() / "private/var/root/Library", true), true))
        found.push_back(std::move(line));
    // A build upgrade gives every system container a new directory name; nothing else
    // moves the victim.
    Container victim = _victim;
    _lookUp(victim, false);
    if (victim.path != _victimPath && !(_buildUpgraded && !victim.path.empty()))
        found.push_back("the victim's look-up answered \"" + victim.path.string() + "\"");
    else
        _victimPath = victim.path;
    _buildUpgraded = false;
    for (auto& line : differences("victim", _victimBefore, snapshot(_victimPath, false, false)))
        found.push_back(std::move(line));
    for (size_t i = 0; i < found.size() && i < 20; ++i)
        fprintf(stderr, "escape (%s): %s\n", when.c_str(), found[i].substr(0, 600).c_str());
    if (found.size() > 20)
        fprintf(stderr, "escape (%s): and %zu more\n", when.c_str(), found.size() - 20);
    _escapes += unsigned(found.size());
    if (!found.empty())
        _baseline(); // each change counts once
}

void Hostile::_round(unsigned round) {
    if (!_daemon.isRunning())
        _crashed("the pause between rounds");
    for (Container* container : {&_data, &_pluginData, &_group, &_system})
        _lookUp(*container, true);
    _plant(round);
    pid_t swapper = _startSwapper(round);
    pid_t systemSwapper = -1;
    if (!_system.path.empty()) {
        fs::path library = _system.path / "Library", link = _system.path / (round % 2 ? "toCanary" : "toOwn");
        systemSwapper = spawnApp(
            [library, link] {
                for (;;)
                    renameat2(AT_FDCWD, library.c_str(), AT_FDCWD, link.c_str(), RENAME_EXCHANGE);
                return true;
            },
            true);
    }
    // Every other round the app also replaces each new staging entry with a link, so that
    // creations have a link where they build.
    pid_t watcher = round % 2 ? _startStagingWatcher() : -1;
    _drive();
    stopApp(swapper);
    _restoreAbove();
    stopApp(systemSwapper);
    stopApp(watcher);
    _check("round " + std::to_string(round));
    _cycle(round);
    _check("round " + std::to_string(round) + " after its restart");
    if (_options.verbose)
        printf("round %u: %u requests so far\n", round, _requests);
}

// What the app (and, where the app cannot, root in its stead) leaves in its containers and
// its class and staging directories.
void Hostile::_plant(unsigned round) {
    const fs::path canary = _canary.path();
    const fs::path ownLibrary = _daemon.root() / "private/var/root/Library";
    unsigned depth = _options.depth ? _options.depth : 3000 + unsigned(_random() % 7001);
    std::vector<fs::path> containers;
    for (const Container* container : {&_data, &_pluginData, &_group})
        if (!container->path.empty())
            containers.push_back(container->path);
    if (containers.empty())
        return;
    // One deep tree a round, in each container in turn: removing one takes a while.
    const fs::path deepIn = containers[round % containers.size()];
    fs::path classDirectory = containers.front().parent_path();
    fs::path staging = classDirectory.parent_path().parent_path() / "Staging";
    std::string victimMetadata = (_victimPath / STWContainerMetadataFileName).string();

    asApp([&] {
        std::error_code ec;
        for (const fs::path& c : containers) {
            for (auto [target, link] : {std::pair{canary, "toCanary"}, {canary / "secret", "toSecret"},
                                        {ownLibrary, "toOwn"}, {canary, "Documents/toCanary"},
                                        {fs::path("loopB"), "loopA"}, {fs::path("loopA"), "loopB"},
                                        {fs::path("self"), "self"}})
                fs::create_symlink(target, c / link, ec);
            // The directories and files the daemon makes and reads, as links and FIFOs.
            fs::remove_all(c / "Library/Caches", ec);
            fs::create_symlink(canary / "Caches", c / "Library/Caches", ec);
            fs::create_directories(c / "Library/Preferences", ec);
            fs::remove(c / "Library/Preferences" / (std::string(kApp) + ".plist"), ec);
            mkfifo((c / "Library/Preferences" / (std::string(kApp) + ".plist")).c_str(), 0644);
            fs::remove_all(c / "tmp", ec);
            mkfifo((c / "tmp").c_str(), 0644);
            fs::create_symlink(canary / "Library", c / "StoreKit", ec);
            fs::create_directories(c / "Documents", ec);
            link((canary / "mobile/note").c_str(), (c / "Documents/hardNote").c_str());
            // Names of 255 bytes, nested until the path is longer than PATH_MAX.
            std::string longName(255, 'n');
            fs::path longPath = c / "Documents";
            for (int i = 0; i < 20; ++i) {
                longPath /= longName;
                mkdir(longPath.c_str(), 0755);
            }
            symlink(canary.c_str(), (longPath / std::string(255, 'l')).c_str());
            if (c == deepIn)
                makeDeepTree(c / "Documents", "d", depth, canary);
        }
        // The class directory: a link and a FIFO under names like a container's, and a
        // directory of the app's with a copy of the victim's metadata or a FIFO in its place.
        fs::create_symlink(canary, classDirectory / "6F1B5C2E-0000-4000-8000-00000000AAAA", ec);
        mkfifo((classDirectory / "6F1B5C2E-0000-4000-8000-00000000BBBB").c_str(), 0644);
        fs::path thief = classDirectory / ("6F1B5C2E-0000-4000-8000-" + std::to_string(100000000000 + round));
        fs::create_directory(thief, ec);
        if (round % 3 == 0)
            fs::copy_file(victimMetadata, thief / STWContainerMetadataFileName, ec);
        else if (round % 3 == 1)
            mkfifo((thief / STWContainerMetadataFileName).c_str(), 0644);
        else if (int fd = open((thief / STWContainerMetadataFileName).c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644); fd >= 0) {
            bool sized = ftruncate(fd, 64 << 20) == 0; // far beyond any metadata
            close(fd);
            if (!sized)
                return false;
        }
        fs::create_symlink(canary, thief / "Library", ec);
        // The staging directory: links out, a loop and a FIFO.
        fs::create_symlink(canary, staging / "hostile-link", ec);
        fs::create_symlink("hostile-loop", staging / "hostile-loop", ec);
        mkfifo((staging / "hostile-fifo").c_str(), 0644);
        // In turn, one container itself goes away: the plugin's, replaced by a directory whose
        // metadata is a FIFO; the group's, whose metadata is a link loop; the app's, replaced
        // by a link to the victim's container.
        auto away = [&](const fs::path& container) {
            return !container.empty() &&
                   rename(container.c_str(), (container.string() + ".away" + std::to_string(round)).c_str()) == 0;
        };
        if (round % 3 == 0 && away(_pluginData.path) && mkdir(_pluginData.path.c_str(), 0755) == 0)
            mkfifo((_pluginData.path / STWContainerMetadataFileName).c_str(), 0644);
        if (round % 3 == 1 && away(_group.path) && mkdir(_group.path.c_str(), 0755) == 0)
            fs::create_symlink(STWContainerMetadataFileName, _group.path / STWContainerMetadataFileName, ec);
        if (round % 3 == 2 && away(_data.path))
            fs::create_symlink(_victimPath, _data.path, ec);
        return true;
    });
    // Hard links to root's files: protected_hardlinks keeps user 501 from making them, so
    // root makes them here, standing in for an app on a system without that protection.
    // Root follows none of the app's links on the way (the app may have left a directory
    // swapped for one).
    auto hardLink = [](const fs::path& file, const fs::path& directory, const char* name) {
        int fd = open("/", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
        for (const fs::path& component : directory.relative_path()) {
            int next = fd < 0 ? -1 : openat(fd, component.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
            close(fd);
            fd = next;
        }
        if (fd >= 0)
            linkat(AT_FDCWD, file.c_str(), fd, name, 0);
        close(fd);
    };
    std::error_code ec;
    for (const fs::path& c : containers) {
        hardLink(canary / "secret", c / "Documents", "hardSecret");
        hardLink(canary / "tool", c, "hardTool");
    }
    hardLink(canary / "secret", staging, "hostile-hard");
    if (!_system.path.empty()) {
        fs::create_symlink(canary, _system.path / "toCanary", ec);
        fs::create_symlink(ownLibrary, _system.path / "toOwn", ec);
        fs::create_symlink("loop", _system.path / "loop", ec);
        mkfifo((_system.path / "fifo").c_str(), 0644);
    }
    // A system process may do the like in its system group container, which content is
    // staged from.
    fs::create_directories(_systemGroup / "incoming/pkg", ec);
    fs::create_symlink(canary, _systemGroup / "out", ec);
    mkfifo((_systemGroup / "fifo").c_str(), 0644);
}

// The app swaps its directories with links to the canary and to the daemon's own library,
// over and over, until it is stopped.
pid_t Hostile::_startSwapper(unsigned round) {
    std::vector<std::pair<fs::path, fs::path>> swaps;
    for (const Container* container : {&_data, &_pluginData, &_group}) {
        // Not through the link the app put in a container's place: what it leads to is not
        // the app's.
        struct stat st;
        if (container->path.empty() || lstat(container->path.c_str(), &st) != 0 || !S_ISDIR(st.st_mode))
            continue;
        swaps.emplace_back(container->path / "Library", container->path / (round % 2 ? "toCanary" : "toOwn"));
        swaps.emplace_back(container->path / "Documents", container->path / "toCanary");
    }
    // In some rounds the directories above the class directories go too.
    fs::path data = _data.path.empty() ? fs::path() : _data.path.parent_path().parent_path();
    bool above = round % 4 == 2 && !data.empty();
    return spawnApp([swaps, above, data, canary = _canary.path()] {
        std::error_code ec;
        for (const char* name : {"Data", "Staging"})
            if (above)
                fs::create_symlink(canary, data.parent_path() / (std::string(name) + ".link"), ec);
        for (;;) {
            for (const auto& [directory, link] : swaps)
                renameat2(AT_FDCWD, directory.c_str(), AT_FDCWD, link.c_str(), RENAME_EXCHANGE);
            for (const char* name : {"Data", "Staging"})
                if (above)
                    renameat2(AT_FDCWD, (data.parent_path() / name).c_str(), AT_FDCWD,
                              (data.parent_path() / (std::string(name) + ".link")).c_str(), RENAME_EXCHANGE);
        }
        return true;
    });
}

// Once the swapper is stopped, the app puts the directories above its class directories back
// where they belong (it may leave them anywhere, but the rounds after this one want them).
void Hostile::_restoreAbove() {
    if (_data.path.empty())
        return;
    fs::path containers = _data.path.parent_path().parent_path().parent_path();
    asApp([&] {
        for (const char* name : {"Data", "Staging"}) {
            struct stat st;
            fs::path link = containers / (std::string(name) + ".link");
            if (lstat((containers / name).c_str(), &st) == 0 && S_ISLNK(st.st_mode))
                renameat2(AT_FDCWD, (containers / name).c_str(), AT_FDCWD, link.c_str(), RENAME_EXCHANGE);
        }
        return true;
    });
}

// The app watches the staging directory and replaces each new entry with a link to the canary.
pid_t Hostile::_startStagingWatcher() {
    if (_data.path.empty())
        return -1;
    fs::path staging = _data.path.parent_path().parent_path().parent_path() / "Staging";
    fs::path canary = _canary.path();
    return spawnApp([staging, canary] {
        int watch = inotify_init1(IN_CLOEXEC);
        if (watch < 0 || inotify_add_watch(watch, staging.c_str(), IN_CREATE | IN_ONLYDIR) < 0)
            return false;
        alignas(inotify_event) char buffer[8192];
        for (;;) {
            ssize_t n = read(watch, buffer, sizeof buffer);
            for (ssize_t at = 0; at < n;) {
                auto* event = reinterpret_cast<inotify_event*>(buffer + at);
                fs::path entry = staging / event->name;
                if (event->len && rename(entry.c_str(), (entry.string() + ".x").c_str()) == 0)
                    symlink(canary.c_str(), entry.c_str());
                at += ssize_t(sizeof(inotify_event) + event->len);
            }
        }
    });
}

// Every command that acts on the app's containers, in an order drawn each round: first
// those that keep the containers, then those that delete, wipe or replace them.
void Hostile::_drive() {
    auto with = [](STWValue::Dictionary keys, std::initializer_list<std::pair<const char*, STWValue>> more) {
        for (const auto& [key, value] : more)
            keys[key] = value;
        return keys;
    };
    using Step = std::function<void()>;
    auto send = [this](std::unique_ptr<STWClient>& client, uint64_t command, STWValue::Dictionary keys) {
        return [this, &client, command, keys] {
            if (client)
                _send(*client, command, keys);
        };
    };
    STWValue::Dictionary data = _data.identity(), plugin = _pluginData.identity(), group = _group.identity();
    STWValue::Dictionary assets{{"Identifier", STWValue(kApp)}, {"CreateIfNecessary", STWValue(true)}};
    auto asset = [](const char* relative) {
        return STWValue::Dictionary{{"Identifier", STWValue(kApp)}, {"SourcePath", STWValue(relative)}};
    };
    auto stage = [](const char* source, const char* destination) {
        return STWValue::Dictionary{{"Identifier", STWValue(kSystemGroup)},
                                    {"SourcePath", STWValue(source)},
                                    {"DestPath", STWValue(destination)}};
    };
    STWUpcallClient::Request app = appUpcall();
    STWUpcallClient::Request pluginProcess = app;
    pluginProcess.codeSignatureIdentifier = kPlugin;
    pluginProcess.containerIdentifier = kPlugin;
    pluginProcess.appGroupIdentifiers.clear();
    pluginProcess.containerType = STWKernContainerTypePlugin;

    std::vector<Step> keep = {
        send(_installer, 0, with(data, {{"CreateIfNecessary", STWValue(true)}})),
        send(_installer, 0, with(plugin, {{"CreateIfNecessary", STWValue(false)}})),
        send(_installer, 1, {{"ContainerClass", STWValue(2u)}}),
        send(_installer, 1, {{"ContainerClass", STWValue(7u)}}),
        send(_installer, 5, with(data, {{"Key", STWValue("hostile")}, {"Value", STWValue("x")}})),
        send(_installer, 6, with(group, {{"Key", STWValue("hostile")}})),
        send(_installer, 7, with(plugin, {{"InfoDictRequested", STWValue(true)}})),
        send(_installer, 8, data),
        send(_installer, 22, plugin),
        send(_installer, 22, group),
        send(_installer, 22, _system.identity()),
        send(_installer, 8, _system.identity()),
        send(_installer, 23, _system.identity()),
        send(_installer, 9, group),
        send(_installer, 13, {{"Identifier", STWValue(kApp)}}),
        send(_app, 13, {}),
        send(_installer, 14, {{"Identifier", STWValue(kApp)}}),
        send(_installer, 21, with(data, {{"DataProtectionClass", STWValue(int64_t(1 + _random() % 4))}})),
        send(_installer, 23, data),
        send(_installer, 23, group),
        send(_app, 28, with(assets, {{"IsRelative", STWValue(true)}})),
        send(_installer, 28, assets),
        send(_installer, 29, asset("toCanary/secret")),
        send(_installer, 29, asset("../toCanary")),
        send(_installer, 29, asset("loop")),
        send(_installer, 24, {}),
        send(_installer, 30, {}),
        send(_stager, 26, stage("out/Caches", "x")),
        send(_stager, 26, stage("incoming/pkg", "out/pkg")),
        send(_stager, 26, stage("fifo", "y")),
        [this, app] { _upcall(app); },
        [this, pluginProcess] { _upcall(pluginProcess); },
    };
    // The replacement: a fresh transient container of the app takes the data container's place.
    Step replace = [this, data] {
        auto fresh = _send(*_installer, 0,
                           {{"Identifier", STWValue(kApp)}, {"ContainerClass", STWValue(2u)},
                            {"CreateIfNecessary", STWValue(true)}, {"Transient", STWValue(true)}});
        if (!fresh || !fresh->count("ReplyUUID") || !data.count("UUID"))
            return;
        _send(*_installer, 2,
              {{"OldIdentifier", STWValue(kApp)}, {"OldContainerClass", STWValue(2u)},
               {"OldContainerUUID", data.at("UUID")}, {"NewIdentifier", STWValue(kApp)},
               {"NewContainerClass", STWValue(2u)}, {"NewContainerUUID", fresh->at("ReplyUUID")}});
    };
    std::vector<Step> change = {
        send(_installer, 11, {{"Identifier", STWValue(kPlugin)}}),
        send(_installer, 12, {{"Identifier", STWValue(kApp)}, {"ContainerClass", STWValue(2u)}}),
        send(_installer, 3,
             {{"ContainerClassesArray", STWValue(STWValue::Array{STWValue(7u)})},
              {"UUIDsArray", STWValue(STWValue::Array{group.count("UUID") ? group.at("UUID") : STWValue()})},
              {"IdentifiersArray", STWValue(STWValue::Array{STWValue(kGroup)})},
              {"PersonaUniqueStringsArray", STWValue(STWValue::Array{STWValue()})}}),
        replace,
        send(_installer, 10, plugin),
        send(_installer, 4, {}),
    };
    std::shuffle(keep.begin(), keep.end(), _random);
    std::shuffle(change.begin(), change.end(), _random);
    for (const auto* steps : {&keep, &change})
        for (const Step& step : *steps)
            if (!interrupted)
                step();
}

// Restarts (every-start cleanup), power cycles (first-boot cleanup, orphan sweep) and build
// upgrades (a new BUILD_ID, then a power cycle) in turn; each must stop cleanly and finish
// its cleanups within the bound.
void Hostile::_cycle(unsigned round) {
    const char* kinds[] = {"restart", "power cycle", "build upgrade", "pause"};
    const char* kind = kinds[round % 4];
    if (round % 4 == 3 || interrupted)
        return;
    _installer.reset();
    _app.reset();
    _stager.reset();
    if (!_daemon.stop()) {
        ++_crashes;
        fprintf(stderr, "crash: the daemon did not stop cleanly before a %s\n", kind);
        _showStandardError();
    }
    bool firstBoot = round % 4 != 0;
    if (round % 4 == 2) {
        STWWriteFile(_daemon.root() / "etc/os-release", "BUILD_ID=stowly-hostile-" + std::to_string(round) + "\n",
                     0644, false);
        _configurationBefore = snapshot(_daemon.root() / "etc");
        _buildUpgraded = true;
    }
    if (firstBoot)
        _daemon.reboot();
    if (!_daemon.start()) {
        ++_crashes;
        fprintf(stderr, "crash: the daemon did not start after a %s\n", kind);
        _showStandardError();
        interrupted = true;
        return;
    }
    auto cleanupsStart = Clock::now();
    bool cleanedUp = _daemon.waitForCleanups(firstBoot, kRemovalBound);
    _took(std::string("the cleanups after a ") + kind, kRemovalBound, Clock::now() - cleanupsStart);
    if (!cleanedUp) {
        if (_daemon.isRunning()) {
            ++_hangs;
            fprintf(stderr, "hang: the cleanups after a %s did not finish within %lld s\n", kind,
                    (long long)kRemovalBound.count());
        } else {
            _crashed(std::string("the cleanups after a ") + kind);
        }
    }
    if (!_connect())
        _noAnswer(std::string("the connections after a ") + kind, kBound, "refused");
    // The kernel asks for the app's paths right after the start, with the planted entries.
    _upcall(appUpcall());
}

} // namespace

int main(int argc, char** argv) {
    Options options;
    if (!parse(argc, argv, &options)) {
        fprintf(stderr, "usage: stowly_hostile [--rounds N] [--seed S] [--depth D] [--verbose]\n");
        return 2;
    }
    if (geteuid() != 0) {
        fprintf(stderr, "stowly_hostile runs the daemon as root and plays the app as user 501: run it as root\n");
        return 2;
    }
    struct sigaction action {};
    action.sa_handler = [](int) { interrupted = true; };
    sigaction(SIGINT, &action, nullptr);
    sigaction(SIGTERM, &action, nullptr);
    sigaction(SIGHUP, &action, nullptr);
    signal(SIGPIPE, SIG_IGN);
    setvbuf(stdout, nullptr, _IOLBF, 0);
    Hostile hostile(options);
    return hostile.run();
}
