#include "Platform/RootPrefix.h"

namespace tarn {

namespace {
std::string& prefix() {
    // Never freed: threads still running while exit() destroys statics
    // (watchers, queued work) resolve paths through it.
    static auto& p = *new std::string("/");
    return p;
}
}  // namespace

void SetRootPrefix(std::string dir) {
    while (dir.size() > 1 && dir.back() == '/') dir.pop_back();
    if (dir.empty()) dir = "/";
    prefix() = std::move(dir);
}

const std::string& RootPrefix() { return prefix(); }
bool RootIsSystemRoot() { return prefix() == "/"; }

std::string RootPath(std::string_view absolutePath) {
    if (RootIsSystemRoot()) return std::string(absolutePath);
    std::string out = prefix();
    if (absolutePath.empty() || absolutePath.front() != '/') out += '/';
    out += absolutePath;
    return out;
}

std::string StripRootPrefix(std::string_view path) {
    if (RootIsSystemRoot()) return std::string(path);
    const std::string& p = prefix();
    if (path.size() >= p.size() && path.substr(0, p.size()) == p &&
        (path.size() == p.size() || path[p.size()] == '/'))
        return path.size() == p.size() ? "/" : std::string(path.substr(p.size()));
    return std::string(path);
}

}  // namespace tarn
