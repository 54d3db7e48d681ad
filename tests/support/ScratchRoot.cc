#include "support/ScratchRoot.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "Platform/RootPrefix.h"

namespace fs = std::filesystem;

namespace tarn::test {

namespace {

std::string tempBase() {
    const char* tmp = std::getenv("TMPDIR");
    return tmp && *tmp ? tmp : "/tmp";
}

// Where the death-test children of test process `pid` make their roots.
// A "threadsafe" death test runs the test again in a new process, which makes
// its own root and then dies without running a destructor; the test process
// removes all of them when it exits.
std::string deathTestRoots(pid_t pid) {
    return tempBase() + "/tarn-death-roots-" + std::to_string(pid);
}

struct DeathTestRootsSweeper {
    ~DeathTestRootsSweeper() {
        if (std::getenv("TARN_KEEP_SCRATCH")) return;
        std::error_code ec;
        fs::remove_all(deathTestRoots(::getpid()), ec);
    }
} gDeathTestRootsSweeper;

}  // namespace

ScratchRoot::ScratchRoot(bool activate) : activated_(activate) {
    std::string base = tempBase();
    // Not InDeathTestChild(): that answers by the death-test style, which a
    // test sets in its body, after its fixture made this root.
    if (!GTEST_FLAG_GET(internal_run_death_test).empty()) {
        base = deathTestRoots(::getppid());
        std::error_code ec;
        fs::create_directories(base, ec);
    }
    std::string tmpl = base + "/tarn-root-XXXXXX";
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
