// stowlyctl run as a program against a scripted daemon: what it sends, what it prints and
// how it exits.
#include "Daemon/Request/STWCommandTable.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWFileIO.h"
#include "tests/client/STWFakeDaemon.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <map>
#include <regex>
#include <sstream>
#include <sys/wait.h>
#include <unistd.h>

namespace {

using Dictionary = STWValue::Dictionary;

struct Outcome {
    int status = -1;
    std::string out;
    std::string err;
};

std::string slurp(const std::filesystem::path& path) {
    std::string contents;
    STWReadFileContents(path, &contents);
    return contents;
}

Outcome stowlyctl(const std::filesystem::path& scratch, std::vector<std::string> arguments) {
    std::filesystem::path out = scratch / "stdout", err = scratch / "stderr";
    arguments.insert(arguments.begin(), STOWLYCTL_PATH);
    pid_t pid = fork();
    if (pid == 0) {
        int o = open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        int e = open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        dup2(o, 1);
        dup2(e, 2);
        std::vector<char*> argv;
        for (std::string& a : arguments)
            argv.push_back(a.data());
        argv.push_back(nullptr);
        execv(argv[0], argv.data());
        _exit(127);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, slurp(out), slurp(err)};
}

// Answers one request with `reply`, keeping what was asked.
void answerOnce(STWFakeDaemon& daemon, Dictionary reply, std::vector<STWFrame>* received) {
    daemon.serve([reply, received](int fd) {
        STWFrameReader reader(fd);
        STWFrame frame;
        while (reader.read(frame, nullptr) == STWFrameReadResult::Frame) {
            received->push_back(frame);
            STWFakeDaemon::reply(fd, frame.id,
                                 frame.kind == STWFrameKindHello ? Dictionary{{"ReplyError", STWValue(1)}}
                                                                 : reply);
        }
    });
}

class stowlyctlTest : public ::testing::Test {
protected:
    Outcome run(std::vector<std::string> arguments) {
        arguments.insert(arguments.begin(), {"--root", daemon.root().string()});
        return stowlyctl(daemon.root(), std::move(arguments));
    }
    STWFakeDaemon daemon;
    std::vector<STWFrame> received;
};

} // namespace

// --help ends with the table of command numbers and the verbs that send them; every
// command of the daemon's table must have one, and each must be a subcommand.
TEST_F(stowlyctlTest, HelpListsAVerbForEveryCommandOfTheDaemon) {
    Outcome r = stowlyctl(daemon.root(), {"--help"});
    ASSERT_EQ(r.status, 0) << r.err;
    size_t table = r.out.find("Command numbers");
    ASSERT_NE(table, std::string::npos) << r.out;
    std::string listing = r.out.substr(0, table), numbers = r.out.substr(table);
    std::map<uint64_t, std::vector<std::string>> verbs;
    std::regex entry(R"(\b(\d+) ([a-z0-9/-]+))");
    for (auto it = std::sregex_iterator(numbers.begin(), numbers.end(), entry); it != std::sregex_iterator();
         ++it) {
        std::stringstream names((*it)[2].str());
        for (std::string name; std::getline(names, name, '/');)
            verbs[std::stoull((*it)[1].str())].push_back(name);
    }
    for (const STWCommandTableEntry& command : STWCommandTable) {
        EXPECT_FALSE(verbs[command.command].empty()) << "no verb sends command " << command.command;
        for (const std::string& verb : verbs[command.command])
            EXPECT_NE(listing.find("\n  " + verb + " "), std::string::npos) << verb << " is not a subcommand";
    }
}

// The shell script asks stowlyctl for the words, which follow the command line as parsed:
// a verb's own options after the verb, nothing (file names) after an option's value.
TEST_F(stowlyctlTest, BashCompletionOffersTheWordsOfTheCommandLine) {
    auto complete = [&](const std::string& line) {
        std::string script = std::string("source ") + STOWLYCTL_COMPLETION_PATH + "; COMP_WORDS=(" +
                             STOWLYCTL_PATH + " " + line +
                             "); COMP_CWORD=$((${#COMP_WORDS[@]} - 1)); _stowlyctl; echo ${COMPREPLY[@]}";
        std::string command = "bash -c '" + script + "' > " + (daemon.root() / "words").string();
        EXPECT_EQ(system(command.c_str()), 0) << command;
        return slurp(daemon.root() / "words");
    };
    EXPECT_EQ(complete("--root /r mig"), "migrate migrate-user\n");
    EXPECT_EQ(complete("device \"\""), "lock unlock reboot --help\n");
    EXPECT_EQ(complete("set-protection x 1 --re"), "--retry\n");
    EXPECT_EQ(complete("--root \"\""), "\n");
    EXPECT_EQ(complete("--json create --t"), "--transient\n"); // not the global --timeout
}

// With --as the hello and its identity go first; then the request with its typed keys (each
// type's parsing is in the argument tests) and the reply printed.
TEST_F(stowlyctlTest, AsSendsHelloFirstThenTheTypedKeysAndPrintsTheReply) {
    std::filesystem::path entitlements = daemon.root() / "entitlements.plist",
                          plist = daemon.root() / "value.plist";
    Dictionary granted{{"com.example.containers", STWValue(STWValue::Array{STWValue("a")})}};
    STW_writeToURL(granted, entitlements, STWWriteDefault, nullptr);
    STW_writeToURL({{"Nested", STWValue(true)}}, plist, STWWriteDefault, nullptr);
    answerOnce(daemon, {{"ReplyError", STWValue(1)}, {"Path", STWValue("/c/A")}, {"Count", STWValue(3)}},
               &received);
    Outcome r = run({"--as", "com.example.tool", "--entitlements", entitlements.string(), "--sandboxed",
                     "--persona", "PERSONA-1", "raw", "18446744073709551615", "Name=str:a=b:c",
                     "Counts=u64arr:1,2", "Info=plist:" + plist.string()});
    daemon.join();
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out, "ReplyError: 1 (Success)\nCount: 3\nPath: \"/c/A\"\n");
    ASSERT_EQ(received.size(), 2u);
    EXPECT_EQ(received[0].kind, STWFrameKindHello);
    EXPECT_EQ(received[0].body, (Dictionary{{"CodeSigningIdentifier", STWValue("com.example.tool")},
                                            {"Entitlements", STWValue(granted)},
                                            {"Sandboxed", STWValue(true)},
                                            {"PersonaUniqueString", STWValue("PERSONA-1")}}));
    EXPECT_EQ(received[1].kind, STWFrameKindRequest);
    EXPECT_EQ(received[1].body, (Dictionary{{"Command", STWValue(UINT64_MAX)},
                                            {"Name", STWValue("a=b:c")},
                                            {"Counts", STWValue(STWValue::Array{STWValue(1), STWValue(2)})},
                                            {"Info", STWValue(Dictionary{{"Nested", STWValue(true)}})}}));
}

// A reply error other than success exits 1 and is named (49 is what a command the daemon
// does not carry yet gets), as is a refused hello; a daemon that is gone or silent exits 2.
TEST_F(stowlyctlTest, ReplyErrorsExitOneAndConnectionProblemsTwo) {
    answerOnce(daemon, {{"ReplyError", STWValue(49)}, {"When", STWValue(STWDate{0, 0})}}, &received);
    Outcome r = run({"--json", "migrate"});
    daemon.join();
    EXPECT_EQ(r.status, 1);
    EXPECT_EQ(r.out, "{\"ReplyError\":49,\"When\":\"1970-01-01T00:00:00Z\"}\n");
    EXPECT_EQ(r.err, "error: 49 UnsupportedCommand: invalid or unsupported command\n");
    ASSERT_EQ(received.size(), 1u);
    EXPECT_EQ(received[0].body, (Dictionary{{"Command", STWValue(24)}}));

    daemon.serve([](int fd) {
        STWFrameReader reader(fd);
        if (auto hello = STWFakeDaemon::readFrame(reader))
            STWFakeDaemon::reply(fd, hello->id, {{"ReplyError", STWValue(55)}});
    });
    r = run({"--as", "com.example.tool", "raw", "1"});
    daemon.join();
    EXPECT_EQ(r.status, 1);
    EXPECT_EQ(r.err, "error: hello refused: 55 NotEntitled: not entitled\n");

    daemon.serve([](int fd) {
        STWFrameReader reader(fd);
        STWFrame frame;
        while (reader.read(frame, nullptr) == STWFrameReadResult::Frame) {
        }
    });
    r = run({"--timeout", "0.2", "raw", "1"});
    daemon.join();
    EXPECT_EQ(r.status, 2);
    EXPECT_NE(r.err.find("timed out"), std::string::npos) << r.err;

    daemon.stopListening();
    r = run({"raw", "1"});
    EXPECT_EQ(r.status, 2);
    EXPECT_NE(r.err.find("Connection refused"), std::string::npos) << r.err;
    // --socket wins over --root.
    r = stowlyctl(daemon.root(), {"--socket", (daemon.root() / "none.sock").string(), "raw", "1"});
    EXPECT_EQ(r.status, 2);
    EXPECT_NE(r.err.find("No such file"), std::string::npos) << r.err;
}

TEST_F(stowlyctlTest, BadArgumentsAreRefusedBeforeConnecting) {
    // Nobody listens: an argument that got as far as connecting would exit 2 instead.
    daemon.stopListening();
    for (std::vector<std::string> arguments : std::vector<std::vector<std::string>>{
             {"raw", "-1"},
             {"raw", "18446744073709551616"},
             {"raw", "1", "K=u64:-1"},
             {"raw", "1", "K=u64:1", "K=str:x"},
             {"raw", "1", "Command=u64:2"},
             {"--as", "x", "--entitlements", "/nonexistent.plist", "raw", "1"},
             {"--timeout", "0", "raw", "1"},
             {"--sandboxed", "raw", "1"},
             {"device"},
             {}}) {
        Outcome r = run(arguments);
        EXPECT_EQ(r.status, 64) << testing::PrintToString(arguments) << ": " << r.err;
    }
}

TEST_F(stowlyctlTest, DeviceLockWritesTheKeybag) {
    std::filesystem::path keybag = daemon.root() / "run/stowly/keybag";
    Outcome r = run({"device", "lock"});
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(slurp(keybag), "locked");
    r = run({"--json", "device", "unlock"});
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out, "{\"Keybag\":\"unlocked\"}\n");
    EXPECT_EQ(slurp(keybag), "unlocked");
}
