#pragma once

#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/linux/ObjectIdentity.h"

/// Names that programs gave to their own memory (prctl PR_SET_VMA_ANON_NAME), each with one of the tags that
/// have no name of the program's own. Safe for use from several threads.
class RegionNames {
public:
    /// The tag of this name, the same for every process; the untagged tag once all are taken.
    uint32_t tagForName(std::string_view name);
    std::optional<std::string> nameForTag(uint32_t tag) const;
    /// A number for the tag that is the same in every run, which the tags of given names are not.
    uint32_t lastingNumber(uint32_t tag, const ObjectIdentity& identity) const;

private:
    mutable std::mutex _mutex;
    std::map<std::string, uint32_t, std::less<>> _tags;
};
