#pragma once

/// What every program of this package does before anything else.
void MWPrepareProgram();

/// What a program answers when it has done everything else. Does not return where threads still wait for the
/// system: nothing that they might touch is destroyed then.
int MWEndProgram(int status);
