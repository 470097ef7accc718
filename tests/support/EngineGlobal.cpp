// Suites built from the internal objects get the engine pointer that the exported
// interface defines in the shared library.
#include "engine/CTqovixMainFrame.h"

CTqovixMainFrame* g_pMainFrame = nullptr;
