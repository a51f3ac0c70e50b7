#pragma once

#include <cstddef>

// This program's own memory. Much of what the measurement of a whole system takes is spent on having fresh
// memory mapped and cleared, page by page; so memory is used again, and for larger amounts the kernel is
// asked for large pages. That is advice: where there are none everything works as before.

/// To be called first thing.
void MWPrepareHeap();

/// For memory that is allocated and not yet used.
void MWUseLargePages(const void* begin, size_t bytes);

/// For so many bytes that the calling thread allocates next in small pieces. Does nothing where that is less
/// than a large page.
void MWExpectAllocations(size_t bytes);
