// One libFuzzer program per target; FUZZ_TARGET names the entry point.
#include "FuzzTargets.h"

#include "engine/CTqovixMainFrame.h"

CTqovixMainFrame* g_pMainFrame = nullptr;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    return fuzztarget::FUZZ_TARGET(data, size);
}
