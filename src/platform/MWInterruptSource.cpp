#include "platform/MWInterruptSource.h"

#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <utility>

namespace {

sigset_t interruptSet() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGINT);
    return set;
}

}  // namespace

// Blocked, SIGINT is queued for the signalfd even while it is ignored; ignored, it ends no thread that was
// made before and does not block it.
MWInterruptSource::MWInterruptSource(std::function<void()> handler) : _handler(std::move(handler)) {
    const sigset_t set = interruptSet();
    _signals = signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK);
    _cancelled = eventfd(0, EFD_CLOEXEC);
    if (_signals >= 0 && _cancelled >= 0) {
        pthread_sigmask(SIG_BLOCK, &set, nullptr);
        std::signal(SIGINT, SIG_IGN);
        _thread = std::thread([this] { _deliver(); });
    }
}

MWInterruptSource::~MWInterruptSource() {
    cancel();
    close(_signals);
    close(_cancelled);
}

// What has arrived before the cancellation is delivered.
void MWInterruptSource::_deliver() {
    std::array<pollfd, 2> waits = {{{_cancelled, POLLIN, 0}, {_signals, POLLIN, 0}}};
    while (poll(waits.data(), waits.size(), -1) >= 0 || errno == EINTR) {
        const bool cancelled = (waits[0].revents & POLLIN) != 0;
        signalfd_siginfo signal = {};
        while (read(_signals, &signal, sizeof(signal)) == sizeof(signal)) {
            _handler();
        }
        if (cancelled) {
            return;
        }
    }
}

void MWInterruptSource::cancel() {
    if (!_thread.joinable()) {
        return;
    }
    eventfd_write(_cancelled, 1);
    _thread.join();
    // One that comes between here and there is discarded: it is still ignored when it is unblocked.
    const sigset_t set = interruptSet();
    pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
    std::signal(SIGINT, SIG_DFL);
}
