#include "Platform/CodeSignRegistry.h"

#include <atomic>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <mutex>

#include "Platform/FileWatcher.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"

namespace fs = std::filesystem;

namespace tarn {

struct CodeSignRegistry::Impl {
    std::mutex mu;
    std::map<std::string, std::shared_ptr<const CodeSignInfo>> byPath;  // guarded by mu
    // Bumped by every change the watcher reports; `loaded` is the count the
    // map reflects. A reader that sees them differ waits for the one load in
    // progress instead of reading the map that load is about to replace.
    std::atomic<uint64_t> changes{1};
    std::atomic<uint64_t> loaded{0};
    std::mutex loadMu;
    std::mutex watchMu;
    std::string watchedDir;                // guarded by watchMu
    std::string watchedRoot;               // guarded by watchMu: the prefix watchedDir is under
    std::unique_ptr<FileWatcher> watcher;  // guarded by watchMu

    std::string dir() const { return RootPath("/etc/tarnkeeper/codesign"); }

    // Follows the root prefix: fixed in the daemon, changed by tests.
    void ensureWatching() {
        std::lock_guard lock(watchMu);
        // Compared by prefix, which costs no allocation on every request.
        if (watcher && watchedRoot == RootPrefix()) return;
        const std::string d = dir();
        watchedRoot = RootPrefix();
        // The callback only marks the registry stale, so stopping here
        // cannot wait on anything this thread holds.
        if (watcher) watcher->stop();
        watcher = FileWatcher::watchDirectory(d, [this](const std::string&) { ++changes; });
        watchedDir = d;
        ++changes;
    }

    void loadIfChanged(bool always) {
        if (!always && loaded.load() == changes.load()) return;
        std::lock_guard lock(loadMu);
        const uint64_t seen = changes.load();
        if (!always && loaded.load() == seen) return;  // another thread loaded it meanwhile
        load();
        loaded = seen;
    }

    static std::string realOrSelf(const std::string& p) {
        std::error_code ec;
        auto r = fs::canonical(p, ec);
        return ec ? p : r.string();
    }

    void load() {
        std::map<std::string, std::shared_ptr<const CodeSignInfo>> fresh;
        std::error_code ec;
        for (auto& entry : fs::directory_iterator(dir(), ec)) {
            if (entry.path().extension() != ".plist") continue;
            std::ifstream in(entry.path(), std::ios::binary);
            std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
            std::string why;
            auto v = PlistValue::fromBytes(bytes.data(), bytes.size(), &why);
            const std::string* exe = v ? (v->find("Executable") ? v->find("Executable")->asString() : nullptr) : nullptr;
            const PlistValue* sid = v ? v->find("SigningIdentifier") : nullptr;
            if (!v || !exe || !sid || !sid->isString()) {
                PlatformLog("conduit", PlatformLogType::Error,
                            "Ignoring code-signing registry file %s: %s", entry.path().string(),
                            v ? "needs \"Executable\" and \"SigningIdentifier\" strings" : why);
                continue;
            }
            auto info = std::make_shared<CodeSignInfo>();
            info->executable = *exe;
            info->signingIdentifier = *sid->asString();
            if (auto* e = v->find("Entitlements"); e && e->isDict()) info->entitlements = *e;
            if (auto* s = v->find("Sandboxed")) info->sandboxed = s->truthy();
            if (auto* p = v->find("PersonaUniqueString"); p && p->isString())
                info->personaUniqueString = *p->asString();
            // Register under the scratch-root copy and the host path alike.
            if (!RootIsSystemRoot()) fresh[realOrSelf(RootPath(*exe))] = info;
            fresh[realOrSelf(*exe)] = info;
        }
        std::lock_guard lock(mu);
        byPath = std::move(fresh);
    }
};

CodeSignRegistry::CodeSignRegistry() : impl_(std::make_unique<Impl>()) { impl_->ensureWatching(); }

CodeSignRegistry& CodeSignRegistry::shared() {
    static auto* r = new CodeSignRegistry;
    return *r;
}

std::shared_ptr<const CodeSignInfo> CodeSignRegistry::infoForExecutable(const std::string& realPath) {
    impl_->ensureWatching();
    impl_->loadIfChanged(false);
    std::lock_guard lock(impl_->mu);
    auto it = impl_->byPath.find(realPath);
    return it == impl_->byPath.end() ? nullptr : it->second;
}

void CodeSignRegistry::reload() {
    impl_->ensureWatching();
    impl_->loadIfChanged(true);
}

}  // namespace tarn
