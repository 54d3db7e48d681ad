// Arbitrary bytes as a container's metadata file, read the way a cache
// rebuild reads it. The reader either answers metadata or an error value
// with a code, never crashes; and what it accepts, written back in our own
// form, reads back the same.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/PlatformLog.h"
#include "fuzz/FuzzRoot.h"

using namespace tarn;

namespace {

FileURL gContainer;  // a data container directory of the mobile user
FileURL gFile;       // its metadata file

void writeBytes(const std::string& path, const void* data, size_t size) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out.write(static_cast<const char*>(data), static_cast<std::streamsize>(size));
    if (!out) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    PlatformLogSetQuiet(true);
    fuzz::MakeFuzzRoot("metadata_fuzz");
    TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
    auto classDirectory = TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
        TarnUserIdentityCache::defaultUserIdentity(), 2, false);
    if (!classDirectory) std::abort();
    gContainer = PathJoin(*classDirectory, "0A1B2C3D-0000-4000-8000-000000000001");
    std::filesystem::create_directories(gContainer);
    gFile = PathJoin(gContainer, kTarnMetadataFileName);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    writeBytes(gFile, data, size);
    const TarnUserIdentityRef owner = TarnUserIdentityCache::defaultUserIdentity();
    auto result =
        TarnMetadata::readAndValidateMetadataAtUrl(gContainer, owner, /*checkClassPath=*/true);
    if (!result.ok()) {
        const TarnErrorRef& error = result.error();
        if (!error || error->code() == TarnSuccess) std::abort();  // a refusal names its reason
        return 0;
    }
    const TarnMetadataRef read = *result;
    if (!TarnContainerClassIsValid(read->containerClass()) || read->url() != gContainer)
        std::abort();
    // Written back as the daemon writes it, the same container reads back.
    const auto bytes = read->dictionaryRepresentation().toBinary();
    if (bytes.empty()) std::abort();
    writeBytes(gFile, bytes.data(), bytes.size());
    auto reread =
        TarnMetadata::readAndValidateMetadataAtUrl(gContainer, owner, /*checkClassPath=*/true);
    const TarnMetadataRef again = reread.valueOr(nullptr);
    if (!again || again->identifier() != read->identifier() || again->uuid() != read->uuid() ||
        again->containerClass() != read->containerClass() || again->info() != read->info() ||
        again->userManagedAssetsDirName() != read->userManagedAssetsDirName() ||
        !again->userIdentity()->isEqualToUserIdentity(*read->userIdentity()))
        std::abort();
    return 0;
}
