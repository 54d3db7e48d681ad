#include "Platform/Conduit.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

#include "Platform/ConduitHarness.h"
#include "Platform/ConduitSocket.h"
#include "Platform/ConduitWire.h"
#include "Platform/PlatformLog.h"
#include "support/ScratchRoot.h"

namespace tarn::conduit {
namespace {

using namespace std::chrono_literals;

PlistValue everyType() {
    PlistDict inner;
    inner["empty string"] = PlistValue(std::string());
    inner["text"] = PlistValue("grüße \xF0\x9F\x90\x9A");
    inner["zero"] = PlistValue(uint64_t{0});
    inner["umax"] = PlistValue(UINT64_MAX);
    inner["imin"] = PlistValue(INT64_MIN);
    inner["imax"] = PlistValue(INT64_MAX);
    inner["minus one"] = PlistValue(int64_t{-1});
    inner["non-negative int64"] = PlistValue(int64_t{7});
    inner["yes"] = PlistValue(true);
    inner["no"] = PlistValue(false);
    inner["uuid"] = PlistValue(*Uuid::parse("0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9"));
    inner["data"] = PlistValue(PlistData{0, 1, 0xFF, 0x80});
    inner["empty data"] = PlistValue(PlistData{});
    inner["empty array"] = PlistValue(PlistArray{});
    inner["empty dict"] = PlistValue(PlistDict{});
    PlistDict body;
    body["Command"] = PlistValue(uint64_t{27});
    body["nested"] = PlistValue(std::move(inner));
    body["list"] = PlistValue(PlistArray{PlistValue("a"), PlistValue(int64_t{-5}),
                                         PlistValue(PlistArray{PlistValue(true)})});
    return PlistValue(std::move(body));
}

std::vector<uint8_t> encode(const PlistValue& v) {
    std::vector<uint8_t> out;
    std::string why;
    EXPECT_TRUE(EncodeBody(v, &out, &why)) << why;
    return out;
}

// A request of one `bytes`-long blob, cut into records.
std::vector<std::vector<uint8_t>> blobRecords(size_t bytes, uint8_t fill, uint64_t messageId,
                                              std::vector<uint8_t>* body = nullptr) {
    PlistDict d;
    d["blob"] = PlistValue(PlistData(bytes, fill));
    const auto encoded = encode(PlistValue(d));
    if (body) *body = encoded;
    RecordHeader h;
    h.flags = kFlagRequest;
    h.messageId = messageId;
    return BuildRecords(h, encoded);
}

PlistValue nestedArrays(size_t depth) {
    PlistValue v(PlistDict{});
    for (size_t i = 1; i < depth; ++i) v = PlistValue(PlistArray{std::move(v)});
    return v;
}

TEST(ConduitWire, RoundTripsEveryTypeKeepingSignedness) {
    const PlistValue original = everyType();
    const auto bytes = encode(original);
    std::string why;
    auto decoded = DecodeBody(bytes.data(), bytes.size(), &why);
    ASSERT_TRUE(decoded) << why;
    EXPECT_EQ(*decoded, original);
    const PlistValue* nested = decoded->find("nested");
    ASSERT_NE(nested, nullptr);
    EXPECT_EQ(nested->find("non-negative int64")->type(), PlistValue::Type::Int);
    EXPECT_EQ(nested->find("zero")->type(), PlistValue::Type::UInt);
    EXPECT_EQ(nested->find("uuid")->type(), PlistValue::Type::Uuid);
}

TEST(ConduitWire, RefusesValuesIpcDoesNotCarryAndNonDictionaryBodies) {
    std::vector<uint8_t> out;
    std::string why;
    for (const PlistValue& bad : {PlistValue(1.5), PlistValue(PlistDate{3}), PlistValue()}) {
        PlistDict d;
        d["k"] = bad;
        EXPECT_FALSE(EncodeBody(PlistValue(d), &out, &why));
        EXPECT_FALSE(why.empty());
    }
    EXPECT_FALSE(EncodeBody(PlistValue("not a dictionary"), &out, &why));
    const std::vector<uint8_t> stringValue = {0x01, 0x00};
    EXPECT_FALSE(DecodeBody(stringValue.data(), stringValue.size(), &why));
}

TEST(ConduitWire, EveryTruncationOfAValidBodyIsRejected) {
    const auto bytes = encode(everyType());
    for (size_t n = 0; n < bytes.size(); ++n) {
        std::string why;
        EXPECT_FALSE(DecodeBody(bytes.data(), n, &why)) << "prefix of " << n << " bytes decoded";
        EXPECT_FALSE(why.empty());
    }
}

TEST(ConduitWire, MalformedBodiesAreRejectedWithAReason) {
    struct Case {
        const char* name;
        std::vector<uint8_t> bytes;
    };
    const std::vector<Case> cases = {
        {"unknown tag", {0x09, 0x01, 0x01, 'k', 0x7F}},
        {"trailing bytes", {0x09, 0x00, 0x00}},
        {"invalid UTF-8 value", {0x09, 0x01, 0x01, 'k', 0x01, 0x02, 0xC3, 0x28}},
        {"invalid UTF-8 key", {0x09, 0x01, 0x01, 0xFF, 0x04}},
        {"overlong UTF-8", {0x09, 0x01, 0x01, 'k', 0x01, 0x02, 0xC0, 0xAF}},
        {"surrogate in UTF-8", {0x09, 0x01, 0x01, 'k', 0x01, 0x03, 0xED, 0xA0, 0x80}},
        {"duplicate key", {0x09, 0x02, 0x01, 'k', 0x04, 0x01, 'k', 0x05}},
        {"duplicate key out of order",
         {0x09, 0x03, 0x01, 'b', 0x04, 0x01, 'a', 0x04, 0x01, 'b', 0x05}},
        {"UTF-8 cut after eight ASCII bytes",
         {0x09, 0x01, 0x01, 'k', 0x01, 0x09, 'a', 'b', 'c', 'd', 'e', 'f', 'g', 'h', 0xC3}},
        {"array count past the end", {0x09, 0x01, 0x01, 'k', 0x08, 0xFF, 0xFF, 0xFF, 0xFF, 0x0F}},
        {"dict count past the end", {0x09, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0x7F}},
        {"data length past the end", {0x09, 0x01, 0x01, 'k', 0x07, 0x10, 0x00}},
        {"varint over 64 bits",
         {0x09, 0x01, 0x01, 'k', 0x02, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0x02}},
        {"varint of eleven bytes",
         {0x09, 0x01, 0x01, 'k', 0x02, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80,
          0x00}},
    };
    for (const Case& c : cases) {
        std::string why;
        EXPECT_FALSE(DecodeBody(c.bytes.data(), c.bytes.size(), &why)) << c.name;
        EXPECT_FALSE(why.empty()) << c.name;
    }
}

// Keys a foreign encoder sends out of order, and non-ASCII text around runs
// of ASCII, decode to the same values.
TEST(ConduitWire, UnorderedKeysAndMixedTextDecode) {
    const std::vector<uint8_t> bytes = {0x09, 0x02, 0x01, 'b', 0x02, 0x02, 0x01, 'a', 0x01, 0x0C,
                                        'a', 'b', 'c', 'd', 'e', 'f', 'g', 'h', 0xC3, 0xA9, 'i', 'j'};
    std::string why;
    auto v = DecodeBody(bytes.data(), bytes.size(), &why);
    ASSERT_TRUE(v) << why;
    EXPECT_EQ(v->find("b")->asUInt64(), 2u);
    EXPECT_EQ(*v->find("a")->asString(), "abcdefgh\xC3\xA9ij");
}

TEST(ConduitWire, NestingAndValueCountAreCapped) {
    std::string why;
    // nestedArrays builds arrays around a dict; a dict body around it adds one level.
    PlistDict atLimit;
    atLimit["a"] = nestedArrays(kMaxNestingDepth - 1);
    auto bytes = encode(PlistValue(atLimit));
    EXPECT_TRUE(DecodeBody(bytes.data(), bytes.size(), &why)) << why;

    PlistDict tooDeep;
    tooDeep["a"] = nestedArrays(kMaxNestingDepth);
    std::vector<uint8_t> out;
    EXPECT_FALSE(EncodeBody(PlistValue(tooDeep), &out, &why));
    // A hand-made frame nested far deeper than the encoder would ever write.
    std::vector<uint8_t> deep = {0x09, 0x01, 0x01, 'k'};
    for (int i = 0; i < 100000; ++i) deep.insert(deep.end(), {0x08, 0x01});
    deep.push_back(0x04);
    EXPECT_FALSE(DecodeBody(deep.data(), deep.size(), &why));
    EXPECT_NE(why.find("nesting"), std::string::npos) << why;

    // 70000 booleans fit in the byte budget but not in the value budget.
    std::vector<uint8_t> many = {0x09, 0x01, 0x01, 'k', 0x08, 0xF0, 0xA2, 0x04};
    many.insert(many.end(), 70000, 0x04);
    EXPECT_FALSE(DecodeBody(many.data(), many.size(), &why));
    EXPECT_NE(why.find("too many"), std::string::npos) << why;
}

TEST(ConduitWire, BodiesOverOneMegabyteAreRefusedBothWays) {
    PlistDict big;
    big["blob"] = PlistValue(PlistData(kMaxBodyBytes, 0xAB));
    std::vector<uint8_t> out;
    std::string why;
    EXPECT_FALSE(EncodeBody(PlistValue(big), &out, &why));

    RecordHeader h;
    h.messageId = 1;
    h.bodyLength = kMaxBodyBytes + 1;
    uint8_t record[kHeaderBytes];
    EncodeHeader(h, record);
    EXPECT_FALSE(DecodeHeader(record, sizeof record, &why));
}

TEST(ConduitWire, LargeMessagesTravelInSeveralRecordsAndReassemble) {
    std::vector<uint8_t> body;
    const auto records = blobRecords(300 * 1024, 0x5A, 42, &body);
    ASSERT_GT(records.size(), 4u);
    RecordAssembler a;
    std::string why;
    for (size_t i = 0; i < records.size(); ++i) {
        auto r = a.add(records[i].data(), records[i].size(), &why);
        EXPECT_EQ(r, i + 1 < records.size() ? RecordAssembler::Result::NeedMore
                                            : RecordAssembler::Result::Complete)
            << why;
        EXPECT_LE(records[i].size(), kMaxRecordBytes);
    }
    EXPECT_EQ(a.header().messageId, 42u);
    EXPECT_EQ(a.header().flags, kFlagRequest);
    EXPECT_EQ(a.take(), body);
}

TEST(ConduitWire, BrokenRecordSequencesAreMalformed) {
    const auto records = blobRecords(150 * 1024, 0x11, 7);
    ASSERT_EQ(records.size(), 3u);
    auto expectMalformed = [](std::vector<std::vector<uint8_t>> seq, const char* name) {
        RecordAssembler a;
        std::string why;
        RecordAssembler::Result r = RecordAssembler::Result::NeedMore;
        for (auto& rec : seq) {
            r = a.add(rec.data(), rec.size(), &why);
            if (r != RecordAssembler::Result::NeedMore) break;
        }
        EXPECT_EQ(r, RecordAssembler::Result::Malformed) << name;
    };
    expectMalformed({records[1]}, "starts mid-body");
    expectMalformed({records[0], records[2]}, "skips a record");
    auto otherId = records[1];
    otherId[8] ^= 1;
    expectMalformed({records[0], otherId}, "continuation with another id");
    auto lastWithMore = records[2];
    lastWithMore[6] |= kFlagMore;
    expectMalformed({records[0], records[1], lastWithMore}, "more after the end");
    auto badMagic = records[0];
    badMagic[0] = 'X';
    expectMalformed({badMagic}, "bad magic");
    auto badVersion = records[0];
    badVersion[4] = 2;
    expectMalformed({badVersion}, "version 2");
    auto bothKinds = records[0];
    bothKinds[6] |= kFlagReply;
    expectMalformed({bothKinds}, "request and reply");
    auto unknownFlag = records[0];
    unknownFlag[7] = 0x80;
    expectMalformed({unknownFlag}, "unknown flag");
    expectMalformed({std::vector<uint8_t>(records[0].begin(), records[0].begin() + 20)},
                    "short header");
}

TEST(ConduitAuditToken, RoundTripsItsFields) {
    AuditTokenFields f{501, 20, 4242, 0x1122334455667788ull};
    auto back = ParseAuditToken(MakeAuditToken(f));
    EXPECT_EQ(back.euid, 501u);
    EXPECT_EQ(back.egid, 20u);
    EXPECT_EQ(back.pid, 4242);
    EXPECT_EQ(back.startTime, 0x1122334455667788ull);
}

// A server in a scratch root: records what it sees and replies through `onMessage`.
struct Server : std::enable_shared_from_this<Server> {
    using MessageHandler = std::function<void(const ConnectionRef&, const MessageRef&)>;

    Mutex mu;
    std::vector<ConnectionRef> connections GUARDED_BY(mu);
    MessageHandler onMessage GUARDED_BY(mu);
    std::atomic<int> invalidEvents{0};
    std::atomic<int> messages{0};

    void install(Listener& listener) {
        std::weak_ptr<Server> weak = weak_from_this();
        listener.setNewConnectionHandler([weak](const ConnectionRef& c) {
            auto self = weak.lock();
            if (!self) return c->cancel();
            std::weak_ptr<Connection> wc = c;
            c->setEventHandler([self, wc](const Event& e) {
                if (e.kind != Event::Kind::Message) {
                    ++self->invalidEvents;
                    return;
                }
                ++self->messages;
                MessageHandler h;
                {
                    MutexLock l(self->mu);
                    h = self->onMessage;
                }
                if (auto c = wc.lock()) h(c, e.message);
            });
            c->setQoSFloor(QoS::Default);
            // Counted only when resumed: one cancelled first (the listener
            // going away meanwhile) never hears ConnectionInvalid.
            if (c->resume()) {
                MutexLock l(self->mu);
                self->connections.push_back(c);
            }
        });
    }

    size_t connectionCount() {
        MutexLock l(mu);
        return connections.size();
    }
};

// Echoes the request body back under "Echo" with "ReplyError" 1.
void echo(const ConnectionRef& c, const MessageRef& m) {
    auto reply = m->createReply();
    if (!reply) return;
    reply->body().set("Echo", m->body());
    reply->body().set("ReplyError", PlistValue(uint64_t{1}));
    c->send(reply);
}

template <class Pred>
bool eventually(Pred pred, std::chrono::milliseconds bound = 5000ms) {
    const auto deadline = std::chrono::steady_clock::now() + bound;
    while (!pred()) {
        if (std::chrono::steady_clock::now() > deadline) return false;
        std::this_thread::sleep_for(1ms);
    }
    return true;
}

PlistValue request(uint64_t seq) {
    PlistDict d;
    d["Seq"] = PlistValue(seq);
    return PlistValue(std::move(d));
}

class ConduitListenerTest : public test::ScratchRootTest {
protected:
    void SetUp() override {
        PlatformLogSetQuiet(true);
        logPath_ = root_.at("/platform.log");
        PlatformLogSetFile(logPath_);
        queue_ = DispatchQueue::createSerial("com.ostrea.tarnkeeperd.listener");
        std::string why;
        listener_ = Listener::create("com.ostrea.tarnkeeperd", queue_, &why);
        ASSERT_TRUE(listener_) << why;
        ASSERT_EQ(listener_->socketPath(), root_.at("/run/com.ostrea.tarnkeeperd.socket"));
        server_ = std::make_shared<Server>();
        setHandler(echo);
        server_->install(*listener_);
    }

    void TearDown() override {
        if (listener_) listener_->cancel();
        // Every resumed connection hears ConnectionInvalid before the fixture goes.
        EXPECT_TRUE(eventually([&] {
            return server_->invalidEvents.load() == static_cast<int>(server_->connectionCount());
        }));
        PlatformLogSetFile("");
        PlatformLogSetQuiet(false);
    }

    void setHandler(Server::MessageHandler h) {
        MutexLock l(server_->mu);
        server_->onMessage = std::move(h);
    }

    std::unique_ptr<Client> connect() {
        std::string why;
        auto c = Client::connect(listener_->socketPath(), &why);
        EXPECT_TRUE(c) << why;
        return c;
    }

    std::string platformLog() {
        std::ifstream in(logPath_);
        std::stringstream s;
        s << in.rdbuf();
        return s.str();
    }

    std::string logPath_;
    DispatchQueueRef queue_;
    std::shared_ptr<Listener> listener_;
    std::shared_ptr<Server> server_;
};

TEST_F(ConduitListenerTest, NothingIsAcceptedBeforeResumeAndStartUpWorkRunsFirst) {
    std::atomic<bool> startUpDone{false};
    std::atomic<bool> sawStartUpDone{false};
    queue_->async([&] {
        std::this_thread::sleep_for(50ms);
        startUpDone = true;
    });
    setHandler([&](const ConnectionRef& c, const MessageRef& m) {
        sawStartUpDone = startUpDone.load();
        echo(c, m);
    });
    auto client = connect();
    std::string why;
    auto id = client->sendRequest(request(1), &why);
    ASSERT_TRUE(id) << why;
    EXPECT_FALSE(client->waitForReply(*id, 100ms, &why));
    EXPECT_EQ(why, "timed out");
    EXPECT_EQ(server_->messages.load(), 0);

    listener_->resume();
    auto reply = client->waitForReply(*id, 5000ms, &why);
    ASSERT_TRUE(reply) << why;
    EXPECT_EQ(*reply->find("Echo"), request(1));
    EXPECT_TRUE(sawStartUpDone.load());
}

TEST_F(ConduitListenerTest, PeersRunConcurrentlyButEachPeerSerially) {
    std::atomic<bool> release{false};
    std::atomic<int> inFlightA{0};
    std::atomic<int> maxInFlightA{0};
    std::atomic<uint64_t> lastSeqA{0};
    std::atomic<bool> orderedA{true};
    setHandler([&](const ConnectionRef& c, const MessageRef& m) {
        if (m->body().find("Peer")->asString()->compare("A") == 0) {
            const int now = ++inFlightA;
            maxInFlightA = std::max(maxInFlightA.load(), now);
            const uint64_t seq = *m->body().find("Seq")->asUInt64();
            if (seq != lastSeqA + 1) orderedA = false;
            lastSeqA = seq;
            // The first request of A waits until B has been answered: only
            // possible when different peers run at the same time.
            if (seq == 1) eventually([&] { return release.load(); });
            --inFlightA;
        }
        echo(c, m);
    });
    listener_->resume();
    auto a = connect();
    auto b = connect();
    std::string why;
    std::vector<uint64_t> idsA;
    for (uint64_t seq = 1; seq <= 40; ++seq) {
        PlistValue r = request(seq);
        r.set("Peer", PlistValue("A"));
        auto id = a->sendRequest(r, &why);
        ASSERT_TRUE(id) << why;
        idsA.push_back(*id);
    }
    PlistValue rb = request(1);
    rb.set("Peer", PlistValue("B"));
    auto replyB = b->sendSync(rb, 5000ms, &why);
    ASSERT_TRUE(replyB) << why;
    release = true;
    // Collect A's replies in reverse to exercise the reply stash.
    for (auto it = idsA.rbegin(); it != idsA.rend(); ++it) {
        auto reply = a->waitForReply(*it, 5000ms, &why);
        ASSERT_TRUE(reply) << why;
    }
    EXPECT_EQ(maxInFlightA.load(), 1);
    EXPECT_TRUE(orderedA.load());
    EXPECT_EQ(lastSeqA.load(), 40u);
}

// A request to an idle peer queue runs on the I/O thread that read it (no
// hand-off to another thread), still as an item of the peer's queue; a
// handler there may even cancel the listener without waiting for itself.
TEST_F(ConduitListenerTest, IdleRequestsRunWhereTheyWereReadAndMayCancelTheListener) {
    struct Seen {
        Mutex mu;
        std::vector<std::string> threads GUARDED_BY(mu);
        bool onQueue GUARDED_BY(mu) = true;
    };
    auto seen = std::make_shared<Seen>();
    auto listener = listener_;
    setHandler([seen, listener](const ConnectionRef& c, const MessageRef& m) {
        char name[32] = {};
        (void)pthread_getname_np(pthread_self(), name, sizeof name);
        {
            MutexLock l(seen->mu);
            seen->threads.emplace_back(name);
            seen->onQueue = seen->onQueue && c->queue()->isCurrent();
        }
        if (m->body().find("Stop")) listener->cancel();
        echo(c, m);
    });
    listener_->resume();
    auto client = connect();
    std::string why;
    for (uint64_t seq = 1; seq <= 20; ++seq) ASSERT_TRUE(client->sendSync(request(seq), 5000ms, &why)) << why;
    {
        MutexLock l(seen->mu);
        ASSERT_EQ(seen->threads.size(), 20u);
        for (const auto& t : seen->threads) EXPECT_EQ(t, "tarn-conduit-io");
        EXPECT_TRUE(seen->onQueue);
    }
    PlistValue stop = request(21);
    stop.set("Stop", PlistValue(true));
    // The handler's own reply may or may not get out before its connection
    // is cancelled; what matters is that cancel() returned inside it.
    (void)client->sendSync(stop, 5000ms, &why);
    EXPECT_TRUE(eventually([&] { return listener_->TEST_connectionCount() == 0; }));
    EXPECT_FALSE(Client::connect(listener_->socketPath(), &why));
}

// After a request the reading thread waits on that peer for a while; a peer
// that pauses longer, or another peer meanwhile, is still served: by the
// polling threads once the wait ends.
TEST_F(ConduitListenerTest, PausingAndInterleavedPeersAreAllServed) {
    listener_->resume();
    auto first = connect();
    auto second = connect();
    std::string why;
    for (uint64_t seq = 1; seq <= 6; ++seq) {
        auto& client = seq % 2 ? first : second;
        auto reply = client->sendSync(request(seq), 5000ms, &why);
        ASSERT_TRUE(reply) << why;
        EXPECT_EQ(reply->find("Echo")->find("Seq")->asUInt64(), seq);
        if (seq % 3 == 0) std::this_thread::sleep_for(120ms);  // longer than the wait
    }
}

// The peer connects, then execs another program that inherits the socket:
// from then on the connection answers with the new executable, and with
// nothing once the process is gone.
TEST_F(ConduitListenerTest, AnExecInThePeerShowsInItsExecutable) {
    const std::string other = "/bin/sleep";
    if (::access(other.c_str(), X_OK) != 0) GTEST_SKIP() << "needs " << other << " to exec";
    listener_->resume();
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, listener_->socketPath().c_str(), sizeof addr.sun_path - 1);
    int go[2];
    ASSERT_EQ(::pipe(go), 0);
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        // Async-signal-safe calls only: the parent has threads.
        ::close(go[1]);
        const int fd = ::socket(AF_UNIX, SOCK_SEQPACKET, 0);  // kept across exec
        if (fd < 0 || ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) ::_exit(2);
        char byte;
        if (::read(go[0], &byte, 1) != 1) ::_exit(3);
        ::execl(other.c_str(), "sleep", "30", static_cast<char*>(nullptr));
        ::_exit(4);
    }
    ::close(go[0]);
    ASSERT_TRUE(eventually([&] { return server_->connectionCount() == 1; }));
    ConnectionRef c;
    {
        MutexLock l(server_->mu);
        c = server_->connections.front();
    }
    const std::string self = std::filesystem::canonical("/proc/self/exe").string();
    EXPECT_EQ(c->executablePath(), std::optional<std::string>(self));
    EXPECT_EQ(c->executablePath(), std::optional<std::string>(self));  // cached answer
    ASSERT_EQ(::write(go[1], "x", 1), 1);
    ::close(go[1]);
    const std::string now = std::filesystem::canonical(other).string();
    EXPECT_TRUE(eventually([&] { return c->executablePath() == std::optional<std::string>(now); }))
        << c->executablePath().value_or("(none)");
    ::kill(child, SIGKILL);
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_FALSE(c->executablePath().has_value());
}

TEST_F(ConduitListenerTest, ARequestIsAnsweredAtMostOnce) {
    std::atomic<int> secondCreate{-1};
    std::atomic<int> secondSend{-1};
    std::atomic<int> oneWayHadContext{-1};
    setHandler([&](const ConnectionRef& c, const MessageRef& m) {
        if (!m->expectsReply()) {
            oneWayHadContext = m->createReply() != nullptr;
            return;
        }
        auto reply = m->createReply();
        secondCreate = m->createReply() != nullptr;
        EXPECT_FALSE(m->expectsReply());
        reply->body().set("ReplyError", PlistValue(uint64_t{1}));
        EXPECT_TRUE(c->send(reply));
        secondSend = c->send(reply);
        // A reply to the same request made by hand is refused as well.
        auto forged = m->remoteConnection();
        EXPECT_EQ(forged, c);
    });
    listener_->resume();
    auto client = connect();
    std::string why;
    ASSERT_TRUE(client->sendOneWay(request(0), &why)) << why;
    auto reply = client->sendSync(request(1), 5000ms, &why);
    ASSERT_TRUE(reply) << why;
    // The reply can overtake the handler's last steps.
    EXPECT_TRUE(eventually([&] { return secondSend.load() != -1; }));
    EXPECT_EQ(secondCreate.load(), 0);
    EXPECT_EQ(secondSend.load(), 0);
    EXPECT_EQ(oneWayHadContext.load(), 0);
    EXPECT_FALSE(client->receive(200ms, &why)) << "a second reply arrived";
    EXPECT_EQ(why, "timed out");
}

TEST_F(ConduitListenerTest, BadInputCancelsOnlyThatPeer) {
    listener_->resume();
    auto good = connect();
    std::string why;
    ASSERT_TRUE(good->sendSync(request(1), 5000ms, &why)) << why;

    struct Bad {
        const char* name;
        std::vector<uint8_t> bytes;
    };
    std::vector<Bad> bads;
    bads.push_back({"garbage", {'h', 'e', 'l', 'l', 'o', ' ', 'w', 'o', 'r', 'l', 'd'}});
    {
        // A valid header around a body that is not a dictionary.
        RecordHeader h;
        h.flags = kFlagRequest;
        h.messageId = 1;
        auto recs = BuildRecords(h, {0x01, 0x00});
        bads.push_back({"non-dictionary body", recs[0]});
    }
    {
        // A header announcing more than 1 MiB.
        RecordHeader h;
        h.messageId = 1;
        h.bodyLength = 2 * 1024 * 1024;
        std::vector<uint8_t> rec(kHeaderBytes);
        EncodeHeader(h, rec.data());
        bads.push_back({"oversized announcement", rec});
    }
    bads.push_back({"record over the limit", std::vector<uint8_t>(kMaxRecordBytes + 1, 0x09)});

    for (const Bad& bad : bads) {
        auto evil = connect();
        ASSERT_TRUE(evil->sendRaw(bad.bytes.data(), bad.bytes.size())) << bad.name;
        EXPECT_FALSE(evil->receive(5000ms, &why)) << bad.name;
        EXPECT_EQ(why, "connection closed by the peer") << bad.name;
        auto reply = good->sendSync(request(2), 5000ms, &why);
        EXPECT_TRUE(reply) << bad.name << ": " << why;
    }
    EXPECT_NE(platformLog().find("Cancelling connection from pid"), std::string::npos);
    // Only the good peer is left.
    EXPECT_TRUE(eventually([&] { return listener_->TEST_connectionCount() == 1; }));
}

TEST_F(ConduitListenerTest, LargestMessagesRoundTripAndAFloodingPeerIsThrottled) {
    listener_->resume();
    auto client = connect();
    std::string why;
    PlistDict d;
    d["blob"] = PlistValue(PlistData(kMaxBodyBytes - 64, 0x42));
    auto reply = client->sendSync(PlistValue(d), 5000ms, &why);
    ASSERT_TRUE(reply) << why;
    EXPECT_EQ(*reply->find("Echo"), PlistValue(d));
    // A reply that cannot be encoded within the limit is refused at the
    // sender, and the connection stays usable.
    setHandler([](const ConnectionRef& c, const MessageRef& m) {
        auto r = m->createReply();
        r->body().set("blob", PlistValue(PlistData(kMaxBodyBytes, 0)));
        EXPECT_FALSE(c->send(r));
    });
    EXPECT_FALSE(client->sendSync(request(0), 300ms, &why));
    setHandler(echo);

    // Many requests sent before reading any reply: the server reads only as
    // fast as the peer's queue drains, and nothing is lost or reordered.
    std::vector<uint64_t> ids;
    for (uint64_t i = 0; i < 200; ++i) ids.push_back(*client->sendRequest(request(i), &why));
    for (uint64_t i = 0; i < 200; ++i) {
        auto r = client->waitForReply(ids[i], 5000ms, &why);
        ASSERT_TRUE(r) << why;
        EXPECT_EQ(*r->find("Echo"), request(i));
    }
}

TEST_F(ConduitListenerTest, ALiveSocketOrAPlainFileIsNeverTakenOver) {
    listener_->resume();
    std::string why;
    EXPECT_FALSE(Listener::create("com.ostrea.tarnkeeperd", queue_, &why));
    EXPECT_NE(why.find("another process is listening"), std::string::npos) << why;
    listener_->cancel();
    root_.writeFile("/run/other.socket", "not a socket");
    EXPECT_FALSE(Listener::create("other", queue_, &why));
    auto again = Listener::create("com.ostrea.tarnkeeperd", queue_, &why);
    EXPECT_TRUE(again) << why;
}

// The peer is another process (tarnctl) that claims to be someone else in its
// message; the server must see only what the kernel says.
TEST_F(ConduitListenerTest, IdentityComesFromTheKernelNotTheMessage) {
    struct Seen {
        Mutex mu;
        uid_t euid = 0;
        gid_t egid = 0;
        pid_t pid = 0;
        AuditToken token{};
        std::optional<std::string> exe;
        ConnectionRef connection;
        PlistValue body;
    };
    auto seen = std::make_shared<Seen>();
    setHandler([seen](const ConnectionRef& c, const MessageRef& m) {
        {
            MutexLock l(seen->mu);
            seen->euid = c->euid();
            seen->egid = c->egid();
            seen->pid = c->pid();
            seen->token = c->auditToken();
            seen->exe = c->executablePath();
            seen->connection = c;
            seen->body = m->body();
        }
        echo(c, m);
    });
    listener_->resume();

    const bool root = ::geteuid() == 0;
    const uid_t uid = root ? 4242 : ::geteuid();
    const gid_t gid = root ? 4343 : ::getegid();
    if (root) {
        // The scratch root is private to us; the other user must reach the socket.
        std::filesystem::permissions(root_.path(), std::filesystem::perms(0755));
        std::filesystem::permissions(root_.at("/run"), std::filesystem::perms(0755));
    }
    const std::string tarnctl = TARN_BINARY_DIR "/tarnctl";
    if (!std::filesystem::exists(tarnctl))
        GTEST_SKIP() << tarnctl << " is not built (the thread-sanitizer build makes no tools)";
    harness::ChildProcess::Options opts;
    if (root) {
        opts.uid = uid;
        opts.gid = gid;
    }
    opts.stdoutPath = root_.at("/out.json");
    opts.stderrPath = root_.at("/err.txt");
    // Lies: every field names root, PID 1 and a forged audit token.
    const std::string claim =
        R"({"euid": 0, "egid": 0, "pid": 1, "uid": 0,)"
        R"( "AuditToken": {"$data": "AAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAA="}})";
    std::string why;
    auto child = harness::ChildProcess::spawn(
        {tarnctl, "--socket", listener_->socketPath(), "send", claim}, opts, &why);
    ASSERT_TRUE(child) << why;
    const pid_t childPid = child->pid();
    auto status = child->wait(10000ms);
    ASSERT_TRUE(status);
    std::ifstream err(opts.stderrPath);
    std::stringstream errText;
    errText << err.rdbuf();
    ASSERT_EQ(*status, 0) << errText.str();

    MutexLock l(seen->mu);
    EXPECT_EQ(seen->pid, childPid);
    EXPECT_EQ(seen->euid, uid);
    EXPECT_EQ(seen->egid, gid);
    EXPECT_EQ(seen->body.find("pid")->asUInt64(), 1u);  // delivered as data, never as identity
    const auto fields = ParseAuditToken(seen->token);
    EXPECT_EQ(fields.pid, childPid);
    EXPECT_EQ(fields.euid, uid);
    EXPECT_EQ(fields.egid, gid);
    EXPECT_GT(fields.startTime, 0u);
    EXPECT_NE(seen->token, AuditToken{});
    ASSERT_TRUE(seen->exe.has_value());
    EXPECT_EQ(*seen->exe, std::filesystem::canonical(tarnctl).string());
    // The peer has exited and been reaped: its PID may now belong to anyone,
    // so the connection no longer answers for it.
    EXPECT_FALSE(seen->connection->executablePath().has_value());
}

}  // namespace
}  // namespace tarn::conduit
