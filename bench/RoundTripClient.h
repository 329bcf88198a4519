#pragma once
// The one client used against both qmd and the echo server, so that their
// ratio measures the servers: a blocking Unix socket that writes one request
// frame and reads one whole reply frame, with no decoding and no queues.

#include <optional>
#include <string>

#include "platform/fd/UniqueFd.h"
#include "platform/value/Value.h"

class RoundTripClient {
public:
    static std::optional<RoundTripClient> connect(const std::string& socketPath);

    // Sends the frame (its id is renumbered) and reads the reply frame; the
    // reply's payload, or nothing when the connection broke.
    const qm::Bytes* roundTrip(qm::Bytes& frame);

private:
    explicit RoundTripClient(qm::UniqueFd socket) : socket_(std::move(socket)) {}
    qm::UniqueFd socket_;
    qm::Bytes in_;
    qm::Bytes payload_;
    std::uint64_t nextId_ = 1;
};
