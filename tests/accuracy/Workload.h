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
        std::optional<uid_t> user = {};  ///< runs as this user, without any capability
        bool hasRandomAddresses = true;  ///< as every program has them, unless told otherwise
    };

    /// `scenario` is its name and its arguments, separated by blanks.
    explicit Workload(const std::string& scenario) : Workload(scenario, Conditions{}) {}
    Workload(std::string scenario, const Conditions& conditions);
    ~Workload();
    Workload(const Workload&) = delete;
    Workload& operator=(const Workload&) = delete;

    pid_t pid(const std::string& name) const { return _pids.at(name); }
    const std::map<std::string, pid_t>& names() const { return _pids; }
    std::vector<pid_t> pids() const;

private:
    void _readReports();
    void _end();

    pid_t _leader = -1;
    int _socket = -1;  ///< to standard input and output of all processes; they end when it is shut down
    std::map<std::string, pid_t> _pids;
};

/// An ordinary user.
inline constexpr uid_t kNobody = 65534;

/// Gives up root for good: user and group `user`, no groups, no capabilities; the process can still look at
/// itself.
void becomeUser(uid_t user);
