// Runs the built tarnctl against a Conduit listener in a scratch root.
#include <gtest/gtest.h>

#include <fstream>
#include <sstream>

#include "Platform/Conduit.h"
#include "Platform/ConduitHarness.h"
#include "Platform/PlatformLog.h"
#include "Tools/tarnctl/Json.h"
#include "support/ScratchRoot.h"

namespace tarn::conduit {
namespace {

using namespace std::chrono_literals;

struct ToolRun {
    int status = -1;
    std::string out;
    std::string err;
};

class TarnctlTest : public test::ScratchRootTest {
protected:
    using Handler = std::function<void(const ConnectionRef&, const MessageRef&)>;

    struct State {
        Mutex mu;
        Handler handler GUARDED_BY(mu);
        std::vector<PlistValue> received GUARDED_BY(mu);
        std::atomic<int> open{0};
    };

    void SetUp() override {
        PlatformLogSetQuiet(true);
        state_ = std::make_shared<State>();
        setHandler([](const ConnectionRef& c, const MessageRef& m) {
            auto reply = m->createReply();
            reply->body() = m->body();
            c->send(reply);
        });
        queue_ = DispatchQueue::createSerial("tarnctl-test.listener");
        std::string why;
        listener_ = Listener::create("com.ostrea.tarnkeeperd", queue_, &why);
        ASSERT_TRUE(listener_) << why;
        listener_->setNewConnectionHandler([s = state_](const ConnectionRef& c) {
            ++s->open;
            std::weak_ptr<Connection> wc = c;
            c->setEventHandler([s, wc](const Event& e) {
                if (e.kind != Event::Kind::Message) {
                    --s->open;
                    return;
                }
                Handler h;
                {
                    MutexLock l(s->mu);
                    s->received.push_back(e.message->body());
                    h = s->handler;
                }
                if (auto c = wc.lock()) h(c, e.message);
            });
            c->resume();
        });
        listener_->resume();
    }

    void TearDown() override {
        if (listener_) listener_->cancel();
        const auto deadline = std::chrono::steady_clock::now() + 5s;
        while (state_->open.load() > 0 && std::chrono::steady_clock::now() < deadline)
            std::this_thread::sleep_for(1ms);
        EXPECT_EQ(state_->open.load(), 0);
        PlatformLogSetQuiet(false);
    }

    void setHandler(Handler h) {
        MutexLock l(state_->mu);
        state_->handler = std::move(h);
    }

    PlistValue lastReceived() {
        MutexLock l(state_->mu);
        return state_->received.empty() ? PlistValue() : state_->received.back();
    }

    ToolRun tarnctl(std::vector<std::string> args) {
        args.insert(args.begin(), TARN_BINARY_DIR "/tarnctl");
        harness::ChildProcess::Options opts;
        opts.stdoutPath = root_.at("/tarnctl.out");
        opts.stderrPath = root_.at("/tarnctl.err");
        std::string why;
        auto child = harness::ChildProcess::spawn(args, opts, &why);
        EXPECT_TRUE(child) << why;
        ToolRun r;
        if (!child) return r;
        r.status = child->wait(20s).value_or(-1);
        r.out = slurp(opts.stdoutPath);
        r.err = slurp(opts.stderrPath);
        return r;
    }

    ToolRun send(const std::string& json, std::vector<std::string> extra = {}) {
        std::vector<std::string> args = {"--root", root_.path()};
        args.insert(args.end(), extra.begin(), extra.end());
        args.push_back("send");
        args.push_back(json);
        return tarnctl(args);
    }

    static std::string slurp(const std::string& path) {
        std::ifstream in(path);
        std::stringstream s;
        s << in.rdbuf();
        return s.str();
    }

    std::shared_ptr<State> state_;
    DispatchQueueRef queue_;
    std::shared_ptr<Listener> listener_;
};

TEST_F(TarnctlTest, JsonMapsToTypedValuesAndBackWithoutLoss) {
    const std::string request =
        R"({"s": "x", "u": 5, "big": 18446744073709551615, "n": -3,)"
        R"( "min": -9223372036854775808, "t": true, "f": false, "a": [1, "b", []], "o": {"k": {}},)"
        R"( "id": {"$uuid": "0a1b2c3d-4e5f-6071-8293-a4b5c6d7e8f9"}, "i": {"$int64": 7},)"
        R"( "d": {"$data": "AAEC/w=="}, "empty": {"$data": ""}, "esc": "q\"\\\n\u00e9\ud83d\ude00",)"
        R"( "notspecial": {"$uuid": "x", "other": 1}})";
    ToolRun r = send(request);
    ASSERT_EQ(r.status, 0) << r.err;

    const PlistValue got = lastReceived();
    ASSERT_TRUE(got.isDict());
    EXPECT_EQ(got.find("u")->type(), PlistValue::Type::UInt);
    EXPECT_EQ(*got.find("big")->asUInt64(), UINT64_MAX);
    EXPECT_EQ(got.find("n")->type(), PlistValue::Type::Int);
    EXPECT_EQ(*got.find("min")->asInt64(), INT64_MIN);
    EXPECT_EQ(got.find("i")->type(), PlistValue::Type::Int);
    EXPECT_EQ(*got.find("i")->asInt64(), 7);
    EXPECT_EQ(got.find("id")->type(), PlistValue::Type::Uuid);
    EXPECT_EQ(*got.find("d")->asData(), (PlistData{0, 1, 2, 255}));
    EXPECT_EQ(*got.find("esc")->asString(), "q\"\\\n\xC3\xA9\xF0\x9F\x98\x80");
    EXPECT_TRUE(got.find("notspecial")->isDict());

    // The echo comes back as one canonical line: keys sorted, typed forms kept.
    EXPECT_EQ(r.out,
              R"({"a": [1, "b", []], "big": 18446744073709551615, "d": {"$data": "AAEC/w=="},)"
              R"( "empty": {"$data": ""}, "esc": "q\"\\\n)"
              "\xC3\xA9\xF0\x9F\x98\x80"
              R"(", "f": false, "i": {"$int64": 7},)"
              R"( "id": {"$uuid": "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9"},)"
              R"( "min": -9223372036854775808, "n": -3, "notspecial": {"$uuid": "x", "other": 1},)"
              R"( "o": {"k": {}}, "s": "x", "t": true, "u": 5})"
              "\n");
}

TEST_F(TarnctlTest, AnyReplyExitsZeroAndEveryFailureExitsNonZeroWithAMessage) {
    setHandler([](const ConnectionRef& c, const MessageRef& m) {
        auto reply = m->createReply();
        reply->body().set("ReplyError", PlistValue(uint64_t{49}));
        reply->body().set("Zero", PlistValue(int64_t{0}));
        c->send(reply);
    });
    ToolRun r = send(R"({"Command": 27})");
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out, "{\"ReplyError\": 49, \"Zero\": {\"$int64\": 0}}\n");
    EXPECT_EQ(*lastReceived().find("Command")->asUInt64(), 27u);

    // Same socket named directly.
    r = tarnctl({"--socket", listener_->socketPath(), "send", "{}"});
    EXPECT_EQ(r.status, 0) << r.err;

    struct Bad {
        const char* json;
        int status;
    };
    const Bad bads[] = {
        {"{", 1},
        {"[1, 2]", 1},
        {R"({"x": 1.5})", 1},
        {R"({"x": null})", 1},
        {R"({"x": 18446744073709551616})", 1},
        {R"({"x": -9223372036854775809})", 1},
        {R"({"x": {"$int64": 9223372036854775808}})", 1},
        {R"({"x": {"$uuid": "not-a-uuid"}})", 1},
        {R"({"x": {"$data": "A"}})", 1},
        {R"({"x": {"$data": "!!!!"}})", 1},
        {R"({"x": 1, "x": 2})", 1},
        {R"({"x": "\ud800"})", 1},
        {R"({"x": 1} trailing)", 1},
    };
    for (const Bad& bad : bads) {
        r = send(bad.json);
        EXPECT_EQ(r.status, bad.status) << bad.json;
        EXPECT_TRUE(r.out.empty()) << bad.json;
        EXPECT_NE(r.err.find("tarnctl:"), std::string::npos) << bad.json << ": " << r.err;
    }

    // A daemon that never answers, one that hangs up, and none at all.
    setHandler([](const ConnectionRef&, const MessageRef&) {});
    r = send("{}", {"--timeout", "0.3"});
    EXPECT_EQ(r.status, 4);
    EXPECT_NE(r.err.find("timed out"), std::string::npos) << r.err;
    setHandler([](const ConnectionRef& c, const MessageRef&) { c->cancel(); });
    r = send("{}");
    EXPECT_EQ(r.status, 4);
    EXPECT_NE(r.err.find("closed"), std::string::npos) << r.err;
    listener_->cancel();
    r = send("{}");
    EXPECT_EQ(r.status, 3);
    EXPECT_NE(r.err.find("cannot reach"), std::string::npos) << r.err;
}

// Answers every request with ReplyError 1 and the given keys.
std::function<void(const ConnectionRef&, const MessageRef&)> answering(PlistDict keys,
                                                                       uint64_t code = 1) {
    return [keys, code](const ConnectionRef& c, const MessageRef& m) {
        auto reply = m->createReply();
        for (const auto& [k, v] : keys) reply->body().set(k, v);
        reply->body().set("ReplyError", PlistValue(code));
        c->send(reply);
    };
}

TEST_F(TarnctlTest, VerbsSendTheDocumentedRequests) {
    setHandler(answering({}));
    const std::string uuid = "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9";
    struct Case {
        std::vector<std::string> args;
        const char* request;  // as send would print it
    };
    const Case cases[] = {
        {{"container", "create", "com.example.notes"},
         R"({"Command": 0, "ContainerClass": 2, "CreateIfNecessary": true, "Identifier": "com.example.notes"})"},
        {{"container", "lookup", "a.b", "--class", "4", "--transient"},
         R"({"Command": 0, "ContainerClass": 4, "Identifier": "a.b", "Transient": true})"},
        {{"container", "wipe", "a.b"}, R"({"Command": 11, "Identifier": "a.b"})"},
        {{"container", "wipe", "a.b", "--class", "2"},
         R"({"Command": 12, "ContainerClass": 2, "Identifier": "a.b"})"},
        {{"container", "info", "set", "a.b", "k", R"({"x": [1, -2]})", "--uuid", uuid, "--persona",
          "P"},
         R"({"Command": 5, "ContainerClass": 2, "Identifier": "a.b", "Key": "k", "PersonaUniqueString": "P",)"
         R"( "UUID": {"$uuid": "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9"}, "Value": {"x": [1, -2]}})"},
        {{"container", "replace", "new.id", "--class", "1", "--old", "old.id", "--old-class", "1"},
         R"({"Command": 2, "NewContainerClass": 1, "NewIdentifier": "new.id", "OldContainerClass": 1,)"
         R"( "OldIdentifier": "old.id"})"},
        {{"groups"}, R"({"Command": 13})"},
        {{"groups", "a.b", "--ids"}, R"({"Command": 14, "Identifier": "a.b"})"},
        {{"system-group", "systemgroup.x", "--owner", "a.b"},
         R"({"Command": 17, "GroupIdentifier": "systemgroup.x", "Identifier": "a.b"})"},
        {{"protection", "set", "a.b", "3", "--retry-if-locked"},
         R"({"Command": 21, "ContainerClass": 2, "DataProtectionClass": {"$int64": 3}, "Identifier": "a.b", "RetryIfLocked": true})"},
        {{"codesign", "set", "a.b", "--info", R"({"k": true})"},
         R"({"CodeSigningInfo": {"k": true}, "Command": 18, "Identifier": "a.b"})"},
        {{"assets", "delete", "a.b", "x/y"},
         R"({"Command": 29, "Identifier": "a.b", "SourcePath": "x/y"})"},
        {{"migrate", "--per-user"}, R"({"Command": 30})"},
    };
    for (const Case& c : cases) {
        std::vector<std::string> args = {"--root", root_.path()};
        args.insert(args.end(), c.args.begin(), c.args.end());
        ToolRun r = tarnctl(args);
        EXPECT_EQ(r.status, 0) << c.request << ": " << r.err;
        std::string why;
        auto expected = tarnctl::JsonToPlist(c.request, &why);
        ASSERT_TRUE(expected) << why;
        EXPECT_EQ(tarnctl::PlistToJson(lastReceived()), tarnctl::PlistToJson(*expected));
    }

    // Arguments that do not parse never reach the daemon.
    const size_t before = [&] {
        MutexLock l(state_->mu);
        return state_->received.size();
    }();
    for (std::vector<std::string> bad :
         {std::vector<std::string>{"container", "du", "a.b", "--class", "two"},
          {"container", "du", "a.b", "--uuid", "nope"},
          {"container", "info", "set", "a.b", "k", "{"},
          {"codesign", "set", "a.b", "--info", "@" + root_.at("/missing.json")}}) {
        bad.insert(bad.begin(), {"--root", root_.path()});
        ToolRun r = tarnctl(bad);
        EXPECT_EQ(r.status, 1) << bad[3];
        EXPECT_NE(r.err.find("tarnctl:"), std::string::npos) << r.err;
    }
    MutexLock l(state_->mu);
    EXPECT_EQ(state_->received.size(), before);
}

TEST_F(TarnctlTest, RepliesReadAsTablesAndFailuresByName) {
    const Uuid u1 = *Uuid::parse("0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9");
    setHandler(
        answering({{"ReplyIdsArray",
                    PlistValue(PlistArray{PlistValue("com.example.longer"), PlistValue("a.b")})},
                   {"ReplyUUIDsArray", PlistValue(PlistArray{PlistValue(u1), PlistValue(u1)})},
                   {"ReplyPersonaUniqueStringsArray",
                    PlistValue(PlistArray{PlistValue(""), PlistValue("P1")})}}));
    ToolRun r = send("{}", {});  // keep the listener warm; the verbs follow
    r = tarnctl({"--root", root_.path(), "container", "list"});
    ASSERT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out,
              "IDENTIFIER          UUID                                  PERSONA\n"
              "com.example.longer  0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9\n"
              "a.b                 0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9  P1\n");
    r = tarnctl({"--root", root_.path(), "--json", "container", "list"});
    EXPECT_EQ(r.out.substr(0, 45), R"({"ReplyError": 1, "ReplyIdsArray": ["com.exam)");

    setHandler(answering(
        {{"ReplyPath", PlistValue("/p")},
         {"ReplyUUID", PlistValue(u1)},
         {"ReplyExisted", PlistValue(false)},
         {"ReplyGroupContainerDict", PlistValue(PlistDict{{"group.b", PlistValue("/g/b")},
                                                          {"group.a", PlistValue("/g/a")}})}}));
    r = tarnctl({"--root", root_.path(), "groups"});
    EXPECT_EQ(r.out,
              "existed:  no\n"
              "path:     /p\n"
              "UUID:     0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9\n"
              "\n"
              "GROUP    PATH\n"
              "group.a  /g/a\n"
              "group.b  /g/b\n");

    // A failed reply: the code's name and meaning on stderr, exit 5; send
    // names it too but keeps exiting 0.
    setHandler(answering({}, 55));
    r = tarnctl({"--root", root_.path(), "container", "delete", "a.b"});
    EXPECT_EQ(r.status, 5);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(
        r.err,
        "tarnctl: 55 not entitled: the client is not entitled for the command or the container\n");
    r = tarnctl({"--root", root_.path(), "--json", "personas"});
    EXPECT_EQ(r.status, 5);
    EXPECT_EQ(r.out, "{\"ReplyError\": 55}\n");
    setHandler(answering({}, 2));
    r = send("{}");
    EXPECT_EQ(r.status, 0);
    EXPECT_NE(r.err.find("2 unknown error"), std::string::npos) << r.err;

    r = tarnctl({"errors", "76"});
    EXPECT_EQ(r.status, 0);
    EXPECT_EQ(r.out.rfind("76 persona mismatch: ", 0), 0u) << r.out;
    EXPECT_NE(r.out.find("(TarnErrorPersonaMismatch)"), std::string::npos);
    EXPECT_EQ(tarnctl({"errors", "3"}).status, 1);
}

TEST_F(TarnctlTest, BashCompletionKnowsEveryVerb) {
    ToolRun gen = tarnctl({"completion", "bash"});
    ASSERT_EQ(gen.status, 0) << gen.err;
    const std::string script = root_.at("/tarnctl.bash");
    { std::ofstream(script) << gen.out; }
    // Each line: the words typed so far, then what completion must offer.
    const std::string probe = root_.at("/probe.sh");
    {
        std::ofstream out(probe);
        out << "source " << script << "\n"
            << "complete_words() { COMP_WORDS=(\"$@\"); COMP_CWORD=$(($# - 1)); _tarnctl;"
               " echo \"${COMPREPLY[*]}\"; }\n"
            << "complete_words tarnctl cont\n"
            << "complete_words tarnctl --root /x container in\n"
            << "complete_words tarnctl container info ''\n"
            << "complete_words tarnctl --timeout 3 codesign ''\n"
            << "complete_words tarnctl container du a.b --p\n"
            << "complete_words tarnctl ''\n";
    }
    harness::ChildProcess::Options opts;
    opts.stdoutPath = root_.at("/probe.out");
    opts.stderrPath = root_.at("/probe.err");
    std::string why;
    auto child = harness::ChildProcess::spawn({"/bin/bash", probe}, opts, &why);
    ASSERT_TRUE(child) << why;
    ASSERT_EQ(child->wait(20s).value_or(-1), 0) << slurp(opts.stderrPath);
    std::istringstream lines(slurp(opts.stdoutPath));
    std::string line;
    std::vector<std::string> got;
    while (std::getline(lines, line)) got.push_back(line);
    ASSERT_EQ(got.size(), 6u);
    EXPECT_EQ(got[0], "container");
    EXPECT_EQ(got[1], "info");
    EXPECT_EQ(got[2], "get set --help");
    EXPECT_EQ(got[3], "set get invalidate --help");
    EXPECT_EQ(got[4], "--persona");
    for (const char* verb :
         {"send", "container", "groups", "system-group", "codesign", "protection", "assets",
          "personas", "migrate", "sandbox-items", "lock", "unlock", "errors", "--json", "--root"})
        EXPECT_NE((" " + got[5] + " ").find(std::string(" ") + verb + " "), std::string::npos)
            << verb;
}

TEST_F(TarnctlTest, UsageAndHelp) {
    ToolRun r = tarnctl({"--help"});
    EXPECT_EQ(r.status, 0);
    for (const char* needle : {"send", "--root", "--socket", "--timeout", "$uuid", "$int64",
                               "$data", "Exit codes"})
        EXPECT_NE(r.out.find(needle), std::string::npos) << needle;
    EXPECT_EQ(tarnctl({}).status, 2);
    EXPECT_EQ(tarnctl({"--root", "/a", "--socket", "/b", "send", "{}"}).status, 2);
    EXPECT_EQ(tarnctl({"frobnicate"}).status, 2);
}

}  // namespace
}  // namespace tarn::conduit
