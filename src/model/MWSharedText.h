#pragma once

#include <memory>
#include <string>

/// An immutable text with several holders.
using MWSharedText = std::shared_ptr<const std::string>;
