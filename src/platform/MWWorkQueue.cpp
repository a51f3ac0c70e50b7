#include "platform/MWWorkQueue.h"

#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <memory>
#include <semaphore>
#include <thread>
#include <utility>

#include "platform/MWHeap.h"
#include "platform/MWSignalMask.h"
#include "platform/MWWatchedWork.h"

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

MWConcurrentQueue::MWConcurrentQueue(std::string label, uint32_t) : _label(std::move(label)) {}

std::vector<size_t> MWConcurrentQueue::apply(size_t count, std::function<void(size_t)> work) const {
    const size_t threads = MWWatchedWork::threadsFor(count);
    const size_t bytesKept = threads == 0 ? 0 : count * _bytesKeptOfItem / threads;
    const auto setUpThread = [label = _label, bytesKept] {
        nameThread(label);
        MWExpectAllocations(bytesKept);
    };
    return std::make_shared<MWWatchedWork>(count, std::move(work))->run(setUpThread);
}

bool MWConcurrentQueue::hasGivenUp() {
    return MWWatchedWork::hasGivenUp();
}

void MWConcurrentQueue::awaitGivenUp() {
    MWWatchedWork::awaitGivenUp();
}

MWSerialQueue::MWSerialQueue(std::string label, uint32_t qualityOfService) : _label(std::move(label)) {
    const MWSignalMask mask;
    _thread = std::thread([this, qualityOfService] { _run(qualityOfService); });
}

MWSerialQueue::~MWSerialQueue() {
    {
        const std::lock_guard lock(_mutex);
        _ended = true;
    }
    _changed.notify_one();
    _thread.join();
}

void MWSerialQueue::async(std::function<void()> work) {
    {
        const std::lock_guard lock(_mutex);
        _items.push_back(std::move(work));
    }
    _changed.notify_one();
}

void MWSerialQueue::sync(const std::function<void()>& work) {
    std::binary_semaphore done(0);
    async([&] {
        work();
        done.release();
    });
    done.acquire();
}

size_t MWSerialQueue::waiting() const {
    const std::lock_guard lock(_mutex);
    return _items.size();
}

void MWSerialQueue::_run(uint32_t qualityOfService) {
    nameThread(_label);
    applyQualityOfService(qualityOfService);
    // An item is destroyed before the next one is waited for: it can hold much.
    while (std::function<void()> item = _next()) {
        item();
    }
}

/// None at the end of the queue.
std::function<void()> MWSerialQueue::_next() {
    std::unique_lock lock(_mutex);
    _changed.wait(lock, [this] { return _ended || !_items.empty(); });
    if (_items.empty()) {
        return nullptr;
    }
    std::function<void()> item = std::move(_items.front());
    _items.pop_front();
    return item;
}
