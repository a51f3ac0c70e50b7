#pragma once

#include <cstdint>
#include <vector>

#include "platform/linux/BackedVma.h"
#include "platform/linux/LinuxImages.h"
#include "platform/linux/RegionNames.h"

/// The allocation tag of each mapping, from its path, its flags and its neighbours; in the same order.
/// `images` are those of the same mappings.
std::vector<uint32_t> tagsForVmas(const std::vector<BackedVma>& vmas, const LinuxImages& images,
                                  RegionNames& names);
