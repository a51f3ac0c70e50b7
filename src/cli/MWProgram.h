#pragma once

/// What every program of this package does before anything else.
void MWPrepareProgram();
