// The engine: the processing library's lifetime, the one job at a time with its movie
// controller, result state and progress, and the callbacks the library drives a job through.
#pragma once

#include <atomic>
#include <pthread.h>
#include <utility>
#include <vector>

#include "engine/CTqovixProgressDataControl.h"
#include "movie/CTqovixMovControl.h"

class CTqovixMainFrame {
public:
    using NotifyProgressFunc = int (*)(int, int);

    CTqovixMainFrame() = default;
    ~CTqovixMainFrame();
    CTqovixMainFrame(const CTqovixMainFrame&) = delete;
    CTqovixMainFrame& operator=(const CTqovixMainFrame&) = delete;

    eTqovixErrorCode Initialize();
    // Stops a running job first (its destination is deleted), so that no library
    // thread is left inside this object once it returns.
    void Close();
    // The third argument is reserved.
    eTqovixErrorCode Execute(const char* sourcePath, const char* destinationPath, int reserved);
    void Abort();
    void Abort(eTqovixErrorCode code);
    void CloseSession(eTqovixErrorCode code);
    bool IsProcessing() const;
    eTqovixErrorCode GetProgress(int* first, int* second) const;
    eTqovixErrorCode GetProcessingState() const;
    eTqovixErrorCode SetCallback(NotifyProgressFunc callback);
    eTqovixErrorCode GetProperty(const char* path) const;

    // The processing library's callbacks; they reach the engine through g_pMainFrame.
    static eTqovixErrorCode InputAFInformation(void* buffer, unsigned long* delivered, unsigned long size,
                                               unsigned long skip);
    static eTqovixErrorCode InputAudioLevelInformation(void* buffer, unsigned long* delivered, unsigned long size,
                                                       unsigned long skip);
    static eTqovixErrorCode InputAudio(void* buffer, unsigned long* delivered, unsigned long size,
                                       unsigned long skip);
    static eTqovixErrorCode OutputAudio(const void* data, unsigned long size);
    static void NotifyProgress(unsigned long first, unsigned long second);
    // Collects the processed AF information and finishes the destination.
    eTqovixErrorCode SetAFInformation();

    static void* PostClosethread(void* code);

private:
    enum class eInput { AFInformation, AudioLevelInformation, Audio };
    static eTqovixErrorCode ServeInput(eInput input, void* buffer, unsigned long* delivered, unsigned long size,
                                       unsigned long skip);
    // The data callbacks' common start: an abort request or a job that has ended
    // answers for them; true when the job is running and the callback may serve.
    bool BeginCallback(eTqovixErrorCode& answer);
    eTqovixErrorCode EndCallback(eTqovixErrorCode result);
    void FinishAACJob();
    // Between the pieces of a long copy, where the library has nothing to report: an abort or
    // the host's answer stops the copy, and the progress moves with it.
    eTqovixErrorCode KeepGoing();
    // The progress shown: the library's, held back by a copy still running beside it, so that
    // it reaches its end only with the movie. Recorded, and returned for the host's callback.
    std::pair<unsigned long, unsigned long> RecordProgress();
    void FailStart(eTqovixErrorCode code, const char* sourcePath, const char* destinationPath);
    void StartCloseThread(eTqovixErrorCode code);
    void JoinCloseThreads();

    bool m_bInitialized = false;
    // Set on the host thread, read on the library's: atomic so the hand-over is well defined.
    std::atomic<bool> m_bAbortRequested{false};
    // Read by the library's thread after a job has ended, when the host may already set it.
    std::atomic<NotifyProgressFunc> m_pfnNotifyProgress{nullptr};
    CTqovixProgressDataControl m_progressDataControl;
    // The library's last progress notification (its thread only).
    unsigned long m_soundProgressFirst = 0;
    unsigned long m_soundProgressSecond = 0;
    unsigned long m_shownProgressFirst = 0;
    CTqovixMovControl m_movControl;
    std::vector<char> m_destinationPath;

    // Close threads are joined before the next session opens and before the engine goes,
    // so a late one can neither close the next job's session nor outlive the engine.
    CTqovixCriticalSection m_closeThreadSection;
    std::vector<pthread_t> m_closeThreads;
};

// Defined by the exported interface; the callbacks reach the engine only through it.
extern CTqovixMainFrame* g_pMainFrame;
