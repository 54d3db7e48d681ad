// Sizing one container of N files (default 100,000) by its project's quota
// usage against walking it, interleaved round by round in one run; the walk
// is the floor. Where project quotas cannot be had (no loop device, a kernel
// without quota support) the fast path falls back to the walk and the ratio
// reads about 1: the line says so.
//
//   project_quota_bench [files] [rounds]    (run as root for the loop mount)
#include <stdlib.h>
#include <sys/mount.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "Daemon/TarnFileManager.h"
#include "Platform/HostConfiguration.h"
#include "Platform/PlatformLog.h"
#include "Platform/PropertyList.h"

namespace stdfs = std::filesystem;

namespace {

double median(std::vector<double> v) {
    std::sort(v.begin(), v.end());
    return v[v.size() / 2];
}

template <class F>
double millis(F f) {
    const auto start = std::chrono::steady_clock::now();
    f();
    return std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start)
        .count();
}

}  // namespace

int main(int argc, char** argv) {
    const int files = argc > 1 ? std::atoi(argv[1]) : 100000;
    const int rounds = argc > 2 ? std::atoi(argv[2]) : 9;
    if (files <= 0 || rounds <= 0) return 2;
    tarn::PlatformLogSetQuiet(true);
    tarn::HostConfiguration config;
    config.featureFlags["fast_container_sizing"] = true;
    tarn::HostConfiguration::TEST_setShared(config);

    std::string scratch = (stdfs::temp_directory_path() / "tarn-pq-bench-XXXXXX").string();
    if (!::mkdtemp(scratch.data())) return 1;
    const std::string image = scratch + "/ext4.img", mnt = scratch + "/mnt";
    stdfs::create_directories(mnt);
    std::ofstream(image).close();
    stdfs::resize_file(image, uint64_t{1} << 30);
    const std::string make = "mkfs.ext4 -q -F -N 200000 -O project,quota -E quotatype=prjquota '" +
                             image + "' >/dev/null 2>&1 && mount -o loop,prjquota '" + image +
                             "' '" + mnt + "' 2>/dev/null";
    const bool mounted = std::system(make.c_str()) == 0;
    const std::string top = (mounted ? mnt : scratch) + "/container";
    stdfs::create_directories(top);

    auto& fm = tarn::TarnFileManager::defaultManager();
    const std::optional<uint32_t> project =
        fm.assignProjectToNewContainer(top, tarn::Uuid::generate());
    for (int i = 0; i < files; ++i) {
        const std::string dir = top + "/d" + std::to_string(i / 1000);
        if (i % 1000 == 0) stdfs::create_directories(dir);
        std::ofstream(dir + "/f" + std::to_string(i))
            << std::string(static_cast<size_t>((i * 7919) % 9000), 'x');
    }
    ::sync();

    uint64_t byQuota = fm.fastDiskUsageForURL(top, project), byWalk = fm.diskUsageForURL(top);
    std::vector<double> quota, walk;
    for (int r = 0; r < rounds; ++r) {
        quota.push_back(millis([&] { byQuota = fm.fastDiskUsageForURL(top, project); }));
        walk.push_back(millis([&] { byWalk = fm.diskUsageForURL(top); }));
    }
    const double q = median(quota), w = median(walk);
    std::printf("%d files, %d rounds, %s\n", files, rounds,
                project ? "project quota in use"
                        : "project quotas unavailable here: the fast path measured is the walk it "
                          "falls back to");
    std::printf("by quota:  %10.3f ms  %llu bytes\n", q, static_cast<unsigned long long>(byQuota));
    std::printf("by walk:   %10.3f ms  %llu bytes (floor)\n", w,
                static_cast<unsigned long long>(byWalk));
    std::printf("ratio walk/quota: %.1fx\n", w / q);

    if (mounted) (void)::umount2(mnt.c_str(), MNT_DETACH);
    std::error_code ec;
    stdfs::remove_all(scratch, ec);
    return 0;
}
