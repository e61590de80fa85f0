// The per-container services: info-set, info-get, regenerate-uuid, du, assets-path,
// assets-delete, stage-shared and retry-test; and set-protection, a data container's
// protection class.
#include "client/stowlyctl/STWCTLArguments.h"
#include "client/stowlyctl/STWCTLCommands.h"

#include <memory>

void STWCTLCommands::_addServiceCommands(CLI::App& app) {
    struct Arguments {
        std::string identifier;
        uint64_t containerClass = 2;
        std::string uuid;
        std::string persona;
        std::string key;
        std::string value;
        std::string source, destination;
        bool relative = false;
        bool noCreate = false;
        uint64_t crashes = 1;
        int64_t protectionClass = 0;
        bool thirdParty = false;
        bool retryIfLocked = false;
        bool wait = false;
    };
    auto arguments = std::make_shared<Arguments>();
    // The commands on one container named by identifier, class and UUID.
    auto addConcrete = [&](CLI::App* command) {
        command->add_option("IDENTIFIER", arguments->identifier, "Container identifier")->required();
        command->add_option("-c,--class", arguments->containerClass, "Container class (1 to 13)")
            ->capture_default_str();
        command->add_option("--uuid", arguments->uuid, "The container's UUID (as created)")->required();
        command->add_option("--persona", arguments->persona, "Persona unique string of the container's user");
    };
    auto concrete = [arguments](uint64_t command, STWCTLSession& session,
                                STWValue::Dictionary* message) -> int {
        std::optional<STWUUID> uuid = STWUUID::fromString(arguments->uuid);
        if (!uuid)
            return session.usageError("\"" + arguments->uuid + "\" is not a UUID");
        *message = {{"Command", STWValue(command)},
                    {"Identifier", STWValue(arguments->identifier)},
                    {"ContainerClass", STWValue(arguments->containerClass)},
                    {"UUID", STWValue(*uuid)}};
        if (!arguments->persona.empty())
            (*message)["PersonaUniqueString"] = STWValue(arguments->persona);
        return 0;
    };

    CLI::App* set = app.add_subcommand("info-set", "Set (or, without a value, remove) a container's info value");
    addConcrete(set);
    set->add_option("--key", arguments->key, "Info key")->required();
    set->add_option("--value", arguments->value, "TYPE:VALUE as for raw (str:hello, u64:3, plist:FILE)");
    _onRun(set, [arguments, concrete](STWCTLSession& session) {
        STWValue::Dictionary m;
        if (int status = concrete(5, session, &m))
            return status;
        m["Key"] = STWValue(arguments->key);
        if (!arguments->value.empty()) {
            size_t colon = arguments->value.find(':');
            if (colon == std::string::npos)
                return session.usageError("--value wants TYPE:VALUE");
            std::string reason;
            auto value = STWCTLParseTypedValue(std::string_view(arguments->value).substr(0, colon),
                                               std::string_view(arguments->value).substr(colon + 1), &reason);
            if (!value)
                return session.usageError(reason);
            m["Value"] = std::move(*value);
        }
        return session.send(m);
    });

    CLI::App* get = app.add_subcommand("info-get", "Show one of a container's info values");
    addConcrete(get);
    get->add_option("--key", arguments->key, "Info key")->required();
    _onRun(get, [arguments, concrete](STWCTLSession& session) {
        STWValue::Dictionary m;
        if (int status = concrete(6, session, &m))
            return status;
        m["Key"] = STWValue(arguments->key);
        return session.send(m);
    });

    // Commands that name one container and nothing else.
    struct Plain {
        const char* name;
        const char* description;
        uint64_t command;
    };
    for (const Plain& plain : {Plain{"regenerate-uuid", "Move a container to a new UUID directory", 9},
                               Plain{"du", "Show the bytes a container takes on disk", 23}}) {
        CLI::App* sub = app.add_subcommand(plain.name, plain.description);
        addConcrete(sub);
        uint64_t command = plain.command;
        _onRun(sub, [concrete, command](STWCTLSession& session) {
            STWValue::Dictionary m;
            int status = concrete(command, session, &m);
            return status ? status : session.send(m);
        });
    }

    CLI::App* assets = app.add_subcommand("assets-path", "Create or find an app's user-managed assets directory");
    assets->add_option("IDENTIFIER", arguments->identifier, "Application identifier")->required();
    assets->add_flag("--relative", arguments->relative, "Answer the path relative to the data container");
    assets->add_flag("--no-create", arguments->noCreate, "Only find an existing directory");
    _onRun(assets, [arguments](STWCTLSession& session) {
        return session.send({{"Command", STWValue(28)},
                             {"Identifier", STWValue(arguments->identifier)},
                             {"IsRelative", STWValue(arguments->relative)},
                             {"CreateIfNecessary", STWValue(!arguments->noCreate)}});
    });

    CLI::App* remove = app.add_subcommand("assets-delete", "Delete an item of an app's user-managed assets directory");
    remove->add_option("IDENTIFIER", arguments->identifier, "Application identifier")->required();
    remove->add_option("PATH", arguments->source, "Path relative to the assets directory")->required();
    _onRun(remove, [arguments](STWCTLSession& session) {
        return session.send({{"Command", STWValue(29)},
                             {"Identifier", STWValue(arguments->identifier)},
                             {"SourcePath", STWValue(arguments->source)}});
    });

    CLI::App* stage = app.add_subcommand("stage-shared", "Move content into place inside a system group container");
    stage->add_option("GROUP", arguments->identifier, "System group identifier")->required();
    stage->add_option("SOURCE", arguments->source, "Source, relative to the group container")->required();
    stage->add_option("DEST", arguments->destination, "Destination, relative to the group container")->required();
    _onRun(stage, [arguments](STWCTLSession& session) {
        return session.send({{"Command", STWValue(26)},
                             {"Identifier", STWValue(arguments->identifier)},
                             {"SourcePath", STWValue(arguments->source)},
                             {"DestPath", STWValue(arguments->destination)}});
    });

    CLI::App* retry = app.add_subcommand("retry-test", "Make the daemon exit N times (internal builds)");
    retry->add_option("N", arguments->crashes, "Exits before the test succeeds")->capture_default_str();
    _onRun(retry, [arguments](STWCTLSession& session) {
        return session.send({{"Command", STWValue(25)}, {"NumRetryCrashes", STWValue(arguments->crashes)}});
    });

    // The daemon answers once the change is done; one that waits for the next unlock answers
    // after it. Without --wait that shows as a time-out after --timeout (the change goes on).
    CLI::App* protection = app.add_subcommand("set-protection", "Change a data container's data-protection class");
    protection->add_option("IDENTIFIER", arguments->identifier, "Container identifier")->required();
    protection->add_option("CLASS", arguments->protectionClass, "Class: 1 complete, 3 until first unlock, 4 none")
        ->required();
    protection->add_option("-c,--class", arguments->containerClass, "Container class (2, 4, 6, 7, 9, 10 or 11)")
        ->capture_default_str();
    protection->add_flag("--third-party", arguments->thirdParty, "The application is not part of the system");
    protection->add_flag("--retry", arguments->retryIfLocked, "When the device is locked, wait for the next unlock");
    protection->add_flag("--wait", arguments->wait, "Block until the daemon answers, however long that takes");
    _onRun(protection, [arguments](STWCTLSession& session) {
        if (arguments->wait)
            session.options.timeoutSeconds = 1e9;
        return session.send({{"Command", STWValue(21)},
                             {"Identifier", STWValue(arguments->identifier)},
                             {"ContainerClass", STWValue(arguments->containerClass)},
                             {"DataProtectionClass", STWValue(arguments->protectionClass)},
                             {"IsThirdParty", STWValue(arguments->thirdParty)},
                             {"RetryIfLocked", STWValue(arguments->retryIfLocked)}});
    });
}
