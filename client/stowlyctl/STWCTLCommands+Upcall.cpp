// stowlyctl upcall: asks for a process's containers as the kernel's sandbox does, over the
// upcall socket, and prints the reply's items by name.
#include "client/STWUpcallClient.h"
#include "client/stowlyctl/STWCTLCommands.h"
#include "client/stowlyctl/STWCTLOutput.h"

#include <cstdio>
#include <cstring>
#include <unistd.h>

namespace {

using Pairs = std::vector<std::pair<std::string, std::string>>;

// The reply as a dictionary for --json; an error reply is its return code alone.
STWValue::Dictionary replyDictionary(const STWUpcallClient::Reply& reply) {
    STWValue::Dictionary d{{"ReturnCode", STWValue(static_cast<int64_t>(reply.returnCode))}};
    if (reply.returnCode != STWKernSuccess)
        return d;
    auto path = [&](const char* key, const std::optional<std::string>& value) {
        if (value)
            d[key] = STWValue(*value);
    };
    auto pairs = [&](const char* key, const Pairs& value) {
        STWValue::Dictionary paths;
        for (const auto& [identifier, p] : value)
            paths[identifier] = STWValue(p);
        if (!paths.empty())
            d[key] = STWValue(std::move(paths));
    };
    path("HomeDirectory", reply.homeDirectory);
    path("DataContainer", reply.dataContainer);
    path("TempDirectory", reply.tempDirectory);
    pairs("AppGroups", reply.appGroups);
    path("SystemContainer", reply.systemContainer);
    pairs("SystemGroups", reply.systemGroups);
    d["Status"] = STWValue(uint64_t{reply.status});
    return d;
}

// One line per item, in the order of the reply.
std::string replyText(const STWUpcallClient::Reply& reply) {
    if (reply.returnCode != STWKernSuccess)
        return "ReturnCode: " + std::to_string(reply.returnCode) + "\n";
    std::string out;
    auto path = [&](const char* name, const std::optional<std::string>& value) {
        if (value)
            out += std::string(name) + ": " + *value + "\n";
    };
    auto pairs = [&](const char* name, const Pairs& value) {
        for (const auto& [identifier, p] : value)
            out += std::string(name) + " " + identifier + ": " + p + "\n";
    };
    path("HomeDirectory", reply.homeDirectory);
    path("DataContainer", reply.dataContainer);
    path("TempDirectory", reply.tempDirectory);
    pairs("AppGroup", reply.appGroups);
    path("SystemContainer", reply.systemContainer);
    pairs("SystemGroup", reply.systemGroups);
    out += "Status: " + std::to_string(reply.status) + "\n";
    return out;
}

} // namespace

void STWCTLCommands::_addUpcall(CLI::App& app) {
    struct Arguments {
        STWUpcallClient::Request request;
        std::string signingID, containerID, systemContainer;
        bool plugin = false;
    };
    auto arguments = std::make_shared<Arguments>();
    STWUpcallClient::Request& request = arguments->request;
    CLI::App* upcall = app.add_subcommand("upcall", "Ask for a process's containers as the kernel does (root only)");
    upcall->add_option("--signing-id", arguments->signingID, "Code-signing identifier of the process");
    upcall->add_option("--container-id", arguments->containerID, "Data container identifier");
    upcall->add_option("--uid", request.uid, "User id of the process");
    upcall->add_option("--app-group", request.appGroupIdentifiers, "An app group identifier (repeat for more)");
    upcall->add_option("--system-container", arguments->systemContainer, "System container identifier");
    upcall->add_option("--system-group", request.systemGroupIdentifiers,
                       "A system group container identifier (repeat for more)");
    upcall->add_option("--persona", request.personaID, "Kernel persona id (default: none)");
    upcall->add_flag("--plugin", arguments->plugin, "The process is a plug-in");
    _onRun(upcall, [arguments](STWCTLSession& session) {
        if (geteuid() != 0)
            return session.usageError("upcall needs root: the upcall socket is root's alone");
        STWUpcallClient::Request request = arguments->request;
        if (!arguments->signingID.empty())
            request.codeSignatureIdentifier = arguments->signingID;
        if (!arguments->containerID.empty())
            request.containerIdentifier = arguments->containerID;
        if (!arguments->systemContainer.empty())
            request.systemContainerIdentifier = arguments->systemContainer;
        request.containerType = arguments->plugin ? STWKernContainerTypePlugin : STWKernContainerTypeApplication;
        if (!request.personaID)
            request.personaID = STWKernNoPersona;
        std::optional<std::chrono::milliseconds> timeout = session.timeout();
        if (!timeout)
            return session.usageError("--timeout must be a positive number of seconds");

        STWErrorRef error;
        auto client = STWUpcallClient::connect(STWUpcallClient::socketPathForRoot(session.root()), &error);
        std::optional<STWUpcallClient::Reply> reply;
        if (client)
            reply = client->send(request, *timeout, &error);
        if (!reply) {
            fprintf(stderr, "stowlyctl: %s: %s\n", error->message().c_str(), strerror(static_cast<int>(error->code())));
            return int(STWCTLExitConnection);
        }
        std::string text = session.options.json ? STWCTLReplyJSON(replyDictionary(*reply)) + "\n" : replyText(*reply);
        fwrite(text.data(), 1, text.size(), stdout);
        fflush(stdout);
        if (reply->returnCode != STWKernSuccess || reply->status != 1u) {
            fprintf(stderr, "error: %s\n",
                    reply->returnCode != STWKernSuccess ? "the upcall was refused" : "some container could not be made");
            return int(STWCTLExitReplyError);
        }
        return int(STWCTLExitSuccess);
    });
}
