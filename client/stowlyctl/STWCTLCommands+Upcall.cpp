// stowlyctl upcall: asks for a process's containers as the kernel's sandbox does, over the
// upcall socket, and prints the reply's items by name.
#include "client/STWUpcallClient.h"
#include "client/stowlyctl/STWCTLCommands.h"
#include "client/stowlyctl/STWCTLOutput.h"

#include <cstdio>
#include <cstring>
#include <functional>
#include <unistd.h>

namespace {

using Reply = STWUpcallClient::Reply;
// Visits the paths of a success reply in reply order: an item's name, the group identifier
// for group items, and the path.
using ItemVisitor = std::function<void(const char* name, const std::string* group, const std::string& path)>;

void forEachItem(const Reply& reply, const ItemVisitor& visit) {
    auto path = [&](const char* name, const std::optional<std::string>& value) {
        if (value)
            visit(name, nullptr, *value);
    };
    auto groups = [&](const char* name, const std::vector<std::pair<std::string, std::string>>& pairs) {
        for (const auto& [identifier, value] : pairs)
            visit(name, &identifier, value);
    };
    path("HomeDirectory", reply.homeDirectory);
    path("DataContainer", reply.dataContainer);
    path("TempDirectory", reply.tempDirectory);
    groups("AppGroup", reply.appGroups);
    path("SystemContainer", reply.systemContainer);
    groups("SystemGroup", reply.systemGroups);
}

// The reply as a dictionary for --json (groups under "AppGroups" and "SystemGroups"); an
// error reply is its return code alone.
STWValue::Dictionary replyDictionary(const Reply& reply) {
    STWValue::Dictionary d{{"ReturnCode", STWValue(static_cast<int64_t>(reply.returnCode))}};
    if (reply.returnCode != STWKernSuccess)
        return d;
    STWValue::Dictionary groups[2];
    forEachItem(reply, [&](const char* name, const std::string* group, const std::string& path) {
        if (group)
            groups[strcmp(name, "AppGroup") == 0 ? 0 : 1][*group] = STWValue(path);
        else
            d[name] = STWValue(path);
    });
    if (!groups[0].empty())
        d["AppGroups"] = STWValue(std::move(groups[0]));
    if (!groups[1].empty())
        d["SystemGroups"] = STWValue(std::move(groups[1]));
    d["Status"] = STWValue(uint64_t{reply.status});
    return d;
}

// One line per item, in the order of the reply.
std::string replyText(const Reply& reply) {
    if (reply.returnCode != STWKernSuccess)
        return "ReturnCode: " + std::to_string(reply.returnCode) + "\n";
    std::string out;
    forEachItem(reply, [&](const char* name, const std::string* group, const std::string& path) {
        out += std::string(name) + (group ? " " + *group : std::string()) + ": " + path + "\n";
    });
    return out + "Status: " + std::to_string(reply.status) + "\n";
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
