// Watched configuration directories that an administrator removes, renames or
// replaces while the daemon runs, and scratch roots removed while the process
// exits: the watchers must neither crash nor go deaf.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <filesystem>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/CodeSignRegistry.h"
#include "Platform/FileWatcher.h"
#include "Platform/PersonaRoster.h"
#include "Platform/RootPrefix.h"
#include "support/ScratchRoot.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;

namespace tarn {
namespace {

// Names reported by a watcher, waited for with a deadline.
class Recorder {
  public:
    void add(const std::string& name) {
        std::lock_guard<std::mutex> guard(lock_);
        names_.insert(name);
        changed_.notify_all();
    }
    bool waitFor(const std::string& name) {
        std::unique_lock<std::mutex> guard(lock_);
        return changed_.wait_for(guard, 5s, [&] { return names_.count(name) > 0; });
    }
    void clear() {
        std::lock_guard<std::mutex> guard(lock_);
        names_.clear();
    }

  private:
    std::mutex lock_;
    std::condition_variable changed_;
    std::set<std::string> names_;
};

class CountingObserver : public PersonaListUpdateObserver {
  public:
    void personaListDidUpdate() override {
        std::lock_guard<std::mutex> guard(lock_);
        ++count_;
        changed_.notify_all();
    }
    bool waitBeyond(unsigned seen) {
        std::unique_lock<std::mutex> guard(lock_);
        return changed_.wait_for(guard, 5s, [&] { return count_ > seen; });
    }
    unsigned count() {
        std::lock_guard<std::mutex> guard(lock_);
        return count_;
    }

  private:
    std::mutex lock_;
    std::condition_variable changed_;
    unsigned count_ = 0;
};

PlistValue personaList(const char* enterprise) {
    PlistArray list{PlistValue(PlistDict{{"Type", PlistValue("personal")},
                                         {"UniqueString", PlistValue("P")},
                                         {"PersonaID", PlistValue(uint64_t{1000})}})};
    if (enterprise) {
        list.push_back(PlistValue(PlistDict{{"Type", PlistValue("enterprise")},
                                            {"UniqueString", PlistValue(enterprise)},
                                            {"PersonaID", PlistValue(uint64_t{1001})}}));
    }
    return PlistValue(std::move(list));
}

std::string bytesOf(const PlistValue& value) {
    auto bytes = value.toBinary();
    return std::string(bytes.begin(), bytes.end());
}

// The ways an administrator takes a configuration directory away. Each leaves
// `dir` missing (or, for "replaced", an empty new directory in its place).
enum class Removal { RemoveTree, RenameAway, RemoveRoot, Replace };

void takeAway(Removal how, const test::ScratchRoot& root, const std::string& dir) {
    switch (how) {
        case Removal::RemoveTree:
            fs::remove_all(dir);
            break;
        case Removal::RenameAway:
            fs::rename(dir, dir + ".old");
            fs::remove_all(dir + ".old");
            break;
        case Removal::RemoveRoot:
            // Everything below the root goes, the root itself included.
            fs::remove_all(root.at("/etc"));
            break;
        case Removal::Replace:
            fs::create_directories(dir + ".new");
            fs::remove_all(dir);
            fs::rename(dir + ".new", dir);
            break;
    }
}

const Removal kRemovals[] = {Removal::RemoveTree, Removal::RenameAway, Removal::RemoveRoot,
                             Removal::Replace};

class FileWatcherTeardownTest : public test::ScratchRootTest {};

TEST_F(FileWatcherTeardownTest, WatchSurvivesTheDirectoryGoingAndComingBack) {
    const std::string dir = root_.at("/etc/tarnkeeper");
    Recorder seen;
    std::string why;
    auto watcher = FileWatcher::watchDirectory(
        dir, [&seen](const std::string& name) { seen.add(name); }, &why);
    ASSERT_TRUE(watcher) << why;
    for (Removal how : kRemovals) {
        SCOPED_TRACE(static_cast<int>(how));
        root_.writeFile("/etc/tarnkeeper/a", "1");
        ASSERT_TRUE(seen.waitFor("a"));
        seen.clear();
        takeAway(how, root_, dir);
        // Losing the directory is a change to every entry in it.
        EXPECT_TRUE(seen.waitFor(""));
        root_.writeFile("/etc/tarnkeeper/b", "2");
        EXPECT_TRUE(seen.waitFor("b")) << "no longer watching after the directory came back";
        seen.clear();
    }
    watcher->stop();
    watcher->stop();  // a second stop is harmless
}

TEST_F(FileWatcherTeardownTest, PersonaRosterFollowsARemovedAndRecreatedList) {
    const std::string dir = root_.at("/etc/tarnkeeper");
    root_.writeFile("/etc/tarnkeeper/personas.plist", bytesOf(personaList("E")));
    auto roster = std::make_unique<FilePersonaRoster>(RootPath("/etc/tarnkeeper/personas.plist"));
    auto observer = std::make_shared<CountingObserver>();
    std::optional<std::string> error = "not called";
    roster->registerPersonaListUpdateObserver(observer, "test", [&](const auto& e) { error = e; });
    ASSERT_FALSE(error) << *error;

    for (Removal how : kRemovals) {
        SCOPED_TRACE(static_cast<int>(how));
        unsigned before = observer->count();
        takeAway(how, root_, dir);
        ASSERT_TRUE(observer->waitBeyond(before)) << "the list went away unnoticed";
        auto list = roster->listAllPersonaWithAttributes();
        ASSERT_TRUE(list);
        EXPECT_TRUE(list->empty());

        before = observer->count();
        root_.writeFile("/etc/tarnkeeper/personas.plist", bytesOf(personaList("E2")));
        ASSERT_TRUE(observer->waitBeyond(before)) << "a recreated list went unnoticed";
        list = roster->listAllPersonaWithAttributes();
        ASSERT_TRUE(list);
        EXPECT_EQ(list->size(), 2u);
    }

    // Destroyed while the tree is being removed under it.
    std::thread remover([&] { fs::remove_all(root_.at("/etc")); });
    roster.reset();
    remover.join();
}

TEST_F(FileWatcherTeardownTest, CodeSignRegistryReadersWaitForTheLoadInProgress) {
    // A new root means a new registry to read; every one of several
    // concurrent first readers must see it, not the map being replaced.
    root_.writeFile("/usr/bin/tool", "");
    root_.writeFile("/etc/tarnkeeper/codesign/tool.plist",
                    bytesOf(PlistValue(PlistDict{{"Executable", PlistValue("/usr/bin/tool")},
                                                 {"SigningIdentifier", PlistValue("com.tool")}})));
    const std::string exe = fs::canonical(root_.at("/usr/bin/tool")).string();
    std::atomic<int> found{0};
    std::vector<std::thread> readers;
    for (int i = 0; i < 8; ++i)
        readers.emplace_back([&] {
            if (CodeSignRegistry::shared().infoForExecutable(exe)) ++found;
        });
    for (auto& t : readers) t.join();
    EXPECT_EQ(found.load(), 8);
}

TEST_F(FileWatcherTeardownTest, CodeSignRegistryReloadsARecreatedDirectory) {
    const std::string dir = root_.at("/etc/tarnkeeper/codesign");
    const std::string exe = root_.at("/usr/bin/tool");
    root_.writeFile("/usr/bin/tool", "");
    auto entry = [&](const char* id) {
        return bytesOf(PlistValue(PlistDict{{"Executable", PlistValue("/usr/bin/tool")},
                                            {"SigningIdentifier", PlistValue(id)}}));
    };
    auto identifier = [&]() -> std::string {
        auto info = CodeSignRegistry::shared().infoForExecutable(fs::canonical(exe).string());
        return info ? info->signingIdentifier : "";
    };
    auto eventually = [&](const std::string& want) {
        for (int i = 0; i < 500; ++i) {
            if (identifier() == want) return true;
            std::this_thread::sleep_for(10ms);
        }
        return false;
    };
    root_.writeFile("/etc/tarnkeeper/codesign/tool.plist", entry("com.one"));
    ASSERT_TRUE(eventually("com.one"));
    for (Removal how : kRemovals) {
        SCOPED_TRACE(static_cast<int>(how));
        takeAway(how, root_, dir);
        EXPECT_TRUE(eventually("")) << "a removed registry still answers";
        root_.writeFile("/usr/bin/tool", "");
        root_.writeFile("/etc/tarnkeeper/codesign/tool.plist", entry("com.two"));
        EXPECT_TRUE(eventually("com.two")) << "a recreated registry went unnoticed";
        root_.writeFile("/etc/tarnkeeper/codesign/tool.plist", entry("com.one"));
        EXPECT_TRUE(eventually("com.one"));
    }
}

// The shared identity cache and its roster live for the whole process, so
// their watcher still runs while exit() destroys statics. Removing the root
// from an exit handler registered before they were made (as a fuzz target or
// a tool cleaning up after itself does) lets the watcher react only after
// everything made later has been destroyed.
void exitAfterRemovingTheRootLate(const std::string& root) {
    static std::string dir;
    dir = root;
    std::atexit([] {
        std::error_code ec;
        fs::remove_all(dir, ec);
        // Let the watcher and the flush it queues run before the process ends.
        std::this_thread::sleep_for(300ms);
    });
    TarnUserIdentityCache::TEST_setPersonasAreSupported(true);
    auto& cache = TarnUserIdentitySharedCache::sharedInstance();
    if (!cache.userIdentityForCurrentUserWithPersonaUniqueString(std::string("E"))) std::_Exit(3);
    (void)CodeSignRegistry::shared().infoForExecutable("/nonexistent");
    std::exit(0);
}

// The same, with the root removed first and exit() racing the watcher.
void removeTheRootThenExit(const std::string& root) {
    TarnUserIdentityCache::TEST_setPersonasAreSupported(true);
    auto& cache = TarnUserIdentitySharedCache::sharedInstance();
    if (!cache.userIdentityForCurrentUserWithPersonaUniqueString(std::string("E"))) std::_Exit(3);
    (void)CodeSignRegistry::shared().infoForExecutable("/nonexistent");
    fs::remove_all(root);
    std::exit(0);
}

TEST_F(FileWatcherTeardownTest, RemovingTheRootWhileExitingDoesNotCorruptTheHeap) {
    // A fresh process per case: the shared objects must be made in it.
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    root_.writeFile("/etc/tarnkeeper/personas.plist", bytesOf(personaList("E")));
    const std::string root = root_.path();
    EXPECT_EXIT(exitAfterRemovingTheRootLate(root), ::testing::ExitedWithCode(0), "");
    root_.writeFile("/etc/tarnkeeper/personas.plist", bytesOf(personaList("E")));
    EXPECT_EXIT(removeTheRootThenExit(root), ::testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace tarn
