// Changing the data-protection class of a data container of N files (the
// whole change: pending file, pass under the identifier lock, recorded class)
// against a bare walk that sets the same attribute on the same items and
// writes the same two fsynced files. Interleaved, alternating which goes
// first, with the tree reset to class 4 (unmeasured) before each. Target:
// ratio <= 1.5. Run it pinned (taskset -c 0) and unpinned.
//
//   dataprotection_bench [files=10000] [rounds=11]
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnDataProtectionManager.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/FileSystem.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"
#include "bench/BenchSupport.h"

namespace {

namespace stdfs = std::filesystem;
using tarn::bench::Clock;
using tarn::bench::die;

// 100 files per directory, ten directories per level-one directory.
void buildTree(const std::string& top, int files) {
    for (int i = 0; i < files; ++i) {
        std::string dir =
            top + "/d" + std::to_string(i / 1000) + "/s" + std::to_string((i / 100) % 10);
        if (i % 100 == 0) stdfs::create_directories(dir);
        std::ofstream(dir + "/f" + std::to_string(i)) << "x";
    }
}

// Every directory and file below `top` (top included) to `cls`; with
// `onlyFrom`, only items currently in that class. Answers the items set.
int setTree(const std::string& top, int32_t cls, int32_t onlyFrom = -1) {
    int set = 0;
    tarn::FsWalk(top, [&](const tarn::FsWalkEntry& e) {
        if (e.type != tarn::FsWalkType::DirectoryPost && e.type != tarn::FsWalkType::File)
            return true;
        tarn::FsFd fd;
        if (tarn::FsOpenItem(e.parentFd, e.name, &fd) != 0) die("open " + e.path);
        int32_t current = 0;
        if (onlyFrom >= 0 &&
            (tarn::FsGetProtectionClass(fd.get(), &current) != 0 || current != onlyFrom))
            return true;
        if (tarn::FsSetProtectionClass(fd.get(), cls) != 0) die("setclass " + e.path);
        ++set;
        return true;
    });
    return set;
}

double ms(Clock::duration d) { return std::chrono::duration<double, std::milli>(d).count(); }

}  // namespace

int main(int argc, char** argv) {
    const int files = argc > 1 ? std::atoi(argv[1]) : 10000;
    const int rounds = argc > 2 ? std::atoi(argv[2]) : 11;
    if (files <= 0 || rounds <= 0) return 2;
    tarn::PlatformLogSetQuiet(true);
    const std::string root = tarn::bench::makeScratchRoot();
    if (root.empty()) die("no scratch root");
    tarn::SetRootPrefix(root);
    tarn::TarnUserIdentityCache::TEST_setPersonasAreSupported(false);

    auto identity = tarn::TarnContainerIdentity::containerIdentityWithUserIdentity(
        tarn::TarnUserIdentityCache::defaultUserIdentity(), std::string("com.example.bench"), 2);
    if (!identity.ok()) die("identity");
    auto made = tarn::TarnClientConnection::privilegedClientConnectionWithUserIdentity(
                    tarn::TarnUserIdentityCache::defaultUserIdentity())
                    ->createOrLookupContainerWithContainerIdentity(*identity, true, false, true);
    if (!made.ok()) die("cannot create the container");
    const std::string container = (*made)->url();
    const std::string docs = container + "/Documents";
    buildTree(docs, files);

    auto& manager = tarn::TarnDataProtectionManager::defaultManager();
    auto reset = [&] {
        // Back to class 4 everywhere, recorded as 4, so that the change to 1
        // is a change of every directory and file.
        for (const char* item : {"/Documents", "/Library", "/tmp"}) setTree(container + item, 4);
        uint64_t code = 0;
        manager.setDataProtectionOnDataContainerForContainerIdentity(*identity, 4, false, false,
                                                                     [&](uint64_t c) { code = c; });
        if (code != 1) die("reset failed: " + std::to_string(code));
    };
    auto change = [&] {
        uint64_t code = 0;
        manager.setDataProtectionOnDataContainerForContainerIdentity(*identity, 1, false, false,
                                                                     [&](uint64_t c) { code = c; });
        if (code != 1) die("change failed: " + std::to_string(code));
    };
    const std::string scratch = root + "/floor";
    stdfs::create_directories(scratch);
    int floorItems = 0;
    auto floor = [&] {
        // The change writes its pending file and the container's metadata,
        // both atomically with fsyncs, and removes the pending file.
        if (tarn::FsWriteFile(scratch + "/pending.plist", std::string(300, 'p'), 0644, true, 0))
            die("floor write");
        floorItems = 0;
        for (const char* item : {"/Documents", "/Library", "/tmp"})
            floorItems += setTree(container + item, 1, 4);
        if (tarn::FsWriteFile(scratch + "/metadata.plist", std::string(600, 'm'), 0644, true, 0))
            die("floor write");
        stdfs::remove(scratch + "/pending.plist");
    };

    reset();
    change();  // warm the caches
    std::vector<double> ours, bare;
    for (int r = 0; r < rounds; ++r) {
        auto timed = [](auto&& work) {
            auto t0 = Clock::now();
            work();
            return ms(Clock::now() - t0);
        };
        if (r % 2 == 0) {
            reset();
            ours.push_back(timed(change));
            reset();
            bare.push_back(timed(floor));
        } else {
            reset();
            bare.push_back(timed(floor));
            reset();
            ours.push_back(timed(change));
        }
    }
    const double a = tarn::bench::medianUs(ours), b = tarn::bench::medianUs(bare);
    std::printf("container: %d files, %d items set per change, %d rounds (median)\n", files,
                floorItems, rounds);
    std::printf("class change (4 -> 1)  : %8.2f ms\n", a);
    std::printf("bare walk, same setxattr: %8.2f ms\n", b);
    std::printf("ratio change/walk       : %.2f %s\n", a / b,
                a <= 1.5 * b ? "(target 1.5 met)" : "(ABOVE target 1.5)");
    std::error_code ec;
    stdfs::remove_all(root, ec);
    return 0;
}
