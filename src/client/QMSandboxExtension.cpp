#include "client/QMSandboxExtension.h"

#include "platform/sandbox/ExtensionConsumption.h"

void QMSandboxExtension::consume() {
    if (handle_.load() == 0) {
        handle_.store(qm::consumeExtension(token_));
    }
}

void QMSandboxExtension::expel() {
    if (std::int64_t handle = handle_.exchange(0); handle != 0) {
        qm::releaseExtension(handle);
    }
}
