#pragma once
// A bare client of the daemon's socket for tests: writes any bytes, reads
// reply frames with a timeout, and tells when the daemon closed the
// connection. Independent of the client library on purpose.

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include "platform/fd/UniqueFd.h"
#include "platform/value/Value.h"

namespace qmtest {

struct ReplyFrame {
    std::uint32_t kind = 0;
    std::uint64_t id = 0;
    qm::Value body;
};

class RawClient {
public:
    explicit RawClient(const std::string& socketPath);
    static bool tryConnect(const std::string& socketPath);

    bool connected() const { return socket_.valid(); }
    int fd() const { return socket_.get(); }

    // Sends a message frame with the CBOR encoding of the value.
    std::uint64_t send(const qm::Value& message);
    void sendWithId(std::uint64_t id, const qm::Value& message);
    // Sends bytes as they are; false when the socket refused them.
    bool sendBytes(const std::string& bytes);
    bool sendBytes(const qm::Bytes& bytes);

    // The next reply frame, or nothing on timeout or when the connection ends.
    std::optional<ReplyFrame> receive(std::chrono::milliseconds timeout = std::chrono::seconds(5));
    // Sends and waits for the reply's body (with the matching id).
    std::optional<qm::Value> roundTrip(const qm::Value& message,
                                       std::chrono::milliseconds timeout = std::chrono::seconds(5));
    // True when the peer closed the connection within the timeout (pending
    // replies are read and dropped).
    bool waitForClose(std::chrono::milliseconds timeout = std::chrono::seconds(5));
    void close() { socket_.reset(); }

private:
    bool readExactly(std::uint8_t* into, std::size_t size, std::chrono::steady_clock::time_point deadline);

    qm::UniqueFd socket_;
    std::uint64_t nextId_ = 1;
};

// Builds a request dictionary from key/value pairs.
qm::Value request(std::initializer_list<qm::Dictionary::Entry> entries);
// The reply's "errorcode" and "error", for compact assertions.
std::optional<std::uint64_t> errorCode(const qm::Value& reply);
std::string errorText(const qm::Value& reply);

}  // namespace qmtest
