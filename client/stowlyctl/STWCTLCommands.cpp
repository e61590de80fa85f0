#include "client/stowlyctl/STWCTLCommands.h"

#include "client/stowlyctl/STWCTLArguments.h"
#include "common/STWFileIO.h"
#include "platform/STWPlatformConfiguration.h"

#include <cerrno>
#include <cstring>
#include <memory>
#include <semaphore.h>
#include <system_error>
#include <tuple>

void STWCTLCommands::addAll(CLI::App& app) {
    _addRaw(app);
    _addContainerCommands(app);
    _addDeletionCommands(app);
    _addCodeSigningCommands(app);
    _addServiceCommands(app);
    _addDevice(app);
    _addUpcall(app);
    app.require_subcommand(1);
}

int STWCTLCommands::run() {
    return _chosen ? _chosen(_session) : _session.usageError("no subcommand");
}

void STWCTLCommands::_onRun(CLI::App* command, Action action) {
    command->callback([this, action = std::move(action)] { _chosen = action; });
}

// raw COMMAND [KEY=TYPE:VALUE ...]: any command number with typed keys, for commands that
// have no subcommand of their own and for trying what the daemon does with odd input.
void STWCTLCommands::_addRaw(CLI::App& app) {
    struct Arguments {
        std::string command;
        std::vector<std::string> keys;
    };
    auto arguments = std::make_shared<Arguments>();
    CLI::App* raw = app.add_subcommand("raw", "Send a command by number with typed keys");
    raw->add_option("COMMAND", arguments->command, "Command number (0 to 18446744073709551615)")->required();
    raw->add_option("KEYS", arguments->keys,
                    "KEY=TYPE:VALUE, TYPE one of str, u64, i64, bool, real, uuid, data (hex), plist (file), "
                    "strarr, u64arr (comma-separated)");
    _onRun(raw, [arguments](STWCTLSession& session) {
        std::optional<uint64_t> command = STWCTLParseUInt64(arguments->command);
        if (!command)
            return session.usageError("\"" + arguments->command + "\" is not a command number");
        std::string reason;
        auto message = STWCTLMessageWithArguments(*command, arguments->keys, &reason);
        if (!message)
            return session.usageError(reason);
        return session.send(*message);
    });
}

// The container commands: create, lookup, list, metadata and recreate-structure.
void STWCTLCommands::_addContainerCommands(CLI::App& app) {
    struct Arguments {
        std::string identifier;
        uint64_t containerClass = 2;
        std::string uuid;
        std::string persona;
        bool transient = false;
        bool info = false;
    };
    auto arguments = std::make_shared<Arguments>();
    auto addIdentity = [&](CLI::App* command, bool identifierRequired) {
        CLI::Option* identifier = command->add_option("IDENTIFIER", arguments->identifier, "Container identifier");
        if (identifierRequired)
            identifier->required();
        command->add_option("-c,--class", arguments->containerClass, "Container class (1 to 13)")
            ->capture_default_str();
    };
    // Builds the message of `command` from the arguments that were given.
    auto message = [arguments](uint64_t command, bool create) {
        STWValue::Dictionary m{{"Command", STWValue(command)}, {"ContainerClass", STWValue(arguments->containerClass)}};
        if (!arguments->identifier.empty())
            m["Identifier"] = STWValue(arguments->identifier);
        if (command == 0) {
            m["CreateIfNecessary"] = STWValue(create);
            m["Transient"] = STWValue(arguments->transient);
        }
        if (command == 1)
            m["Transient"] = STWValue(arguments->transient);
        if (!arguments->persona.empty())
            m["PersonaUniqueString"] = STWValue(arguments->persona);
        return m;
    };

    CLI::App* create = app.add_subcommand("create", "Create a container (or find the existing one)");
    addIdentity(create, false);
    create->add_flag("--transient", arguments->transient, "A transient container");
    _onRun(create, [message](STWCTLSession& session) { return session.send(message(0, true)); });

    CLI::App* lookup = app.add_subcommand("lookup", "Find an existing container");
    addIdentity(lookup, false);
    lookup->add_flag("--transient", arguments->transient, "A transient container");
    _onRun(lookup, [message](STWCTLSession& session) { return session.send(message(0, false)); });

    CLI::App* list = app.add_subcommand("list", "List the containers of a class");
    list->add_option("-c,--class", arguments->containerClass, "Container class (1 to 13)")->capture_default_str();
    list->add_flag("--transient", arguments->transient, "Transient containers");
    _onRun(list, [message](STWCTLSession& session) { return session.send(message(1, false)); });

    for (auto [name, command, help] : {std::tuple{"metadata", uint64_t{7}, "Show where a container is"},
                                       std::tuple{"recreate-structure", uint64_t{8},
                                                  "Create missing standard subdirectories"}}) {
        CLI::App* sub = app.add_subcommand(name, help);
        addIdentity(sub, true);
        sub->add_option("--uuid", arguments->uuid, "The container's UUID (as created)")->required();
        sub->add_option("--persona", arguments->persona, "Persona unique string of the container's user");
        if (command == 7)
            sub->add_flag("--info", arguments->info, "Include the info dictionary");
        _onRun(sub, [message, arguments, command = command](STWCTLSession& session) {
            STWValue::Dictionary m = message(command, false);
            std::optional<STWUUID> uuid = STWUUID::fromString(arguments->uuid);
            if (!uuid)
                return session.usageError("\"" + arguments->uuid + "\" is not a UUID");
            m["UUID"] = STWValue(*uuid);
            if (command == 7)
                m["InfoDictRequested"] = STWValue(arguments->info);
            return session.send(m);
        });
    }
}

// Containers leaving and changing places: delete, stage-delete, wipe, replace and
// empty-deathrow.
void STWCTLCommands::_addDeletionCommands(CLI::App& app) {
    struct Arguments {
        std::string identifier;
        uint64_t containerClass = 2;
        std::string uuid, oldUUID;
        std::string persona;
        bool transient = false;
    };
    auto arguments = std::make_shared<Arguments>();
    auto addIdentity = [&](CLI::App* command) {
        command->add_option("IDENTIFIER", arguments->identifier, "Container identifier")->required();
        command->add_option("-c,--class", arguments->containerClass, "Container class (1 to 13)")
            ->capture_default_str();
    };
    auto parseUUID = [](const std::string& text, STWCTLSession& session, std::optional<STWUUID>* uuid) {
        *uuid = STWUUID::fromString(text);
        return *uuid ? 0 : session.usageError("\"" + text + "\" is not a UUID");
    };

    CLI::App* remove = app.add_subcommand("delete", "Delete a container (through death row)");
    addIdentity(remove);
    remove->add_flag("--transient", arguments->transient, "A transient container");
    _onRun(remove, [arguments](STWCTLSession& session) {
        return session.send({{"Command", STWValue(10)},
                             {"Identifier", STWValue(arguments->identifier)},
                             {"ContainerClass", STWValue(arguments->containerClass)},
                             {"Transient", STWValue(arguments->transient)}});
    });

    CLI::App* stage = app.add_subcommand("stage-delete", "Move one container, named by its UUID, to death row");
    addIdentity(stage);
    stage->add_option("--uuid", arguments->uuid, "The container's UUID")->required();
    stage->add_option("--persona", arguments->persona, "Persona unique string of the container's user");
    _onRun(stage, [arguments, parseUUID](STWCTLSession& session) {
        std::optional<STWUUID> uuid;
        if (int status = parseUUID(arguments->uuid, session, &uuid))
            return status;
        return session.send({{"Command", STWValue(3)},
                             {"ContainerClassesArray", STWValue(STWValue::Array{STWValue(arguments->containerClass)})},
                             {"UUIDsArray", STWValue(STWValue::Array{STWValue(*uuid)})},
                             {"IdentifiersArray", STWValue(STWValue::Array{STWValue(arguments->identifier)})},
                             {"PersonaUniqueStringsArray", STWValue(STWValue::Array{STWValue(arguments->persona)})}});
    });

    CLI::App* wipe = app.add_subcommand("wipe", "Empty a data container, keeping its path and UUID");
    addIdentity(wipe);
    _onRun(wipe, [arguments](STWCTLSession& session) {
        return session.send({{"Command", STWValue(12)},
                             {"Identifier", STWValue(arguments->identifier)},
                             {"ContainerClass", STWValue(arguments->containerClass)}});
    });

    CLI::App* replace = app.add_subcommand("replace", "Put a (transient) container in the place of another");
    addIdentity(replace);
    replace->add_option("--uuid", arguments->uuid, "UUID of the container that takes the place")->required();
    replace->add_option("--old-uuid", arguments->oldUUID, "UUID of the container it replaces (none: promote)");
    replace->add_option("--persona", arguments->persona, "Persona unique string of the containers' user");
    _onRun(replace, [arguments, parseUUID](STWCTLSession& session) {
        std::optional<STWUUID> uuid, oldUUID;
        if (int status = parseUUID(arguments->uuid, session, &uuid))
            return status;
        STWValue::Dictionary m{{"Command", STWValue(2)},
                               {"NewIdentifier", STWValue(arguments->identifier)},
                               {"NewContainerClass", STWValue(arguments->containerClass)},
                               {"NewContainerUUID", STWValue(*uuid)}};
        if (!arguments->oldUUID.empty()) {
            if (int status = parseUUID(arguments->oldUUID, session, &oldUUID))
                return status;
            m["OldIdentifier"] = STWValue(arguments->identifier);
            m["OldContainerClass"] = STWValue(arguments->containerClass);
            m["OldContainerUUID"] = STWValue(*oldUUID);
        }
        if (!arguments->persona.empty()) {
            m["NewPersonaUniqueString"] = STWValue(arguments->persona);
            m["OldPersonaUniqueString"] = STWValue(arguments->persona);
        }
        return session.send(m);
    });

    CLI::App* empty = app.add_subcommand("empty-deathrow", "Remove everything in death row (waits for it)");
    _onRun(empty, [](STWCTLSession& session) { return session.send({{"Command", STWValue(4)}}); });
}

// What the installer tells the daemon about an identifier, and the group and system
// containers that follow from it: set-codesigning, codesigning, invalidate-codesigning,
// groups, group-ids, system-container, system-groups and system-group.
void STWCTLCommands::_addCodeSigningCommands(CLI::App& app) {
    struct Arguments {
        std::string identifier;
        std::string infoFile;
        std::string parent;
        uint64_t dataContainerClass = 0;
        bool placeholder = false;
        std::string group;
    };
    auto arguments = std::make_shared<Arguments>();
    // Adds the optional identifier: without it the command is about the caller itself.
    auto identified = [&](CLI::App* command, uint64_t number) {
        command->add_option("IDENTIFIER", arguments->identifier, "Identifier (default: the caller's own)");
        _onRun(command, [arguments, number](STWCTLSession& session) {
            STWValue::Dictionary m{{"Command", STWValue(number)}};
            if (!arguments->identifier.empty())
                m["Identifier"] = STWValue(arguments->identifier);
            return session.send(m);
        });
    };

    CLI::App* set = app.add_subcommand("set-codesigning",
                                       "Store an identifier's code-signing info (a plist file); none forgets it");
    set->add_option("IDENTIFIER", arguments->identifier, "Code-signing identifier")->required();
    set->add_option("PLIST", arguments->infoFile, "Property-list file with the code-signing info dictionary");
    set->add_option("--data-class", arguments->dataContainerClass, "Class of the identifier's data container");
    set->add_option("--parent", arguments->parent, "Identifier of the parent application (for a plug-in)");
    set->add_flag("--placeholder", arguments->placeholder, "A placeholder installation");
    _onRun(set, [arguments](STWCTLSession& session) {
        STWValue::Dictionary m{{"Command", STWValue(18)}, {"Identifier", STWValue(arguments->identifier)}};
        if (!arguments->infoFile.empty()) {
            std::string reason;
            std::optional<STWValue> info = STWCTLParseTypedValue("plist", arguments->infoFile, &reason);
            if (!info)
                return session.usageError(reason);
            if (!info->dictionary())
                return session.usageError(arguments->infoFile + " does not hold a dictionary");
            m["CodeSigningInfo"] = std::move(*info);
        }
        STWValue::Dictionary options;
        if (arguments->dataContainerClass)
            options["com.vorlane.Stowly.DataContainerClass"] = STWValue(arguments->dataContainerClass);
        if (!arguments->parent.empty())
            options["com.vorlane.Stowly.ParentBundleID"] = STWValue(arguments->parent);
        if (arguments->placeholder)
            options["com.vorlane.Stowly.PlaceholderEntitlements"] = STWValue(true);
        m["OptionsDictionary"] = STWValue(std::move(options));
        return session.send(m);
    });

    CLI::App* show = app.add_subcommand("codesigning", "Show an identifier's code-signing info");
    show->add_option("IDENTIFIER", arguments->identifier, "Code-signing identifier")->required();
    _onRun(show, [arguments](STWCTLSession& session) {
        return session.send({{"Command", STWValue(19)}, {"Identifier", STWValue(arguments->identifier)}});
    });

    CLI::App* invalidate = app.add_subcommand("invalidate-codesigning",
                                              "Invalidate the code-signing info of apps whose bundle is gone");
    _onRun(invalidate, [](STWCTLSession& session) { return session.send({{"Command", STWValue(20)}}); });

    identified(app.add_subcommand("groups", "Create or find the app-group containers of an owner"), 13);
    identified(app.add_subcommand("group-ids", "List the app groups an owner is entitled to"), 14);
    identified(app.add_subcommand("system-container", "Create or find a system container"), 15);
    identified(app.add_subcommand("system-groups", "Create or find the system-group containers of an owner"), 16);

    CLI::App* systemGroup = app.add_subcommand("system-group", "Create or find one system-group container");
    systemGroup->add_option("GROUP", arguments->group, "System group identifier")->required();
    systemGroup->add_option("--owner", arguments->identifier, "Owner (default: the caller itself)");
    _onRun(systemGroup, [arguments](STWCTLSession& session) {
        STWValue::Dictionary m{{"Command", STWValue(17)}, {"GroupIdentifier", STWValue(arguments->group)}};
        if (!arguments->identifier.empty())
            m["Identifier"] = STWValue(arguments->identifier);
        return session.send(m);
    });
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
