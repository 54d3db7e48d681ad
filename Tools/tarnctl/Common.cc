#include <iostream>

#include "Platform/Conduit.h"
#include "Platform/RootPrefix.h"
#include "Tools/tarnctl/Subcommands.h"

namespace tarnctl {

namespace {
constexpr const char* kServiceName = "com.ostrea.tarnkeeperd";
}

std::string Options::socketPath() const {
    if (!socket.empty()) return socket;
    if (!root.empty()) tarn::SetRootPrefix(root);
    return tarn::conduit::ServiceSocketPath(kServiceName);
}

std::chrono::milliseconds Options::timeout() const {
    return std::chrono::milliseconds(static_cast<int64_t>(timeoutSeconds * 1000));
}

std::optional<tarn::PlistValue> SendRequest(Options& options, const tarn::PlistValue& request) {
    std::string why;
    const std::string path = options.socketPath();
    auto client = tarn::conduit::Client::connect(path, &why);
    if (!client) {
        std::cerr << "tarnctl: cannot reach the daemon: " << why << "\n";
        options.exitCode = kExitUnavailable;
        return std::nullopt;
    }
    auto id = client->sendRequest(request, &why);
    if (!id) {
        std::cerr << "tarnctl: cannot send the request: " << why << "\n";
        options.exitCode = kExitUnavailable;
        return std::nullopt;
    }
    auto reply = client->waitForReply(*id, options.timeout(), &why);
    if (!reply) {
        std::cerr << "tarnctl: no reply: " << why << "\n";
        options.exitCode = kExitNoReply;
        return std::nullopt;
    }
    return reply;
}

}  // namespace tarnctl
