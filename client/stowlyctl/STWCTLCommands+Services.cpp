// The per-container services: info-set, info-get, regenerate-uuid, du, assets-path,
// assets-delete and stage-shared; and set-protection, a data container's protection class.
#include "client/stowlyctl/STWCTLArguments.h"
#include "client/stowlyctl/STWCTLCommands.h"

#include <memory>

void STWCTLCommands::_addServiceCommands(CLI::App& app) {
    struct Arguments {
        STWCTLContainerArguments container;
        std::string identifier;
        uint64_t containerClass = 2;
        std::string key;
        std::string value;
        std::string source, destination;
        bool relative = false;
        bool noCreate = false;
        int64_t protectionClass = 0;
        bool thirdParty = false;
        bool retryIfLocked = false;
        bool wait = false;
    };
    auto arguments = std::make_shared<Arguments>();
    STWCTLContainerArguments& container = arguments->container;

    CLI::App* set = _addVerb(app, "info-set", 5, "Set (or, without a value, remove) a container's info value",
                             [arguments](STWCTLSession& session, STWValue::Dictionary& m) {
                                 m["Key"] = STWValue(arguments->key);
                                 if (!arguments->value.empty()) {
                                     std::string_view text = arguments->value;
                                     size_t colon = text.find(':');
                                     if (colon == std::string::npos)
                                         return session.usageError("--value wants TYPE:VALUE");
                                     std::string reason;
                                     auto value = STWCTLParseTypedValue(text.substr(0, colon),
                                                                        text.substr(colon + 1), &reason);
                                     if (!value)
                                         return session.usageError(reason);
                                     m["Value"] = std::move(*value);
                                 }
                                 return arguments->container.addKeys(session, m);
                             });
    container.addTo(set);
    set->add_option("--key", arguments->key, "Info key")->required();
    set->add_option("--value", arguments->value, "TYPE:VALUE as for raw (str:hello, u64:3, plist:FILE)");

    CLI::App* get = _addVerb(app, "info-get", 6, "Show one of a container's info values",
                             [arguments](STWCTLSession& session, STWValue::Dictionary& m) {
                                 m["Key"] = STWValue(arguments->key);
                                 return arguments->container.addKeys(session, m);
                             });
    container.addTo(get);
    get->add_option("--key", arguments->key, "Info key")->required();

    // Commands that name one container and nothing else.
    auto containerOnly = [arguments](STWCTLSession& session, STWValue::Dictionary& m) {
        return arguments->container.addKeys(session, m);
    };
    container.addTo(
        _addVerb(app, "regenerate-uuid", 9, "Move a container to a new UUID directory", containerOnly));
    container.addTo(_addVerb(app, "du", 23, "Show the bytes a container takes on disk", containerOnly));

    CLI::App* assets =
        _addVerb(app, "assets-path", 28, "Create or find an app's user-managed assets directory",
                 [arguments](STWCTLSession&, STWValue::Dictionary& m) {
                     m["Identifier"] = STWValue(arguments->identifier);
                     m["IsRelative"] = STWValue(arguments->relative);
                     m["CreateIfNecessary"] = STWValue(!arguments->noCreate);
                     return 0;
                 });
    assets->add_option("IDENTIFIER", arguments->identifier, "Application identifier")->required();
    assets->add_flag("--relative", arguments->relative, "Answer the path relative to the data container");
    assets->add_flag("--no-create", arguments->noCreate, "Only find an existing directory");

    CLI::App* remove =
        _addVerb(app, "assets-delete", 29, "Delete an item of an app's user-managed assets directory",
                 [arguments](STWCTLSession&, STWValue::Dictionary& m) {
                     m["Identifier"] = STWValue(arguments->identifier);
                     m["SourcePath"] = STWValue(arguments->source);
                     return 0;
                 });
    remove->add_option("IDENTIFIER", arguments->identifier, "Application identifier")->required();
    remove->add_option("PATH", arguments->source, "Path relative to the assets directory")->required();

    CLI::App* stage =
        _addVerb(app, "stage-shared", 26, "Move content into place inside a system group container",
                 [arguments](STWCTLSession&, STWValue::Dictionary& m) {
                     m["Identifier"] = STWValue(arguments->identifier);
                     m["SourcePath"] = STWValue(arguments->source);
                     m["DestPath"] = STWValue(arguments->destination);
                     return 0;
                 });
    stage->add_option("GROUP", arguments->identifier, "System group identifier")->required();
    stage->add_option("SOURCE", arguments->source, "Source, relative to the group container")->required();
    stage->add_option("DEST", arguments->destination, "Destination, relative to the group container")
        ->required();

    // The daemon answers once the change is done; one that waits for the next unlock answers
    // after it. Without --wait that shows as a time-out after --timeout (the change goes on).
    CLI::App* protection =
        _addVerb(app, "set-protection", 21, "Change a data container's data-protection class",
                 [arguments](STWCTLSession& session, STWValue::Dictionary& m) {
                     if (arguments->wait)
                         session.options.timeoutSeconds = 1e9;
                     m["Identifier"] = STWValue(arguments->identifier);
                     m["ContainerClass"] = STWValue(arguments->containerClass);
                     m["DataProtectionClass"] = STWValue(arguments->protectionClass);
                     m["IsThirdParty"] = STWValue(arguments->thirdParty);
                     m["RetryIfLocked"] = STWValue(arguments->retryIfLocked);
                     return 0;
                 });
    protection->add_option("IDENTIFIER", arguments->identifier, "Container identifier")->required();
    protection
        ->add_option("CLASS", arguments->protectionClass, "Class: 1 complete, 3 until first unlock, 4 none")
        ->required();
    protection
        ->add_option("-c,--class", arguments->containerClass, "Container class (2, 4, 6, 7, 9, 10 or 11)")
        ->capture_default_str();
    protection->add_flag("--third-party", arguments->thirdParty, "The application is not part of the system");
    protection->add_flag("--retry", arguments->retryIfLocked,
                         "When the device is locked, wait for the next unlock");
    protection->add_flag("--wait", arguments->wait,
                         "Block until the daemon answers, however long that takes");
}
