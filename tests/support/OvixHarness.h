// Plays the system's side of the processing library for its tests: callbacks over in-memory
// AF information, audio level and PCM, a record of everything the library asked and pushed,
// and scripted faults (failing callbacks, aborts, a callback held at a gate).
#pragma once

#include <ovix/Ovix.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstring>
#include <limits>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace ovixtest {

using Bytes = std::vector<uint8_t>;

inline constexpr auto kPatience = std::chrono::seconds(20);

// Polls until `done` holds; false when the patience runs out, so no test can hang.
template <typename Predicate>
bool WaitFor(Predicate done)
{
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (!done()) {
        if (std::chrono::steady_clock::now() > deadline) {
            return false;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
}

// Holds one callback until the test opens it; both sides wait a bounded time.
class Gate {
public:
    void Arrive()
    {
        std::unique_lock lock(m_mutex);
        m_arrived = true;
        m_changed.notify_all();
        m_changed.wait_for(lock, kPatience, [this] { return m_open; });
    }
    bool WaitArrived()
    {
        std::unique_lock lock(m_mutex);
        return m_changed.wait_for(lock, kPatience, [this] { return m_arrived; });
    }
    void Open()
    {
        std::lock_guard lock(m_mutex);
        m_open = true;
        m_changed.notify_all();
    }

private:
    std::mutex m_mutex;
    std::condition_variable m_changed;
    bool m_arrived = false;
    bool m_open = false;
};

// Event letters: 'a' AF size query, 'A' AF read, 'l' level size query, 'L' level read,
// 'I' audio pull, 'O' audio push, 'N' progress notification.
struct Script {
    Bytes afBlock;
    std::optional<Bytes> levelBlock;
    std::vector<int16_t> pcm;  // interleaved
    unsigned channels = 2;
    bool zerosAfterEnd = false;  // decoded AAC: the track is followed by zeros forever
    unsigned long infoPieceLimit = std::numeric_limits<unsigned long>::max();
    unsigned long audioFrameLimit = std::numeric_limits<unsigned long>::max();
    std::optional<unsigned long> afSizeOverride;
    bool overDeliver = false;  // the audio reader claims one byte more than asked
    char failOn = 0;  // the callback of this event letter fails ...
    int failOrdinal = 0;  // ... at its n-th call (0-based)
    char abortOn = 0;  // TqovixAbortSession inside this callback ...
    int abortOrdinal = 0;
    char holdOn = 0;  // held at the gate inside this callback ...
    int holdOrdinal = 0;
    Gate* gate = nullptr;
    int closeInNotification = -1;  // closes from inside the n-th notification ...
    bool closeLibrary = false;  // ... the library rather than the session
};

struct Note {
    unsigned long done = 0;
    unsigned long total = 0;
    unsigned long state = 0;  // TqovixIsSessionFinished inside the notification
};

class Harness {
public:
    explicit Harness(Script script) : m_script(std::move(script)) { Current() = this; }
    ~Harness() { Current() = nullptr; }
    Harness(const Harness&) = delete;
    Harness& operator=(const Harness&) = delete;

    static void Register()
    {
        TqovixSetCallbackInputAFInformation(&Harness::InputAf);
        TqovixSetCallbackInputAudioLevelInformation(&Harness::InputLevel);
        TqovixSetCallbackInputAudio(&Harness::InputAudio);
        TqovixSetCallbackOutputAudio(&Harness::OutputAudio);
        TqovixSetCallbackNotifyProgress(&Harness::Notify);
    }

    // Read only after the session is closed (its worker joined) unless noted.
    std::string events;
    std::vector<unsigned long> audioRequests;
    std::vector<int16_t> pushed;
    std::vector<Note> notes;
    Bytes processedAtEnd;  // read inside the notification that first reports the end
    std::atomic<int> outputs{0};  // safe to poll while running
    std::atomic<int> notifications{0};
    // What the close inside a notification returned; stored last, after which the harness
    // is no longer touched by the worker.
    std::atomic<long> closedInside{-1};

private:
    static std::atomic<Harness*>& Current()
    {
        static std::atomic<Harness*> current{nullptr};
        return current;
    }

    // Counts the event and plays the scripted fault; false when this call is to fail.
    bool Enter(char event)
    {
        const int ordinal = static_cast<int>(std::count(events.begin(), events.end(), event));
        events.push_back(event);
        if (m_script.abortOn == event && m_script.abortOrdinal == ordinal) {
            TqovixAbortSession();
        }
        if (m_script.holdOn == event && m_script.holdOrdinal == ordinal && m_script.gate != nullptr) {
            m_script.gate->Arrive();
        }
        return !(m_script.failOn == event && m_script.failOrdinal == ordinal);
    }

    // The system's sequential reader: a null buffer asks for the size; the end delivers 0
    // and rewinds.
    unsigned long ReadInfo(const Bytes& block, size_t& position, void* buffer, unsigned long* delivered,
                           unsigned long size, unsigned long skip)
    {
        if (buffer == nullptr) {
            *delivered = m_script.afSizeOverride && &block == &m_script.afBlock ? *m_script.afSizeOverride
                                                                              : block.size();
            return 0;
        }
        position = std::min(block.size(), position + skip);
        const size_t piece = std::min({block.size() - position, size_t{size}, size_t{m_script.infoPieceLimit}});
        if (piece > 0) {
            std::memcpy(buffer, block.data() + position, piece);
        }
        position = piece == 0 ? 0 : position + piece;
        *delivered = piece;
        return 0;
    }

    static unsigned long InputAf(void* buffer, unsigned long* delivered, unsigned long size, unsigned long skip)
    {
        Harness& h = *Current();
        if (!h.Enter(buffer == nullptr ? 'a' : 'A')) {
            return ovix::kFailure;
        }
        return h.ReadInfo(h.m_script.afBlock, h.m_afPosition, buffer, delivered, size, skip);
    }

    static unsigned long InputLevel(void* buffer, unsigned long* delivered, unsigned long size, unsigned long skip)
    {
        Harness& h = *Current();
        if (!h.Enter(buffer == nullptr ? 'l' : 'L')) {
            return ovix::kFailure;
        }
        if (!h.m_script.levelBlock) {
            *delivered = 0;
            return ovix::kNoAudioLevel;
        }
        return h.ReadInfo(*h.m_script.levelBlock, h.m_levelPosition, buffer, delivered, size, skip);
    }

    static unsigned long InputAudio(void* buffer, unsigned long* delivered, unsigned long size, unsigned long)
    {
        Harness& h = *Current();
        h.audioRequests.push_back(size);
        if (!h.Enter('I')) {
            return ovix::kFailure;
        }
        const size_t frameBytes = h.m_script.channels * sizeof(int16_t);
        const size_t left = (h.m_script.pcm.size() - h.m_samplePosition) * sizeof(int16_t);
        size_t piece = std::min<size_t>(size, left);
        piece = std::min<size_t>(piece, h.m_script.audioFrameLimit * frameBytes);
        if (piece > 0) {
            std::memcpy(buffer, h.m_script.pcm.data() + h.m_samplePosition, piece);
        }
        h.m_samplePosition += piece / sizeof(int16_t);
        if (h.m_script.zerosAfterEnd && piece == left && piece < size) {
            std::memset(static_cast<uint8_t*>(buffer) + piece, 0, size - piece);
            piece = size;
        }
        *delivered = piece + (h.m_script.overDeliver ? 1 : 0);
        return 0;
    }

    static unsigned long OutputAudio(void* data, unsigned long size)
    {
        Harness& h = *Current();
        const int16_t* samples = static_cast<const int16_t*>(data);
        h.pushed.insert(h.pushed.end(), samples, samples + size / sizeof(int16_t));
        const bool ok = h.Enter('O');
        h.outputs.fetch_add(1);
        return ok ? 0 : ovix::kFailure;
    }

    static void Notify(unsigned long done, unsigned long total)
    {
        Harness& h = *Current();
        h.Enter('N');
        const unsigned long state = TqovixIsSessionFinished();
        if (state != 0 && h.processedAtEnd.empty()) {
            uint8_t piece[1024];
            unsigned long count = 0;
            unsigned long result = 0;
            do {
                result = TqovixGetProcessedAFInfo(piece, sizeof piece, &count);
                if (result <= ovix::kLastPiece) {
                    h.processedAtEnd.insert(h.processedAtEnd.end(), piece, piece + count);
                }
            } while (result == 0);
        }
        h.notes.push_back({done, total, state});
        const int ordinal = h.notifications.fetch_add(1);
        if (ordinal == h.m_script.closeInNotification) {
            const unsigned long result = h.m_script.closeLibrary ? TqovixLibraryClose() : TqovixCloseSession(0);
            h.closedInside.store(static_cast<long>(result));
        }
    }

    Script m_script;
    size_t m_afPosition = 0;
    size_t m_levelPosition = 0;
    size_t m_samplePosition = 0;
};

}  // namespace ovixtest
