#include "movie/CTqovixBackgroundCopy.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <system_error>
#include <vector>

#include "file/CTqovixFile.h"

namespace {

// Small enough that a writer at the copy's very place waits only a few milliseconds, and
// that a stop is seen within a piece's time even from a slow source.
constexpr uint64_t kPiece = 8ULL << 20;
// How often a waiting join asks whether to go on when pieces are slow to come.
constexpr auto kJoinPoll = std::chrono::milliseconds(40);

}  // namespace

void CTqovixBackgroundCopy::Start(CTqovixFile& destination, CTqovixFile& source, uint64_t from, uint64_t end)
{
    Stop();
    m_pDestination = &destination;
    m_pSource = &source;
    m_claims.clear();
    m_claimedEnd = from;
    m_reached = from;
    m_from = from;
    m_end = std::max(from, end);
    m_bDone = from >= end;
    m_bCancel = false;
    m_result = eTqovixSuccess;
    if (m_bDone) {
        return;
    }
    try {
        m_thread = std::thread([this, from] { Run(from); });
    } catch (const std::system_error&) {
        Run(from);  // no thread to be had: the copy is simply not beside anything
    }
}

void CTqovixBackgroundCopy::Run(uint64_t from)
{
    eTqovixErrorCode result = eTqovixSuccess;
    for (uint64_t begin = from; !TqovixFailed(result);) {
        uint64_t stop = 0;
        std::map<uint64_t, uint64_t> claims;
        {
            std::lock_guard lock(m_mutex);
            if (m_bCancel) {
                result = eTqovixErrorAborted;
                break;
            }
            // The end may have been brought forward meanwhile.
            if (begin >= m_end) {
                break;
            }
            stop = std::min(m_end, begin + kPiece);
            // Claims made until now stand; later ones lie past what the copy owns.
            m_claimedEnd = stop;
            std::vector<std::pair<uint64_t, uint64_t>> beyond;
            for (auto it = m_claims.begin(); it != m_claims.end() && it->first < stop;) {
                claims.insert(*it);
                if (it->second > stop) {
                    beyond.emplace_back(stop, it->second);  // the rest stays claimed for the next piece
                }
                it = m_claims.erase(it);
            }
            for (const auto& [claimBegin, claimEnd] : beyond) {
                auto& kept = m_claims[claimBegin];
                kept = std::max(kept, claimEnd);
            }
        }
        result = CopyPiece(begin, stop, claims);
        std::lock_guard lock(m_mutex);
        if (!TqovixFailed(result)) {
            m_reached = stop;
        }
        m_progress.notify_all();
        begin = stop;
    }
    std::lock_guard lock(m_mutex);
    m_result = result;
    m_bDone = true;
    m_progress.notify_all();
}

eTqovixErrorCode CTqovixBackgroundCopy::CopyPiece(uint64_t begin, uint64_t end,
                                                  const std::map<uint64_t, uint64_t>& claims)
{
    // The gaps between the claimed ranges, each copied as it stands.
    uint64_t at = begin;
    const auto copy = [&](uint64_t until) {
        if (until <= at) {
            return eTqovixSuccess;
        }
        bool copied = false;
        const eTqovixErrorCode result = m_pDestination->CopyRange(*m_pSource, at, at, until - at, &copied, nullptr);
        return TqovixFailed(result) ? result : copied ? eTqovixSuccess : eTqovixErrorInternal;
    };
    for (const auto& [claimBegin, claimEnd] : claims) {
        const eTqovixErrorCode result = copy(std::min(claimBegin, end));
        if (TqovixFailed(result)) {
            return result;
        }
        at = std::max(at, std::min(claimEnd, end));
    }
    return copy(end);
}

eTqovixErrorCode CTqovixBackgroundCopy::Claim(uint64_t offset, uint64_t size)
{
    std::unique_lock lock(m_mutex);
    for (;;) {
        if (m_bDone || offset + size <= m_reached) {
            return m_result;
        }
        if (offset >= m_claimedEnd) {
            const auto [it, added] = m_claims.emplace(offset, offset + size);
            if (!added) {
                it->second = std::max(it->second, offset + size);
            }
            return eTqovixSuccess;
        }
        m_progress.wait(lock);
    }
}

eTqovixErrorCode CTqovixBackgroundCopy::Join(const KeepGoing& keepGoing)
{
    if (keepGoing) {
        std::unique_lock lock(m_mutex);
        while (!m_bDone) {
            m_progress.wait_for(lock, kJoinPoll);
            if (m_bDone) {
                break;
            }
            const uint64_t done = m_reached - m_from;
            const uint64_t total = m_end - m_from;
            lock.unlock();
            const eTqovixErrorCode answer = keepGoing(done, total);
            if (TqovixFailed(answer)) {
                Stop();
                return answer;
            }
            lock.lock();
        }
    }
    if (m_thread.joinable()) {
        m_thread.join();
    }
    std::lock_guard lock(m_mutex);
    return m_result;
}

void CTqovixBackgroundCopy::GetProgress(uint64_t& done, uint64_t& total)
{
    std::lock_guard lock(m_mutex);
    done = m_reached - m_from;
    total = m_end - m_from;
}

eTqovixErrorCode CTqovixBackgroundCopy::JoinUpTo(uint64_t end, const KeepGoing& keepGoing)
{
    {
        std::lock_guard lock(m_mutex);
        m_end = std::max(m_from, std::min(m_end, end));
    }
    return Join(keepGoing);
}

void CTqovixBackgroundCopy::Stop()
{
    {
        std::lock_guard lock(m_mutex);
        m_bCancel = true;
    }
    if (m_thread.joinable()) {
        m_thread.join();
    }
}
