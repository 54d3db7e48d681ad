// A scratch root for the fuzz targets that need the daemon's world: a fresh
// directory under $TMPDIR made the root prefix, with a mobile account (501).
// Left behind on exit: watchers of the root may still run during teardown.
#pragma once

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "Platform/RootPrefix.h"

namespace tarn::fuzz {

inline std::string MakeFuzzRoot(const char* name) {
    const char* tmp = std::getenv("TMPDIR");
    std::string dir = std::string(tmp && *tmp ? tmp : "/tmp") + "/" + name + ".XXXXXX";
    if (!mkdtemp(dir.data())) std::abort();
    SetRootPrefix(dir);
    std::filesystem::create_directories(dir + "/etc/tarnkeeper");
    std::filesystem::create_directories(dir + "/private/var/mobile");
    std::ofstream(dir + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/false\n";
    std::ofstream(dir + "/etc/group") << "mobile:x:501:\n";
    return dir;
}

}  // namespace tarn::fuzz
