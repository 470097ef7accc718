// One libFuzzer program per target; FUZZ_TARGET names the entry point.
#include "FuzzTargets.h"

#include "engine/CTqovixMainFrame.h"

CTqovixMainFrame* g_pMainFrame = nullptr;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    // A broken property is a finding like a crash: trap, so that libFuzzer keeps the input.
    if (fuzztarget::FUZZ_TARGET(data, size) != 0) {
        __builtin_trap();
    }
    return 0;
}
