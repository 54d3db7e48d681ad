#include "Platform/Accounts.h"

#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <charconv>
#include <fstream>
#include <sstream>
#include <vector>

#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

std::vector<std::string> splitColon(const std::string& line) {
    std::vector<std::string> out;
    std::string field;
    std::istringstream in(line);
    while (std::getline(in, field, ':')) out.push_back(field);
    if (!line.empty() && line.back() == ':') out.emplace_back();
    return out;
}

// A numeric id field: plain decimal digits that fit, nothing else (no sign,
// no blanks), so that "-1" is not read as the largest id.
template <class Id>
bool parseId(const std::string& field, Id* id) {
    const char* end = field.data() + field.size();
    auto [at, ec] = std::from_chars(field.data(), end, *id);
    return !field.empty() && ec == std::errc() && at == end;
}

template <class Match>
std::optional<AccountUser> scanPasswd(Match match) {
    std::ifstream in(RootPath("/etc/passwd"));
    std::string line;
    while (std::getline(in, line)) {
        auto f = splitColon(line);
        if (f.size() < 6) continue;
        AccountUser u;
        u.name = f[0];
        // A malformed line is skipped, as libc does.
        if (!parseId(f[2], &u.uid) || !parseId(f[3], &u.gid)) continue;
        u.home = f[5];
        if (match(u)) return u;
    }
    return std::nullopt;
}

std::optional<AccountUser> fromPasswd(const passwd* pw) {
    if (!pw) return std::nullopt;
    return AccountUser{pw->pw_name, pw->pw_uid, pw->pw_gid, pw->pw_dir ? pw->pw_dir : ""};
}

}  // namespace

std::optional<AccountUser> AccountUserByName(const std::string& name) {
    if (!RootIsSystemRoot()) return scanPasswd([&](const AccountUser& u) { return u.name == name; });
    passwd pw, *res = nullptr;
    std::vector<char> buf(16384);
    if (getpwnam_r(name.c_str(), &pw, buf.data(), buf.size(), &res) != 0) return std::nullopt;
    return fromPasswd(res);
}

std::optional<AccountUser> AccountUserByUID(uid_t uid) {
    if (!RootIsSystemRoot()) return scanPasswd([&](const AccountUser& u) { return u.uid == uid; });
    passwd pw, *res = nullptr;
    std::vector<char> buf(16384);
    if (getpwuid_r(uid, &pw, buf.data(), buf.size(), &res) != 0) return std::nullopt;
    return fromPasswd(res);
}

std::optional<AccountGroup> AccountGroupByName(const std::string& name) {
    if (!RootIsSystemRoot()) {
        std::ifstream in(RootPath("/etc/group"));
        std::string line;
        while (std::getline(in, line)) {
            auto f = splitColon(line);
            if (f.size() < 3 || f[0] != name) continue;
            gid_t gid = 0;
            if (parseId(f[2], &gid)) return AccountGroup{f[0], gid};
        }
        return std::nullopt;
    }
    group gr, *res = nullptr;
    std::vector<char> buf(16384);
    if (getgrnam_r(name.c_str(), &gr, buf.data(), buf.size(), &res) != 0 || !res)
        return std::nullopt;
    return AccountGroup{res->gr_name, res->gr_gid};
}

bool ProcessIsPrivileged() { return ::geteuid() == 0; }

}  // namespace tarn
