// Watches one directory with inotify and calls back, on the watcher's own
// thread, with the name of each entry that was created, written, moved or
// removed. The directory is created if it is missing so that a file that
// appears later is still seen. One thread per watcher; stop() or the
// destructor joins it.
#pragma once

#include <functional>
#include <memory>
#include <string>

namespace tarn {

class FileWatcher {
public:
    using Callback = std::function<void(const std::string& name)>;
    // Returns nullptr (and the reason in *why) when inotify is unavailable.
    static std::unique_ptr<FileWatcher> watchDirectory(const std::string& dir, Callback callback,
                                                       std::string* why = nullptr);
    ~FileWatcher();
    void stop();

private:
    FileWatcher() = default;
    struct State;
    std::shared_ptr<State> state_;
};

}  // namespace tarn
