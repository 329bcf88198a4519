#pragma once
// Open-transaction counting: while any OpenTransaction exists the process is
// not idle. Peer connections and plug-in holds each keep one. (A connected
// client counts here, unlike on the design's home platform: exiting under a
// connected client would break its connection.)

#include <cstddef>

namespace qm::duct {

class OpenTransaction {
public:
    OpenTransaction() noexcept;
    ~OpenTransaction();
    OpenTransaction(const OpenTransaction&) = delete;
    OpenTransaction& operator=(const OpenTransaction&) = delete;
};

std::size_t openTransactionCount() noexcept;

}  // namespace qm::duct
