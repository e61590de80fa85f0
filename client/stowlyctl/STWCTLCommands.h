// stowlyctl's subcommands. Each one is a small function that adds itself to the command
// line and says what to do when chosen. A verb that sends a daemon command is added with
// the command's number, which both starts its message and files the verb in the table of
// command numbers that --help ends with; it only adds the message's other keys.
#pragma once

#include "client/stowlyctl/STWCTLSession.h"

#include <CLI/CLI.hpp>

#include <functional>
#include <map>
#include <string>
#include <vector>

// An identifier, class, UUID and persona that name one existing container, as most
// per-container commands take them.
struct STWCTLContainerArguments {
    std::string identifier;
    uint64_t containerClass = 2;
    std::string uuid;
    std::string persona;

    // IDENTIFIER, -c/--class, --uuid and --persona.
    void addTo(CLI::App* command);
    // Identifier, ContainerClass, UUID and, when given, PersonaUniqueString; 0, or the exit
    // status of a bad UUID.
    int addKeys(STWCTLSession& session, STWValue::Dictionary& message) const;
};

// `text` as a UUID into `uuid`; 0, or the exit status of a usage error.
int STWCTLParseUUID(STWCTLSession& session, const std::string& text, STWUUID* uuid);

class STWCTLCommands {
public:
    explicit STWCTLCommands(STWCTLSession& session) : _session(session) {}

    void addAll(CLI::App& app);
    // The exit status of the subcommand the command line chose.
    int run();

    // The verbs filed under each command number, in the order they were added.
    const std::map<uint64_t, std::vector<std::string>>& verbsByCommand() const { return _verbs; }

private:
    using Action = std::function<int(STWCTLSession&)>;
    // Adds a verb's keys to its message {"Command": N}; returns 0, or the exit status of a
    // bad argument, which stops the verb before it connects.
    using MessageKeys = std::function<int(STWCTLSession&, STWValue::Dictionary&)>;

    // Makes `action` what runs when `command` is chosen.
    void _onRun(CLI::App* command, Action action);
    // Adds verb `name`, which sends command `command` with the keys `keys` adds.
    CLI::App* _addVerb(CLI::App& app, const std::string& name, uint64_t command,
                       const std::string& description, MessageKeys keys);
    // The table of command numbers and their verbs, wrapped for --help.
    std::string _commandTable() const;

    void _addRaw(CLI::App& app);
    void _addContainerCommands(CLI::App& app);
    void _addDeletionCommands(CLI::App& app);
    // STWCTLCommands+CodeSigning.cpp
    void _addCodeSigningCommands(CLI::App& app);
    // STWCTLCommands+Services.cpp
    void _addServiceCommands(CLI::App& app);
    // STWCTLCommands+Migration.cpp
    void _addMigrationCommands(CLI::App& app);
    // STWCTLCommands+Testing.cpp
    void _addTestingCommands(CLI::App& app);
    void _addDevice(CLI::App& app);
    // STWCTLCommands+Upcall.cpp
    void _addUpcall(CLI::App& app);
    // STWCTLCommands+Completion.cpp
    void _addCompletion(CLI::App& app);

    STWCTLSession& _session;
    Action _chosen;
    std::map<uint64_t, std::vector<std::string>> _verbs;
};
