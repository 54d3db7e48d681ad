// Container requests as a client sends them: arbitrary bytes decoded as a
// Conduit body and handed to the request-decoding rules and to the
// stage-for-deletion handler (which only queues work, so nothing on disk is
// touched). Whatever the request holds, decoding either builds an identity or
// reports a code; it never crashes and never reports success without one.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnContainerCommands.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/ConduitWire.h"
#include "Platform/PlatformLog.h"
#include "fuzz/FuzzRoot.h"

using namespace tarn;

namespace {

std::shared_ptr<TarnClientConnection> gAnyPersona;
std::shared_ptr<TarnClientConnection> gEnterprise;

void writeFile(const std::string& path, const std::string& contents) {
    std::ofstream(path, std::ios::binary) << contents;
}

// A scratch root with a mobile account and a personal and an enterprise persona.
void makeRoot() {
    const std::string dir = fuzz::MakeFuzzRoot("container_request_fuzz");
    PlistValue personal{PlistDict{}}, enterprise{PlistDict{}};
    personal.set("Type", "personal");
    personal.set("UniqueString", "P");
    personal.set("PersonaID", uint64_t{1000});
    enterprise.set("Type", "enterprise");
    enterprise.set("UniqueString", "E");
    enterprise.set("PersonaID", uint64_t{1001});
    enterprise.set("BundleIDs", PlistArray{PlistValue("com.e")});
    auto bytes = PlistValue(PlistArray{personal, enterprise}).toBinary();
    writeFile(dir + "/etc/tarnkeeper/personas.plist", std::string(bytes.begin(), bytes.end()));
}

std::shared_ptr<TarnClientConnection> caller(TarnUserIdentityRef user) {
    auto identity = TarnClientIdentity::initWithBundleIdentifier(
        "com.fuzz", 501, 501, 1, std::move(user), PlistValue(PlistDict{}), true, TarnAuditToken{},
        false);
    return TarnClientConnection::initWithClientIdentity(identity, true, true, true, std::nullopt,
                                                        std::nullopt,
                                                        std::make_shared<TarnCommandQueue>());
}

// A decoded identity is either there or a failure whose code is not success.
template <class T>
void checkDecoded(const TarnResult<T>& decoded) {
    if (decoded.ok() ? !*decoded : decoded.code(TarnSuccess) == TarnSuccess) std::abort();
}

void checkConnection(const PlistValue& request, TarnClientConnection& connection) {
    checkDecoded(validatedContainerIdentity(request, connection, nullptr, "ContainerClass"));
    checkDecoded(concreteContainerIdentity(request, connection, {}));
    TarnConcreteIdentityKeys old{"OldIdentifier", "OldContainerClass", "OldContainerUUID",
                                 "OldPersonaUniqueString"};
    checkDecoded(concreteContainerIdentity(request, connection, old));

    auto queued = std::make_shared<TarnCommandQueue>();
    auto fresh = TarnClientConnection::initWithClientIdentity(
        connection.clientIdentity(), true, true, true, std::nullopt, std::nullopt, queued);
    PlistValue reply{PlistDict{}};
    uint64_t error = TarnSuccess;
    TarnHandleStageForDeleteCommand({}, request, reply, fresh.get(), &error);
    // A refused request queues nothing.
    if ((error == TarnErrorBadInput || error == TarnErrorPersonaMismatch) &&
        queued->TEST_count() != 0)
        std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    PlatformLogSetQuiet(true);
    makeRoot();
    TarnUserIdentityCache::TEST_setPersonasAreSupported(true);
    auto& cache = TarnUserIdentitySharedCache::sharedInstance();
    gAnyPersona = caller(cache.unspecificUserIdentity());
    gEnterprise = caller(cache.userIdentityForCurrentUserWithPersonaUniqueString(std::string("E")));
    if (!gAnyPersona || !gEnterprise) std::abort();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string why;
    auto request = conduit::DecodeBody(data, size, &why);
    if (!request || !request->isDict()) return 0;
    checkConnection(*request, *gAnyPersona);
    checkConnection(*request, *gEnterprise);
    return 0;
}
