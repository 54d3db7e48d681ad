#include "Platform/Notifications.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <map>
#include <mutex>
#include <vector>

#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

struct Registry {
    std::mutex mu;
    int nextToken = 1;                                                         // guarded by mu
    std::map<int, std::pair<std::string, std::function<void()>>> observers;  // guarded by mu
};

Registry& registry() {
    static auto* r = new Registry;
    return *r;
}

}  // namespace

uint32_t NotifyPost(const std::string& name) {
    std::vector<std::function<void()>> toCall;
    {
        auto& r = registry();
        std::lock_guard lock(r.mu);
        for (auto& [token, obs] : r.observers)
            if (obs.first == name) toCall.push_back(obs.second);
    }
    for (auto& fn : toCall) fn();

    // Other processes wait on this file; one line per post, appended atomically.
    std::string dir = RootPath("/run/tarnkeeper");
    std::error_code ec;
    std::filesystem::create_directories(dir, ec);
    int fd = ::open((dir + "/notifications").c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC,
                    0644);
    if (fd < 0) return static_cast<uint32_t>(errno);
    std::string line = name + "\n";
    ssize_t n = ::write(fd, line.data(), line.size());
    int err = errno;
    ::close(fd);
    return n == static_cast<ssize_t>(line.size()) ? 0 : static_cast<uint32_t>(err ? err : EIO);
}

int NotifyRegister(const std::string& name, std::function<void()> callback) {
    auto& r = registry();
    std::lock_guard lock(r.mu);
    int token = r.nextToken++;
    r.observers.emplace(token, std::make_pair(name, std::move(callback)));
    return token;
}

void NotifyCancel(int token) {
    auto& r = registry();
    std::lock_guard lock(r.mu);
    r.observers.erase(token);
}

}  // namespace tarn
