// The kernel upcall over its socket: who counts as the kernel, which data
// container class a process gets, the answer's items and their order, the
// persona's home, a container that cannot be made, and malformed messages,
// which are answered with their codes while the daemon goes on serving.
#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <packbuff/packbuff.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <vector>

#include "Daemon/TarnError.h"
#include "Platform/Failpoints.h"
#include "Platform/Path.h"
#include "Platform/UpcallSocket.h"
#include "Tools/tarnctl/Json.h"
#include "support/IpcTest.h"

namespace tarn {
namespace {

using namespace upcall;

// A pack buffer built item by item.
class Packed {
  public:
    Packed() : p_(sb_packbuff_new(0)) {}
    ~Packed() { sb_packbuff_free(p_); }
    Packed& string(uint16_t type, const std::string& s) {
        EXPECT_EQ(sb_packbuff_pack_string(p_, type, s.c_str(), s.size()), 0);
        return *this;
    }
    Packed& number(uint16_t type, uint32_t v) {
        EXPECT_EQ(sb_packbuff_pack_uint32(p_, type, v), 0);
        return *this;
    }
    std::vector<uint8_t> bytes() const {
        const auto* b = static_cast<const uint8_t*>(sb_packbuff_get_bytes(p_));
        return {b, b + sb_packbuff_get_size(p_)};
    }

  private:
    sb_packbuff_t* p_;
};

class UpcallTest : public test::IpcTest {
  protected:
    // `tarnctl upcall ARGS` as the (root) admin client: the printed object.
    PlistValue upcall(std::vector<std::string> args) {
        args.insert(args.begin(), "upcall");
        const test::ProcessResult r = daemon_->tarnctl(admin_, args);
        EXPECT_EQ(r.exitCode, 0) << r.err;
        std::string why;
        auto json = tarnctl::JsonToPlist(r.out, &why);
        EXPECT_TRUE(json) << r.out << why;
        return json ? *json : PlistValue(PlistDict{});
    }
    static int64_t returnCode(const PlistValue& answer) {
        const PlistValue* v = answer.find("ReturnCode");
        if (!v) return -1;
        if (auto u = v->asUInt64()) return static_cast<int64_t>(*u);
        return v->asInt64().value_or(-1);
    }
    static const PlistArray& items(const PlistValue& answer) {
        static const PlistArray kNone;
        const PlistValue* v = answer.find("Items");
        return v && v->asArray() ? *v->asArray() : kNone;
    }
    static std::vector<uint64_t> types(const PlistValue& answer) {
        std::vector<uint64_t> out;
        for (const PlistValue& item : items(answer))
            out.push_back(item.find("Type")->asUInt64().value_or(999));
        return out;
    }
    // The string value of the first item of `type`.
    static std::string value(const PlistValue& answer, uint64_t type) {
        for (const PlistValue& item : items(answer))
            if (item.find("Type")->asUInt64() == type) return stringOf(item, "Value");
        return "";
    }
    static uint64_t status(const PlistValue& answer) {
        const PlistArray& all = items(answer);
        return all.empty() ? 999 : all.back().find("Value")->asUInt64().value_or(999);
    }
    std::string diskLog() const {
        std::ifstream in(root_.at("/private/var/root/Library/Logs/TarnKeeper/tarnkeeperd.log"));
        std::stringstream s;
        s << in.rdbuf();
        return s.str();
    }
    std::string upcallSocket() const {
        return PathJoin(PathParent(daemon_->socketPath()), "com.ostrea.tarnkeeperd.upcall.socket");
    }
};

TEST_F(UpcallTest, OnlyASenderRunningAsRootIsTheKernel) {
    if (IsSkipped()) return;
    daemon_->start();
    const std::vector<uint8_t> request = EncodeRequestDatagram(Packed().number(3, 501).bytes());

    std::string why;
    auto client = UpcallClient::connect(upcallSocket(), &why);
    ASSERT_TRUE(client) << why;
    auto reply = client->call(request, std::chrono::seconds(10), &why);
    ASSERT_TRUE(reply) << why;
    EXPECT_EQ(DecodeReplyDatagram(*reply, &why)->returnCode, 0);

    // The child connects as "nobody" through the socket's directory, opened
    // while still root (the scratch root itself is private), and uses only
    // system calls after the fork.
    const int dir = ::open(PathParent(upcallSocket()).c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
    ASSERT_GE(dir, 0);
    struct sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    const std::string viaDir =
        "/proc/self/fd/" + std::to_string(dir) + "/com.ostrea.tarnkeeperd.upcall.socket";
    std::memcpy(addr.sun_path, viaDir.c_str(), viaDir.size());
    int out[2];
    ASSERT_EQ(::pipe(out), 0);
    const pid_t child = ::fork();
    if (child == 0) {
        uint8_t buffer[256];
        const int fd = ::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
        if (::setgroups(0, nullptr) != 0 || ::setgid(65534) != 0 || ::setuid(65534) != 0 ||
            ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 ||
            ::send(fd, request.data(), request.size(), 0) != static_cast<ssize_t>(request.size()))
            ::_exit(2);
        const ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
        if (n <= 0 || ::write(out[1], buffer, static_cast<size_t>(n)) != n) ::_exit(3);
        ::_exit(0);
    }
    ::close(out[1]);
    ::close(dir);
    uint8_t buffer[256];
    const ssize_t n = ::read(out[0], buffer, sizeof buffer);
    ::close(out[0]);
    int wstatus = 0;
    ASSERT_EQ(::waitpid(child, &wstatus, 0), child);
    ASSERT_TRUE(WIFEXITED(wstatus) && WEXITSTATUS(wstatus) == 0) << "child status " << wstatus;
    ASSERT_GT(n, 0);
    auto refused = DecodeReplyDatagram({buffer, static_cast<size_t>(n)}, &why);
    ASSERT_TRUE(refused) << why;
    EXPECT_EQ(refused->returnCode, 5);
    EXPECT_EQ(refused->id, kProcessContainersRequestID + kReplyIDOffset);
}

TEST_F(UpcallTest, PluginSandboxTypeGetsAPluginDataContainer) {
    if (IsSkipped()) return;
    daemon_->start();
    ASSERT_EQ(ask(admin_,
                  R"({"Command": 18, "Identifier": "com.ostrea.test.app", "CodeSigningInfo": {}, )"
                  R"("OptionsDictionary": {"com.ostrea.TarnKeeper.DataContainerClass": 2}})"),
              TarnSuccess);

    PlistValue answer = upcall(
        {"--uid", "501", "--code-signing-id", "com.ostrea.test.app", "--container-type", "1"});
    EXPECT_EQ(returnCode(answer), 0);
    EXPECT_EQ(types(answer), (std::vector<uint64_t>{100, 1, 2, 0}));
    EXPECT_EQ(status(answer), 1u);
    const std::string data = value(answer, 1);
    EXPECT_EQ(value(answer, 2), data + "/tmp");
    EXPECT_EQ(value(answer, 100), root_.at("/private/var/mobile"));

    // It is the plug-in data container of that identifier, and no application one was made.
    PlistValue plugin =
        send(admin_, R"({"Command": 0, "Identifier": "com.ostrea.test.app", "ContainerClass": 4})");
    EXPECT_EQ(errorOf(plugin), TarnSuccess);
    EXPECT_EQ(stringOf(plugin, "ReplyPath"), data);
    EXPECT_NE(
        ask(admin_, R"({"Command": 0, "Identifier": "com.ostrea.test.app", "ContainerClass": 2})"),
        TarnSuccess);
    EXPECT_NE(diskLog().find("SB Type: 1, Pallet Type: 2.  Declaring this a plugin"),
              std::string::npos);
}

TEST_F(UpcallTest, AnswerCarriesEveryContainerInOrderAndFindsThemAgain) {
    if (IsSkipped()) return;
    daemon_->start();
    const std::vector<std::string> args = {"--uid",
                                           "0",
                                           "--container-id",
                                           "com.ostrea.test.daemon",
                                           "--app-group",
                                           "group.one",
                                           "--app-group",
                                           "group.two",
                                           "--system-container",
                                           "com.ostrea.test.system",
                                           "--system-group",
                                           "systemgroup.com.ostrea.test"};
    PlistValue first = upcall(args);
    ASSERT_EQ(returnCode(first), 0);
    EXPECT_EQ(types(first), (std::vector<uint64_t>{100, 1, 2, 3, 3, 101, 102, 0}));
    EXPECT_EQ(status(first), 1u);
    EXPECT_EQ(value(first, 100), root_.at("/private/var/root"));
    const PlistArray& all = items(first);
    EXPECT_EQ(stringOf(all[3], "Key"), "group.one");
    EXPECT_EQ(stringOf(all[4], "Key"), "group.two");
    EXPECT_EQ(stringOf(all[6], "Key"), "systemgroup.com.ostrea.test");
    for (size_t i = 1; i + 1 < all.size(); ++i)
        EXPECT_TRUE(std::filesystem::is_directory(stringOf(all[i], "Value"))) << i;

    // Found, not made again: the same paths.
    EXPECT_EQ(upcall(args), first);
}

TEST_F(UpcallTest, PersonaIdChoosesTheUserIdentity) {
    if (IsSkipped()) return;
    enablePersonas({{"ENTERPRISE-0001", 1001, "/private/var/personas/enterprise", {}}});
    daemon_->start();
    PlistValue enterprise =
        upcall({"--uid", "501", "--persona", "1001", "--code-signing-id", "com.ostrea.test.ent"});
    EXPECT_EQ(returnCode(enterprise), 0);
    EXPECT_EQ(value(enterprise, 100), root_.at("/private/var/personas/enterprise"));
    EXPECT_TRUE(value(enterprise, 1).starts_with(root_.at("/private/var/personas/enterprise/")));

    PlistValue personal = upcall({"--uid", "501", "--persona", "1000"});
    EXPECT_EQ(returnCode(personal), 0);
    EXPECT_EQ(value(personal, 100), root_.at("/private/var/mobile"));

    EXPECT_EQ(returnCode(upcall({"--uid", "501", "--persona", "4242"})), 4);
}

TEST_F(UpcallTest, OneGroupThatCannotBeMadeLeavesOnlyStatusZero) {
    if (IsSkipped()) return;
    FailpointClearAll();
    ::setenv("TARN_FAILPOINTS", "upcall.createOrLookup=errno:28@3", 1);
    daemon_->start();
    ::unsetenv("TARN_FAILPOINTS");
    // Data container, first group, then the second group fails.
    PlistValue answer =
        upcall({"--uid", "501", "--code-signing-id", "com.ostrea.test.app", "--app-group",
                "group.one", "--app-group", "group.two", "--app-group", "group.three"});
    EXPECT_EQ(returnCode(answer), 0);
    ASSERT_EQ(items(answer).size(), 1u);
    EXPECT_EQ(types(answer), std::vector<uint64_t>{0});
    EXPECT_EQ(status(answer), 0u);
    EXPECT_NE(diskLog().find("createOrLookupGroupContainersForUser: Failed with error:"),
              std::string::npos);
    // The group after the failed one was still made.
    EXPECT_EQ(ask(admin_, R"({"Command": 0, "Identifier": "group.three", "ContainerClass": 7})"),
              TarnSuccess);
}

TEST_F(UpcallTest, MalformedMessagesAreAnsweredWithTheirCodes) {
    if (IsSkipped()) return;
    daemon_->start();
    const std::vector<uint8_t> valid = EncodeRequestDatagram(Packed().number(3, 501).bytes());
    auto with = [&](const std::function<void(std::vector<uint8_t>&)>& change) {
        std::vector<uint8_t> d = valid;
        change(d);
        return d;
    };
    // Item type 2 (string) of 3 bytes whose last byte is not zero, then the end mark.
    std::vector<uint8_t> unterminated(24, 0);
    unterminated[0] = 2;
    unterminated[4] = 3;
    std::memcpy(unterminated.data() + 8, "abc", 3);

    struct Case {
        const char* what;
        std::vector<uint8_t> datagram;
        int32_t code;
    };
    const Case cases[] = {
        {"shorter than a message", std::vector<uint8_t>(valid.begin(), valid.begin() + 40), -304},
        {"message size 60", with([](auto& d) { StoreU32(d.data() + kOffsetSize, 60); }), -304},
        {"not complex", with([](auto& d) { StoreU32(d.data() + kOffsetBits, 0); }), -304},
        {"two descriptors", with([](auto& d) { StoreU32(d.data() + kOffsetDescriptorCount, 2); }),
         -304},
        {"region outside the datagram",
         with([](auto& d) { StoreU64(d.data() + kOffsetDescriptorAddress, 4096); }), -304},
        {"descriptor not out-of-line", with([](auto& d) { d[kOffsetDescriptorType] = 0; }), -300},
        {"descriptor size not the count", with([](auto& d) {
             StoreU32(d.data() + kOffsetDataCount, LoadU32(d.data() + kOffsetDataCount) + 8);
         }),
         -300},
        {"value type 9", EncodeRequestDatagram(Packed().number(9, 1).bytes()), 4},
        {"string without terminator", EncodeRequestDatagram(unterminated), 5},
        {"user id as a string", EncodeRequestDatagram(Packed().string(3, "501").bytes()), 5},
        {"unknown message id", EncodeRequestDatagram(Packed().bytes(), 1234), -303},
        {"the service's other id",
         EncodeRequestDatagram(Packed().bytes(), kProcessContainersRequestID + 1), -303},
    };
    std::string why;
    auto client = UpcallClient::connect(upcallSocket(), &why);
    ASSERT_TRUE(client) << why;
    for (const Case& c : cases) {
        auto bytes = client->call(c.datagram, std::chrono::seconds(10), &why);
        ASSERT_TRUE(bytes) << c.what << ": " << why;
        auto reply = DecodeReplyDatagram(*bytes, &why);
        ASSERT_TRUE(reply) << c.what << ": " << why;
        EXPECT_EQ(reply->returnCode, c.code) << c.what;
        const auto id = static_cast<int32_t>(LoadU32(c.datagram.data() + kOffsetID));
        EXPECT_EQ(reply->id, id + kReplyIDOffset) << c.what;
    }
    // Still serving, on this connection and through the request socket.
    auto bytes = client->call(valid, std::chrono::seconds(10), &why);
    ASSERT_TRUE(bytes) << why;
    auto reply = DecodeReplyDatagram(*bytes, &why);
    ASSERT_TRUE(reply) << why;
    EXPECT_EQ(reply->returnCode, 0);
    EXPECT_FALSE(reply->answer.empty());
    EXPECT_EQ(
        ask(admin_,
            R"({"Command": 0, "Identifier": "com.ostrea.test.app", "ContainerClass": 2, "CreateIfNecessary": true})"),
        TarnSuccess);
}

}  // namespace
}  // namespace tarn
