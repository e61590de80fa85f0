#include "client/stowlyctl/STWCTLCommands.h"

#include "client/stowlyctl/STWCTLArguments.h"

#include <memory>
#include <tuple>

void STWCTLCommands::addAll(CLI::App& app) {
    _addRaw(app);
    _addContainerCommands(app);
    _addDeletionCommands(app);
    _addCodeSigningCommands(app);
    _addServiceCommands(app);
    _addMigrationCommands(app);
    _addTestingCommands(app);
    _addDevice(app);
    _addUpcall(app);
    _addCompletion(app);
    app.require_subcommand(1);
    app.footer(_commandTable());
}

int STWCTLCommands::run() {
    return _chosen ? _chosen(_session) : _session.usageError("no subcommand");
}

void STWCTLCommands::_onRun(CLI::App* command, Action action) {
    command->callback([this, action = std::move(action)] { _chosen = action; });
}

CLI::App* STWCTLCommands::_addVerb(CLI::App& app, const std::string& name, uint64_t command,
                                   const std::string& description, MessageKeys keys) {
    CLI::App* verb = app.add_subcommand(name, description);
    _verbs[command].push_back(name);
    _onRun(verb, [command, keys = std::move(keys)](STWCTLSession& session) {
        STWValue::Dictionary message{{"Command", STWValue(command)}};
        if (int status = keys(session, message))
            return status;
        return session.send(message);
    });
    return verb;
}

std::string STWCTLCommands::_commandTable() const {
    std::string table = "Command numbers and their verbs (raw sends any number):\n";
    std::string line = " ";
    for (const auto& [command, verbs] : _verbs) {
        std::string entry = " " + std::to_string(command);
        for (size_t i = 0; i < verbs.size(); ++i)
            entry += (i ? "/" : " ") + verbs[i];
        if (command != _verbs.rbegin()->first)
            entry += ',';
        if (line.size() + entry.size() > 79) {
            table += line + "\n";
            line = " ";
        }
        line += entry;
    }
    return table + line;
}

void STWCTLContainerArguments::addTo(CLI::App* command) {
    command->add_option("IDENTIFIER", identifier, "Container identifier")->required();
    command->add_option("-c,--class", containerClass, "Container class (1 to 13)")->capture_default_str();
    command->add_option("--uuid", uuid, "The container's UUID (as created)")->required();
    command->add_option("--persona", persona, "Persona unique string of the container's user");
}

int STWCTLContainerArguments::addKeys(STWCTLSession& session, STWValue::Dictionary& message) const {
    STWUUID parsed;
    if (int status = STWCTLParseUUID(session, uuid, &parsed))
        return status;
    message["Identifier"] = STWValue(identifier);
    message["ContainerClass"] = STWValue(containerClass);
    message["UUID"] = STWValue(parsed);
    if (!persona.empty())
        message["PersonaUniqueString"] = STWValue(persona);
    return 0;
}

int STWCTLParseUUID(STWCTLSession& session, const std::string& text, STWUUID* uuid) {
    std::optional<STWUUID> parsed = STWUUID::fromString(text);
    if (!parsed)
        return session.usageError("\"" + text + "\" is not a UUID");
    *uuid = *parsed;
    return 0;
}

// raw COMMAND [KEY=TYPE:VALUE ...]: any command number with typed keys, for trying what the
// daemon does with odd input.
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

// The container commands: create, lookup, list, metadata and recreate-structure (twice:
// commands 8 and 22 do the same).
void STWCTLCommands::_addContainerCommands(CLI::App& app) {
    struct Arguments {
        STWCTLContainerArguments container;
        bool transient = false;
        bool info = false;
    };
    auto arguments = std::make_shared<Arguments>();
    STWCTLContainerArguments& container = arguments->container;
    auto addClass = [&](CLI::App* command) {
        command->add_option("-c,--class", container.containerClass, "Container class (1 to 13)")
            ->capture_default_str();
        command->add_flag("--transient", arguments->transient, "A transient container");
    };

    for (bool create : {true, false}) {
        CLI::App* sub =
            _addVerb(app, create ? "create" : "lookup", 0,
                     create ? "Create a container (or find the existing one)" : "Find an existing container",
                     [arguments, create](STWCTLSession&, STWValue::Dictionary& m) {
                         if (!arguments->container.identifier.empty())
                             m["Identifier"] = STWValue(arguments->container.identifier);
                         m["ContainerClass"] = STWValue(arguments->container.containerClass);
                         m["CreateIfNecessary"] = STWValue(create);
                         m["Transient"] = STWValue(arguments->transient);
                         return 0;
                     });
        sub->add_option("IDENTIFIER", container.identifier,
                        "Container identifier (default: the caller's own)");
        addClass(sub);
    }

    addClass(_addVerb(app, "list", 1, "List the containers of a class",
                      [arguments](STWCTLSession&, STWValue::Dictionary& m) {
                          m["ContainerClass"] = STWValue(arguments->container.containerClass);
                          m["Transient"] = STWValue(arguments->transient);
                          return 0;
                      }));

    CLI::App* metadata = _addVerb(app, "metadata", 7, "Show where a container is",
                                  [arguments](STWCTLSession& session, STWValue::Dictionary& m) {
                                      m["InfoDictRequested"] = STWValue(arguments->info);
                                      return arguments->container.addKeys(session, m);
                                  });
    container.addTo(metadata);
    metadata->add_flag("--info", arguments->info, "Include the info dictionary");

    for (auto [name, command, description] :
         {std::tuple{"recreate-structure", uint64_t{8}, "Create missing standard subdirectories"},
          std::tuple{"recreate-structure2", uint64_t{22},
                     "As recreate-structure, through its second command number"}})
        container.addTo(_addVerb(app, name, command, description,
                                 [arguments](STWCTLSession& session, STWValue::Dictionary& m) {
                                     return arguments->container.addKeys(session, m);
                                 }));
}

// Containers leaving and changing places: delete, stage-delete, wipe, wipe-plugin, replace
// and empty-deathrow.
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

    CLI::App* remove = _addVerb(app, "delete", 10, "Delete a container (through death row)",
                                [arguments](STWCTLSession&, STWValue::Dictionary& m) {
                                    m["Identifier"] = STWValue(arguments->identifier);
                                    m["ContainerClass"] = STWValue(arguments->containerClass);
                                    m["Transient"] = STWValue(arguments->transient);
                                    return 0;
                                });
    addIdentity(remove);
    remove->add_flag("--transient", arguments->transient, "A transient container");

    CLI::App* stage =
        _addVerb(app, "stage-delete", 3, "Move one container, named by its UUID, to death row",
                 [arguments](STWCTLSession& session, STWValue::Dictionary& m) {
                     STWUUID uuid;
                     if (int status = STWCTLParseUUID(session, arguments->uuid, &uuid))
                         return status;
                     m["ContainerClassesArray"] =
                         STWValue(STWValue::Array{STWValue(arguments->containerClass)});
                     m["UUIDsArray"] = STWValue(STWValue::Array{STWValue(uuid)});
                     m["IdentifiersArray"] = STWValue(STWValue::Array{STWValue(arguments->identifier)});
                     m["PersonaUniqueStringsArray"] = STWValue(STWValue::Array{STWValue(arguments->persona)});
                     return 0;
                 });
    addIdentity(stage);
    stage->add_option("--uuid", arguments->uuid, "The container's UUID")->required();
    stage->add_option("--persona", arguments->persona, "Persona unique string of the container's user");

    addIdentity(_addVerb(app, "wipe", 12, "Empty a data container, keeping its path and UUID",
                         [arguments](STWCTLSession&, STWValue::Dictionary& m) {
                             m["Identifier"] = STWValue(arguments->identifier);
                             m["ContainerClass"] = STWValue(arguments->containerClass);
                             return 0;
                         }));

    // Command 11 is for callers whose wipeContainer entitlement lists the plug-ins they may
    // wipe; the class is always the plug-in data class.
    CLI::App* wipePlugin = _addVerb(app, "wipe-plugin", 11, "Empty a plug-in's data container",
                                    [arguments](STWCTLSession&, STWValue::Dictionary& m) {
                                        m["Identifier"] = STWValue(arguments->identifier);
                                        return 0;
                                    });
    wipePlugin->add_option("IDENTIFIER", arguments->identifier, "Plug-in identifier")->required();

    CLI::App* replace =
        _addVerb(app, "replace", 2, "Put a (transient) container in the place of another",
                 [arguments](STWCTLSession& session, STWValue::Dictionary& m) {
                     STWUUID uuid, oldUUID;
                     if (int status = STWCTLParseUUID(session, arguments->uuid, &uuid))
                         return status;
                     m["NewIdentifier"] = STWValue(arguments->identifier);
                     m["NewContainerClass"] = STWValue(arguments->containerClass);
                     m["NewContainerUUID"] = STWValue(uuid);
                     if (!arguments->oldUUID.empty()) {
                         if (int status = STWCTLParseUUID(session, arguments->oldUUID, &oldUUID))
                             return status;
                         m["OldIdentifier"] = STWValue(arguments->identifier);
                         m["OldContainerClass"] = STWValue(arguments->containerClass);
                         m["OldContainerUUID"] = STWValue(oldUUID);
                     }
                     if (!arguments->persona.empty()) {
                         m["NewPersonaUniqueString"] = STWValue(arguments->persona);
                         m["OldPersonaUniqueString"] = STWValue(arguments->persona);
                     }
                     return 0;
                 });
    addIdentity(replace);
    replace->add_option("--uuid", arguments->uuid, "UUID of the container that takes the place")->required();
    replace->add_option("--old-uuid", arguments->oldUUID,
                        "UUID of the container it replaces (none: promote)");
    replace->add_option("--persona", arguments->persona, "Persona unique string of the containers' user");

    _addVerb(app, "empty-deathrow", 4, "Remove everything in death row (waits for it)",
             [](STWCTLSession&, STWValue::Dictionary&) { return 0; });
}
