#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <nlohmann/json_fwd.hpp>
#include <string>
#include <utility>

/// An element of the auxiliary-data tree: a value or a container. Immutable and shared: a merge result may
/// hold the very elements of its inputs.
class MWAuxDataType {
public:
    virtual ~MWAuxDataType() = default;
    virtual bool isContainer() const = 0;
    virtual nlohmann::json jsonRepresentation() const = 0;
};

using MWAuxDatum = std::shared_ptr<const MWAuxDataType>;

/// A number, in bytes for every producer of this program.
class MWAuxData final : public MWAuxDataType {
public:
    /// `shouldAggregate`: whether values of one name are added up over processes.
    /// (initWithValue:shouldAggregate:)
    MWAuxData(int64_t value, bool shouldAggregate) : _aggregate(shouldAggregate), _value(value) {}

    int64_t value() const { return _value; }
    bool shouldAggregate() const { return _aggregate; }
    bool isContainer() const override { return false; }
    nlohmann::json jsonRepresentation() const override;

private:
    bool _aggregate;
    int64_t _value;
};

/// Named elements. Under one name every producer puts either always a container or always a value.
class MWAuxDataContainer final : public MWAuxDataType {
public:
    using Elements = std::map<std::string, MWAuxDatum>;

    explicit MWAuxDataContainer(Elements elements) : _elements(std::move(elements)) {}

    const Elements& elements() const { return _elements; }
    bool isContainer() const override { return true; }
    nlohmann::json jsonRepresentation() const override;

    /// Both trees with aggregating values added up and the others left out; none when nothing is left.
    /// `data` may be none.
    std::shared_ptr<const MWAuxDataContainer> mergeWithData(const MWAuxDataContainer* data) const;
    /// `withDatum` may be none; none when the name is to be left out. A container merged with a value is an
    /// invariant violation.
    static MWAuxDatum mergeAuxDatum(const MWAuxDatum& datum, const MWAuxDatum& withDatum);

private:
    Elements _elements;
};

/// A process's auxiliary data, or none.
using MWAuxDataTree = std::shared_ptr<const MWAuxDataContainer>;
