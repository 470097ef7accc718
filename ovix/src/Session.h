// One processing session: the worker's steps (AF information, audio level, processed AF
// information, audio blocks, the closing notification) and the state the host polls.
// The worker never holds a lock while it calls out, so the host may call back into the
// library from inside any callback.
#pragma once

#include "NoiseSuppressor.h"
#include "ovix/Ovix.h"

#include <atomic>
#include <cstdint>
#include <mutex>
#include <vector>

namespace ovix {

struct SessionCallbacks {
    TqovixInputCallback inputAfInformation = nullptr;
    TqovixInputCallback inputAudioLevel = nullptr;
    TqovixInputCallback inputAudio = nullptr;
    TqovixOutputCallback outputAudio = nullptr;
    TqovixProgressCallback notifyProgress = nullptr;
};

struct SessionFormat {
    uint64_t rateHz = 0;
    unsigned channels = 0;
    uint64_t sampleCount = 0;
    int64_t startShift = 0;
    SampleFormat sample = SampleFormat::Int16();

    uint64_t FrameBytes() const { return uint64_t{channels} * sample.Bytes(); }
};

class Session {
public:
    // Allocates the audio block and the filter state up front; may throw std::bad_alloc.
    Session(const SessionFormat& format, const SessionCallbacks& callbacks);

    // The worker thread's whole life; returns when the session has ended by any route.
    void Run();
    // Stops the worker before its next callback; no notification follows.
    void Abort();
    // 0 running, 1 finished, 200 aborted, a verdict, or 190 after a failed callback.
    unsigned long State() const { return m_state.load(std::memory_order_acquire); }
    unsigned long ReadProcessedAfInformation(void* buffer, unsigned long size, unsigned long* count);

private:
    static constexpr unsigned long kRunning = 0;

    unsigned long Work();
    unsigned long ReadAfInformation(std::vector<uint8_t>& block);
    unsigned long ReadAudioLevel();
    unsigned long ReadBlock(TqovixInputCallback input, uint64_t size, std::vector<uint8_t>& block);
    unsigned long Prepare(std::vector<uint8_t> block);
    unsigned long ProcessAudio();
    // Pushes every pulled block whose frames are final; kRunning to go on.
    unsigned long PushReady(bool ended);
    bool Stopped() const { return State() != kRunning; }
    void Finish(unsigned long endState);

    const SessionFormat m_format;
    const SessionCallbacks m_callbacks;
    std::atomic<unsigned long> m_state{kRunning};
    uint64_t m_framesDone = 0;  // pushed; worker only
    uint64_t m_framesPulled = 0;
    std::vector<uint8_t> m_block;  // one block and the piece of a frame a truncated stream ends in
    NoiseSuppressor m_suppressor;
    // Frames of each pulled block not yet pushed, oldest first: pushes mirror the pulls.
    std::vector<uint16_t> m_blocks;
    size_t m_blocksHead = 0;
    size_t m_blocksCount = 0;
    size_t m_tailBytes = 0;

    std::mutex m_processedMutex;
    std::vector<uint8_t> m_processed;  // empty until built
    size_t m_processedCursor = 0;
};

}  // namespace ovix
