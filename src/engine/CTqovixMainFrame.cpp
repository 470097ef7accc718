#include "engine/CTqovixMainFrame.h"

#include "bridge/TqovixCodeTable.h"

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <new>

#include "bridge/TqovixInterfaceConvert.h"
#include "file/CTqovixUtil.h"

namespace ovixbridge = TqovixInterfaceConvert;

namespace {

constexpr unsigned long kAFInformationPiece = 1024;
// Far beyond any camera's AF information: a library that never says "last piece" stops here.
constexpr size_t kMaxProcessedAFInformation = 16u << 20;


}  // namespace

CTqovixMainFrame::~CTqovixMainFrame() { Close(); }

eTqovixErrorCode CTqovixMainFrame::Initialize()
{
    if (m_bInitialized) {
        return eTqovixErrorGeneral;
    }
    const eTqovixErrorCode result = ovixbridge::TqovixLibraryInitialize();
    if (TqovixFailed(result)) {
        return result;
    }
    ovixbridge::TqovixSetCallbackInputAFInformation(InputAFInformation);
    ovixbridge::TqovixSetCallbackInputAudioLevelInformation(InputAudioLevelInformation);
    ovixbridge::TqovixSetCallbackInputAudio(InputAudio);
    ovixbridge::TqovixSetCallbackOutputAudio(OutputAudio);
    ovixbridge::TqovixSetCallbackNotifyProgress(NotifyProgress);
    m_progressDataControl.SetFinished(eTqovixFinished);
    m_progressDataControl.Reset();
    m_bInitialized = true;
    return result;
}

void CTqovixMainFrame::Close()
{
    if (m_bInitialized) {
        const bool running = m_progressDataControl.GetErrorResult() == eTqovixRunning;
        if (running) {
            m_bAbortRequested = true;
        }
        // Returns only when the library's thread has left every callback for good.
        ovixbridge::TqovixLibraryClose();
        if (m_progressDataControl.GetErrorResult() == eTqovixRunning) {
            // The library stopped before a callback could see the request: end the job here
            // (the unfinished destination, never named, goes with the controller).
            m_movControl.Close();
            m_destinationPath.clear();
            m_progressDataControl.SetFinished(eTqovixErrorAborted);
        }
        m_pfnNotifyProgress = nullptr;
        m_bInitialized = false;
    }
    JoinCloseThreads();
}

eTqovixErrorCode CTqovixMainFrame::Execute(const char* sourcePath, const char* destinationPath, int)
{
    if (!m_bInitialized) {
        m_progressDataControl.SetFinished(eTqovixErrorGeneral);
        return eTqovixErrorGeneral;
    }
    if (m_progressDataControl.GetErrorResult() == eTqovixRunning) {
        return eTqovixErrorGeneral;
    }
    // Without a destination the controller would open for a query, not a job.
    if (destinationPath == nullptr || destinationPath[0] == '\0' ||
        (sourcePath != nullptr && std::strcmp(sourcePath, destinationPath) == 0)) {
        m_progressDataControl.SetFinished(eTqovixErrorGeneral);
        return eTqovixErrorGeneral;
    }
    JoinCloseThreads();
    m_bAbortRequested = false;
    m_progressDataControl.Reset();
    m_movControl.Close();
    m_destinationPath.clear();
    m_soundProgressFirst = 0;
    m_soundProgressSecond = 0;
    m_shownProgressFirst = 0;
    m_movControl.SetKeepGoing([this](uint64_t, uint64_t) { return KeepGoing(); });

    eTqovixErrorCode result = m_movControl.Initialize(sourcePath, destinationPath);
    if (TqovixFailed(result)) {
        FailStart(result, sourcePath, destinationPath);
        return result;
    }
    if (m_movControl.IsAACCodec()) {
        m_movControl.GetMainFrame(this);
    }
    ovixbridge::TqovixAudioInformation audio;
    result = m_movControl.GetAudioInformation(audio);
    if (TqovixFailed(result)) {
        FailStart(result, sourcePath, destinationPath);
        return result;
    }
    ovixbridge::TqovixTrimInformation trim;
    result = m_movControl.GetTrimInformation(trim);
    if (TqovixFailed(result)) {
        FailStart(result, sourcePath, destinationPath);
        return result;
    }
    // Recorded before the session opens: its first callbacks may already end the job.
    try {
        m_destinationPath.assign(destinationPath, destinationPath + std::strlen(destinationPath) + 1);
    } catch (const std::bad_alloc&) {
        FailStart(eTqovixErrorOutOfMemory, sourcePath, destinationPath);
        return eTqovixErrorOutOfMemory;
    }
    m_progressDataControl.SetFinished(eTqovixRunning);
    result = ovixbridge::TqovixOpenSession(audio, trim);
    if (TqovixFailed(result)) {
        m_destinationPath.clear();
        FailStart(result, sourcePath, destinationPath);
        return result;
    }
    return result;
}

void CTqovixMainFrame::FailStart(eTqovixErrorCode code, const char*, const char*)
{
    // What stands at the destination's path was never touched: the job wrote under no name.
    m_movControl.Close();
    m_progressDataControl.SetFinished(code);
}

void CTqovixMainFrame::Abort()
{
    if (m_bInitialized && m_progressDataControl.GetErrorResult() == eTqovixRunning) {
        m_bAbortRequested = true;
    }
}

void CTqovixMainFrame::Abort(eTqovixErrorCode code)
{
    ovixbridge::TqovixAbortSession();
    CloseSession(code);
    m_bAbortRequested = false;
}

void CTqovixMainFrame::CloseSession(eTqovixErrorCode code)
{
    // A result, once final, is final: a host answer or a late failure after the end changes nothing.
    if (m_progressDataControl.GetErrorResult() != eTqovixRunning) {
        return;
    }
    // Only a complete movie takes the destination's name; every other ending leaves the path as
    // it was, and the unnamed file goes with the controller.
    if (code == eTqovixFinished) {
        const eTqovixErrorCode published =
            m_movControl.IsDestinationComplete() ? m_movControl.PublishDestination() : eTqovixErrorInternal;
        code = TqovixFailed(published) ? published : code;
    }
    StartCloseThread(code);
    m_movControl.Close();
    m_destinationPath.clear();
    m_progressDataControl.SetFinished(code);
}

void CTqovixMainFrame::StartCloseThread(eTqovixErrorCode code)
{
    pthread_t thread;
    void* argument = reinterpret_cast<void*>(static_cast<intptr_t>(code));
    if (pthread_create(&thread, nullptr, PostClosethread, argument) != 0) {
        // No thread to close from: at least stop the library's worker.
        ovixbridge::TqovixAbortSession();
        return;
    }
    CTqovixLock lock(m_closeThreadSection);
    m_closeThreads.push_back(thread);
}

void CTqovixMainFrame::JoinCloseThreads()
{
    std::vector<pthread_t> threads;
    {
        CTqovixLock lock(m_closeThreadSection);
        threads.swap(m_closeThreads);
    }
    for (pthread_t thread : threads) {
        pthread_join(thread, nullptr);
    }
}

void* CTqovixMainFrame::PostClosethread(void* code)
{
    ovixbridge::TqovixCloseSession(static_cast<eTqovixErrorCode>(reinterpret_cast<intptr_t>(code)));
    return nullptr;
}

bool CTqovixMainFrame::IsProcessing() const
{
    return m_bInitialized && m_progressDataControl.GetErrorResult() == eTqovixRunning;
}

eTqovixErrorCode CTqovixMainFrame::GetProgress(int* first, int* second) const
{
    if (!m_bInitialized) {
        return eTqovixErrorGeneral;
    }
    return m_progressDataControl.GetProgress(first, second);
}

eTqovixErrorCode CTqovixMainFrame::GetProcessingState() const
{
    return m_bInitialized ? m_progressDataControl.GetErrorResult() : eTqovixErrorGeneral;
}

eTqovixErrorCode CTqovixMainFrame::SetCallback(NotifyProgressFunc callback)
{
    if (!m_bInitialized || m_progressDataControl.GetErrorResult() == eTqovixRunning) {
        return eTqovixErrorGeneral;
    }
    m_pfnNotifyProgress = callback;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMainFrame::GetProperty(const char* path) const
{
    if (!m_bInitialized) {
        return eTqovixErrorGeneral;
    }
    CTqovixMovControl control;
    eTqovixErrorCode result = control.Initialize(path, nullptr);
    if (TqovixFailed(result)) {
        return result;
    }
    unsigned long size = 0;
    control.GetAFInformation(nullptr, &size, 0, 0);
    if (size == 0) {
        result = eTqovixErrorInvalidMovie;
    } else {
        std::vector<uint8_t> block;
        try {
            block.assign(size, 0);
        } catch (const std::bad_alloc&) {
            control.Close();
            return eTqovixErrorOutOfMemory;
        }
        unsigned long delivered = 0;
        result = control.GetAFInformation(block.data(), &delivered, size, 0);
        if (!TqovixFailed(result)) {
            result = ovixbridge::TqovixIsEnable(block.data(), size);
        }
        if (result == eTqovixEnable) {
            // A job's start opens the codecs too: a track they refuse is refused here as well.
            ovixbridge::TqovixAudioInformation audio;
            result = control.GetAudioInformation(audio);
        }
    }
    control.Close();
    return result;
}

bool CTqovixMainFrame::BeginCallback(eTqovixErrorCode& answer)
{
    if (!m_bInitialized) {
        answer = eTqovixErrorGeneral;
        return false;
    }
    // After the job has ended the library only learns how it ended; a late abort request
    // must not turn a finished job into an aborted one.
    if (m_progressDataControl.GetErrorResult() != eTqovixRunning) {
        answer = m_progressDataControl.GetErrorResult();
        return false;
    }
    if (m_bAbortRequested) {
        Abort(eTqovixErrorAborted);
        answer = m_progressDataControl.GetErrorResult();
        return false;
    }
    return true;
}

eTqovixErrorCode CTqovixMainFrame::EndCallback(eTqovixErrorCode result)
{
    // The serving operation may have ended the job itself (finishing an AAC destination).
    if (TqovixFailed(result) && m_progressDataControl.GetErrorResult() == eTqovixRunning) {
        CloseSession(result);
    }
    return result;
}

eTqovixErrorCode CTqovixMainFrame::ServeInput(eInput input, void* buffer, unsigned long* delivered,
                                              unsigned long size, unsigned long skip)
{
    CTqovixMainFrame* engine = g_pMainFrame;
    if (engine == nullptr) {
        return eTqovixErrorGeneral;
    }
    eTqovixErrorCode answer = eTqovixSuccess;
    if (!engine->BeginCallback(answer)) {
        return answer;
    }
    const CTqovixMovControl& control = engine->m_movControl;
    switch (input) {
    case eInput::AFInformation: answer = control.GetAFInformation(buffer, delivered, size, skip); break;
    case eInput::AudioLevelInformation:
        answer = control.GetAudioLevelInformation(buffer, delivered, size, skip);
        break;
    case eInput::Audio: answer = control.GetAudioData(buffer, delivered, size, skip); break;
    }
    return engine->EndCallback(answer);
}

eTqovixErrorCode CTqovixMainFrame::InputAFInformation(void* buffer, unsigned long* delivered, unsigned long size,
                                                      unsigned long skip)
{
    return ServeInput(eInput::AFInformation, buffer, delivered, size, skip);
}

eTqovixErrorCode CTqovixMainFrame::InputAudioLevelInformation(void* buffer, unsigned long* delivered,
                                                              unsigned long size, unsigned long skip)
{
    return ServeInput(eInput::AudioLevelInformation, buffer, delivered, size, skip);
}

eTqovixErrorCode CTqovixMainFrame::InputAudio(void* buffer, unsigned long* delivered, unsigned long size,
                                              unsigned long skip)
{
    return ServeInput(eInput::Audio, buffer, delivered, size, skip);
}

eTqovixErrorCode CTqovixMainFrame::OutputAudio(const void* data, unsigned long size)
{
    CTqovixMainFrame* engine = g_pMainFrame;
    if (engine == nullptr) {
        return eTqovixErrorGeneral;
    }
    eTqovixErrorCode answer = eTqovixSuccess;
    if (!engine->BeginCallback(answer)) {
        return answer;
    }
    return engine->EndCallback(engine->m_movControl.SetMovieMetaData(data, size));
}

void CTqovixMainFrame::NotifyProgress(unsigned long first, unsigned long second)
{
    CTqovixMainFrame* engine = g_pMainFrame;
    if (engine == nullptr) {
        return;
    }
    const bool running = engine->IsProcessing();
    if (running && engine->m_bAbortRequested) {
        engine->Abort(eTqovixErrorAborted);
        return;
    }
    engine->m_soundProgressFirst = first;
    engine->m_soundProgressSecond = second;
    auto shown = running ? engine->RecordProgress() : std::make_pair(first, second);
    if (!running) {
        engine->m_progressDataControl.SetProgress(first, second);
    }

    bool endedByError = false;
    const eTqovixErrorCode finished = ovixbridge::TqovixIsSessionFinished();
    if (finished == eTqovixFinished) {
        if (running) {
            if (engine->m_movControl.IsPCMCodec()) {
                if (TqovixFailed(engine->SetAFInformation())) {
                    return;
                }
            } else {
                engine->FinishAACJob();
                // Ended otherwise while it waited for its copy: what was to be shown is stale.
                if (engine->m_progressDataControl.GetErrorResult() != eTqovixFinished) {
                    return;
                }
            }
        }
    } else if (finished != eTqovixRunning) {
        endedByError = true;
        if (running) {
            engine->Abort(finished);
        }
    }

    const NotifyProgressFunc callback = engine->m_pfnNotifyProgress.load();
    if (callback == nullptr) {
        return;
    }
    if (engine->m_progressDataControl.GetErrorResult() == eTqovixFinished) {
        shown = {first, second};  // the movie is complete
    }
    const int answer = callback(static_cast<int>(static_cast<uint32_t>(shown.first)),
                                static_cast<int>(static_cast<uint32_t>(shown.second)));
    if (answer == 0 || endedByError) {
        return;
    }
    engine->Abort(TqovixCodes::FromHostAnswer(answer));
}

std::pair<unsigned long, unsigned long> CTqovixMainFrame::RecordProgress()
{
    const unsigned long second = m_soundProgressSecond;
    unsigned long first = m_soundProgressFirst;
    const double copied = m_movControl.GetCopyFraction();
    if (copied < 1.0) {
        first = std::min(first, static_cast<unsigned long>(static_cast<double>(second) * copied));
        // The last frame's worth waits for the copy's end.
        first = std::min(first, second > 0 ? second - 1 : 0);
    }
    if (m_movControl.IsPatching()) {
        // Never backwards, whichever of the sound and the copy holds it back.
        first = std::max(first, std::min(m_shownProgressFirst, second));
        m_shownProgressFirst = first;
    }
    m_progressDataControl.SetProgress(first, second);
    return {first, second};
}

eTqovixErrorCode CTqovixMainFrame::KeepGoing()
{
    if (m_bAbortRequested) {
        return eTqovixErrorAborted;
    }
    const auto [first, second] = RecordProgress();
    const NotifyProgressFunc callback = m_pfnNotifyProgress.load();
    if (callback == nullptr) {
        return eTqovixSuccess;
    }
    const int answer =
        callback(static_cast<int>(static_cast<uint32_t>(first)), static_cast<int>(static_cast<uint32_t>(second)));
    if (answer != 0) {
        return TqovixCodes::FromHostAnswer(answer);
    }
    // The host may have asked to stop from its callback or meanwhile.
    return m_bAbortRequested ? eTqovixErrorAborted : eTqovixSuccess;
}

void CTqovixMainFrame::FinishAACJob()
{
    // The last packets normally finish the destination from the encoder callback; a
    // library that stopped short gets the encoder flushed, and a destination still
    // missing chunks fails rather than passing as done.
    if (!m_movControl.IsDestinationComplete()) {
        eTqovixErrorCode result = m_movControl.FlushEncoder();
        if (!TqovixFailed(result) && m_movControl.TakeFinishPending()) {
            result = SetAFInformation();
        }
        if (m_progressDataControl.GetErrorResult() != eTqovixRunning) {
            return;
        }
        if (TqovixFailed(result)) {
            CloseSession(result);
            return;
        }
        if (!m_movControl.IsDestinationComplete()) {
            CloseSession(eTqovixErrorInternal);
            return;
        }
    }
    CloseSession(eTqovixFinished);
}

eTqovixErrorCode CTqovixMainFrame::SetAFInformation()
{
    const bool pcm = m_movControl.IsPCMCodec();
    std::vector<uint8_t> collected;
    uint8_t piece[kAFInformationPiece];
    for (;;) {
        unsigned long count = 0;
        const eTqovixErrorCode result = ovixbridge::TqovixGetProcessedAFInfo(piece, sizeof piece, &count);
        if (TqovixFailed(result)) {
            CloseSession(result);
            return result;
        }
        if (count > sizeof piece || collected.size() + count > kMaxProcessedAFInformation) {
            CloseSession(eTqovixErrorInternal);
            return eTqovixErrorInternal;
        }
        try {
            collected.insert(collected.end(), piece, piece + count);
        } catch (const std::bad_alloc&) {
            CloseSession(eTqovixErrorOutOfMemory);
            return eTqovixErrorOutOfMemory;
        }
        if (result != eTqovixRunning) {
            break;
        }
    }
    if (collected.empty()) {
        CloseSession(eTqovixErrorInternal);
        return eTqovixErrorInternal;
    }
    const eTqovixErrorCode result = m_movControl.SetMovieDataInformation(collected.data(), collected.size());
    if (TqovixFailed(result)) {
        CloseSession(result);
    } else if (pcm) {
        CloseSession(eTqovixFinished);
    }
    return result;
}
