// Replacing a container of 1,000 files (command 2's operation, in this
// process) against the same file-system work done directly: the replace
// file written to a temporary name, synced, renamed, its directory synced;
// the old container renamed into staging, the new one renamed into place,
// the destination's directory synced; staging and the replace file renamed
// into fresh death-row slots. Rounds alternate which side goes first and are
// run pinned to one CPU, then unpinned; medians and ratio. Target: 1.5.
//
//   replace_bench [files=1000] [rounds=15]
#include <fcntl.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/ConduitHarness.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"
#include "bench/BenchSupport.h"

namespace {

namespace stdfs = std::filesystem;
using namespace tarn;
using bench::Clock;

void fill(const std::string& dir, int files) {
    for (int i = 0; i < files; ++i) {
        const std::string sub = dir + "/Documents/d" + std::to_string(i / 100);
        if (i % 100 == 0) stdfs::create_directories(sub);
        std::ofstream(sub + "/f" + std::to_string(i)) << "x";
    }
}

void syncDirectory(const std::string& dir) {
    const int fd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0 || ::fsync(fd) != 0) bench::die("cannot sync " + dir);
    ::close(fd);
}

void renameOrDie(const std::string& from, const std::string& to) {
    if (::rename(from.c_str(), to.c_str()) != 0) bench::die("rename " + from + " -> " + to);
}

std::string slotIn(const std::string& deathRow) {
    std::string slot = deathRow + "/temp.XXXXXX";
    if (!::mkdtemp(slot.data())) bench::die("mkdtemp in " + deathRow);
    return slot;
}

struct World {
    TarnClientConnection connection;
    FileURL live, transient, staging, replace, deathRow;
    std::string replaceBytes;  // a replace file as the daemon writes it
    int files = 0;
    int serial = 0;

    TarnMetadataRef make(const std::string& identifier, bool transientTree) {
        auto identity = TarnContainerIdentity::containerIdentityWithUserIdentity(
            TarnUserIdentityCache::defaultUserIdentity(), identifier, 2);
        if (!identity.ok()) bench::die("identity");
        auto made = connection.createOrLookupContainerWithContainerIdentity(
            *identity, /*createIfNecessary=*/true, transientTree, /*useLocking=*/true);
        if (!made.ok()) bench::die("cannot create " + identifier);
        fill((*made)->url(), files);
        return *made;
    }

    double ours() {
        const std::string id = "bench.replace" + std::to_string(serial++);
        TarnMetadataRef old = make(id, false), neu = make(id, true);
        const auto t0 = Clock::now();
        TarnStatus replaced = connection.replaceContainerIdentity(
            old->containerIdentity(), neu->containerIdentity(), /*preserveOldUUID=*/false,
            /*startDeletionThread=*/false);
        const auto t1 = Clock::now();
        if (!replaced.ok()) bench::die("replacement failed");
        return std::chrono::duration<double, std::micro>(t1 - t0).count();
    }

    double floor() {
        const std::string name = Uuid::generate().string();
        const std::string oldDir = live + "/" + Uuid::generate().string();
        const std::string newDir = transient + "/" + name;
        stdfs::create_directories(oldDir);
        stdfs::create_directories(newDir);
        fill(oldDir, files);
        fill(newDir, files);
        const std::string token = Uuid::generate().string();
        const std::string file = replace + "/" + token + ".plist";
        const std::string parked = staging + "/" + token;
        const std::string dest = live + "/" + name;

        const auto t0 = Clock::now();
        const std::string temporary = file + ".tmp";
        const int fd = ::open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        if (fd < 0 ||
            ::write(fd, replaceBytes.data(), replaceBytes.size()) !=
                static_cast<ssize_t>(replaceBytes.size()) ||
            ::fsync(fd) != 0)
            bench::die("cannot write " + temporary);
        ::close(fd);
        renameOrDie(temporary, file);
        syncDirectory(replace);
        renameOrDie(oldDir, parked);
        renameOrDie(newDir, dest);
        syncDirectory(live);
        renameOrDie(parked, slotIn(deathRow) + "/" + token);
        renameOrDie(file, slotIn(deathRow) + "/" + token + ".plist");
        const auto t1 = Clock::now();
        return std::chrono::duration<double, std::micro>(t1 - t0).count();
    }

    void emptyDeathRow() {
        for (const auto& e : stdfs::directory_iterator(deathRow)) stdfs::remove_all(e.path());
    }
};

void measure(const char* placement, World& world, int rounds) {
    std::vector<double> a, b;
    for (int r = 0; r < rounds; ++r) {
        if (r % 2 == 0) {
            a.push_back(world.ours());
            b.push_back(world.floor());
        } else {
            b.push_back(world.floor());
            a.push_back(world.ours());
        }
        world.emptyDeathRow();
    }
    const double ours = bench::medianUs(a), direct = bench::medianUs(b);
    std::printf("%-9s replace %d files: %8.1f us   direct renames: %8.1f us   ratio %.2f %s\n",
                placement, world.files, ours, direct, ours / direct,
                ours / direct <= 1.5 ? "(target 1.5 met)" : "(ABOVE target 1.5)");
}

}  // namespace

int main(int argc, char** argv) {
    const int files = argc > 1 ? std::atoi(argv[1]) : 1000;
    const int rounds = argc > 2 ? std::atoi(argv[2]) : 15;
    if (files <= 0 || rounds <= 0) return 2;
    PlatformLogSetQuiet(true);
    const std::string root = bench::makeScratchRoot();
    if (root.empty()) bench::die("no scratch root");
    SetRootPrefix(root);
    TarnUserIdentityCache::TEST_setPersonasAreSupported(false);

    World world;
    world.files = files;
    auto& configuration = TarnGlobalConfiguration::sharedInstance();
    const TarnUserIdentityRef user = TarnUserIdentityCache::defaultUserIdentity();
    // The direct side works in the daemon's own directories, so both draw
    // on the same directory sizes and inode groups.
    world.live = *configuration.containerDirectoryURLForUserIdentity(user, 2, false);
    world.transient = *configuration.containerDirectoryURLForUserIdentity(user, 2, true);
    world.staging = configuration.stagingDirectoryURLForUserIdentity(user, 2);
    world.replace = configuration.replaceDirectory();
    world.deathRow = configuration.deathrowDirectory();
    const FileURL sample = world.replace + "/sample.plist";
    if (!TarnClientConnection::_writeToDiskReplaceAt(sample, world.live + "/A",
                                                     world.transient + "/B", world.staging + "/C",
                                                     world.live + "/B")
             .ok())
        bench::die("cannot write a sample replace file");
    std::ifstream in(sample, std::ios::binary);
    world.replaceBytes.assign(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
    stdfs::remove(sample);

    (void)world.ours();  // warm the cache of the class
    (void)world.floor();
    world.emptyDeathRow();

    namespace harness = conduit::harness;
    const std::vector<int> all = harness::AllowedCpus();
    std::string why;
    if (harness::SetProcessCpus(::getpid(), {all.front()}, &why))
        measure("pinned", world, rounds);
    else
        std::fprintf(stderr, "pinning: %s\n", why.c_str());
    if (!harness::SetProcessCpus(::getpid(), all, &why)) std::fprintf(stderr, "%s\n", why.c_str());
    measure("unpinned", world, rounds);

    std::error_code ec;
    stdfs::remove_all(root, ec);
    return 0;
}
