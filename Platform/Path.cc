#include "Platform/Path.h"

namespace tarn {

std::string PathJoin(std::string_view base, std::string_view component) {
    while (!component.empty() && component.front() == '/') component.remove_prefix(1);
    std::string out(base);
    while (out.size() > 1 && out.back() == '/') out.pop_back();
    if (component.empty()) return out;
    if (out.empty() || out.back() != '/') out += '/';
    out += component;
    while (out.size() > 1 && out.back() == '/') out.pop_back();
    return out;
}

std::string PathLastComponent(std::string_view path) {
    return std::string(PathLastComponentView(path));
}

std::string_view PathLastComponentView(std::string_view path) {
    while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
    auto pos = path.rfind('/');
    if (pos == std::string_view::npos || path.size() == 1) return path;
    return path.substr(pos + 1);
}

std::string PathParent(std::string_view path) {
    while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
    auto pos = path.rfind('/');
    if (pos == std::string_view::npos) return "";
    if (pos == 0) return "/";
    return std::string(path.substr(0, pos));
}

std::vector<std::string> PathComponents(std::string_view path) {
    std::vector<std::string> out;
    size_t i = 0;
    while (i < path.size()) {
        while (i < path.size() && path[i] == '/') ++i;
        size_t j = i;
        while (j < path.size() && path[j] != '/') ++j;
        if (j > i) out.emplace_back(path.substr(i, j - i));
        i = j;
    }
    return out;
}

std::string PathStandardize(std::string_view path) {
    bool absolute = !path.empty() && path.front() == '/';
    std::string out = absolute ? "/" : "";
    for (auto& c : PathComponents(path)) {
        if (c == ".") continue;
        if (!out.empty() && out.back() != '/') out += '/';
        out += c;
    }
    return out;
}

bool PathHasDotDotComponent(std::string_view path) {
    for (auto& c : PathComponents(path))
        if (c == "..") return true;
    return false;
}

}  // namespace tarn
