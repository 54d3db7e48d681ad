#include "Platform/ConduitSocket.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <memory>
#include <optional>
#include <sstream>

#include "Platform/Format.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace tarn::conduit::sock {

namespace {

int64_t remainingMs(std::chrono::steady_clock::time_point deadline) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    return std::max<int64_t>(0, left.count());
}

std::string errnoText(const char* call) { return Format("%s: %s", call, std::strerror(errno)); }

uint64_t bootTicksNow() {
    struct timespec ts;
    ::clock_gettime(CLOCK_BOOTTIME, &ts);
    const long hz = ::sysconf(_SC_CLK_TCK);
    return static_cast<uint64_t>(ts.tv_sec) * static_cast<uint64_t>(hz) +
           static_cast<uint64_t>(ts.tv_nsec) / (1000000000ull / static_cast<uint64_t>(hz));
}

}  // namespace

bool SendRecord(int fd, const uint8_t* data, size_t size, std::chrono::milliseconds timeout,
                std::string* why) {
    // Set by the first full buffer: a send that goes through reads no clock.
    std::optional<std::chrono::steady_clock::time_point> deadline;
    for (;;) {
        const ssize_t n = ::send(fd, data, size, MSG_NOSIGNAL | MSG_DONTWAIT);
        if (n == static_cast<ssize_t>(size)) return true;
        if (n >= 0) {
            // SOCK_SEQPACKET sends whole records or nothing.
            if (why) *why = "short send";
            return false;
        }
        if (errno == EINTR) continue;
        if (errno != EAGAIN && errno != EWOULDBLOCK) {
            if (why) *why = errnoText("send");
            return false;
        }
        struct pollfd p = {fd, POLLOUT, 0};
        if (!deadline) deadline = std::chrono::steady_clock::now() + timeout;
        const int64_t left = remainingMs(*deadline);
        if (left == 0) {
            if (why) *why = "peer does not read its messages";
            return false;
        }
        if (::poll(&p, 1, static_cast<int>(std::min<int64_t>(left, 1 << 30))) < 0 &&
            errno != EINTR) {
            if (why) *why = errnoText("poll");
            return false;
        }
    }
}

bool SendRecords(int fd, const std::vector<std::vector<uint8_t>>& records,
                 std::chrono::milliseconds timeout, std::string* why) {
    for (const auto& r : records)
        if (!SendRecord(fd, r.data(), r.size(), timeout, why)) return false;
    return true;
}

bool SendEncodedMessage(int fd, const RecordHeader& header, std::vector<uint8_t>* encoded,
                        std::chrono::milliseconds timeout, std::string* why) {
    const auto split = FrameMessage(header, encoded);
    const bool ok = split.empty() ? SendRecord(fd, encoded->data(), encoded->size(), timeout, why)
                                  : SendRecords(fd, split, timeout, why);
    // A thread's buffer stays small once a big message has gone.
    if (encoded->capacity() > kMaxRecordBytes) std::vector<uint8_t>().swap(*encoded);
    return ok;
}

RecvResult ReceiveRecord(int fd, size_t limit, std::vector<uint8_t>* buffer, std::string* why,
                         bool wait) {
    // Received into per-thread scratch and copied out at its real length:
    // sizing the caller's vector to the limit first would zero the whole limit
    // (64 KiB) on every call, the last one that finds nothing included.
    thread_local std::unique_ptr<uint8_t[]> scratch;
    thread_local size_t scratchSize = 0;
    if (scratchSize < limit) {
        scratch.reset(new uint8_t[limit]);
        scratchSize = limit;
    }
    for (;;) {
        // MSG_TRUNC makes recv report the record's real length, so an oversized
        // record is recognised instead of silently cut.
        const ssize_t n = ::recv(fd, scratch.get(), limit, (wait ? 0 : MSG_DONTWAIT) | MSG_TRUNC);
        if (n > 0) {
            if (static_cast<size_t>(n) > limit) {
                if (why) *why = Format("record of %zd bytes is larger than the limit", n);
                buffer->clear();
                return RecvResult::Error;
            }
            buffer->assign(scratch.get(), scratch.get() + n);
            return RecvResult::Record;
        }
        if (n == 0) {
            buffer->clear();
            return RecvResult::Closed;
        }
        if (errno == EINTR) continue;
        buffer->clear();
        if (errno == EAGAIN || errno == EWOULDBLOCK) return RecvResult::WouldBlock;
        if (errno == ECONNRESET) return RecvResult::Closed;
        if (why) *why = errnoText("recv");
        return RecvResult::Error;
    }
}

bool SetReceiveTimeout(int fd, std::chrono::milliseconds timeout) {
    struct timeval tv = {};
    tv.tv_sec = static_cast<time_t>(timeout.count() / 1000);
    tv.tv_usec = static_cast<suseconds_t>(timeout.count() % 1000 * 1000);
    return ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv) == 0;
}

bool WaitReadable(int fd, std::chrono::milliseconds timeout, std::string* why) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
        struct pollfd p = {fd, POLLIN, 0};
        const int64_t left = remainingMs(deadline);
        const int r = ::poll(&p, 1, static_cast<int>(std::min<int64_t>(left, 1 << 30)));
        if (r > 0) return true;
        if (r == 0) {
            if (why) *why = "timed out";
            return false;
        }
        if (errno != EINTR) {
            if (why) *why = errnoText("poll");
            return false;
        }
    }
}

void CloseFd(int fd) {
    if (fd >= 0) (void)::close(fd);  // nothing useful to do about a failed close
}

std::optional<uint64_t> ProcessStartTime(pid_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
    std::string line;
    if (!in || !std::getline(in, line)) return std::nullopt;
    // The command name (field 2) may hold spaces and parentheses; fields after
    // it start past the last ')'.
    const size_t close = line.rfind(')');
    if (close == std::string::npos) return std::nullopt;
    std::istringstream rest(line.substr(close + 1));
    std::string field;
    // Field 3 is the first after ')'; field 22 is the 20th.
    for (int i = 3; i <= 22; ++i) {
        if (!(rest >> field)) return std::nullopt;
    }
    char* end = nullptr;
    errno = 0;
    const unsigned long long v = std::strtoull(field.c_str(), &end, 10);
    if (errno != 0 || end == field.c_str() || *end != '\0') return std::nullopt;
    return static_cast<uint64_t>(v);
}

bool PidfdAlive(int pidfd) {
    // A pidfd polls readable once its process has exited.
    struct pollfd p = {pidfd, POLLIN, 0};
    for (;;) {
        const int r = ::poll(&p, 1, 0);
        if (r == 0) return true;
        if (r > 0) return false;
        if (errno != EINTR) return false;
    }
}

std::optional<std::string> ProcessExecutable(pid_t pid) {
    std::string link = "/proc/" + std::to_string(pid) + "/exe";
    std::vector<char> buf(4096);
    const ssize_t n = ::readlink(link.c_str(), buf.data(), buf.size());
    if (n <= 0 || static_cast<size_t>(n) >= buf.size()) return std::nullopt;
    return std::string(buf.data(), static_cast<size_t>(n));
}

std::optional<std::string> ExecutableLinkAt(int exeLinkFd) {
    char buf[4096];
    const ssize_t n = ::readlinkat(exeLinkFd, "", buf, sizeof buf);
    if (n <= 0 || static_cast<size_t>(n) >= sizeof buf) return std::nullopt;
    return std::string(buf, static_cast<size_t>(n));
}

std::optional<FileIdentity> ProcessExecutableFile(pid_t pid) {
    const std::string link = "/proc/" + std::to_string(pid) + "/exe";
    struct stat st;
    if (::stat(link.c_str(), &st) != 0) return std::nullopt;
    return FileIdentity{static_cast<uint64_t>(st.st_dev), static_cast<uint64_t>(st.st_ino)};
}

std::optional<PeerCredentials> ReadPeerCredentials(int fd, std::string* why) {
    const uint64_t acceptedAt = bootTicksNow();
    struct ucred cred;
    socklen_t len = sizeof cred;
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) {
        if (why) *why = errnoText("getsockopt(SO_PEERCRED)");
        return std::nullopt;
    }
    if (cred.pid <= 0) {
        if (why) *why = "peer has no process id in this namespace";
        return std::nullopt;
    }
    PeerCredentials out;
    out.euid = cred.uid;
    out.egid = cred.gid;
    out.pid = cred.pid;

    int pidfd = -1;
    len = sizeof pidfd;
    bool fromSocket = ::getsockopt(fd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &len) == 0 && pidfd >= 0;
    if (!fromSocket) {
        pidfd = static_cast<int>(::syscall(SYS_pidfd_open, cred.pid, 0));
        if (pidfd < 0) {
            if (why) *why = errnoText("pidfd_open");
            return std::nullopt;
        }
    }
    auto startTime = ProcessStartTime(cred.pid);
    const std::string exeLink = "/proc/" + std::to_string(cred.pid) + "/exe";
    const int exeLinkFd = ::open(exeLink.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC);
    // Alive after the reads means the PID named this process while we read it.
    if (!startTime || !PidfdAlive(pidfd)) {
        CloseFd(exeLinkFd);
        CloseFd(pidfd);
        if (why) *why = "peer exited before its identity could be read";
        return std::nullopt;
    }
    // Without SO_PEERPIDFD the PID might have been reused between connect and
    // pidfd_open; the connecting process started before we accepted it.
    if (!fromSocket && *startTime > acceptedAt) {
        CloseFd(exeLinkFd);
        CloseFd(pidfd);
        if (why) *why = "peer PID was reused before it could be pinned";
        return std::nullopt;
    }
    (void)::fcntl(pidfd, F_SETFD, FD_CLOEXEC);  // best effort: pidfds come close-on-exec
    out.startTime = *startTime;
    out.pidfd = pidfd;
    out.exeLinkFd = exeLinkFd;  // -1 when /proc could not be opened: callers fall back to the PID
    return out;
}

}  // namespace tarn::conduit::sock
