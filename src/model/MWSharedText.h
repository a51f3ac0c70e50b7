#pragma once

#include <memory>
#include <string>

/// An immutable text with several holders.
using MWSharedText = std::shared_ptr<const std::string>;

/// The text for holders of something that is never destroyed: nobody counts them, so that threads which copy
/// it all the time do not wait for one another.
inline MWSharedText MWUncountedText(const std::string& text) {
    return {MWSharedText(), &text};
}
