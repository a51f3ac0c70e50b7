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

// An ignored signal never reaches a signalfd, so SIGINT is blocked instead: it neither ends the process nor
// gets lost. Threads made from now on inherit the mask, which is why the source must be made before the
// threads whose work an interrupt is to outlive.
MWInterruptSource::MWInterruptSource(std::function<void()> handler) : _handler(std::move(handler)) {
    const sigset_t set = interruptSet();
    pthread_sigmask(SIG_BLOCK, &set, nullptr);
    _signals = signalfd(-1, &set, SFD_CLOEXEC);
    _cancelled = eventfd(0, EFD_CLOEXEC);
    _thread = std::thread([this] { _deliver(); });
}

MWInterruptSource::~MWInterruptSource() {
    cancel();
}

void MWInterruptSource::_deliver() {
    std::array<pollfd, 2> waits = {{{_cancelled, POLLIN, 0}, {_signals, POLLIN, 0}}};
    while (poll(waits.data(), waits.size(), -1) >= 0 || errno == EINTR) {
        if ((waits[0].revents & POLLIN) != 0) {
            return;
        }
        signalfd_siginfo signal = {};
        if ((waits[1].revents & POLLIN) != 0 && read(_signals, &signal, sizeof(signal)) == sizeof(signal)) {
            _handler();
        }
    }
}

void MWInterruptSource::cancel() {
    if (!_thread.joinable()) {
        return;
    }
    eventfd_write(_cancelled, 1);
    _thread.join();
    close(_signals);
    close(_cancelled);
    std::signal(SIGINT, SIG_DFL);
    const sigset_t set = interruptSet();
    pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
}
