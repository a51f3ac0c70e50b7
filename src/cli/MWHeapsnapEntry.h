#pragma once

/// memweight-heapsnap: writes the memory of a live process to a file. The exit status: 0, or 1 after a
/// sentence on standard error that says what is wrong; no file is then left behind and none is changed.
int MWHeapsnapMain(int argc, char* const argv[]);
