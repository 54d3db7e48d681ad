// Arbitrary bytes as a replace file, read the way start-up recovery reads it.
// The reader either answers four absolute paths below the root or an error
// with its code, never crashes; and what it accepts, written back the
// daemon's way, reads back the same.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <fstream>
#include <string>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"
#include "fuzz/FuzzRoot.h"

using namespace tarn;

namespace {

FileURL gFile;

bool belowRoot(const FileURL& path) {
    return !path.empty() && path.front() == '/' &&
           (RootIsSystemRoot() || path.starts_with(RootPrefix() + "/"));
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    PlatformLogSetQuiet(true);
    fuzz::MakeFuzzRoot("replace_file_fuzz");
    gFile = PathJoin(TarnGlobalConfiguration::sharedInstance().replaceDirectory(), "fuzz.plist");
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    {
        std::ofstream out(gFile, std::ios::binary | std::ios::trunc);
        out.write(reinterpret_cast<const char*>(data), static_cast<std::streamsize>(size));
        if (!out) std::abort();
    }
    auto read = TarnClientConnection::_readAndValidateReplaceFileAtUrl(gFile);
    // The root is a fresh directory the inputs cannot know: the same
    // dictionary with its strings placed below it goes through the checks too.
    if (auto parsed = PlistValue::fromBytes(data, size); parsed && parsed->isDict()) {
        PlistValue rooted = *parsed;
        for (const char* key : {"TarnReplaceOperationOldURL", "TarnReplaceOperationNewURL",
                                "TarnReplaceOperationStagingURL", "TarnReplaceOperationDestURL"})
            if (const PlistValue* v = parsed->find(key); v && v->asString())
                rooted.set(key, RootPrefix() + *v->asString());
        auto checked = TarnClientConnection::_validateReplaceDictionary(rooted, gFile);
        if (!checked.ok() && checked.code(TarnSuccess) != TarnErrorReplaceRecoveryFailed)
            std::abort();
        if (checked.ok() && !belowRoot(checked->oldURL)) std::abort();
    }
    if (!read.ok()) {
        if (read.code(TarnSuccess) != TarnErrorReplaceRecoveryFailed) std::abort();
        return 0;
    }
    const TarnClientConnection::ReplaceInfo info = *read;
    for (const FileURL* p : {&info.oldURL, &info.newURL, &info.stagingURL, &info.destURL})
        if (!belowRoot(*p)) std::abort();
    if (!TarnClientConnection::_writeToDiskReplaceAt(gFile, info.oldURL, info.newURL,
                                                     info.stagingURL, info.destURL)
             .ok())
        std::abort();
    auto again = TarnClientConnection::_readAndValidateReplaceFileAtUrl(gFile);
    if (!again.ok() || again->oldURL != info.oldURL || again->newURL != info.newURL ||
        again->stagingURL != info.stagingURL || again->destURL != info.destURL)
        std::abort();
    return 0;
}
