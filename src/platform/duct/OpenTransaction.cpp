#include "platform/duct/OpenTransaction.h"

#include <atomic>

namespace qm::duct {

namespace {
std::atomic<std::size_t> openCount{0};
}

OpenTransaction::OpenTransaction() noexcept {
    openCount.fetch_add(1);
}

OpenTransaction::~OpenTransaction() {
    openCount.fetch_sub(1);
}

std::size_t openTransactionCount() noexcept {
    return openCount.load();
}

}  // namespace qm::duct
