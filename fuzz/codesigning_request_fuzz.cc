// Code-signing requests as the installer sends them: arbitrary bytes decoded
// as a Conduit body and handed to command 18, then its queued work, then the
// readers (commands 19 and 14) for the same identifier, against a real
// mapping on a scratch root. Whatever the request holds, the handler answers
// a code and the readers cope with whatever was stored.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <memory>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningCommands.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/ConduitWire.h"
#include "Platform/Dispatch.h"
#include "Platform/PlatformLog.h"
#include "fuzz/FuzzRoot.h"

using namespace tarn;

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    PlatformLogSetQuiet(true);
    const std::string root = fuzz::MakeFuzzRoot("codesigning_request_fuzz");
    std::filesystem::create_directories(root + "/store");
    auto store = TarnSQLiteDB::initWithParentDirectoryURL(root + "/store");
    if (!store) std::abort();
    TarnCodeSigningMapping::TEST_setSharedInstance(std::make_unique<TarnCodeSigningMapping>(
        &TarnUserIdentitySharedCache::sharedInstance(),
        DispatchQueue::createSerial("com.ostrea.TarnKeeper.EntitlementQueue"), std::move(store)));
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string why;
    auto request = conduit::DecodeBody(data, size, &why);
    if (!request || !request->isDict()) return 0;
    auto connection = TarnClientConnection::privilegedClientConnectionWithUserIdentity(
        TarnUserIdentityCache::defaultUserIdentity());
    PlistValue reply{PlistDict{}};
    uint64_t error = TarnSuccess;
    TarnHandleProcessCodeSigningInfoCommand({}, *request, reply, connection.get(), &error);
    if (error == 0) std::abort();  // no code is 0
    uint64_t queued = TarnSuccess;
    (void)connection->completeWithError(&queued);

    // Read back whatever was stored under the identifier.
    const PlistValue* identifier = request->find("Identifier");
    if (!identifier) return 0;
    PlistValue read{PlistDict{{"Identifier", *identifier}}};
    for (auto handler : {TarnHandleGetCodeSigningInfoCommand, TarnHandleGroupIdentifiersCommand}) {
        PlistValue answer{PlistDict{}};
        uint64_t code = TarnSuccess;
        handler({}, read, answer, connection.get(), &code);
        if (code == 0) std::abort();
    }
    return 0;
}
