#pragma once

#include <optional>
#include <string>

inline constexpr const char* MWMemweightError = "MWMemweightError";

/// Why a whole operation failed: the domain says which numbering `code` belongs to. `description` is what
/// the user is told; an error without one is told by its consequence alone (usage text, exit status).
struct MWError {
    std::string domain;
    int code = 0;
    std::optional<std::string> description;
};
