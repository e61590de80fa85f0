// stowlyctl: the command-line client of stowlyd.
#include "client/stowlyctl/STWCTLCommands.h"
#include "client/stowlyctl/STWCTLSession.h"
#include "common/STWLog.h"

#include <CLI/CLI.hpp>

#include <cstdlib>

int main(int argc, char** argv) {
    // The library's own log lines would only repeat on standard error what stowlyctl
    // reports itself; STOWLY_LOG_LEVEL brings them back.
    if (!getenv("STOWLY_LOG_LEVEL"))
        STWLog::setSystemLogLevel(STWLogLevel::Fault);

    STWCTLSession session;
    STWCTLOptions& o = session.options;
    CLI::App app("Talks to stowlyd over its socket", "stowlyctl");
    app.add_option("--root", o.root, "Root prefix of the daemon (socket DIR/run/stowly/stowlyd.sock)")
        ->type_name("DIR");
    app.add_option("--socket", o.socket, "Socket path")->type_name("PATH");
    CLI::Option* as =
        app.add_option("--as", o.identifier, "Code-signing identifier to claim (developer mode)")
            ->type_name("IDENTIFIER");
    app.add_option("--entitlements", o.entitlementsPath, "Property-list dictionary of entitlements")
        ->type_name("FILE")
        ->needs(as);
    app.add_flag("--sandboxed", o.sandboxed, "Claim to be sandboxed")->needs(as);
    app.add_option("--persona", o.persona, "Persona unique string to act for")
        ->type_name("UNIQUESTRING")
        ->needs(as);
    app.add_flag("--json", o.json, "Print the reply as one JSON object");
    app.add_option("--timeout", o.timeoutSeconds, "Seconds to wait for a reply")
        ->type_name("SECONDS")
        ->capture_default_str();

    STWCTLCommands commands(session);
    commands.addAll(app);
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        int status = app.exit(e);
        return status == 0 ? 0 : STWCTLExitUsage;
    }
    return commands.run();
}
