#pragma once

/// The run-wide analysis mode: on, each process's physical charge is broken down into its regions; off, dirty
/// memory is what the kernel's VM objects say. The value lives with the host ("vm.self_region_memweight");
/// this is its cache, filled by whichever thread reads first and safe to read from all of them.
class MWPhysMemweightSwitch {
public:
    /// Off without a message where the host has no such switch.
    static bool isOn();
    /// Forgets the cached value, so that the next read asks the host again.
    static void set(bool on);
};
