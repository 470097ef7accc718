// Plays the system's side of the processing library for its tests: callbacks over in-memory
// AF information, audio level and PCM, a record of what the library asked and pushed, and
// scripted faults (a failing callback, an abort inside one, a callback held at a gate).
#pragma once

#include <ovix/Ovix.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <optional>
#include <ostream>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace ovixtest {

using Bytes = std::vector<uint8_t>;

inline constexpr auto kPatience = std::chrono::seconds(20);

// Polls until `done` holds; false when the patience runs out, so no test can hang.
template <typename Predicate>
bool WaitFor(Predicate done)
{
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (!done() && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return done();
}

// Holds one callback until the test opens it; both sides wait a bounded time.
class Gate {
public:
    void Arrive()
    {
        m_arrived = true;
        WaitFor([this] { return m_open.load(); });
    }
    bool WaitArrived() { return WaitFor([this] { return m_arrived.load(); }); }
    void Open() { m_open = true; }

private:
    std::atomic<bool> m_arrived{false};
    std::atomic<bool> m_open{false};
};

// The n-th (0-based) call of one callback, by event letter: 'a' AF size query, 'A' AF read,
// 'l' level size query, 'L' level read, 'I' audio pull, 'O' audio push, 'N' notification.
using Trigger = std::pair<char, int>;

struct Script {
    Bytes afBlock = {};
    Bytes levelBlock = {};  // empty: the recording has no audio level
    std::vector<int16_t> pcm = {};  // interleaved
    unsigned channels = 2;
    bool zerosAfterEnd = false;  // decoded AAC: the track is followed by zeros forever
    size_t infoPieceLimit = SIZE_MAX;
    size_t audioFrameLimit = SIZE_MAX / 64;
    std::optional<unsigned long> afSize = {};  // announced instead of the true size
    bool overDeliver = false;  // the audio reader claims one byte more than asked
    Trigger failAt = {}, abortAt = {}, holdAt = {};
    Gate* gate = nullptr;
};

struct Note {
    unsigned long done = 0, total = 0;
    unsigned long state = 0;  // TqovixIsSessionFinished inside the notification
    bool operator==(const Note&) const = default;
    friend void PrintTo(const Note& n, std::ostream* out) { *out << n.done << '/' << n.total << " state " << n.state; }
};

class Harness {
public:
    explicit Harness(Script script) : m_script(std::move(script)) { s_current = this; }
    ~Harness() { s_current = nullptr; }

    static void Register()
    {
        TqovixSetCallbackInputAFInformation([](void* to, unsigned long* got, unsigned long n, unsigned long) {
            return s_current.load()->ReadInfo('a', to, got, n);
        });
        TqovixSetCallbackInputAudioLevelInformation([](void* to, unsigned long* got, unsigned long n, unsigned long) {
            return s_current.load()->ReadInfo('l', to, got, n);
        });
        TqovixSetCallbackInputAudio(&Harness::InputAudio);
        TqovixSetCallbackOutputAudio(&Harness::OutputAudio);
        TqovixSetCallbackNotifyProgress(&Harness::Notify);
    }

    // Read only after the session is closed (its worker joined) or while it is held at the gate.
    std::string events;
    std::vector<int16_t> pushed;
    std::vector<Note> notes;
    Bytes processedAtEnd;  // read inside the notification that first reports the end

private:
    static inline std::atomic<Harness*> s_current{nullptr};

    // Records the event and plays the scripted fault; false when this call is to fail.
    bool Enter(char event)
    {
        const Trigger now{event, static_cast<int>(std::ranges::count(events, event))};
        events.push_back(event);
        if (now == m_script.abortAt) {
            TqovixAbortSession();
        }
        if (now == m_script.holdAt && m_script.gate != nullptr) {
            m_script.gate->Arrive();
        }
        return now != m_script.failAt;
    }

    // The system's sequential reader: a null buffer asks for the size; the end delivers 0 and
    // rewinds.
    unsigned long ReadInfo(char event, void* buffer, unsigned long* delivered, unsigned long size)
    {
        const bool af = event == 'a';
        const Bytes& block = af ? m_script.afBlock : m_script.levelBlock;
        size_t& position = af ? m_afPosition : m_levelPosition;
        if (!Enter(buffer != nullptr ? (af ? 'A' : 'L') : event)) {
            return ovix::kFailure;
        }
        if (buffer == nullptr) {
            *delivered = af ? m_script.afSize.value_or(block.size()) : block.size();
            return !af && block.empty() ? ovix::kNoAudioLevel : ovix::kSuccess;
        }
        *delivered = std::min({block.size() - position, size_t{size}, m_script.infoPieceLimit});
        std::copy_n(block.begin() + position, *delivered, static_cast<uint8_t*>(buffer));
        position = *delivered == 0 ? 0 : position + *delivered;
        return ovix::kSuccess;
    }

    static unsigned long InputAudio(void* buffer, unsigned long* delivered, unsigned long size, unsigned long)
    {
        Harness& h = *s_current;
        const Script& s = h.m_script;
        if (!h.Enter('I')) {
            return ovix::kFailure;
        }
        const size_t left = (s.pcm.size() - h.m_samplePosition) * sizeof(int16_t);
        size_t piece = std::min({size_t{size}, left, s.audioFrameLimit * s.channels * sizeof(int16_t)});
        uint8_t* out = static_cast<uint8_t*>(buffer);
        std::copy_n(reinterpret_cast<const uint8_t*>(s.pcm.data() + h.m_samplePosition), piece, out);
        h.m_samplePosition += piece / sizeof(int16_t);
        if (s.zerosAfterEnd && piece == left && piece < size) {
            piece = std::fill_n(out + piece, size - piece, 0) - out;
        }
        *delivered = piece + (s.overDeliver ? 1 : 0);
        return ovix::kSuccess;
    }

    static unsigned long OutputAudio(void* data, unsigned long size)
    {
        Harness& h = *s_current;
        const int16_t* samples = static_cast<const int16_t*>(data);
        h.pushed.insert(h.pushed.end(), samples, samples + size / sizeof(int16_t));
        return h.Enter('O') ? ovix::kSuccess : ovix::kFailure;
    }

    static void Notify(unsigned long done, unsigned long total)
    {
        Harness& h = *s_current;
        h.Enter('N');
        const unsigned long state = TqovixIsSessionFinished();
        if (state != 0 && h.processedAtEnd.empty()) {
            uint8_t piece[7];  // smaller than any block, so that it comes in pieces
            unsigned long count = 0;
            unsigned long result = 0;
            do {
                result = TqovixGetProcessedAFInfo(piece, sizeof piece, &count);
                count = result <= ovix::kLastPiece ? count : 0;
                h.processedAtEnd.insert(h.processedAtEnd.end(), piece, piece + count);
            } while (result == ovix::kSuccess && h.processedAtEnd.size() < 4096);
        }
        h.notes.push_back({done, total, state});
    }

    Script m_script;
    size_t m_afPosition = 0;
    size_t m_levelPosition = 0;
    size_t m_samplePosition = 0;
};

}  // namespace ovixtest
