// The thirteen exported functions over one library-wide state: the registered callbacks and
// at most one session with its worker thread.
#include "Session.h"
#include "ovix/Ovix.h"

#include <algorithm>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <new>
#include <optional>
#include <system_error>
#include <thread>

using namespace ovix;

namespace {

constexpr unsigned long kMaxChannels = NoiseSuppressor::kMaxChannels;
// Far above any recording rate; it bounds what a session allocates for its ramps.
constexpr unsigned long kMaxRateKiloHertz = 1000;

struct OpenSession {
    std::shared_ptr<Session> session;
    std::thread worker;
    std::thread::id workerId;
    bool closing = false;  // one closer joins; everyone else is refused or waits
};

struct LibraryState {
    std::mutex mutex;
    std::condition_variable sessionGone;
    bool initialized = false;
    SessionCallbacks callbacks;
    std::unique_ptr<OpenSession> open;
};

// Never destroyed: a worker still running at process exit may call back into the library,
// and a joinable std::thread must not be destroyed.
LibraryState& State()
{
    union Holder {
        LibraryState state;
        Holder() : state() {}
        ~Holder() {}
    };
    static Holder holder;
    return holder.state;
}

std::shared_ptr<Session> CurrentSession()
{
    LibraryState& state = State();
    std::lock_guard lock(state.mutex);
    return state.open ? state.open->session : nullptr;
}

// Called with the lock held and `open.closing` just claimed; returns with the lock held and
// the session gone. A worker that closes its own session cannot join itself: it is detached
// and ends as soon as its current callback returns, owning the session until then.
void CloseClaimed(std::unique_lock<std::mutex>& lock)
{
    LibraryState& state = State();
    std::shared_ptr<Session> session = state.open->session;
    std::thread worker = std::move(state.open->worker);
    lock.unlock();
    session->Abort();
    if (worker.get_id() == std::this_thread::get_id()) {
        worker.detach();
    } else if (worker.joinable()) {
        worker.join();
    }
    session.reset();
    lock.lock();
    state.open.reset();
    state.sessionGone.notify_all();
}

uint64_t SessionRateHz(unsigned long kiloHertz)
{
    // Hosts pass the rate in whole kHz; the 11 025 Hz family loses its fraction there.
    switch (kiloHertz) {
    case 11: return 11025;
    case 22: return 22050;
    case 44: return 44100;
    case 88: return 88200;
    case 176: return 176400;
    default: return kiloHertz * 1000;
    }
}

// The session's format, or nullopt for a record it cannot serve. A record of the first layout
// ends before the exact rate and the float flag: it says 16-bit integers, and the rate in kHz.
std::optional<SessionFormat> FormatOf(const TqovixAudioInformation& audio, const TqovixTrimInformation& trim)
{
    const bool first = audio.size == kOvixFirstAudioRecordSize;
    if ((!first && audio.size != sizeof(TqovixAudioInformation)) || trim.size != sizeof(TqovixTrimInformation) ||
        audio.channels < 1 || audio.channels > kMaxChannels || audio.sampleRate == 0 ||
        audio.sampleRate > kMaxRateKiloHertz || audio.sampleCount == 0) {
        return std::nullopt;
    }
    const unsigned long rateHz = first || audio.sampleRateHz == 0 ? SessionRateHz(audio.sampleRate) : audio.sampleRateHz;
    if (!first && (audio.floatingPoint > 1 || rateHz / 1000 != audio.sampleRate)) {
        return std::nullopt;  // a rate that contradicts its own kHz is no record to trust
    }
    const std::optional<SampleFormat> sample =
        first ? (audio.bitsPerSample == 16 ? std::optional(SampleFormat::Int16()) : std::nullopt)
              : SampleFormat::Of(static_cast<unsigned>(std::min(audio.bitsPerSample, 256ul)), audio.floatingPoint == 1);
    if (!sample) {
        return std::nullopt;
    }
    return SessionFormat{rateHz, static_cast<unsigned>(audio.channels), audio.sampleCount,
                         static_cast<int32_t>(audio.startOffset), *sample};
}

}  // namespace

unsigned long TqovixLibraryInitialize()
{
    LibraryState& state = State();
    std::lock_guard lock(state.mutex);
    if (state.initialized) {
        return kFailure;
    }
    state.initialized = true;
    return kSuccess;
}

unsigned long TqovixLibraryClose()
{
    LibraryState& state = State();
    std::unique_lock lock(state.mutex);
    state.initialized = false;
    while (state.open) {
        if (!state.open->closing) {
            state.open->closing = true;
            CloseClaimed(lock);
        } else if (state.open->workerId == std::this_thread::get_id()) {
            break;  // the closer is waiting for this very thread to return
        } else {
            state.sessionGone.wait(lock);
        }
    }
    return kSuccess;
}

unsigned long TqovixIsEnable(void* block, unsigned long size)
{
    return JudgeAfBlock(static_cast<const uint8_t*>(block), size);
}

unsigned long TqovixOpenSession(const TqovixAudioInformation& audio, const TqovixTrimInformation& trim)
{
    LibraryState& state = State();
    std::lock_guard lock(state.mutex);
    const std::optional<SessionFormat> format = FormatOf(audio, trim);
    if (!state.initialized || state.open || !format) {
        return kFailure;
    }
    try {
        auto open = std::make_unique<OpenSession>();
        open->session = std::make_shared<Session>(*format, state.callbacks);
        open->worker = std::thread([session = open->session] { session->Run(); });
        open->workerId = open->worker.get_id();
        state.open = std::move(open);
    } catch (const std::bad_alloc&) {
        return kOutOfMemory;
    } catch (const std::system_error&) {
        return kFailure;
    }
    return kSuccess;
}

unsigned long TqovixIsSessionFinished()
{
    const std::shared_ptr<Session> session = CurrentSession();
    return session ? session->State() : kFailure;
}

unsigned long TqovixGetProcessedAFInfo(void* buffer, unsigned long size, unsigned long* count)
{
    const std::shared_ptr<Session> session = CurrentSession();
    return session ? session->ReadProcessedAfInformation(buffer, size, count) : kFailure;
}

unsigned long TqovixAbortSession()
{
    const std::shared_ptr<Session> session = CurrentSession();
    if (!session) {
        return kFailure;
    }
    session->Abort();
    return kSuccess;
}

unsigned long TqovixCloseSession(unsigned long /*code*/)
{
    LibraryState& state = State();
    std::unique_lock lock(state.mutex);
    if (!state.open || state.open->closing) {
        return kFailure;
    }
    state.open->closing = true;
    CloseClaimed(lock);
    return kSuccess;
}

namespace {

template <typename Callback>
unsigned long Register(Callback SessionCallbacks::*slot, Callback callback)
{
    LibraryState& state = State();
    std::lock_guard lock(state.mutex);
    state.callbacks.*slot = callback;
    return kSuccess;
}

}  // namespace

unsigned long TqovixSetCallbackInputAFInformation(TqovixInputCallback callback)
{
    return Register(&SessionCallbacks::inputAfInformation, callback);
}

unsigned long TqovixSetCallbackInputAudioLevelInformation(TqovixInputCallback callback)
{
    return Register(&SessionCallbacks::inputAudioLevel, callback);
}

unsigned long TqovixSetCallbackInputAudio(TqovixInputCallback callback)
{
    return Register(&SessionCallbacks::inputAudio, callback);
}

unsigned long TqovixSetCallbackOutputAudio(TqovixOutputCallback callback)
{
    return Register(&SessionCallbacks::outputAudio, callback);
}

unsigned long TqovixSetCallbackNotifyProgress(TqovixProgressCallback callback)
{
    return Register(&SessionCallbacks::notifyProgress, callback);
}
