// What the installer tells the daemon about an identifier, and the group and system
// containers that follow from it: set-codesigning, codesigning, invalidate-codesigning,
// groups, group-ids, system-container, system-groups and system-group.
#include "client/stowlyctl/STWCTLArguments.h"
#include "client/stowlyctl/STWCTLCommands.h"

#include <memory>

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
    // Without an identifier the command is about the caller itself.
    auto optionalIdentifier = [arguments](STWCTLSession&, STWValue::Dictionary& m) {
        if (!arguments->identifier.empty())
            m["Identifier"] = STWValue(arguments->identifier);
        return 0;
    };

    CLI::App* set = _addVerb(
        app, "set-codesigning", 18, "Store an identifier's code-signing info (a plist file); none forgets it",
        [arguments](STWCTLSession& session, STWValue::Dictionary& m) {
            m["Identifier"] = STWValue(arguments->identifier);
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
            return 0;
        });
    set->add_option("IDENTIFIER", arguments->identifier, "Code-signing identifier")->required();
    set->add_option("PLIST", arguments->infoFile, "Property-list file with the code-signing info dictionary");
    set->add_option("--data-class", arguments->dataContainerClass,
                    "Class of the identifier's data container");
    set->add_option("--parent", arguments->parent, "Identifier of the parent application (for a plug-in)");
    set->add_flag("--placeholder", arguments->placeholder, "A placeholder installation");

    _addVerb(app, "codesigning", 19, "Show an identifier's code-signing info", optionalIdentifier)
        ->add_option("IDENTIFIER", arguments->identifier, "Code-signing identifier")
        ->required();

    _addVerb(app, "invalidate-codesigning", 20,
             "Invalidate the code-signing info of apps whose bundle is gone",
             [](STWCTLSession&, STWValue::Dictionary&) { return 0; });

    struct Owned {
        const char* name;
        uint64_t command;
        const char* description;
    };
    for (const Owned& owned :
         {Owned{"groups", 13, "Create or find the app-group containers of an owner"},
          Owned{"group-ids", 14, "List the app groups an owner is entitled to"},
          Owned{"system-container", 15, "Create or find a system container"},
          Owned{"system-groups", 16, "Create or find the system-group containers of an owner"}})
        _addVerb(app, owned.name, owned.command, owned.description, optionalIdentifier)
            ->add_option("IDENTIFIER", arguments->identifier, "Identifier (default: the caller's own)");

    CLI::App* systemGroup =
        _addVerb(app, "system-group", 17, "Create or find one system-group container",
                 [arguments, optionalIdentifier](STWCTLSession& session, STWValue::Dictionary& m) {
                     m["GroupIdentifier"] = STWValue(arguments->group);
                     return optionalIdentifier(session, m);
                 });
    systemGroup->add_option("GROUP", arguments->group, "System group identifier")->required();
    systemGroup->add_option("--owner", arguments->identifier, "Owner (default: the caller itself)");
}
