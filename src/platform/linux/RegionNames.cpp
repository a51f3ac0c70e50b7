#include "platform/linux/RegionNames.h"

#include "platform/MWRegionTags.h"

uint32_t RegionNames::tagForName(std::string_view name) {
    const std::lock_guard lock(_mutex);
    const auto known = _tags.find(name);
    if (known != _tags.end()) {
        return known->second;
    }
    const uint32_t tag = MWTagFirstDynamic + static_cast<uint32_t>(_tags.size());
    if (tag > MWTagLastDynamic) {
        return MWTagNone;
    }
    _tags.emplace(name, tag);
    return tag;
}

std::optional<std::string> RegionNames::nameForTag(uint32_t tag) const {
    const std::lock_guard lock(_mutex);
    for (const auto& [name, itsTag] : _tags) {
        if (itsTag == tag) {
            return name;
        }
    }
    return std::nullopt;
}

uint32_t RegionNames::lastingNumber(uint32_t tag, const ObjectIdentity& identity) const {
    constexpr uint32_t kNamed = 0x80000000;
    const auto name = nameForTag(tag);
    return name ? static_cast<uint32_t>(identity.bytes(*name)) | kNamed : tag;
}
