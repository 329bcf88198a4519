#include "platform/process/TerminationSignals.h"

#include <sys/signalfd.h>
#include <unistd.h>

#include <csignal>

namespace qm {

namespace {

sigset_t terminationSignals() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGTERM);
    sigaddset(&set, SIGINT);
    return set;
}

}  // namespace

void blockTerminationSignals() {
    sigset_t set = terminationSignals();
    ::pthread_sigmask(SIG_BLOCK, &set, nullptr);
}

Result<std::shared_ptr<TerminationSignals>> TerminationSignals::watch(EventLoop& loop, Handler handler) {
    sigset_t set = terminationSignals();
    UniqueFd fd(::signalfd(-1, &set, SFD_NONBLOCK | SFD_CLOEXEC));
    if (!fd) {
        return posixError(errno, "signalfd");
    }
    int raw = fd.get();
    std::shared_ptr<TerminationSignals> signals(new TerminationSignals(std::move(fd), std::move(handler)));
    auto id = loop.add(raw, EPOLLIN, signals);
    if (!id) {
        return id.error();
    }
    return signals;
}

TerminationSignals::TerminationSignals(UniqueFd signalFd, Handler handler)
    : signalFd_(std::move(signalFd)), handler_(std::move(handler)) {}

void TerminationSignals::handleEvents(std::uint32_t /*events*/) {
    signalfd_siginfo info{};
    while (::read(signalFd_.get(), &info, sizeof info) == static_cast<ssize_t>(sizeof info)) {
        handler_(info.ssi_signo == SIGINT ? "SIGINT" : "SIGTERM");
    }
}

}  // namespace qm
