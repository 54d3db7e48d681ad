// Hostile input: a table of path and identifier layouts (links out of the
// container, "..", absolute paths, very long names, newlines, lone
// surrogates) sent through every command that takes an identifier or a
// path, and oversized or deeply nested property lists in requests and in the
// files the daemon reads. Each must be answered (or the connection dropped),
// touch nothing outside the container tree, and leave the daemon serving.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <map>

#include "Daemon/TarnConsistencyChecker.h"
#include "Daemon/TarnError.h"
#include "Platform/RootPrefix.h"
#include "support/IpcTest.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

// JSON string literal of `s` (control characters escaped).
std::string quoted(const std::string& s) {
    std::string out = "\"";
    for (char c : s) {
        if (c == '"' || c == '\\')
            out += '\\', out += c;
        else if (c == '\n')
            out += "\\n";
        else
            out += c;
    }
    return out + "\"";
}

// Everything below `dir`, with sizes: what "untouched" compares.
std::map<std::string, uintmax_t> listing(const std::string& dir) {
    std::map<std::string, uintmax_t> out;
    std::error_code ec;
    for (auto it = fs::recursive_directory_iterator(dir, ec); !ec && it != fs::end(it);
         it.increment(ec))
        out[it->path().string()] = it->is_regular_file(ec) ? it->file_size(ec) : 0;
    return out;
}

class HostileInputTest : public test::IpcTest {};

TEST_F(HostileInputTest, EveryCommandRefusesOrContainsHostileNames) {
    if (IsSkipped()) return;
    daemon_->start();
    // The client's own container, with links that lead out of it.
    PlistValue made =
        send(admin_, R"({"Command": 0, "ContainerClass": 2, )"
                     R"("CreateIfNecessary": true, "Identifier": "com.hostile.app"})");
    const std::string home = stringOf(made, "ReplyPath");
    ASSERT_FALSE(home.empty());
    root_.writeFile("/outside/secret", "keep");
    fs::create_directory_symlink(root_.at("/outside"), home + "/escape");
    fs::create_symlink(home + "/loop", home + "/loop");
    const auto outsideBefore = listing(root_.at("/outside"));
    const auto etcBefore = listing(root_.at("/etc"));

    const std::vector<std::string> names = {
        "../../../../outside/secret",
        "/outside/secret",
        root_.at("/outside/secret"),
        "escape/secret",
        "escape/../escape/secret",
        "loop/x",
        "a/../../b",
        "..",
        ".",
        "",
        std::string(300, 'n'),
        std::string(5000, 'n'),
        "line\nbreak",
        "\\ud800 lone surrogate",
        "com.hostile.app/../../..",
    };
    const std::vector<std::string> requests = {
        R"({"Command": 0, "ContainerClass": 2, "CreateIfNecessary": true, "Identifier": @})",
        R"({"Command": 0, "ContainerClass": 12, "CreateIfNecessary": true, "Identifier": @})",
        R"({"Command": 0, "ContainerClass": 7, "CreateIfNecessary": true, "Identifier": @})",
        R"({"Command": 10, "ContainerClass": 2, "Identifier": @})",
        R"({"Command": 5, "ContainerClass": 2, "Identifier": @, "Key": @, "Value": "v"})",
        R"({"Command": 6, "ContainerClass": 2, "Identifier": @, "Key": @})",
        R"({"Command": 14, "Identifier": @})",
        R"({"Command": 15, "Identifier": @})",
        R"({"Command": 17, "Identifier": @})",
        R"({"Command": 18, "Identifier": @, "CodeSigningInfo": {}, "OptionsDictionary": {}})",
        R"({"Command": 19, "Identifier": @})",
        R"({"Command": 23, "ContainerClass": 2, "Identifier": @})",
        R"({"Command": 26, "Identifier": @, "SourcePath": @, "DestPath": @})",
        R"({"Command": 28, "Identifier": @, "CreateIfNecessary": true, "IsRelative": false})",
        R"({"Command": 29, "Identifier": "com.hostile.app", "SourcePath": @})",
    };
    int tried = 0;
    for (const std::string& request : requests) {
        for (const std::string& name : names) {
            std::string json = request;
            for (size_t at; (at = json.find('@')) != std::string::npos;)
                json.replace(at, 1, quoted(name));
            SCOPED_TRACE(json.substr(0, 200));
            std::optional<PlistValue> reply = daemon_->send(admin_, json);
            ++tried;
            // A reply path, when there is one, stays inside the container tree.
            const PlistValue* path = reply ? reply->find("ReplyPath") : nullptr;
            if (path && path->asString())
                EXPECT_TRUE(path->asString()->starts_with(root_.at("/private/var/")))
                    << *path->asString();
        }
    }
    EXPECT_EQ(listing(root_.at("/outside")), outsideBefore);
    EXPECT_EQ(listing(root_.at("/etc")), etcBefore);
    // Still serving.
    EXPECT_EQ(ask(admin_, R"({"Command": 27})"), TarnErrorInvalidCommand);
    std::cout << "[ hostile  ] " << tried << " requests\n";
}

TEST_F(HostileInputTest, OversizedAndDeeplyNestedPropertyLists) {
    if (IsSkipped()) return;
    // A configuration file nested far past any limit, and one far too large.
    std::string nested;
    for (int i = 0; i < 5000; ++i) nested += "<array>";
    for (int i = 0; i < 5000; ++i) nested += "</array>";
    root_.writeFile("/etc/tarnkeeper/host.plist",
                    "<?xml version=\"1.0\"?><plist version=\"1.0\">" + nested + "</plist>");
    daemon_->start();
    // Requests: nesting past the wire's depth, an array past its count, a
    // message past its size. The daemon refuses or drops them.
    std::string deep = "1";
    for (int i = 0; i < 64; ++i) deep = "[" + deep + "]";
    std::string wide = "[";
    for (int i = 0; i < 70000; ++i) wide += i ? ",1" : "1";
    wide += "]";
    for (const std::string& value : {deep, wide, quoted(std::string(2 << 20, 'x'))}) {
        std::optional<PlistValue> r = daemon_->send(
            admin_, R"({"Command": 5, "ContainerClass": 2, "Identifier": "com.big", "Key": "k", )"
                    R"("Value": )" +
                        value + "}");
        if (r) EXPECT_NE(errorOf(*r), TarnSuccess);
    }
    // Metadata: a container whose metadata file is nested too deeply is refused
    // by the readers (and reported by the checker), the rest still served.
    PlistValue made = send(admin_, R"({"Command": 0, "ContainerClass": 2, )"
                                   R"("CreateIfNecessary": true, "Identifier": "com.deep"})");
    const std::string path = stringOf(made, "ReplyPath");
    ASSERT_FALSE(path.empty());
    daemon_->stop();
    std::ofstream(path + "/.com.ostrea.tarn_keeper.metadata.plist")
        << "<?xml version=\"1.0\"?><plist version=\"1.0\">" << nested << "</plist>";
    daemon_->start();
    EXPECT_NE(ask(admin_, R"({"Command": 0, "ContainerClass": 2, "Identifier": "com.deep"})"),
              TarnSuccess);
    EXPECT_EQ(ask(admin_, R"({"Command": 0, "ContainerClass": 2, "CreateIfNecessary": true, )"
                          R"("Identifier": "com.after"})"),
              TarnSuccess);
    daemon_->stop();
    TarnConsistencyReport report = TarnCheckContainerTree();
    bool named = false;
    for (const auto& v : report.violations) named |= v.path == StripRootPrefix(path);
    EXPECT_TRUE(named) << report.describe();
}

}  // namespace
}  // namespace tarn
