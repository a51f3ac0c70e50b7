#include "platform/MWWorkQueue.h"

#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

namespace {

// Utility work yields to what the user does; work that the user waits for runs like everything else.
constexpr int kUtilityNice = 5;

void applyQualityOfService(uint32_t qualityOfService) {
    if (qualityOfService <= QOS_CLASS_UTILITY) {
        // On Linux a nice value belongs to the thread that sets it. Refusal leaves the default priority.
        setpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)), kUtilityNice);
    }
}

// The kernel keeps 15 characters of a thread's name; the end of a label says most.
void nameThread(const std::string& label) {
    constexpr size_t kLongestName = 15;
    const std::string name = label.size() > kLongestName ? label.substr(label.size() - kLongestName) : label;
    pthread_setname_np(pthread_self(), name.c_str());
}

}  // namespace

MWConcurrentQueue::MWConcurrentQueue(std::string label, uint32_t qualityOfService)
    : _label(std::move(label)), _qualityOfService(qualityOfService) {}

void MWConcurrentQueue::apply(size_t count, const std::function<void(size_t)>& work) const {
    std::atomic<size_t> next = 0;
    const auto drain = [&] {
        nameThread(_label);
        applyQualityOfService(_qualityOfService);
        for (size_t index = next++; index < count; index = next++) {
            work(index);
        }
    };
    const size_t width = std::min<size_t>(count, std::max(1U, std::thread::hardware_concurrency()));
    std::vector<std::jthread> threads;
    threads.reserve(width);
    try {
        while (threads.size() < width) {
            threads.emplace_back(drain);
        }
    } catch (const std::system_error&) {
        // No more threads to be had: those that there are do the work, in the last resort this one.
        if (threads.empty()) {
            drain();
        }
    }
}
