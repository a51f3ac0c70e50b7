#pragma once

#include <csignal>

/// Blocks all signals in the calling thread for its lifetime, so that threads made meanwhile never take one:
/// an ignored signal that finds a thread which does not block it is gone, whoever waits for it.
class MWSignalMask {
public:
    MWSignalMask() {
        sigset_t all;
        sigfillset(&all);
        pthread_sigmask(SIG_BLOCK, &all, &_before);
    }
    ~MWSignalMask() { pthread_sigmask(SIG_SETMASK, &_before, nullptr); }
    MWSignalMask(const MWSignalMask&) = delete;
    MWSignalMask& operator=(const MWSignalMask&) = delete;

private:
    sigset_t _before = {};
};
