// Throws link layouts and relative paths at the two ways the daemon keeps a
// client's path inside a directory, and checks the one property that
// matters: the child test accepts only paths that lie inside the base once
// everything that exists of them is resolved, and the descriptor-relative
// resolution hands back only a directory inside the base and a plain name.
//
// Input: lines of a small layout language, all names relative to a work
// directory W that holds the base W/base and a sibling W/out:
//     D name          a directory
//     F name          a file
//     L name target   a symbolic link (target as given: relative or absolute)
//     P path          the suspicious path, relative to W/base (last one wins)
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <sstream>
#include <string>
#include <system_error>

#include "Daemon/TarnFileManager.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"

namespace {

namespace stdfs = std::filesystem;

const std::string& workDir() {
    static const std::string dir = [] {
        std::string tmpl = (stdfs::temp_directory_path() / "tarn-realpath-fuzz-XXXXXX").string();
        if (!::mkdtemp(tmpl.data())) std::abort();
        return stdfs::canonical(tmpl).string();
    }();
    return dir;
}

bool safeName(const std::string& name) {
    if (name.empty() || name.size() > 64 || name[0] == '/') return false;
    for (auto& c : tarn::PathComponents(name))
        if (c == ".." || c == ".") return false;
    return true;
}

bool insideOf(const std::string& path, const std::string& base) {
    return path == base || (path.size() > base.size() && path.compare(0, base.size(), base) == 0 &&
                            path[base.size()] == '/');
}

// Resolves the longest existing prefix of `path` and appends the rest.
std::string resolveWhatExists(const std::string& path) {
    stdfs::path p(path), rest;
    std::error_code ec;
    while (!p.empty() && p != p.root_path()) {
        if (stdfs::exists(stdfs::symlink_status(p, ec))) {
            auto real = stdfs::canonical(p, ec);
            if (ec) return "";  // dangling: the child test must not have accepted it
            return (real / rest).lexically_normal().string();
        }
        rest = p.filename() / rest;
        p = p.parent_path();
    }
    return "";
}

// The descriptor-relative resolution: whatever it accepts names one entry
// directly inside a directory that is itself inside the base.
void checkBelow(const std::string& base, const std::string& baseReal, const std::string& relative) {
    auto& fm = tarn::TarnFileManager::defaultManager();
    tarn::FsFd baseFd;
    if (fm.openDirectoryAtURL(base, &baseFd) != 0) std::abort();
    auto item = fm.itemBelowDirectory(baseFd, relative);
    if (!item.ok()) return;
    std::error_code ec;
    const std::string directory =
        stdfs::read_symlink("/proc/self/fd/" + std::to_string(item->directory.get()), ec).string();
    if (ec || !insideOf(directory, baseReal) || item->name.empty() ||
        item->name.find('/') != std::string::npos || item->name == "." || item->name == "..") {
        std::fprintf(stderr, "resolved %s to %s / %s outside %s\n", relative.c_str(),
                     directory.c_str(), item->name.c_str(), baseReal.c_str());
        std::abort();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static bool once = [] {
        tarn::PlatformLogSetQuiet(true);
        return true;
    }();
    (void)once;
    if (size > 2048) return 0;
    const std::string& w = workDir();
    tarn::SetRootPrefix(w);
    std::error_code ec;
    for (auto& entry : stdfs::directory_iterator(w, ec)) stdfs::remove_all(entry.path(), ec);
    stdfs::create_directories(w + "/base", ec);
    stdfs::create_directories(w + "/out", ec);

    std::string suspicious = "x";
    std::istringstream in(std::string(reinterpret_cast<const char*>(data), size));
    std::string line;
    int entries = 0;
    while (std::getline(in, line) && entries < 24) {
        if (line.size() < 3 || line[1] != ' ') continue;
        std::string rest = line.substr(2);
        ++entries;
        if (line[0] == 'P') {
            suspicious = rest;
            continue;
        }
        std::string name = rest, target;
        if (line[0] == 'L') {
            auto sp = rest.find(' ');
            if (sp == std::string::npos) continue;
            name = rest.substr(0, sp);
            target = rest.substr(sp + 1);
            if (target.empty() || target.find('\0') != std::string::npos) continue;
        }
        if (!safeName(name) || name.find('\0') != std::string::npos) continue;
        stdfs::path at = stdfs::path(w) / name;
        // Parents are made only through real directories inside W.
        auto parent = resolveWhatExists(at.parent_path().string());
        if (parent.empty() || !insideOf(parent, w)) continue;
        stdfs::create_directories(at.parent_path(), ec);
        if (line[0] == 'D') stdfs::create_directory(at, ec);
        if (line[0] == 'F') {
            if (FILE* f = std::fopen(at.c_str(), "w")) std::fclose(f);
        }
        if (line[0] == 'L') stdfs::create_symlink(target, at, ec);
    }
    if (suspicious.find('\0') != std::string::npos || suspicious.size() > 512) return 0;

    std::string base = w + "/base";
    std::string baseReal = stdfs::canonical(base).string();
    checkBelow(base, baseReal, suspicious);
    auto accepted = tarn::TarnFileManager::defaultManager().realPathForURL(tarn::PathJoin(base, suspicious), base);
    if (!accepted) return 0;
    std::string resolved = resolveWhatExists(*accepted);
    if (resolved.empty() || !insideOf(resolved, baseReal) || !insideOf(*accepted, baseReal)) {
        std::fprintf(stderr, "accepted %s -> %s (resolves to %s) outside %s\n", suspicious.c_str(),
                     accepted->c_str(), resolved.c_str(), baseReal.c_str());
        std::abort();
    }
    return 0;
}
