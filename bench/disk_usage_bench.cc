// The full-walk container sizing against `du -s --block-size=1` of the same
// tree, in the same run, interleaved so both see the same cache state.
// Target: no slower than du (ratio <= 1).
//
//   disk_usage_bench [files=10000] [rounds=15]
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "Daemon/TarnFileManager.h"
#include "Platform/PlatformLog.h"

namespace {

namespace stdfs = std::filesystem;
using Clock = std::chrono::steady_clock;

// A container-like tree: 100 files per directory, two levels, sizes from
// empty to a few blocks, some links.
void buildTree(const std::string& top, int files) {
    int perDir = 100;
    for (int i = 0; i < files; ++i) {
        std::string dir = top + "/d" + std::to_string(i / (perDir * 10)) + "/s" + std::to_string((i / perDir) % 10);
        if (i % perDir == 0) stdfs::create_directories(dir);
        std::string name = dir + "/f" + std::to_string(i);
        if (i % 50 == 49) {
            stdfs::create_symlink("f0", name);
            continue;
        }
        std::ofstream(name) << std::string(static_cast<size_t>((i * 7919) % 9000), 'x');
    }
}

uint64_t duBytes(const std::string& path) {
    std::string cmd = "du -s --block-size=1 '" + path + "'";
    FILE* f = ::popen(cmd.c_str(), "r");
    unsigned long long v = 0;
    if (!f) return 0;
    if (std::fscanf(f, "%llu", &v) != 1) v = 0;
    ::pclose(f);
    return v;
}

double median(std::vector<double> v) {
    std::sort(v.begin(), v.end());
    return v[v.size() / 2];
}

}  // namespace

int main(int argc, char** argv) {
    int files = argc > 1 ? std::atoi(argv[1]) : 10000;
    int rounds = argc > 2 ? std::atoi(argv[2]) : 15;
    if (files <= 0 || rounds <= 0) return 2;
    tarn::PlatformLogSetQuiet(true);
    std::string tmpl = (stdfs::temp_directory_path() / "tarn-du-bench-XXXXXX").string();
    if (!::mkdtemp(tmpl.data())) return 1;
    std::string top = tmpl + "/tree";
    buildTree(top, files);

    auto& fm = tarn::TarnFileManager::defaultManager();
    uint64_t ours = fm.diskUsageForURL(top), theirs = duBytes(top);  // warm the caches
    std::vector<double> oursMs, duMs;
    for (int r = 0; r < rounds; ++r) {
        auto t0 = Clock::now();
        ours = fm.diskUsageForURL(top);
        auto t1 = Clock::now();
        theirs = duBytes(top);
        auto t2 = Clock::now();
        oursMs.push_back(std::chrono::duration<double, std::milli>(t1 - t0).count());
        duMs.push_back(std::chrono::duration<double, std::milli>(t2 - t1).count());
    }
    double a = median(oursMs), b = median(duMs);
    std::printf("tree: %d files, %d rounds (median)\n", files, rounds);
    std::printf("diskUsageForURL: %8.3f ms  %llu bytes\n", a, static_cast<unsigned long long>(ours));
    std::printf("du -s          : %8.3f ms  %llu bytes (includes starting du)\n", b,
                static_cast<unsigned long long>(theirs));
    std::printf("ratio ours/du  : %.2f %s\n", a / b, a <= b ? "(target met)" : "(SLOWER than du)");
    if (ours != theirs) std::printf("MISMATCH: sizes differ\n");
    std::error_code ec;
    stdfs::remove_all(tmpl, ec);
    return ours == theirs ? 0 : 1;
}
