#include "client/stowlyctl/STWCTLSession.h"

#include "client/STWClient.h"
#include "client/stowlyctl/STWCTLOutput.h"
#include "common/STWDictionaryUtilities.h"

#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstring>

namespace {

int connectionError(const STWErrorRef& error) {
    std::string text = error ? error->message() : "unknown failure";
    if (error && error->domain() == STWPOSIXErrorDomain && error->code() > 0)
        text += std::string(": ") + strerror(static_cast<int>(error->code()));
    fprintf(stderr, "stowlyctl: %s\n", text.c_str());
    return STWCTLExitConnection;
}

} // namespace

std::filesystem::path STWCTLSession::root() const {
    return options.root.empty() ? std::filesystem::path("/") : std::filesystem::path(options.root);
}

std::filesystem::path STWCTLSession::socketPath() const {
    if (!options.socket.empty())
        return options.socket;
    if (!options.root.empty())
        return STWClient::socketPathForRoot(options.root);
    return STWClient::defaultSocketPath();
}

std::optional<std::chrono::milliseconds> STWCTLSession::timeout() const {
    if (!std::isfinite(options.timeoutSeconds) || options.timeoutSeconds <= 0)
        return std::nullopt;
    return std::chrono::milliseconds(static_cast<int64_t>(std::ceil(std::min(options.timeoutSeconds, 1e9) * 1000)));
}

int STWCTLSession::send(const STWValue::Dictionary& message) {
    std::optional<std::chrono::milliseconds> limit = timeout();
    if (!limit)
        return usageError("--timeout must be a positive number of seconds");
    std::chrono::milliseconds timeout = *limit;

    std::optional<STWValue::Dictionary> identity;
    if (!options.identifier.empty()) {
        STWValue::Dictionary entitlements;
        if (!options.entitlementsPath.empty()) {
            STWErrorRef error;
            auto read = STW_dictionaryWithContentsOfURL(options.entitlementsPath, STWReadDefault, &error);
            if (!read)
                return usageError("cannot read entitlements from " + options.entitlementsPath + ": " +
                                  (error ? error->message() : std::string()));
            entitlements = std::move(*read);
        }
        identity = STWValue::Dictionary{
            {"CodeSigningIdentifier", STWValue(options.identifier)},
            {"Entitlements", STWValue(std::move(entitlements))},
            {"Sandboxed", STWValue(options.sandboxed)},
        };
        if (!options.persona.empty())
            identity->emplace("PersonaUniqueString", STWValue(options.persona));
    }

    STWErrorRef error;
    std::unique_ptr<STWClient> client = STWClient::connect(socketPath(), &error);
    if (!client)
        return connectionError(error);
    if (identity) {
        std::optional<uint64_t> accepted = client->hello(*identity, timeout, &error);
        if (!accepted)
            return connectionError(error);
        if (*accepted != STWErrorSuccess) {
            fprintf(stderr, "error: hello refused: %s\n", STWCTLErrorCodeText(*accepted).c_str());
            return STWCTLExitReplyError;
        }
    }
    std::optional<STWValue::Dictionary> reply = client->sendMessage(message, timeout, &error);
    if (!reply)
        return connectionError(error);

    print(*reply);
    std::optional<uint64_t> replyError = STWDictionaryUInt64(*reply, "ReplyError");
    if (!replyError) {
        fprintf(stderr, "error: reply without ReplyError\n");
        return STWCTLExitReplyError;
    }
    if (*replyError != STWErrorSuccess) {
        fprintf(stderr, "error: %s\n", STWCTLErrorCodeText(*replyError).c_str());
        return STWCTLExitReplyError;
    }
    return STWCTLExitSuccess;
}

void STWCTLSession::print(const STWValue::Dictionary& result) const {
    std::string text = options.json ? STWCTLReplyJSON(result) + "\n" : STWCTLReplyText(result);
    fwrite(text.data(), 1, text.size(), stdout);
    fflush(stdout);
}

int STWCTLSession::usageError(const std::string& message) const {
    fprintf(stderr, "stowlyctl: %s\n", message.c_str());
    return STWCTLExitUsage;
}
