#include "model/MWAuxData.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

namespace {

MWAuxDatum sum(int64_t value) {
    return std::make_shared<MWAuxData>(value, true);
}
MWAuxDatum lone(int64_t value) {
    return std::make_shared<MWAuxData>(value, false);
}
MWAuxDataTree tree(MWAuxDataContainer::Elements elements) {
    return std::make_shared<MWAuxDataContainer>(std::move(elements));
}

/// The tree as JSON text, or "none".
std::string text(const MWAuxDatum& datum) {
    return datum == nullptr ? "none" : datum->jsonRepresentation().dump();
}

TEST(MWAuxData, MergesWhatAggregatesAndLeavesOutTheRest) {
    const auto onlyLone = tree({{"a", lone(1)}, {"c", tree({{"d", lone(2)}})}});
    const auto ab = tree({{"a", sum(4)}, {"b", sum(5)}});
    const auto nested = tree({{"a", sum(3)}, {"c", tree({{"d", lone(1)}})}});
    const auto deep = tree({{"c", tree({{"d", sum(8)}, {"e", sum(1)}})}});
    struct Case {
        MWAuxDataTree data;
        MWAuxDataTree with;
        std::string merged;
    };
    const std::vector<Case> cases = {
        {onlyLone, onlyLone, "none"},
        {nested, nullptr, R"({"a":3})"},
        {tree({}), nested, R"({"a":3})"},
        {deep, deep, R"({"c":{"d":16,"e":2}})"},
        // The first one's flag decides, over the whole of a name.
        {ab, onlyLone, R"({"a":5,"b":5})"},
        {onlyLone, ab, R"({"b":5})"},
        {nested, deep, R"({"a":3,"c":{"e":1}})"},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(text(c.data->mergeWithData(c.with.get())), c.merged);
    }
    EXPECT_EQ(text(ab), R"({"a":4,"b":5})");  // inputs stay as they were

    // A sum aggregates again, even over one that does not.
    const auto merged = ab->mergeWithData(onlyLone.get());
    EXPECT_EQ(text(merged->mergeWithData(merged.get())), R"({"a":10,"b":10})");

    EXPECT_DEATH(deep->mergeWithData(tree({{"c", sum(1)}}).get()),
                 "^!datum2 \\|\\| datum1\\.isContainer == datum2\\.isContainer\n$");
    EXPECT_DEATH(tree({{"c", sum(1)}})->mergeWithData(deep.get()), "!datum2 ");
}

}  // namespace
