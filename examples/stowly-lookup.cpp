// stowly-lookup: asks stowlyd for the caller's own data container through libstowly, the
// smallest complete client. examples/cmake-consumer and examples/pkgconfig-consumer build
// it against an installed libstowly, one with find_package(stowly), one with pkg-config.
//
//   stowly-lookup [SOCKET]    (default: $STOWLY_SOCKET, else /run/stowly/stowlyd.sock)
//
// The daemon tells who is calling from its client registry: a property list in
// /etc/stowly/clients.d/ naming this program's executable and the CodeSigningIdentifier it
// runs as (see stowlyd.plist(5)). The lookup (command 0 without CreateIfNecessary) answers
// that identifier's data container when it exists. Exit status: 0 found, 1 the daemon
// answered with an error code, 2 no answer.
#include "client/STWClient.h"

#include <chrono>
#include <cstdio>
#include <cstdlib>

int main(int argc, char** argv) {
    std::filesystem::path socket = STWClient::defaultSocketPath();
    if (argc > 1)
        socket = argv[1];
    else if (const char* variable = std::getenv("STOWLY_SOCKET"))
        socket = variable;

    STWErrorRef error;
    std::unique_ptr<STWClient> client = STWClient::connect(socket, &error);
    if (!client) {
        std::fprintf(stderr, "stowly-lookup: cannot connect to %s: %s\n", socket.c_str(), error->message().c_str());
        return 2;
    }
    STWValue::Dictionary request{{"Command", STWValue(0)},
                                 {"ContainerClass", STWValue(2)}, // the data container of an app
                                 {"CreateIfNecessary", STWValue(false)}};
    auto reply = client->sendMessage(request, std::chrono::seconds(10), &error);
    if (!reply) {
        std::fprintf(stderr, "stowly-lookup: no reply from %s: %s\n", socket.c_str(), error->message().c_str());
        return 2;
    }
    const STWValue answer(std::move(*reply));
    const STWValue* code = answer.find("ReplyError");
    const STWValue* path = answer.find("ReplyPath");
    uint64_t result = code ? code->uint64Value().value_or(0) : 0;
    if (result != 1) {
        std::fprintf(stderr, "stowly-lookup: the daemon answered error %llu\n", static_cast<unsigned long long>(result));
        return 1;
    }
    std::printf("%s\n", path && path->string() ? path->string()->c_str() : "");
    return 0;
}
