#include "Platform/FileWatcher.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <thread>

namespace fs = std::filesystem;

namespace tarn {

namespace {

constexpr uint32_t kDirectoryEvents = IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_CREATE |
                                      IN_DELETE | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
// On an ancestor only the missing path component coming (back) matters, and
// the ancestor itself going away.
constexpr uint32_t kAncestorEvents =
    IN_CREATE | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
constexpr uint32_t kWatchGone = IN_DELETE_SELF | IN_MOVE_SELF | IN_IGNORED | IN_UNMOUNT;
// Each pass either watches the directory or an ancestor that existed a moment
// ago; a tree that keeps changing under us is retried on its next event.
constexpr int kMaxArmAttempts = 16;

}  // namespace

struct FileWatcher::State {
    // Constant after construction.
    fs::path dir;
    Callback callback;
    int inotifyFd = -1;
    int stopFd = -1;
    std::thread thread;

    // Set up before the thread starts, then touched by the watcher thread only.
    int dirWatch = -1;        // on `dir`, while it exists
    int ancestorWatch = -1;   // on the nearest existing ancestor, while `dir` is missing
    std::string missingName;  // the component below that ancestor that is awaited

    ~State() {
        if (inotifyFd >= 0) ::close(inotifyFd);
        if (stopFd >= 0) ::close(stopFd);
    }

    void drop(int& wd) {
        // Fails harmlessly when the kernel already removed the watch.
        if (wd >= 0) (void)::inotify_rm_watch(inotifyFd, wd);
        wd = -1;
    }

    // Watches `dir`, or else the nearest existing ancestor for it to come back.
    // Returns false with errno set when neither could be watched.
    bool arm() {
        drop(ancestorWatch);
        for (int attempt = 0; attempt < kMaxArmAttempts; ++attempt) {
            dirWatch = ::inotify_add_watch(inotifyFd, dir.c_str(), kDirectoryEvents);
            if (dirWatch >= 0) return true;
            if (errno != ENOENT && errno != ENOTDIR) return false;
            fs::path missing = dir;
            while (ancestorWatch < 0 && missing.has_relative_path()) {
                fs::path parent = missing.parent_path();
                ancestorWatch = ::inotify_add_watch(inotifyFd, parent.c_str(), kAncestorEvents);
                if (ancestorWatch < 0 && errno != ENOENT && errno != ENOTDIR) return false;
                if (ancestorWatch < 0) missing = parent;
            }
            if (ancestorWatch < 0) return false;
            missingName = missing.filename().string();
            // It may have come back before the ancestor was watched.
            std::error_code ec;
            if (!fs::exists(missing, ec)) return true;
            drop(ancestorWatch);
        }
        return true;
    }

    void reportEntries() {
        std::error_code ec;
        for (fs::directory_iterator it(dir, ec), end; !ec && it != end; it.increment(ec)) {
            callback(it->path().filename().string());
        }
    }

    void handle(const inotify_event& ev) {
        std::string name = ev.len ? ev.name : "";
        if (ev.mask & IN_Q_OVERFLOW) {
            callback("");
            return;
        }
        if (ev.wd >= 0 && ev.wd == dirWatch) {
            if (ev.mask & kWatchGone) {
                drop(dirWatch);
                callback("");
                if (arm() && dirWatch >= 0) reportEntries();
                return;
            }
            callback(name);
            return;
        }
        if (ev.wd >= 0 && ev.wd == ancestorWatch) {
            if ((ev.mask & kWatchGone) || name == missingName) {
                if (ev.mask & IN_IGNORED) ancestorWatch = -1;
                if (arm() && dirWatch >= 0) reportEntries();
            }
        }
        // Anything else belongs to a watch already given up.
    }

    void run() {
        alignas(inotify_event) char buf[8192];
        for (;;) {
            pollfd fds[2] = {{inotifyFd, POLLIN, 0}, {stopFd, POLLIN, 0}};
            if (::poll(fds, 2, -1) < 0) {
                if (errno == EINTR) continue;
                return;
            }
            if (fds[1].revents) return;
            if (fds[0].revents & (POLLERR | POLLNVAL)) return;
            ssize_t n = ::read(inotifyFd, buf, sizeof buf);
            if (n <= 0) continue;
            for (char* p = buf; p < buf + n;) {
                const auto* ev = reinterpret_cast<const inotify_event*>(p);
                handle(*ev);
                p += sizeof(inotify_event) + ev->len;
            }
        }
    }
};

std::unique_ptr<FileWatcher> FileWatcher::watchDirectory(const std::string& dir, Callback callback,
                                                         std::string* why) {
    auto st = std::make_unique<State>();
    st->dir = fs::path(dir).lexically_normal();
    if (st->dir.has_relative_path() && !st->dir.has_filename()) st->dir = st->dir.parent_path();
    st->callback = std::move(callback);
    st->inotifyFd = ::inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    st->stopFd = ::eventfd(0, EFD_CLOEXEC);
    if (st->inotifyFd < 0 || st->stopFd < 0 || !st->arm()) {
        if (why) *why = std::string("inotify on ") + dir + ": " + std::strerror(errno);
        return nullptr;
    }
    State* raw = st.get();
    st->thread = std::thread([raw] { raw->run(); });
    std::unique_ptr<FileWatcher> w(new FileWatcher);
    w->state_ = std::move(st);
    return w;
}

void FileWatcher::stop() {
    if (!state_) return;
    uint64_t one = 1;
    (void)!::write(state_->stopFd, &one, sizeof one);
    if (state_->thread.joinable()) state_->thread.join();
    state_.reset();
}

FileWatcher::~FileWatcher() { stop(); }

}  // namespace tarn
