#pragma once
// One end of a Duct stream socket, for tests on either side of the wire: a
// client of the daemon, or the daemon that a client library talks to. It
// writes whatever it is told (any kind, any length, broken payloads), reads
// frames with a timeout and tells when the other end closed. It shares only
// the frame header and the codec with the transport under test.

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/fd/UniqueFd.h"
#include "platform/value/Value.h"
#include "protocol/WireKeys.h"

namespace qmtest {

struct Frame {
    std::uint32_t kind = 0;
    std::uint64_t id = 0;
    qm::Value body;
};

class FramePeer {
public:
    explicit FramePeer(qm::UniqueFd socket) : socket_(std::move(socket)) {}
    // Connects to a listening socket; not connected() when nobody listens.
    explicit FramePeer(const std::string& socketPath);
    static bool canConnect(const std::string& socketPath);
    // A socket listening at the path, and the next connection it takes.
    static qm::UniqueFd listenAt(const std::string& socketPath);
    static FramePeer accept(const qm::UniqueFd& listener);

    bool connected() const { return socket_.valid(); }
    int fd() const { return socket_.get(); }

    // A message frame with the next id (returned), or a reply to an id.
    std::uint64_t send(const qm::Value& message);
    bool reply(std::uint64_t id, const qm::Value& body);
    // Bytes as they are; false when the socket refused them.
    bool sendBytes(const qm::Bytes& bytes);

    // The next frame, or nothing on timeout, on a closed connection or on a
    // payload that does not decode.
    std::optional<Frame> receive(std::chrono::milliseconds timeout = std::chrono::seconds(5));
    // Sends a message and waits for the body of its reply.
    std::optional<qm::Value> roundTrip(const qm::Value& message, std::chrono::milliseconds timeout = std::chrono::seconds(5));
    // A request at the current version (unless it names one) and its reply;
    // null, and a test failure, when none comes.
    qm::Value ask(qm::Dictionary request);
    // True when the other end closed within the timeout (what it still sent
    // is read and dropped).
    bool waitForClose(std::chrono::milliseconds timeout = std::chrono::seconds(5));
    void close() { socket_.reset(); }

private:
    bool readExactly(std::uint8_t* into, std::size_t size, std::chrono::steady_clock::time_point deadline);

    qm::UniqueFd socket_;
    std::uint64_t nextId_ = 1;
};

// The 16 header bytes, and a whole frame around a raw payload, for frames
// that the codec would never write.
qm::Bytes frameHeader(std::uint32_t payloadLength, std::uint32_t kind, std::uint64_t id);
qm::Bytes rawFrame(std::string_view payload, std::uint32_t kind = 1, std::uint64_t id = 1);

// Builds a request dictionary from key/value pairs; the daemon's no-op
// request at a version; a reply's "errorcode" and "error".
qm::Value request(std::initializer_list<qm::Dictionary::Entry> entries);
qm::Value bulk(std::uint64_t version = wire::kCurrentVersion);
std::optional<std::uint64_t> errorCode(const qm::Value& reply);
std::string errorText(const qm::Value& reply);

}  // namespace qmtest
