#include "Session.h"

#include "AfInformation.h"

#include <algorithm>
#include <cstring>
#include <exception>

namespace ovix {

Session::Session(const SessionFormat& format, const SessionCallbacks& callbacks)
    : m_format(format),
      m_callbacks(callbacks),
      m_block((NoiseSuppressor::kBlockFrames + 1) * format.FrameBytes()),
      m_suppressor(format.rateHz, format.channels, format.sampleCount, format.sample),
      // Blocks of one frame at worst.
      m_blocks(m_suppressor.Parameters().capacityFrames + 1)
{
}

void Session::Run()
{
    unsigned long endState = kFailure;
    try {
        endState = Work();
    } catch (const std::exception&) {
        // Out of memory for a block the host described, or a host callback that threw.
        endState = kFailure;
    }
    Finish(endState);
}

void Session::Abort()
{
    unsigned long expected = kRunning;
    m_state.compare_exchange_strong(expected, kAborted, std::memory_order_acq_rel);
}

unsigned long Session::ReadProcessedAfInformation(void* buffer, unsigned long size, unsigned long* count)
{
    if (buffer == nullptr || size == 0 || count == nullptr) {
        return kFailure;
    }
    std::lock_guard lock(m_processedMutex);
    if (m_processed.empty()) {
        return kFailure;
    }
    const size_t piece = std::min<size_t>(size, m_processed.size() - m_processedCursor);
    std::memcpy(buffer, m_processed.data() + m_processedCursor, piece);
    *count = piece;
    m_processedCursor += piece;
    if (m_processedCursor < m_processed.size()) {
        return kSuccess;
    }
    m_processedCursor = 0;
    return kLastPiece;
}

// Each step answers kRunning to go on, or the state the session ends in.
unsigned long Session::Work()
{
    std::vector<uint8_t> block;
    unsigned long result = ReadAfInformation(block);
    if (result != kRunning) {
        return result;
    }
    const unsigned long verdict = JudgeAfBlock(block.data(), block.size());
    if (verdict != kSuccess) {
        return verdict;
    }
    result = ReadAudioLevel();
    if (result != kRunning) {
        return result;
    }
    result = Prepare(std::move(block));
    if (result != kRunning) {
        return result;
    }
    return ProcessAudio();
}

unsigned long Session::ReadAfInformation(std::vector<uint8_t>& block)
{
    if (Stopped()) {
        return kAborted;
    }
    if (m_callbacks.inputAfInformation == nullptr) {
        return kFailure;
    }
    unsigned long size = 0;
    if (m_callbacks.inputAfInformation(nullptr, &size, 0, 0) != kSuccess || size > kMaxBlockSize) {
        return kFailure;
    }
    return ReadBlock(m_callbacks.inputAfInformation, size, block);
}

// The first version does not use the recording level, but the host still expects it to be
// read in full, and a broken reader must end the session here rather than pass unnoticed.
unsigned long Session::ReadAudioLevel()
{
    if (Stopped()) {
        return kAborted;
    }
    if (m_callbacks.inputAudioLevel == nullptr) {
        return kFailure;
    }
    unsigned long size = 0;
    const unsigned long result = m_callbacks.inputAudioLevel(nullptr, &size, 0, 0);
    if (result == kNoAudioLevel || (result == kSuccess && size == 0)) {
        return kRunning;
    }
    if (result != kSuccess || size > kMaxBlockSize) {
        return kFailure;
    }
    std::vector<uint8_t> level;
    return ReadBlock(m_callbacks.inputAudioLevel, size, level);
}

unsigned long Session::ReadBlock(TqovixInputCallback input, uint64_t size, std::vector<uint8_t>& block)
{
    block.assign(size, 0);
    uint64_t got = 0;
    while (got < size) {
        if (Stopped()) {
            return kAborted;
        }
        unsigned long delivered = 0;
        const unsigned long left = size - got;
        if (input(block.data() + got, &delivered, left, 0) != kSuccess || delivered == 0 || delivered > left) {
            return kFailure;
        }
        got += delivered;
    }
    return kRunning;
}

// Everything that allocates happens here, before any audio moves; the processed AF
// information must be readable from inside the audio callbacks.
unsigned long Session::Prepare(std::vector<uint8_t> block)
{
    const AfInformation information(std::move(block));
    m_suppressor.SetSpans(information.Spans({m_format.rateHz, m_format.startShift, m_format.sampleCount}));
    std::vector<uint8_t> processed = information.ProcessedBlock();
    std::lock_guard lock(m_processedMutex);
    m_processed = std::move(processed);
    m_processedCursor = 0;
    return kRunning;
}

// The library cannot tell AAC from PCM: decoded AAC is followed by zeros forever, so the
// sample count bounds the pull, and PCM may still end earlier with an empty delivery.
// Blocks are pushed back once the suppressor has made them final, which for sound near an
// interval is after the interval and its surroundings have been pulled.
unsigned long Session::ProcessAudio()
{
    if (m_callbacks.inputAudio == nullptr || m_callbacks.outputAudio == nullptr) {
        return kFailure;
    }
    const uint64_t frameBytes = m_format.FrameBytes();
    bool ended = false;
    while (!ended) {
        const uint64_t frames = std::min<uint64_t>(NoiseSuppressor::kBlockFrames, m_format.sampleCount - m_framesPulled);
        if (frames == 0) {
            break;
        }
        if (m_suppressor.Room() < frames || m_blocksCount == m_blocks.size()) {
            return kFailure;  // the look-ahead's sizes rule this out
        }
        const unsigned long requested = frames * frameBytes;
        if (Stopped()) {
            return kAborted;
        }
        unsigned long delivered = 0;
        if (m_callbacks.inputAudio(m_block.data(), &delivered, requested, 0) != kSuccess || delivered > requested) {
            return kFailure;
        }
        if (delivered == 0) {
            break;
        }
        const uint64_t whole = delivered / frameBytes;
        // A piece of a frame can only be the tail of a truncated stream: it goes back as it came.
        m_tailBytes = delivered - whole * frameBytes;
        ended = m_tailBytes != 0;
        m_blocks[(m_blocksHead + m_blocksCount++) % m_blocks.size()] = static_cast<uint16_t>(whole);
        m_framesPulled += whole;
        if (ended) {
            std::memcpy(m_block.data() + NoiseSuppressor::kBlockFrames * frameBytes, m_block.data() + whole * frameBytes,
                        m_tailBytes);
        }
        m_suppressor.Append(m_block.data(), whole);
        const unsigned long result = PushReady(false);
        if (result != kRunning) {
            return result;
        }
    }
    m_suppressor.Finish();
    const unsigned long result = PushReady(true);
    return result != kRunning ? result : kSessionFinished;
}

unsigned long Session::PushReady(bool ended)
{
    const uint64_t frameBytes = m_format.FrameBytes();
    while (m_blocksCount > 0) {
        const uint64_t frames = m_blocks[m_blocksHead];
        if (m_framesDone + frames > m_suppressor.Ready()) {
            return kRunning;
        }
        m_suppressor.Read(m_framesDone, frames, m_block.data());
        unsigned long bytes = frames * frameBytes;
        if (ended && m_blocksCount == 1 && m_tailBytes != 0) {
            std::memmove(m_block.data() + bytes, m_block.data() + NoiseSuppressor::kBlockFrames * frameBytes, m_tailBytes);
            bytes += m_tailBytes;
        }
        if (Stopped()) {
            return kAborted;
        }
        if (m_callbacks.outputAudio(m_block.data(), bytes) != kSuccess) {
            return kFailure;
        }
        m_blocksHead = (m_blocksHead + 1) % m_blocks.size();
        --m_blocksCount;
        m_framesDone += frames;
        m_suppressor.Release(m_framesDone);
        if (Stopped()) {
            return kAborted;
        }
        if (m_callbacks.notifyProgress != nullptr) {
            m_callbacks.notifyProgress(m_framesDone, m_format.sampleCount);
        }
    }
    return kRunning;
}

// The host learns of every end only through a notification, so each end sends exactly
// one, after the state it reports is visible. An abort has already claimed the state.
void Session::Finish(unsigned long endState)
{
    unsigned long expected = kRunning;
    if (!m_state.compare_exchange_strong(expected, endState, std::memory_order_acq_rel)) {
        return;
    }
    if (m_callbacks.notifyProgress != nullptr) {
        const uint64_t done = endState == kSessionFinished ? m_format.sampleCount : m_framesDone;
        m_callbacks.notifyProgress(done, m_format.sampleCount);
    }
}

}  // namespace ovix
