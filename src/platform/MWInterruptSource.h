#pragma once

#include <functional>
#include <thread>

/// Delivers SIGINT to a handler on a thread of its own, outside signal context, once for each interrupt.
/// From its creation on SIGINT no longer ends the process. `cancel` (or the destructor) stops the delivery;
/// when it returns the handler is not running and will not run again, and SIGINT has its default action.
/// Where no descriptors are left, nothing is delivered and SIGINT keeps its default action.
class MWInterruptSource {
public:
    explicit MWInterruptSource(std::function<void()> handler);
    ~MWInterruptSource();
    MWInterruptSource(const MWInterruptSource&) = delete;
    MWInterruptSource& operator=(const MWInterruptSource&) = delete;

    void cancel();

private:
    void _deliver();

    std::function<void()> _handler;
    int _signals = -1;    ///< signalfd
    int _cancelled = -1;  ///< eventfd
    std::thread _thread;
};
