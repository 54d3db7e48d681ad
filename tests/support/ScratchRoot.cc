#include "support/ScratchRoot.h"

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "Platform/RootPrefix.h"

namespace fs = std::filesystem;

namespace tarn::test {

ScratchRoot::ScratchRoot(bool activate) : activated_(activate) {
    const char* tmp = std::getenv("TMPDIR");
    std::string tmpl = std::string(tmp && *tmp ? tmp : "/tmp") + "/tarn-root-XXXXXX";
    char* made = ::mkdtemp(tmpl.data());
    if (!made) std::abort();
    // Resolve symlinks in TMPDIR so that real-path checks compare like with like.
    path_ = fs::canonical(made).string();
    writeFile("/etc/passwd",
              "root:x:0:0:root:/private/var/root:/bin/sh\n"
              "_installd:x:33:33:installd:/private/var/installd:/bin/false\n"
              "mobile:x:501:501:Mobile User:/private/var/mobile:/bin/sh\n");
    writeFile("/etc/group", "wheel:x:0:\nmobile:x:501:\nsystemusers:x:1020:\n");
    mkdirs("/private/var/mobile");
    mkdirs("/private/var/root");
    if (activated_) {
        previousRoot_ = RootPrefix();
        SetRootPrefix(path_);
    }
}

ScratchRoot::~ScratchRoot() {
    if (activated_) SetRootPrefix(previousRoot_);
    if (std::getenv("TARN_KEEP_SCRATCH")) return;
    std::error_code ec;
    // Immutable files left by a test would block removal; clear them first.
    (void)std::system(("chattr -R -i '" + path_ + "' >/dev/null 2>&1").c_str());
    fs::remove_all(path_, ec);
}

std::string ScratchRoot::at(const std::string& absolute) const {
    return absolute.empty() || absolute[0] != '/' ? path_ + "/" + absolute : path_ + absolute;
}

void ScratchRoot::writeFile(const std::string& absolute, const std::string& contents) const {
    std::string p = at(absolute);
    fs::create_directories(fs::path(p).parent_path());
    std::ofstream(p, std::ios::binary | std::ios::trunc) << contents;
}

void ScratchRoot::mkdirs(const std::string& absolute) const { fs::create_directories(at(absolute)); }

}  // namespace tarn::test
