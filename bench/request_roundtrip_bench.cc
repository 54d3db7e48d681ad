// Request round trip: what Conduit and the daemon add on top of the socket.
//
//   (a) floor: the bytes of one encoded request record echoed over a bare
//       SOCK_SEQPACKET socket pair by another process: the daemon is one, and
//       each hop to another process switches address space, which a thread
//       of our own does not (that in-process echo is printed too, as "thread");
//   (b) the same request ({"Command": 27}, answered with "ReplyError"
//       TarnErrorInvalidCommand) through a running tarnkeeperd in a scratch
//       root;
//   (c) for reference, the same request through an in-process Conduit
//       listener that only echoes: what Conduit alone costs.
//
// Rounds of (a) and (b) alternate back to back so that both see the same
// machine state; medians and the ratio b/a are printed, once with everything
// pinned to one CPU and once unpinned. (b) is skipped with a message when the
// daemon does not answer.
//
//   request_roundtrip_bench [ROUNDS] [OPS_PER_ROUND]
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "Daemon/TarnError.h"
#include "Platform/Conduit.h"
#include "Platform/ConduitHarness.h"
#include "Platform/ConduitWire.h"
#include "Platform/PlatformLog.h"
#include "bench/BenchSupport.h"

using namespace tarn;
using namespace tarn::conduit;
using namespace tarn::bench;
using namespace std::chrono_literals;

namespace {

PlistValue command27() {
    PlistDict d;
    d["Command"] = PlistValue(uint64_t{27});
    return PlistValue(std::move(d));
}

bool daemonAnswers(Client& client, std::string* why) {
    auto reply = client.sendSync(command27(), 5000ms, why);
    if (!reply) return false;
    const PlistValue* e = reply->find("ReplyError");
    if (!e || e->asUInt64() != uint64_t{TarnErrorInvalidCommand}) {
        *why = "unexpected reply " + reply->description();
        return false;
    }
    return true;
}

struct Result {
    double echoUs = 0;
    double threadEchoUs = 0;
    double conduitUs = 0;
    double daemonUs = 0;
    bool daemon = false;
};

void timeRequests(Client& client, int ops, std::vector<double>* lat) {
    std::string why;
    for (int i = 0; i < ops; ++i) {
        const auto t0 = Clock::now();
        if (!client.sendSync(command27(), 5000ms, &why)) {
            std::fprintf(stderr, "round trip failed: %s\n", why.c_str());
            std::exit(1);
        }
        lat->push_back(std::chrono::duration<double, std::micro>(Clock::now() - t0).count());
    }
}

void timeEcho(harness::SeqpacketEcho& echo, const std::vector<uint8_t>& record, int ops,
              std::vector<double>* lat) {
    std::vector<uint8_t> back;
    for (int i = 0; i < ops; ++i) {
        const auto t0 = Clock::now();
        if (!echo.roundTrip(record, &back)) {
            std::fprintf(stderr, "echo failed\n");
            std::exit(1);
        }
        lat->push_back(std::chrono::duration<double, std::micro>(Clock::now() - t0).count());
    }
}

Result measure(harness::SeqpacketEcho& echo, harness::SeqpacketEcho& threadEcho,
               Client& conduitEcho, Client* daemon, const std::vector<uint8_t>& record,
               int rounds, int ops) {
    std::vector<double> echoLat, threadLat, conduitLat, daemonLat;
    for (int r = 0; r < rounds; ++r) {
        timeEcho(echo, record, ops, &echoLat);
        timeEcho(threadEcho, record, ops, &threadLat);
        timeRequests(conduitEcho, ops, &conduitLat);
        if (daemon) timeRequests(*daemon, ops, &daemonLat);
    }
    return {medianUs(echoLat), medianUs(threadLat), medianUs(conduitLat), medianUs(daemonLat),
            daemon != nullptr};
}

void report(const char* config, const Result& r) {
    std::printf("%-9s (a) echo %6.2f us (thread %5.2f) | (c) conduit echo %6.2f us (x%.2f)",
                config, r.echoUs, r.threadEchoUs, r.conduitUs,
                r.echoUs > 0 ? r.conduitUs / r.echoUs : 0.0);
    if (r.daemon)
        std::printf(" | (b) daemon %7.2f us  ratio b/a %.2f\n", r.daemonUs,
                    r.echoUs > 0 ? r.daemonUs / r.echoUs : 0.0);
    else
        std::printf(" | (b) daemon skipped\n");
}

}  // namespace

int main(int argc, char** argv) {
    const int rounds = argc > 1 ? std::max(1, std::atoi(argv[1])) : 20;
    const int ops = argc > 2 ? std::max(1, std::atoi(argv[2])) : 200;
    PlatformLogSetQuiet(true);

    // The exact record Conduit sends for the request.
    std::vector<uint8_t> body;
    std::string why;
    if (!EncodeBody(command27(), &body, &why)) return 1;
    RecordHeader h;
    h.flags = kFlagRequest;
    h.messageId = 1;
    const std::vector<uint8_t> record = BuildRecords(h, body).front();

    const std::string root = makeScratchRoot();
    if (root.empty()) {
        std::fprintf(stderr, "cannot make a scratch root\n");
        return 1;
    }
    harness::ChildProcess::Options opts;
    opts.stdoutPath = root + "/daemon.out";
    opts.stderrPath = root + "/daemon.err";
    auto daemon = harness::ChildProcess::spawn(
        {TARN_BINARY_DIR "/tarnkeeperd", "--root", root}, opts, &why);
    std::unique_ptr<Client> client;
    const std::string socket = root + "/run/com.ostrea.tarnkeeperd.socket";
    const auto deadline = Clock::now() + 15s;
    while (daemon && Clock::now() < deadline) {
        client = Client::connect(socket, &why);
        if (client && daemonAnswers(*client, &why)) break;
        client.reset();
        if (daemon->wait(50ms)) {
            why = "the daemon exited";
            break;
        }
    }
    if (!client)
        std::printf("daemon round trip skipped: %s (see %s)\n",
                    daemon ? why.c_str() : "cannot start " TARN_BINARY_DIR "/tarnkeeperd",
                    opts.stderrPath.c_str());

    // (c): a Conduit listener in this process that answers like the daemon would.
    auto echoQueue = DispatchQueue::createSerial("bench.conduit-echo");
    auto echoListener = Listener::createAtPath(root + "/run/bench.echo.socket", echoQueue, &why);
    if (!echoListener) {
        std::fprintf(stderr, "conduit echo listener: %s\n", why.c_str());
        return 1;
    }
    echoListener->setNewConnectionHandler([](const ConnectionRef& c) {
        std::weak_ptr<Connection> weak = c;
        c->setEventHandler([weak](const Event& e) {
            auto c = weak.lock();
            if (e.kind != Event::Kind::Message || !c) return;
            auto reply = e.message->createReply();
            if (!reply) return;
            reply->body().set("ReplyError", PlistValue(uint64_t{TarnErrorInvalidCommand}));
            c->send(reply);
        });
        c->resume();
    });
    echoListener->resume();
    auto conduitEcho = Client::connect(echoListener->socketPath(), &why);
    if (!conduitEcho) {
        std::fprintf(stderr, "conduit echo connect: %s\n", why.c_str());
        return 1;
    }

    std::printf("request {\"Command\": 27}: %zu-byte record, %d rounds x %d ops each side\n",
                record.size(), rounds, ops);
    const std::vector<int> all = harness::AllowedCpus();
    {
        // Pinned: every thread of ours (the echo thread starts after), and of the daemon.
        if (!harness::SetProcessCpus(::getpid(), {all.front()}, &why))
            std::fprintf(stderr, "%s\n", why.c_str());
        if (client && !harness::SetProcessCpus(daemon->pid(), {all.front()}, &why))
            std::fprintf(stderr, "%s\n", why.c_str());
        auto echo = harness::SeqpacketEcho::start(&why, /*otherProcess=*/true);
        auto threadEcho = harness::SeqpacketEcho::start(&why);
        if (!echo || !threadEcho) return 1;
        measure(*echo, *threadEcho, *conduitEcho, client.get(), record, 1, ops);  // warm-up
        report("pinned", measure(*echo, *threadEcho, *conduitEcho, client.get(), record, rounds, ops));
    }
    {
        (void)harness::SetProcessCpus(::getpid(), all, &why);  // back to every CPU we had
        if (client) (void)harness::SetProcessCpus(daemon->pid(), all, &why);
        auto echo = harness::SeqpacketEcho::start(&why, /*otherProcess=*/true);
        auto threadEcho = harness::SeqpacketEcho::start(&why);
        if (!echo || !threadEcho) return 1;
        measure(*echo, *threadEcho, *conduitEcho, client.get(), record, 1, ops);
        report("unpinned", measure(*echo, *threadEcho, *conduitEcho, client.get(), record, rounds, ops));
    }

    client.reset();
    conduitEcho.reset();
    echoListener->cancel();
    if (daemon) daemon->terminate();
    std::error_code ec;
    std::filesystem::remove_all(root, ec);
    return 0;
}
