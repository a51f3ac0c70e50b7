#include "platform/MWPhysMemweightSwitch.h"

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstdio>

#include "platform/MWHostInterface.h"

namespace {

enum class State : uint8_t { unknown, off, on };
std::atomic<State> gState = State::unknown;

State readFromHost() {
    int32_t value = 0;
    if (MWHostInterface::current().sysctlSelfRegionMemweight(value) != 0) {
        if (errno != ENOENT) {
            std::perror("Unable to retrieve status of physical memweight data collection");
        }
        value = 0;
    }
    return value != 0 ? State::on : State::off;
}

}  // namespace

bool MWPhysMemweightSwitch::isOn() {
    State state = gState.load();
    if (state == State::unknown) {
        state = readFromHost();
        gState.store(state);
    }
    return state == State::on;
}

void MWPhysMemweightSwitch::set(bool on) {
    if (MWHostInterface::current().setSysctlSelfRegionMemweight(on ? 1 : 0) != 0 && errno != ENOENT) {
        std::perror("Unable to configure physical memweight data collection");
    }
    gState.store(State::unknown);
}
