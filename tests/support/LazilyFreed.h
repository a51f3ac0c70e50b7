#pragma once

#include <cstddef>

/// Once any process has lazily freed memory, a page of this kind can be anywhere, and smaps is read for
/// everything until the machine is started again. Moves the caller into a mount namespace of its own in which
/// /proc/vmstat says that nobody has, so that what it starts from now on measures as on a fresh machine. The
/// number of pages that are covered up; 0 where there is nothing to cover, and nothing is changed then.
///
/// Needs root. Throws std::runtime_error where it cannot be done.
size_t coverLazilyFreed();
