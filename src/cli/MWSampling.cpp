#include "cli/MWSampling.h"

#include <fmt/printf.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <utility>

#include "platform/MWHostInterface.h"
#include "process/MWUserProcess.h"

namespace {

constexpr double kNanosecondsPerSecond = 1e9;

/// The longest interval is some 146 years.
uint64_t nanosecondsOf(double seconds) {
    constexpr double kMost = 0x1p62;
    return static_cast<uint64_t>(std::clamp(seconds * kNanosecondsPerSecond, 1.0, kMost));
}

double secondsOf(uint64_t nanoseconds) {
    return static_cast<double>(nanoseconds) / kNanosecondsPerSecond;
}

/// Whether the kernel charges the process what it did when `earlier` was measured. The objects can stand for
/// two processes that had one pid.
bool isUnchanged(const MWProcess& earlier, const MWProcess& now) {
    const auto* before = dynamic_cast<const MWUserProcess*>(&earlier);
    const auto* after = dynamic_cast<const MWUserProcess*>(&now);
    return before != nullptr && after != nullptr && before->phys_memweight() != 0 &&
           before->phys_memweight() == after->phys_memweight() && before->isSameProcess(*after) &&
           before->canBeAnalyzedAgain() && before->hiddenFromDisplay() == after->hiddenFromDisplay();
}

/// Puts the unchanged ones in the place of the new ones: they are gathered already.
void carryOver(const MWProcessList& earlier, MWTargetMap& targets) {
    for (const auto& process : earlier) {
        const auto target = targets.find(process->asNumber());
        if (target != targets.end() && isUnchanged(*process, *target->second)) {
            target->second = process;
        }
    }
}

}  // namespace

MWSampling::MWSampling(MWMemweightArgs& args, const Formatters& formatters)
    : _args(args),
      _formatters(formatters),
      _interval(nanosecondsOf(args.sampleInterval())),
      _leeway(std::min(_interval, nanosecondsOf(1)) / 2),
      _analysisQueue("org.memweight.memweight.sample-analysis", QOS_CLASS_UTILITY),
      _timerQueue("org.memweight.memweight.sample-timer", QOS_CLASS_USER_INITIATED) {}

bool MWSampling::run() {
    MWHostInterface& host = MWHostInterface::current();
    for (const auto& formatter : _formatters) {
        formatter->configureForMultipleOutputs();
    }
    _timer = host.makeTimer(_timerQueue, [this](uint64_t fires) { _fire(fires); });
    if (_timer == nullptr) {
        std::perror("memweight: no timer for sampling");
        return false;
    }
    _lastFire = host.uptimeNanoseconds();
    _timer->arm({.firstAfter = 0, .interval = _interval, .leeway = _leeway});
    const auto interrupt = MWMemweight::installCancelHandler([this] { _stop("\nStopping...\n"); });
    fmt::fprintf(stderr, "Sampling at %.3gs interval... (<ctrl-c> to stop)\n", _args.sampleInterval());
    _done.acquire();
    std::fputs("Analyzing and writing output...\n", stderr);
    interrupt->cancel();
    _analysisQueue.sync([] {});
    return true;
}

void MWSampling::_fire(uint64_t fires) {
    const uint64_t now = MWHostInterface::current().uptimeNanoseconds();
    _keepUp(fires, now);
    _lastFire = now;
    _sample();
}

// One late sample is no trend.
void MWSampling::_keepUp(uint64_t fires, uint64_t now) {
    if (fires < 2 || std::exchange(_isFirstOverrun, false)) {
        return;
    }
    const uint64_t elapsed = now - _lastFire;
    if (elapsed <= _interval) {
        return;
    }
    constexpr double kRoom = 1.1;
    _interval += static_cast<uint64_t>(static_cast<double>(elapsed - _interval) * kRoom);
    fmt::fprintf(stderr, "WARNING: Unable to keep up with sampling interval. Increasing interval to %.3gs.\n",
                 secondsOf(_interval));
    _timer->arm({.firstAfter = _interval, .interval = _interval, .leeway = _leeway});
}

void MWSampling::_sample() {
    constexpr size_t kMostWaiting = 8;
    if (_analysisQueue.waiting() >= kMostWaiting) {
        if (std::exchange(_isFirstLeftOut, false)) {
            std::fputs("WARNING: Unable to write samples as fast as they are taken. Leaving some out.\n",
                       stderr);
        }
        return;
    }
    MWProcessList processes;
    for (const auto& [pid, process] : _resolveTargets()) {
        processes.push_back(process);
    }
    const auto memweight = std::make_shared<MWMemweight>(std::move(processes));
    memweight->setQualityOfService(QOS_CLASS_USER_INITIATED);
    {
        const std::lock_guard lock(_currentMutex);
        _current = memweight;
    }
    if (_isStopping || memweight->gatherData()) {
        return;
    }
    _analysisQueue.async([this, memweight] { _print(*memweight); });
}

MWTargetMap MWSampling::_resolveTargets() {
    MWTargetMap targets = _args.targetProcesses().targets.value_or(MWTargetMap());
    std::shared_ptr<MWMemweight> earlier;
    {
        const std::lock_guard lock(_currentMutex);
        earlier = _current.lock();
    }
    if (earlier != nullptr) {
        carryOver(earlier->processes(), targets);
    }
    return targets;
}

void MWSampling::_print(MWMemweight& memweight) {
    memweight.analyzeData();
    for (const auto& formatter : _formatters) {
        memweight.addOutputFormatter(*formatter);
    }
    memweight.printOutputVerbose({.verbose = _args.spanlistLikeOutput(), .summarize = _args.summarize()});
    errno = 0;
    if (std::fflush(stdout) != 0 || std::ferror(stdout) != 0) {
        // A reader that has seen enough is no failure.
        if (errno != 0 && errno != EPIPE) {
            std::perror("memweight: standard output");
        }
        _stop("");
    }
}

void MWSampling::_stop(const char* message) {
    const bool isFirst = !_isStopping.exchange(true);
    _timer->cancel();
    {
        const std::lock_guard lock(_currentMutex);
        if (const auto current = _current.lock()) {
            current->cancel();
        }
    }
    std::fputs(message, stderr);
    _timerQueue.sync([] {});
    if (isFirst) {
        _done.release();
    }
}
