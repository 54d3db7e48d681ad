#include "Platform/FileWatcher.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <thread>

namespace tarn {

struct FileWatcher::State {
    int inotifyFd = -1;
    int stopFd = -1;
    std::thread thread;
    Callback callback;
};

std::unique_ptr<FileWatcher> FileWatcher::watchDirectory(const std::string& dir, Callback callback,
                                                         std::string* why) {
    std::error_code ec;
    std::filesystem::create_directories(dir, ec);
    auto st = std::make_shared<State>();
    st->callback = std::move(callback);
    st->inotifyFd = ::inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    st->stopFd = ::eventfd(0, EFD_CLOEXEC);
    if (st->inotifyFd < 0 || st->stopFd < 0 ||
        ::inotify_add_watch(st->inotifyFd, dir.c_str(),
                            IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_CREATE | IN_DELETE) <
            0) {
        if (why) *why = std::string("inotify on ") + dir + ": " + std::strerror(errno);
        if (st->inotifyFd >= 0) ::close(st->inotifyFd);
        if (st->stopFd >= 0) ::close(st->stopFd);
        return nullptr;
    }
    st->thread = std::thread([st] {
        alignas(inotify_event) char buf[8192];
        for (;;) {
            pollfd fds[2] = {{st->inotifyFd, POLLIN, 0}, {st->stopFd, POLLIN, 0}};
            if (::poll(fds, 2, -1) < 0) {
                if (errno == EINTR) continue;
                return;
            }
            if (fds[1].revents) return;
            ssize_t n = ::read(st->inotifyFd, buf, sizeof buf);
            if (n <= 0) continue;
            for (char* p = buf; p < buf + n;) {
                auto* ev = reinterpret_cast<inotify_event*>(p);
                std::string name = ev->len ? ev->name : "";
                st->callback(name);
                p += sizeof(inotify_event) + ev->len;
            }
        }
    });
    std::unique_ptr<FileWatcher> w(new FileWatcher);
    w->state_ = std::move(st);
    return w;
}

void FileWatcher::stop() {
    if (!state_) return;
    uint64_t one = 1;
    (void)!::write(state_->stopFd, &one, sizeof one);
    if (state_->thread.joinable()) state_->thread.join();
    ::close(state_->inotifyFd);
    ::close(state_->stopFd);
    state_.reset();
}

FileWatcher::~FileWatcher() { stop(); }

}  // namespace tarn
