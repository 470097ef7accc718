// The system's side of the processing library for its tests: callbacks over in-memory blocks and
// PCM, a record of what the library asked and pushed, and scripted faults.
#pragma once

#include <ovix/Ovix.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace ovixtest {

using Bytes = std::vector<uint8_t>;

// Polls until `done` holds; false after 20 s, so that no test can hang.
bool WaitFor(auto done)
{
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (!done() && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return done();
}

// Holds one callback until the test opens it; both sides wait a bounded time.
struct Gate {
    std::atomic<bool> arrived{false}, open{false};
    bool WaitArrived() { return WaitFor([this] { return arrived.load(); }); }
};

// The n-th (0-based) call of one callback, by event letter: 'a' AF size query, 'A' AF read,
// 'l' level size query, 'L' level read, 'I' audio pull, 'O' audio push, 'N' notification.
using Trigger = std::pair<char, int>;

struct Script {
    Bytes afBlock = {};
    Bytes levelBlock = {};  // empty: the recording has no audio level
    std::vector<int16_t> pcm = {};  // interleaved
    unsigned channels = 2;
    Bytes sound = {};  // if set, served instead of `pcm`: frames of `frameBytes` in any format
    size_t frameBytes = 0;
    bool zerosAfterEnd = false;  // decoded AAC: the track is followed by zeros forever
    size_t infoPieceLimit = SIZE_MAX;
    size_t audioFrameLimit = SIZE_MAX / 64;
    std::vector<size_t> deliveryCycle = {};  // if set, the n-th pull delivers at most deliveryCycle[n % size] frames
    unsigned long afSize = 0;  // if not 0, announced instead of the true size
    bool overDeliver = false;  // the audio reader claims one byte more than asked
    Trigger failAt = {}, abortAt = {}, holdAt = {};  // held at the harness's gate
};

struct Note {
    unsigned long done = 0, total = 0, state = 0;  // state: TqovixIsSessionFinished inside the notification
    bool operator==(const Note&) const = default;
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
        TqovixSetCallbackOutputAudio([](void* data, unsigned long size) {
            Harness& h = *s_current;
            const auto* bytes = static_cast<const uint8_t*>(data);
            h.pushedSound.insert(h.pushedSound.end(), bytes, bytes + size);
            const int16_t* samples = static_cast<const int16_t*>(data);
            h.pushed.insert(h.pushed.end(), samples, samples + size / sizeof(int16_t));
            h.pushedBytes.push_back(size);
            return h.Enter('O') ? ovix::kSuccess : ovix::kFailure;
        });
        TqovixSetCallbackNotifyProgress([](unsigned long done, unsigned long total) {
            Harness& h = *s_current;
            h.Enter('N');
            h.notes.push_back({done, total, TqovixIsSessionFinished()});
        });
    }

    // Read only after the session is closed (its worker joined) or while it is held at the gate.
    std::string events;
    std::vector<int16_t> pushed;
    Bytes pushedSound;  // everything pushed, as bytes
    std::vector<Note> notes;
    std::vector<size_t> pulledBytes, pushedBytes;  // every delivery and push, in order
    Gate gate;

private:
    static inline std::atomic<Harness*> s_current{nullptr};

    // Records the event and plays the scripted fault; false when this call is to fail.
    bool Enter(char event)
    {
        const Trigger now{event, m_calls[static_cast<unsigned char>(event)]++};
        events.push_back(event);
        if (now == m_script.abortAt) {
            TqovixAbortSession();
        }
        if (now == m_script.holdAt) {
            gate.arrived = true;
            WaitFor([this] { return gate.open.load(); });
        }
        return now != m_script.failAt;
    }

    // The system's sequential reader: a null buffer asks for the size; the end delivers 0 and rewinds.
    unsigned long ReadInfo(char event, void* buffer, unsigned long* delivered, unsigned long size)
    {
        const bool af = event == 'a';
        const Bytes& block = af ? m_script.afBlock : m_script.levelBlock;
        size_t& position = af ? m_afPosition : m_levelPosition;
        if (!Enter(buffer != nullptr ? (af ? 'A' : 'L') : event)) {
            return ovix::kFailure;
        }
        if (buffer == nullptr) {
            *delivered = af && m_script.afSize != 0 ? m_script.afSize : block.size();
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
        const bool raw = !s.sound.empty();
        const auto* source = raw ? s.sound.data() : reinterpret_cast<const uint8_t*>(s.pcm.data());
        const size_t left = (raw ? s.sound.size() : s.pcm.size() * sizeof(int16_t)) - h.m_bytePosition;
        const size_t frameBytes = raw ? s.frameBytes : s.channels * sizeof(int16_t);
        const size_t limit = s.deliveryCycle.empty() ? s.audioFrameLimit
                                                     : s.deliveryCycle[h.pulledBytes.size() % s.deliveryCycle.size()];
        size_t piece = std::min({size_t{size}, left, limit * frameBytes});
        uint8_t* out = static_cast<uint8_t*>(buffer);
        std::copy_n(source + h.m_bytePosition, piece, out);
        h.m_bytePosition += piece;
        if (s.zerosAfterEnd && piece == left && piece < size) {
            piece = std::fill_n(out + piece, size - piece, 0) - out;
        }
        *delivered = piece + (s.overDeliver ? 1 : 0);
        h.pulledBytes.push_back(*delivered);
        return ovix::kSuccess;
    }

    Script m_script;
    size_t m_afPosition = 0, m_levelPosition = 0, m_bytePosition = 0;
    std::array<int, 256> m_calls = {};  // by event letter
};

}  // namespace ovixtest
