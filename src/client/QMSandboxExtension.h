#pragma once
// The holder of one sandbox extension token a process received, and of the
// handle of its consumption: while consuming, the process may read the
// token's path. Teardown ends the consumption. Use from one thread at a time.

#include <atomic>
#include <cstdint>
#include <string>

class QMSandboxExtension {
public:
    explicit QMSandboxExtension(std::string token) : token_(std::move(token)) {}  // initWithExtension:
    ~QMSandboxExtension() { expel(); }
    QMSandboxExtension(const QMSandboxExtension&) = delete;
    QMSandboxExtension& operator=(const QMSandboxExtension&) = delete;

    // Begins the consumption unless there is one. Whatever handle the
    // service answers, a failure (-1) included, is kept and handed back by expel.
    void consume();
    // Ends the consumption, if there is one.
    void expel();

    const std::string& token() const noexcept { return token_; }
    std::int64_t handle() const noexcept { return handle_.load(); }

private:
    const std::string token_;
    std::atomic<std::int64_t> handle_{0};
};
