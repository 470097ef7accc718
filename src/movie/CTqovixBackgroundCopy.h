// A kernel copy of one file into another at the same offsets, on a thread of its own, that
// bytes written meanwhile are never overwritten by: a writer claims a range first, and the
// copy passes claimed ranges over (or, when it is at that very place, the writer waits).
#pragma once

#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <thread>

#include "bridge/TqovixErrorCode.h"

class CTqovixFile;

class CTqovixBackgroundCopy {
public:
    // Asked while a join waits: the bytes copied so far and in all; anything but success stops
    // the copy, and the join ends with that code.
    using KeepGoing = std::function<eTqovixErrorCode(uint64_t done, uint64_t total)>;

    CTqovixBackgroundCopy() = default;
    ~CTqovixBackgroundCopy() { Stop(); }
    CTqovixBackgroundCopy(const CTqovixBackgroundCopy&) = delete;
    CTqovixBackgroundCopy& operator=(const CTqovixBackgroundCopy&) = delete;

    // Copies [from, end) of `source` into `destination`; both files outlive the copy.
    void Start(CTqovixFile& destination, CTqovixFile& source, uint64_t from, uint64_t end);
    // Before a write to [offset, offset + size): from then on the copy leaves it alone.
    // The copy's failure, if it has failed.
    eTqovixErrorCode Claim(uint64_t offset, uint64_t size);
    // Waits for the whole copy; its result. `keepGoing`, when given, is asked after every piece
    // and at least every few tens of milliseconds, so a stop is seen while the copy is long.
    eTqovixErrorCode Join(const KeepGoing& keepGoing = nullptr);
    // Asks the copy to stop and waits for it.
    void Stop();
    // The copy ends at `end` instead (where it has not passed it yet); then as Join.
    eTqovixErrorCode JoinUpTo(uint64_t end, const KeepGoing& keepGoing = nullptr);
    // Bytes copied so far and in all (both 0 when no copy was started).
    void GetProgress(uint64_t& done, uint64_t& total);

private:
    void Run(uint64_t from);
    eTqovixErrorCode CopyPiece(uint64_t begin, uint64_t end, const std::map<uint64_t, uint64_t>& claims);

    CTqovixFile* m_pDestination = nullptr;
    CTqovixFile* m_pSource = nullptr;
    std::thread m_thread;
    std::mutex m_mutex;
    std::condition_variable m_progress;
    std::map<uint64_t, uint64_t> m_claims;  // begin -> end, ahead of the copy
    uint64_t m_claimedEnd = 0;              // the copy owns everything below this
    uint64_t m_reached = 0;                 // and has copied everything below this
    uint64_t m_from = 0;
    uint64_t m_end = 0;
    bool m_bDone = true;
    bool m_bCancel = false;
    eTqovixErrorCode m_result = eTqovixSuccess;
};
