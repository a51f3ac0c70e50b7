#include "model/MWAuxData.h"

#include <nlohmann/json.hpp>

#include "platform/MWInvariant.h"

nlohmann::json MWAuxData::jsonRepresentation() const {
    return _value;
}

nlohmann::json MWAuxDataContainer::jsonRepresentation() const {
    auto json = nlohmann::json::object();
    for (const auto& [name, element] : _elements) {
        json[name] = element->jsonRepresentation();
    }
    return json;
}

std::shared_ptr<const MWAuxDataContainer> MWAuxDataContainer::mergeWithData(
    const MWAuxDataContainer* data) const {
    static const Elements none;
    const Elements& others = data == nullptr ? none : data->_elements;
    Elements merged;
    const auto store = [&merged](const std::string& name, MWAuxDatum result) {
        if (result != nullptr) {
            merged.emplace(name, std::move(result));
        }
    };
    for (const auto& [name, element] : _elements) {
        const auto other = others.find(name);
        store(name, mergeAuxDatum(element, other == others.end() ? nullptr : other->second));
    }
    for (const auto& [name, element] : others) {
        if (!_elements.contains(name)) {
            store(name, mergeAuxDatum(element, nullptr));
        }
    }
    return merged.empty() ? nullptr : std::make_shared<const MWAuxDataContainer>(std::move(merged));
}

MWAuxDatum MWAuxDataContainer::mergeAuxDatum(const MWAuxDatum& datum, const MWAuxDatum& withDatum) {
    MW_INVARIANT(!withDatum || datum->isContainer() == withDatum->isContainer(),
                 "!datum2 || datum1.isContainer == datum2.isContainer");
    if (datum->isContainer()) {
        const auto& container = static_cast<const MWAuxDataContainer&>(*datum);
        return container.mergeWithData(static_cast<const MWAuxDataContainer*>(withDatum.get()));
    }
    const auto& value = static_cast<const MWAuxData&>(*datum);
    if (!value.shouldAggregate()) {
        return nullptr;
    }
    if (withDatum == nullptr) {
        return datum;
    }
    const auto& other = static_cast<const MWAuxData&>(*withDatum);
    // Unsigned, because figures from a damaged file may overflow.
    const auto sum = static_cast<uint64_t>(value.value()) + static_cast<uint64_t>(other.value());
    return std::make_shared<MWAuxData>(static_cast<int64_t>(sum), true);
}
