// The user-managed assets directory (commands 28 and 29) and the staging of
// shared content in a system group container (command 26) over IPC. These
// take paths from clients and act on them as root, so most cases here are
// paths that try to leave the container: "..", absolute paths, links, a
// sibling whose name extends the directory's, and a link swapped in while
// requests run. A canary outside must never change.
#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <ostream>
#include <thread>

#include "Daemon/TarnError.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Platform/FileSystem.h"
#include "Tools/tarnctl/Json.h"
#include "support/DaemonHarness.h"
#include "support/IpcTest.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using test::DaemonHarness;

constexpr const char* kApp = "com.ostrea.test.app";
constexpr const char* kGroup = "systemgroup.com.example.share";
constexpr const char* kUncreatedGroup = "systemgroup.com.example.nothere";
constexpr gid_t kSystemUsersGID = 1020;  // seeded by the scratch root

// What must not change about an item outside the container.
struct Canary {
    uint64_t ino = 0;
    uint32_t mode = 0;
    uid_t uid = 0;
    gid_t gid = 0;
    std::string contents;
    int aclEntry = -1;
    bool operator==(const Canary&) const = default;
    friend std::ostream& operator<<(std::ostream& out, const Canary& c) {
        return out << "{ino " << c.ino << ", mode " << std::oct << c.mode << std::dec << ", uid "
                   << c.uid << ", gid " << c.gid << ", \"" << c.contents << "\", acl " << c.aclEntry
                   << "}";
    }
};

class AssetCommandsTest : public test::IpcTest {
  protected:
    void SetUp() override {
        IpcTest::SetUp();
        if (IsSkipped()) return;
        root_.writeFile("/private/var/canary/file", "canary");
        ::chmod(root_.at("/private/var/canary/file").c_str(), 0600);
    }

    static std::optional<bool> boolOf(const PlistValue& reply, const char* key) {
        const PlistValue* v = reply.find(key);
        return v ? v->asBool() : std::nullopt;
    }
    static std::string quoted(const std::string& text) {
        return tarnctl::PlistToJson(PlistValue(text));
    }

    // The path of a container, created when missing.
    std::string create(const std::string& identifier, int containerClass) {
        PlistValue r =
            send(admin_, R"({"Command": 0, "CreateIfNecessary": true, "ContainerClass": )" +
                             std::to_string(containerClass) + R"(, "Identifier": ")" + identifier +
                             R"("})");
        EXPECT_EQ(errorOf(r), TarnSuccess) << identifier;
        return stringOf(r, "ReplyPath");
    }
    PlistValue assetsPath(const std::string& client, const std::string& identifier, bool create,
                          bool relative = false) {
        return send(client, R"({"Command": 28, "Identifier": ")" + identifier +
                                R"(", "CreateIfNecessary": )" + (create ? "true" : "false") +
                                R"(, "IsRelative": )" + (relative ? "true" : "false") + "}");
    }
    uint64_t deleteAsset(const std::string& relativePath) {
        return ask(admin_, R"({"Command": 29, "Identifier": ")" + std::string(kApp) +
                               R"(", "SourcePath": )" + quoted(relativePath) + "}");
    }
    uint64_t stage(const std::string& client, const std::string& group, const std::string& source,
                   const std::string& dest) {
        return ask(client, R"({"Command": 26, "Identifier": ")" + group + R"(", "SourcePath": )" +
                               quoted(source) + R"(, "DestPath": )" + quoted(dest) + "}");
    }
    // A client entitled to stage shared content; `groups` (JSON array) are
    // the system groups its recorded code-signing information names.
    std::string addMember(const std::string& name, const std::string& groups) {
        PlistValue ent{PlistDict{}};
        ent.set("com.ostrea.private.TarnKeeper.stageSharedContent", true);
        std::string client = daemon_->addClient(name, "com.ostrea.test." + name, ent);
        if (!groups.empty()) {
            EXPECT_EQ(
                ask(admin_, R"({"Command": 18, "Identifier": "com.ostrea.test.)" + name +
                                R"(", "CodeSigningInfo": {"com.ostrea.TarnKeeper.Entitlements": )"
                                R"({"com.ostrea.security.system-groups": )" +
                                groups + "}}}"),
                TarnSuccess);
        }
        return client;
    }

    Canary canary(const std::string& path) {
        Canary c;
        FsStat st;
        EXPECT_EQ(0, FsLstat(path, &st)) << path;
        c.ino = st.ino;
        c.mode = st.mode;
        c.uid = st.uid;
        c.gid = st.gid;
        std::ifstream in(path);
        c.contents.assign(std::istreambuf_iterator<char>(in), {});
        FsFd parent;
        std::string name;
        int def = -1, mask = -1;
        EXPECT_EQ(0, FsOpenParent(path, &parent, &name));
        EXPECT_EQ(0,
                  FsGetGroupACLAt(parent.get(), name, kSystemUsersGID, &c.aclEntry, &def, &mask));
        return c;
    }
    // Writes a file at a host path (below the root), creating its directories.
    static void writeAt(const std::string& path, const std::string& contents) {
        fs::create_directories(fs::path(path).parent_path());
        std::ofstream(path) << contents;
    }
    std::vector<std::string> namesIn(const std::string& dir) {
        std::vector<std::string> names;
        for (const auto& e : fs::directory_iterator(dir)) names.push_back(e.path().filename());
        std::sort(names.begin(), names.end());
        return names;
    }
    // Every item on death row (inside the slots the moves make).
    std::vector<std::string> deathRowItems() {
        std::vector<std::string> items;
        const FileURL dir = TarnGlobalConfiguration::sharedInstance().deathrowDirectory();
        std::error_code ec;
        for (auto it = fs::recursive_directory_iterator(dir, ec);
             !ec && it != fs::recursive_directory_iterator(); ++it)
            if (it.depth() == 1) items.push_back(it->path().filename());
        return items;
    }
};

TEST_F(AssetCommandsTest, TheAssetsDirectoryIsMadeOnceAndFoundAfterwards) {
    std::string guest =
        daemon_->addClient("guest", "com.ostrea.test.guest", PlistValue(PlistDict{}));
    daemon_->start();
    EXPECT_EQ(errorOf(assetsPath(admin_, kApp, /*create=*/true)), TarnErrorInvalidArgument)
        << "no data container";
    const std::string container = create(kApp, 2);

    EXPECT_EQ(errorOf(assetsPath(admin_, kApp, /*create=*/false)),
              TarnErrorUserManagedPathNotFound);
    PlistValue made = assetsPath(admin_, kApp, /*create=*/true);
    ASSERT_EQ(errorOf(made), TarnSuccess);
    const std::string path = stringOf(made, "ReplyPath");
    EXPECT_EQ(boolOf(made, "ReplyExisted"), false);
    EXPECT_EQ(fs::path(path).parent_path(), fs::path(container) / "Library");
    EXPECT_EQ(0u, fs::path(path).filename().string().rfind("com.ostrea.UserManagedAssets.", 0))
        << path;
    FsStat st;
    ASSERT_EQ(0, FsLstat(path, &st));
    EXPECT_TRUE(st.isDirectory());
    EXPECT_EQ(0755u, st.mode & 07777);
    EXPECT_EQ(501u, st.uid) << "owned by the container's user";

    PlistValue found = assetsPath(admin_, kApp, /*create=*/true);
    EXPECT_EQ(stringOf(found, "ReplyPath"), path);
    EXPECT_EQ(boolOf(found, "ReplyExisted"), true);
    PlistValue relative = assetsPath(admin_, kApp, /*create=*/false, /*relative=*/true);
    EXPECT_EQ(stringOf(relative, "ReplyPath"), "Library/" + fs::path(path).filename().string());
    EXPECT_EQ(namesIn(container + "/Library").size(), 3u) << "Caches, Preferences, one assets dir";

    // A client without the entitlement gets only its own.
    EXPECT_EQ(errorOf(assetsPath(guest, kApp, /*create=*/true)), TarnErrorBadInput);
    create("com.ostrea.test.guest", 2);
    EXPECT_EQ(errorOf(assetsPath(guest, "com.ostrea.test.guest", /*create=*/true)), TarnSuccess);
}

TEST_F(AssetCommandsTest, ConcurrentRequestsMakeOneDirectory) {
    daemon_->start();
    const std::string container = create(kApp, 2);
    const std::string request = R"({"Command": 28, "CreateIfNecessary": true, "Identifier": ")" +
                                std::string(kApp) + R"("})";
    auto run = [&] {
        std::string why;
        return tarnctl::JsonToPlist(daemon_->tarnctl(admin_, {"send", request}).out, &why)
            .value_or(PlistValue(PlistDict{}));
    };
    std::vector<std::future<PlistValue>> replies;
    for (int i = 0; i < 4; ++i) replies.push_back(std::async(std::launch::async, run));
    std::set<std::string> paths;
    int made = 0;
    for (auto& reply : replies) {
        PlistValue r = reply.get();
        ASSERT_EQ(errorOf(r), TarnSuccess);
        paths.insert(stringOf(r, "ReplyPath"));
        if (boolOf(r, "ReplyExisted") == false) ++made;
    }
    EXPECT_EQ(paths.size(), 1u);
    EXPECT_EQ(made, 1);
}

// "Library" replaced by a link: the directory is not made where it leads.
TEST_F(AssetCommandsTest, ALinkAsLibraryIsNotFollowed) {
    daemon_->start();
    const std::string container = create(kApp, 2);
    fs::remove_all(container + "/Library");
    fs::create_symlink(root_.at("/private/var/canary"), container + "/Library");
    EXPECT_EQ(errorOf(assetsPath(admin_, kApp, /*create=*/true)), TarnErrorCreateDirectoryFailed);
    EXPECT_EQ(namesIn(root_.at("/private/var/canary")), std::vector<std::string>{"file"});
}

TEST_F(AssetCommandsTest, OnlyAssetsInsideTheDirectoryAreDeleted) {
    daemon_->start();
    const std::string container = create(kApp, 2);
    EXPECT_EQ(deleteAsset("anything"), TarnErrorInvalidArgument) << "no assets directory yet";
    const std::string assets = stringOf(assetsPath(admin_, kApp, /*create=*/true), "ReplyPath");
    ASSERT_FALSE(assets.empty());
    const std::string assetsName = fs::path(assets).filename();
    const std::string canaryFile = root_.at("/private/var/canary/file");
    const Canary before = canary(canaryFile);

    writeAt(assets + "/keep", "k");
    writeAt(assets + "/sub/file", "f");
    writeAt(assets + "/dir/inner", "i");
    // A sibling whose name extends the assets directory's.
    const std::string sibling = assets + "-evil";
    writeAt(sibling + "/victim", "v");
    fs::create_symlink(root_.at("/private/var/canary"), assets + "/out");
    fs::create_symlink(canaryFile, assets + "/outfile");
    fs::create_symlink("../" + assetsName + "-evil", assets + "/sib");
    fs::create_symlink("sub", assets + "/inside-link");

    const struct {
        std::string path;
        uint64_t expected;
    } refused[] = {
        {".", TarnErrorInvalidPath},
        {"", TarnErrorInvalidPath},
        {"./", TarnErrorInvalidPath},
        {"..", TarnErrorInvalidPath},
        {"../" + assetsName + "-evil/victim", TarnErrorInvalidPath},
        {"sub/../keep", TarnErrorInvalidPath},
        {"sub/../../" + assetsName, TarnErrorInvalidPath},
        {canaryFile, TarnErrorInvalidPath},
        {"/keep", TarnErrorInvalidPath},
        {"out/file", TarnErrorInvalidPath},
        {"outfile", TarnErrorInvalidPath},
        {"sib/victim", TarnErrorInvalidPath},
        {"inside-link/file", TarnErrorInvalidPath},
        {"missing", TarnErrorInvalidPath},
        {"keep/below", TarnErrorInvalidPath},
    };
    for (const auto& c : refused) {
        SCOPED_TRACE(c.path);
        EXPECT_EQ(deleteAsset(c.path), c.expected);
    }
    EXPECT_EQ(ask(admin_, R"({"Command": 29, "Identifier": ")" + std::string(kApp) + R"("})"),
              TarnErrorInvalidArgument)
        << "no path";
    EXPECT_TRUE(deathRowItems().empty());
    EXPECT_EQ(canary(canaryFile), before);
    EXPECT_EQ(namesIn(root_.at("/private/var/canary")), std::vector<std::string>{"file"});
    EXPECT_TRUE(fs::exists(sibling + "/victim"));
    EXPECT_EQ(namesIn(assets), (std::vector<std::string>{"dir", "inside-link", "keep", "out",
                                                         "outfile", "sib", "sub"}));

    // Legitimate assets go to death row: a file below a directory, a directory.
    EXPECT_EQ(deleteAsset("sub/file"), TarnSuccess);
    EXPECT_EQ(deleteAsset("./dir/"), TarnSuccess);
    EXPECT_FALSE(fs::exists(assets + "/sub/file"));
    EXPECT_FALSE(fs::exists(assets + "/dir"));
    std::vector<std::string> onDeathRow = deathRowItems();
    std::sort(onDeathRow.begin(), onDeathRow.end());
    EXPECT_EQ(onDeathRow, (std::vector<std::string>{"dir", "file"}));
    EXPECT_TRUE(fs::is_directory(assets));
    EXPECT_EQ(canary(canaryFile), before);
}

class SharedContentTest : public AssetCommandsTest {
  protected:
    void SetUp() override {
        AssetCommandsTest::SetUp();
        if (IsSkipped()) return;
        daemon_->start();
        member_ =
            addMember("member", "[\"" + std::string(kGroup) + "\", \"" + kUncreatedGroup + "\"]");
        group_ = create(kGroup, 13);
        ASSERT_FALSE(group_.empty());
        canaryFile_ = root_.at("/private/var/canary/file");
    }
    void expectCanaryUntouched(const Canary& before) {
        EXPECT_EQ(canary(canaryFile_), before);
        EXPECT_EQ(namesIn(root_.at("/private/var/canary")), std::vector<std::string>{"file"});
    }

    std::string member_, group_, canaryFile_;
};

TEST_F(SharedContentTest, AnEntitledMemberMovesContentInsideItsGroup) {
    writeAt(group_ + "/incoming/doc", "d");
    fs::create_directory(group_ + "/shared");
    ASSERT_EQ(stage(member_, kGroup, "incoming/doc", "shared/doc"), TarnSuccess);
    EXPECT_FALSE(fs::exists(group_ + "/incoming/doc"));
    FsStat st;
    ASSERT_EQ(0, FsLstat(group_ + "/shared/doc", &st));
    EXPECT_EQ(65534u, st.uid) << "standardised as shared content";
    // The reply says where the content now is.
    PlistValue moved =
        send(member_, R"({"Command": 26, "Identifier": ")" + std::string(kGroup) +
                          R"(", "SourcePath": "shared/doc", "DestPath": "shared/kept"})");
    EXPECT_EQ(stringOf(moved, "ReplyPath"), group_ + "/shared/kept");
    ASSERT_EQ(stage(member_, kGroup, "shared/kept", "shared/doc"), TarnSuccess);

    std::string outsider = addMember("outsider", "");
    EXPECT_EQ(stage(outsider, kGroup, "shared/doc", "doc"), TarnErrorNotEntitled);
    EXPECT_EQ(stage(member_, "systemgroup.com.example.other", "shared/doc", "doc"),
              TarnErrorNotEntitled);
    EXPECT_EQ(stage(member_, kUncreatedGroup, "shared/doc", "doc"), TarnErrorNotFound);
    EXPECT_EQ(stage(member_, kGroup, "shared/../shared/doc", "doc"), TarnErrorBadInput);
    EXPECT_EQ(stage(member_, kGroup, "shared/doc", "../doc"), TarnErrorBadInput);
    EXPECT_EQ(ask(member_, R"({"Command": 26, "Identifier": ")" + std::string(kGroup) +
                               R"(", "SourcePath": "shared/doc"})"),
              TarnErrorInvalidArgument);
    EXPECT_EQ(stage(member_, kGroup, "shared/missing", "doc"), TarnErrorACLFailed);
    EXPECT_EQ(stage(member_, kGroup, "shared/doc", "nowhere/doc"), TarnErrorStageMoveFailed);
    EXPECT_TRUE(fs::exists(group_ + "/shared/doc"));
}

TEST_F(SharedContentTest, PathsThroughLinksOrOntoTheRecordAreRefused) {
    const Canary before = canary(canaryFile_);
    writeAt(group_ + "/shared/doc", "d");
    fs::create_symlink(root_.at("/private/var/canary"), group_ + "/escape");
    fs::create_symlink(canaryFile_, group_ + "/escape-file");
    fs::create_symlink("shared", group_ + "/inside-link");
    const struct {
        const char* source;
        const char* dest;
    } refused[] = {
        {"escape/file", "stolen"},
        {"escape-file", "stolen"},
        {"inside-link/doc", "moved"},
        {"/shared/doc", "moved"},
        {"shared/doc", "escape/file"},
        {"shared/doc", "escape/new"},
        {"shared/doc", "escape-file"},
        {"shared/doc", "/moved"},
        {"shared/doc", "."},
        {".", "shared/moved"},
        {"", "shared/moved"},
        {".com.ostrea.tarn_keeper.metadata.plist", "moved"},
        {"shared/doc", ".com.ostrea.tarn_keeper.metadata.plist"},
        {"shared/doc", "shared/doc/below"},
    };
    for (const auto& c : refused) {
        SCOPED_TRACE(std::string(c.source) + " -> " + c.dest);
        EXPECT_EQ(stage(member_, kGroup, c.source, c.dest), TarnErrorInvalidPath);
    }
    expectCanaryUntouched(before);
    EXPECT_TRUE(fs::exists(group_ + "/shared/doc"));
    EXPECT_TRUE(fs::exists(group_ + "/.com.ostrea.tarn_keeper.metadata.plist"));
    EXPECT_FALSE(fs::exists(group_ + "/stolen"));
    EXPECT_FALSE(fs::exists(group_ + "/moved"));
}

// A directory of the path is exchanged with a link to the canary directory,
// over and over, while the member stages content through it back and forth.
TEST_F(SharedContentTest, ALinkSwappedInDuringRequestsIsNeverFollowed) {
    const Canary before = canary(canaryFile_);
    writeAt(group_ + "/dir/file", "staged");
    fs::create_directory(group_ + "/out");
    fs::create_symlink(root_.at("/private/var/canary"), group_ + "/swap");
    const std::string dir = group_ + "/dir", swap = group_ + "/swap";

    std::atomic<bool> stop{false};
    std::atomic<uint64_t> swaps{0};
    std::thread swapper([&] {
        while (!stop.load() || swaps.load() < 10000) {
            if (::renameat2(AT_FDCWD, dir.c_str(), AT_FDCWD, swap.c_str(), RENAME_EXCHANGE) == 0)
                swaps.fetch_add(1);
        }
    });
    bool inDir = true;  // where the staged file is now
    int moved = 0, refused = 0, requests = 0;
    const auto until = std::chrono::steady_clock::now() + std::chrono::seconds(3);
    while (std::chrono::steady_clock::now() < until && requests < 400) {
        ++requests;
        const uint64_t code = inDir ? stage(member_, kGroup, "dir/file", "out/file")
                                    : stage(member_, kGroup, "out/file", "dir/file");
        if (code == TarnSuccess) {
            ++moved;
            inDir = !inDir;
        } else {
            EXPECT_EQ(code, TarnErrorInvalidPath);
            ++refused;
        }
    }
    stop = true;
    swapper.join();
    if (fs::is_symlink(dir))
        ASSERT_EQ(0, ::renameat2(AT_FDCWD, dir.c_str(), AT_FDCWD, swap.c_str(), RENAME_EXCHANGE));

    EXPECT_GE(swaps.load(), 10000u);
    EXPECT_GT(moved, 0);
    expectCanaryUntouched(before);
    EXPECT_TRUE(fs::exists(inDir ? dir + "/file" : group_ + "/out/file"))
        << requests << " requests, " << moved << " moved, " << refused << " refused";
    EXPECT_FALSE(fs::exists(inDir ? group_ + "/out/file" : dir + "/file"));
}

}  // namespace
}  // namespace tarn
