// Hostile and greedy clients cost their own connection, never the daemon's
// service to others.

#include <sys/socket.h>

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <thread>

#include "platform/duct/Frame.h"
#include "support/DaemonProcess.h"
#include "support/RawClient.h"

using qmtest::DaemonProcess;
using qmtest::RawClient;
using qmtest::errorCode;
using qmtest::request;

namespace {

qm::Value bulk() {
    return request({{"request", "bulk"}, {"version", std::uint64_t{3}}});
}

std::string header(std::uint32_t length, std::uint32_t kind, std::uint64_t id) {
    std::uint8_t bytes[16];
    qm::duct::writeFrameHeader(bytes, {length, kind, id});
    return std::string(reinterpret_cast<char*>(bytes), 16);
}

std::string frame(const std::string& payload, std::uint32_t kind = 1) {
    return header(static_cast<std::uint32_t>(payload.size()), kind, 1) + payload;
}

void expectServed(DaemonProcess& daemon) {
    RawClient other(daemon.socketPath());
    auto reply = other.roundTrip(bulk());
    ASSERT_TRUE(reply);
    EXPECT_FALSE(errorCode(*reply).has_value());
}

TEST(Connections, BrokenFramesCloseOnlyTheirOwnConnection) {
    DaemonProcess daemon;
    RawClient bystander(daemon.socketPath());
    struct Case {
        const char* what;
        std::string bytes;
    };
    const Case cases[] = {
        {"header over 16 MiB, no payload sent", header(16 * 1024 * 1024 + 1, 1, 1)},
        {"reply kind from a client", frame("\xa0", 2)},
        {"unknown kind", frame("\xa0", 7)},
        {"not CBOR at all", frame("\xff\xff\xff")},
        {"trailing bytes", frame(std::string("\xa0\x00", 2))},
        {"indefinite map", frame("\xbf\xff")},
        {"integer map key", frame("\xa1\x01\x02")},
        {"duplicate key", frame("\xa2\x61k\x01\x61k\x02")},
        {"invalid UTF-8", frame("\xa1\x61k\x62\xc3\x28")},
        {"unknown tag", frame("\xa1\x61k\xc2\x41\x01")},
        {"truncated item", frame("\xa1\x61k")},
        {"100000 nested arrays", frame(std::string(100000, '\x81') + "\x80")},
    };
    for (const auto& c : cases) {
        RawClient attacker(daemon.socketPath());
        ASSERT_TRUE(attacker.sendBytes(c.bytes)) << c.what;
        EXPECT_TRUE(attacker.waitForClose()) << c.what;
        ASSERT_TRUE(daemon.running()) << c.what;
        auto reply = bystander.roundTrip(bulk());
        EXPECT_TRUE(reply.has_value()) << c.what;
    }
    EXPECT_TRUE(daemon.waitForLog("connection closed: frame announces 16777217 bytes"));
}

TEST(Connections, APayloadOfExactlySixteenMebibytesIsAccepted) {
    DaemonProcess daemon;
    RawClient client(daemon.socketPath());
    // {"request": "bulk", "version": 3, "x": <bytes>} sized to 16 MiB exactly.
    std::string prefix = "\xa3\x67request\x64" "bulk\x67version\x03\x61x\x5a";
    std::size_t total = 16 * 1024 * 1024;
    std::size_t dataLength = total - prefix.size() - 4;
    std::string payload = prefix;
    for (int shift : {24, 16, 8, 0}) {
        payload += static_cast<char>((dataLength >> shift) & 0xff);
    }
    payload += std::string(dataLength, 'z');
    ASSERT_EQ(payload.size(), total);
    ASSERT_TRUE(client.sendBytes(frame(payload)));
    auto reply = client.receive(std::chrono::seconds(20));
    ASSERT_TRUE(reply);
    EXPECT_FALSE(errorCode(reply->body).has_value());
}

TEST(Connections, AFrameArrivingByteByByteIsServed) {
    DaemonProcess daemon;
    RawClient client(daemon.socketPath());
    auto bytes = qm::duct::encodeFrame(qm::duct::FrameKind::message, 42, bulk());
    ASSERT_TRUE(bytes);
    for (std::uint8_t byte : *bytes) {
        ASSERT_TRUE(client.sendBytes(qm::Bytes{byte}));
        std::this_thread::sleep_for(std::chrono::microseconds(200));
    }
    auto reply = client.receive();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->id, 42u);
}

TEST(Connections, AFloodingClientThatNeverReadsDelaysNobodyElse) {
    DaemonProcess daemon;
    RawClient flooder(daemon.socketPath());
    auto one = qm::duct::encodeFrame(qm::duct::FrameKind::message, 1, request({{"request", "nope"}, {"version", std::uint64_t{3}}}));
    qm::Bytes batch;
    for (int i = 0; i < 1000; ++i) {
        batch.insert(batch.end(), one->begin(), one->end());
    }
    std::atomic<bool> stop{false};
    std::atomic<bool> cutOff{false};
    std::thread flood([&] {
        // Non-blocking, so the thread ends when asked even if the daemon
        // stops reading; a partial send goes on where it stopped.
        std::size_t offset = 0;
        while (!stop.load()) {
            ssize_t n = ::send(flooder.fd(), batch.data() + offset, batch.size() - offset, MSG_DONTWAIT | MSG_NOSIGNAL);
            if (n > 0) {
                offset = (offset + static_cast<std::size_t>(n)) % batch.size();
            } else if (errno == EPIPE || errno == ECONNRESET) {
                cutOff = true;
                return;
            } else {
                std::this_thread::sleep_for(std::chrono::milliseconds(1));
            }
        }
    });
    for (int i = 0; i < 20; ++i) {
        RawClient polite(daemon.socketPath());
        auto reply = polite.roundTrip(bulk(), std::chrono::seconds(10));
        ASSERT_TRUE(reply) << "round " << i;
    }
    // The flood goes on unread: its replies outgrow the backlog bound, and
    // the daemon cuts the flooder off rather than hold them.
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (!cutOff.load() && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    stop = true;
    flood.join();
    EXPECT_TRUE(cutOff.load());
    EXPECT_TRUE(daemon.waitForLog("reply backlog over 4 MiB"));
    ASSERT_TRUE(daemon.running());
    expectServed(daemon);
}

TEST(Connections, FiveHundredConcurrentClientsAreServedAndLeaveNoDescriptorBehind) {
    DaemonProcess daemon;
    {
        RawClient warmUp(daemon.socketPath());
        ASSERT_TRUE(warmUp.roundTrip(bulk()));
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    std::size_t before = daemon.openDescriptorCount();
    std::vector<std::unique_ptr<RawClient>> clients;
    for (int i = 0; i < 500; ++i) {
        clients.push_back(std::make_unique<RawClient>(daemon.socketPath()));
        ASSERT_TRUE(clients.back()->connected()) << i;
    }
    for (auto& c : clients) {
        c->send(bulk());
    }
    for (std::size_t i = 0; i < clients.size(); ++i) {
        auto reply = clients[i]->receive(std::chrono::seconds(10));
        ASSERT_TRUE(reply) << i;
        EXPECT_FALSE(errorCode(reply->body).has_value());
    }
    EXPECT_GE(daemon.openDescriptorCount(), before + 500);
    clients.clear();
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    while (daemon.openDescriptorCount() != before && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    EXPECT_EQ(daemon.openDescriptorCount(), before);
}

TEST(Connections, AClientThatHangsUpIsMarkedDead) {
    DaemonProcess daemon(qmtest::withArguments({"-v"}));
    {
        RawClient client(daemon.socketPath());
        ASSERT_TRUE(client.roundTrip(bulk()));
    }
    EXPECT_TRUE(daemon.waitForLog("client " + std::to_string(::getpid()) + " is dead"));
    expectServed(daemon);
}

}  // namespace
