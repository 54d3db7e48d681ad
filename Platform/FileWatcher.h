// Watches one directory with inotify and calls back, on the watcher's own
// thread, with the name of each entry that was created, written, moved or
// removed.
//
// The directory need not exist, and may be removed, renamed away or replaced
// while it is watched. Its loss is reported once with an empty name (any
// entry may have changed; the same is reported when the kernel dropped
// events). While it is missing the watcher waits on the nearest existing
// ancestor for the path to appear, then watches it and reports every entry it
// holds by name.
//
// One thread per watcher; stop() or the destructor joins it, after which the
// callback is never called again. Neither may be called from the callback. A
// watcher that is never destroyed keeps calling back while the process exits,
// so its callback must only reach objects that are never destroyed.
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
    // Idempotent; for the owner, not for several threads at once.
    void stop();

  private:
    FileWatcher() = default;
    struct State;
    std::unique_ptr<State> state_;
};

}  // namespace tarn
