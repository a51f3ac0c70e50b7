#include "analysis/MWProcessGroup.h"

#include <algorithm>
#include <typeinfo>

#include "platform/MWInvariant.h"

void MWProcessGroupMinimal::addProcess(const MWProcess& process) {
    const auto place = std::ranges::lower_bound(*_processes, process.pid(), {}, &MWProcess::pid);
    if (place != _processes->end() && (*place)->isEqual(process)) {
        return;
    }
    const auto index = place - _processes->begin();
    if (_processes.use_count() > 1) {
        // An immutable copy holds these members; they must not change under it.
        _processes = std::make_shared<MWProcessSet>(*_processes);
    }
    _processes->insert(_processes->begin() + index, &process);
    _hashValue = (_hashValue * 37) ^ static_cast<uint64_t>(process.hash());
}

std::shared_ptr<MWProcessGroup> MWProcessGroupMinimal::immutableCopy() const {
    auto group = std::make_shared<MWProcessGroup>();
    group->setHashValue(_hashValue);
    group->setProcesses(_processes);
    return group;
}

bool MWProcessGroupMinimal::isEqual(const MWProcessGroupMinimal& other) const {
    return std::ranges::equal(processes(), other.processes(), {}, &MWProcess::pid, &MWProcess::pid);
}

std::string MWProcessGroupMinimal::description() const {
    std::string members;
    for (const MWProcess* process : processes()) {
        members += (members.empty() ? "" : ", ") + process->description();
    }
    return "MWProcessGroup{" + members + "}";
}

void MWProcessGroup::addProcess(const MWProcess&) {
    MW_INVARIANT(false, "Attempt to add process to immutable MWProcessGroup");
}

void MWProcessGroup::addObject(std::shared_ptr<const MWMemoryObject> object) {
    if (!_objects) {
        _objects.emplace();
    }
    _objects->push_back(std::move(object));
}

void MWProcessGroup::attachCachedCategories(Categories categories, uint32_t refcount) {
    MW_INVARIANT(refcount != 0, "Attempt to cache categories that nobody will consume");
    _categoriesRefcount = refcount;
    _categories = std::move(categories);
}

MWProcessGroup::Categories MWProcessGroup::consumeCachedCategories() {
    if (!_categories) {
        return nullptr;
    }
    _categoriesRefcount -= 1;
    return _categoriesRefcount == 0 ? std::exchange(_categories, nullptr) : _categories;
}

bool MWProcessGroup::isEqual(const MWProcessGroupMinimal& other) const {
    return typeid(other) == typeid(MWProcessGroupMinimal) ? MWProcessGroupMinimal::isEqual(other)
                                                          : this == &other;
}
