#pragma once

#include <sys/types.h>

#include <map>
#include <optional>
#include <string>
#include <vector>

/// A group of processes of the workload program, see workload/Workload.cpp. Construction returns once all of
/// them have their memory; the destructor returns once all of them have ended.
class Workload {
public:
    struct Conditions {
        std::optional<uid_t> user;       ///< runs as this user, without any capability
        bool hasRandomAddresses = true;  ///< as every program has them, unless told otherwise
    };

    Workload(const std::string& scenario, const std::vector<std::string>& arguments, Conditions conditions);
    Workload(const std::string& scenario, const std::vector<std::string>& arguments)
        : Workload(scenario, arguments, Conditions{}) {}
    ~Workload();
    Workload(const Workload&) = delete;
    Workload& operator=(const Workload&) = delete;

    pid_t pid(const std::string& name) const { return _pids.at(name); }
    const std::map<std::string, pid_t>& names() const { return _pids; }
    /// Of all its processes.
    std::vector<pid_t> pids() const;

private:
    void _readReports();
    void _end();

    pid_t _leader = -1;
    int _reports = -1;
    int _lifeline = -1;  ///< the processes end when it is closed
    std::map<std::string, pid_t> _pids;
};

/// Of the pids of all these.
std::vector<pid_t> pidsOf(std::initializer_list<const Workload*> workloads);

/// Gives up root for good: user and group `user`, no groups, no capabilities; the process can still look at
/// itself.
void becomeUser(uid_t user);
