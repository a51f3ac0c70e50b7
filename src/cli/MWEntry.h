#pragma once

#include <memory>

#include "cli/MWMemweightArgs.h"

class MWMemweight;

/// Takes over what a measurement holds, for a program that ends then: the kernel takes a million regions back
/// at once, piece by piece it would take as long as to analyze them.
using MWKeptUntilExit = std::shared_ptr<MWMemweight>;

/// The program: parses the command line, measures, reports. Returns the exit status, 0 or 1. The host must be
/// installed. The report goes to standard output, every message to standard error.
int MWMemweightMain(int argc, char* const argv[], MWKeptUntilExit* kept = nullptr);

/// The run of a command line that was parsed: one measurement of the processes that it names, or, when there
/// is none, a message and no output file left behind. Returns the exit status.
int MWRunMemweight(MWMemweightArgs& args, MWKeptUntilExit* kept = nullptr);
