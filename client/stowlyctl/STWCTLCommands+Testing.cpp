// What tests and demonstrations drive: retry-test, test-lock and unsupported, which the
// daemon answers only on internal builds or not at all, and device lock|unlock|reboot, the
// device state a daemon on a private root reads from files.
#include "client/stowlyctl/STWCTLCommands.h"

#include "client/stowlyctl/STWCTLArguments.h"
#include "common/STWFileIO.h"
#include "platform/STWPlatformConfiguration.h"

#include <cerrno>
#include <cstring>
#include <memory>
#include <semaphore.h>
#include <system_error>

void STWCTLCommands::_addTestingCommands(CLI::App& app) {
    struct Arguments {
        uint64_t crashes = 1;
        uint64_t lock = 0;
        std::string state;
    };
    auto arguments = std::make_shared<Arguments>();

    _addVerb(app, "retry-test", 25, "Make the daemon exit N times (internal builds)",
             [arguments](STWCTLSession&, STWValue::Dictionary& m) {
                 m["NumRetryCrashes"] = STWValue(arguments->crashes);
                 return 0;
             })
        ->add_option("N", arguments->crashes, "Exits before the test succeeds")
        ->capture_default_str();

    // The daemon keeps a lock it was told to hold across requests and connections, until a
    // later test-lock releases it.
    CLI::App* lock =
        _addVerb(app, "test-lock", 31, "Hold or release one of the daemon's test locks (internal builds)",
                 [arguments](STWCTLSession&, STWValue::Dictionary& m) {
                     m["TestLock"] = STWValue(arguments->lock);
                     m["Enable"] = STWValue(arguments->state == "on");
                     return 0;
                 });
    lock->add_option("LOCK", arguments->lock,
                     "0 or 1: the daemon-wide lock for reading or writing; 2 to 5: park points "
                     "(2 before a disk-usage walk); 6 with off: turn the test locks off")
        ->required();
    lock->add_option("STATE", arguments->state, "on (hold) or off (release)")
        ->required()
        ->check(CLI::IsMember({"on", "off"}));

    _addVerb(app, "unsupported", 27, "Send the command number no daemon supports (it answers 49)",
             [](STWCTLSession&, STWValue::Dictionary&) { return 0; });
}

// device lock|unlock: the keybag state the daemon watches under its root.
void STWCTLCommands::_addDevice(CLI::App& app) {
    CLI::App* device = app.add_subcommand("device", "Change the simulated device state");
    device->require_subcommand(1);
    for (const char* state : {"locked", "unlocked"}) {
        std::string verb = strcmp(state, "locked") == 0 ? "lock" : "unlock";
        CLI::App* command = device->add_subcommand(verb, "Mark the keybag " + std::string(state));
        _onRun(command, [state](STWCTLSession& session) {
            std::filesystem::path directory = session.root() / "run/stowly";
            std::error_code ec;
            std::filesystem::create_directories(directory, ec);
            // Written whole through a rename, so the daemon's watcher never reads half a word.
            int e = ec ? ec.value() : STWWriteFileAtomically(directory / "keybag", state, 0644, false);
            if (e) {
                fprintf(stderr, "stowlyctl: cannot write %s: %s\n", (directory / "keybag").c_str(),
                        strerror(e));
                return int(STWCTLExitConnection);
            }
            session.print({{"Keybag", STWValue(state)}});
            return int(STWCTLExitSuccess);
        });
    }
    // A reboot clears the marker of a first start since power-on, so the next daemon on
    // this root runs its first-boot work again.
    CLI::App* reboot = device->add_subcommand("reboot", "Forget that the daemon has started since power-on");
    _onRun(reboot, [](STWCTLSession& session) {
        STWErrorRef error;
        auto configuration = STWPlatformConfiguration::loadFromRoot(session.root(), &error);
        if (!configuration) {
            fprintf(stderr, "stowlyctl: %s\n", error->message().c_str());
            return int(STWCTLExitConnection);
        }
        std::string name = configuration->firstBootSemaphoreName();
        if (sem_unlink(name.c_str()) != 0 && errno != ENOENT) {
            fprintf(stderr, "stowlyctl: cannot remove %s: %s\n", name.c_str(), strerror(errno));
            return int(STWCTLExitConnection);
        }
        session.print({{"FirstBootMarker", STWValue("cleared")}});
        return int(STWCTLExitSuccess);
    });
}
