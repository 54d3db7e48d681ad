#include "Platform/ListeningSocket.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <set>
#include <system_error>

#include "Platform/Format.h"

namespace tarn {

namespace {

int fail(std::string* why, std::string reason, int fd = -1) {
    if (fd >= 0) ::close(fd);
    if (why) *why = std::move(reason);
    return -1;
}

bool socketAddress(const std::string& path, struct sockaddr_un* addr, std::string* why) {
    *addr = {};
    addr->sun_family = AF_UNIX;
    if (path.empty() || path.size() >= sizeof addr->sun_path) {
        if (why) *why = Format("socket path too long: %s", path);
        return false;
    }
    std::memcpy(addr->sun_path, path.data(), path.size());
    return true;
}

}  // namespace

int TakeActivatedSocket(const std::string& path, int type) {
    static std::mutex lock;
    static auto& taken = *new std::set<int>();  // never freed: asked until exit
    std::lock_guard<std::mutex> guard(lock);
    const int n = ::sd_listen_fds(0);
    for (int fd = SD_LISTEN_FDS_START; n > 0 && fd < SD_LISTEN_FDS_START + n; ++fd) {
        if (taken.count(fd)) continue;
        if (::sd_is_socket_unix(fd, type, 1, path.c_str(), 0) <= 0) continue;
        (void)::fcntl(fd, F_SETFD, FD_CLOEXEC);  // best effort; children never need it
        const int flags = ::fcntl(fd, F_GETFL);
        if (flags < 0 || ::fcntl(fd, F_SETFL, flags | O_NONBLOCK) != 0) return -1;
        taken.insert(fd);
        return fd;
    }
    return -1;
}

int BindListeningSocket(const std::string& path, int type, mode_t mode, std::string* why) {
    struct sockaddr_un addr;
    if (!socketAddress(path, &addr, why)) return -1;

    std::error_code ec;
    std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ec);
    if (ec) return fail(why, Format("cannot create %s: %s", path, ec.message()));

    struct stat st;
    if (::lstat(path.c_str(), &st) == 0) {
        if (!S_ISSOCK(st.st_mode)) return fail(why, Format("%s exists and is not a socket", path));
        // A stale socket from an earlier run is replaced; a live one is not.
        const int probe = ::socket(AF_UNIX, type | SOCK_CLOEXEC, 0);
        const bool live =
            probe >= 0 && ::connect(probe, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
        if (probe >= 0) ::close(probe);
        if (live) return fail(why, Format("another process is listening on %s", path));
        if (::unlink(path.c_str()) != 0 && errno != ENOENT)
            return fail(why, Format("unlink %s: %s", path, std::strerror(errno)));
    }

    const int fd = ::socket(AF_UNIX, type | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd < 0) return fail(why, Format("socket: %s", std::strerror(errno)));
    if (::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0)
        return fail(why, Format("bind %s: %s", path, std::strerror(errno)), fd);
    if (::chmod(path.c_str(), mode) != 0 || ::listen(fd, SOMAXCONN) != 0) {
        const std::string reason = Format("listen %s: %s", path, std::strerror(errno));
        (void)::unlink(path.c_str());  // ours, just made
        return fail(why, reason, fd);
    }
    return fd;
}

int ConnectUnixSocket(const std::string& path, int type, std::string* why) {
    struct sockaddr_un addr;
    if (!socketAddress(path, &addr, why)) return -1;
    const int fd = ::socket(AF_UNIX, type | SOCK_CLOEXEC, 0);
    if (fd < 0) return fail(why, Format("socket: %s", std::strerror(errno)));
    int r;
    do {
        r = ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
    } while (r != 0 && errno == EINTR);
    if (r != 0) return fail(why, Format("connect %s: %s", path, std::strerror(errno)), fd);
    return fd;
}

}  // namespace tarn
