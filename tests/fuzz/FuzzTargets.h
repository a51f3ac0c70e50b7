#pragma once

#include <span>
#include <string_view>

/// A reader of text that comes from outside, and what it promises for any bytes at all. `read` throws where a
/// promise is not kept. The folder corpus/NAME has texts to begin with, among them those that once showed a
/// fault.
struct FuzzTarget {
    std::string_view name;
    void (*read)(std::string_view text);
};

std::span<const FuzzTarget> fuzzTargets();
