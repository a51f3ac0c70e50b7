#pragma once

/// Prints the invariant's text on standard error and aborts. Kept out of line so that a check costs one
/// branch.
[[noreturn]] void MWInvariantViolated(const char* text);

/// A contract between parts of the program. A violation stops the program at once, in every build: figures
/// that follow from a broken invariant would be wrong without anyone noticing.
#define MW_INVARIANT(condition, text)  \
    do {                               \
        if (!(condition)) {            \
            MWInvariantViolated(text); \
        }                              \
    } while (false)
