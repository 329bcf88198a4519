#pragma once
// The yardstick: a raw Unix-socket server that answers each frame it reads
// with a reply frame of a fixed payload (the bytes qmd answers the same
// request with), carrying the request's id. One thread, one epoll loop, no
// decoding: what any server on this transport must at least pay.

#include <string>

#include "ChildProcess.h"
#include "platform/value/Value.h"

// Listens on the path and serves in a forked child until it is killed.
ChildProcess startEchoServer(const std::string& socketPath, const qm::Bytes& replyPayload);
