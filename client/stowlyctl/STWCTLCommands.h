// stowlyctl's subcommands. Each one is a small function that adds itself to the command
// line and says what to do when chosen; most only build a message for session.send().
#pragma once

#include "client/stowlyctl/STWCTLSession.h"

#include <CLI/CLI.hpp>

#include <functional>

class STWCTLCommands {
public:
    explicit STWCTLCommands(STWCTLSession& session) : _session(session) {}

    void addAll(CLI::App& app);
    // The exit status of the subcommand the command line chose.
    int run();

private:
    using Action = std::function<int(STWCTLSession&)>;
    // Makes `action` what runs when `command` is chosen.
    void _onRun(CLI::App* command, Action action);

    void _addRaw(CLI::App& app);
    void _addContainerCommands(CLI::App& app);
    void _addDeletionCommands(CLI::App& app);
    void _addCodeSigningCommands(CLI::App& app);
    // STWCTLCommands+Services.cpp
    void _addServiceCommands(CLI::App& app);
    void _addDevice(CLI::App& app);
    // STWCTLCommands+Upcall.cpp
    void _addUpcall(CLI::App& app);

    STWCTLSession& _session;
    Action _chosen;
};
