// The exported functions: each forwards to the one engine and turns its internal
// result into the exported code.
#include "api/TqOVIXUtility.h"

#include <new>

#include "bridge/TqovixCodeTable.h"
#include "engine/CTqovixMainFrame.h"

// Defined here, not beside the engine, so that a program holding the internals for other
// work (the command-line tool's inspector) and this library share one engine pointer.
__attribute__((visibility("default"))) CTqovixMainFrame* g_pMainFrame = nullptr;

namespace {

int ConvertToUtilityError(eTqovixErrorCode code) { return TqovixCodes::Exported(code); }

// Nothing thrown inside may reach the host through a C function: out of memory answers 100,
// anything else 190.
template <typename Call>
auto Guarded(Call&& call, decltype(call()) failed) noexcept -> decltype(call())
{
    try {
        return call();
    } catch (const std::bad_alloc&) {
        return failed == 190 ? 100 : failed;
    } catch (...) {
        return failed;
    }
}

}  // namespace

extern "C" {

int TqInitializeOVIX(void)
{
    return Guarded(
        [&] {
            if (g_pMainFrame != nullptr) {
                return 190;
            }
            auto* engine = new (std::nothrow) CTqovixMainFrame;
            if (engine == nullptr) {
                return 100;
            }
            const eTqovixErrorCode result = engine->Initialize();
            if (result != eTqovixSuccess) {
                delete engine;
                return ConvertToUtilityError(result);
            }
            g_pMainFrame = engine;
            return 0;
        },
        190);
}

void TqCloseOVIX(void)
{
    Guarded(
        [&] {
            CTqovixMainFrame* engine = g_pMainFrame;
            if (engine != nullptr) {
                // Close waits until the library's thread has left the engine; only then is it freed.
                engine->Close();
                g_pMainFrame = nullptr;
                delete engine;
            }
            return 0;
        },
        0);
}

int TqGetPropertyOVIX(const char* path)
{
    return Guarded([&] { return g_pMainFrame ? ConvertToUtilityError(g_pMainFrame->GetProperty(path)) : 190; }, 190);
}

int TqSetCallBackNotifyProgressOVIX(int (*callback)(int, int))
{
    return Guarded([&] { return g_pMainFrame ? ConvertToUtilityError(g_pMainFrame->SetCallback(callback)) : 190; },
                   190);
}

int TqExecuteOVIX(const char* sourcePath, const char* destinationPath)
{
    return Guarded(
        [&] {
            return g_pMainFrame ? ConvertToUtilityError(g_pMainFrame->Execute(sourcePath, destinationPath, 0)) : 190;
        },
        190);
}

int TqIsFinishedOVIX(void)
{
    return Guarded([&] { return g_pMainFrame ? ConvertToUtilityError(g_pMainFrame->GetProcessingState()) : 190; }, 190);
}

void TqAbortOVIX(void)
{
    Guarded(
        [&] {
            if (g_pMainFrame != nullptr) {
                g_pMainFrame->Abort();
            }
            return 0;
        },
        0);
}

int TqGetProgressOVIX(int* first, int* second)
{
    return Guarded(
        [&] { return g_pMainFrame ? ConvertToUtilityError(g_pMainFrame->GetProgress(first, second)) : 190; }, 190);
}

}  // extern "C"
