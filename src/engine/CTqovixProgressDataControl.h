// The engine's result state (running, idle, or how the last job ended) and the
// two progress values the processing library last reported, read by the host.
#pragma once

#include <atomic>
#include <cstdint>

#include "bridge/TqovixErrorCode.h"
#include "engine/CTqovixCriticalSection.h"

class CTqovixProgressDataControl {
public:
    // Records 0/0 while no job runs, so a late notification cannot show a stale figure.
    void SetProgress(unsigned long first, unsigned long second);
    eTqovixErrorCode GetProgress(int* first, int* second) const;
    void Reset();
    void SetFinished(eTqovixErrorCode result) { m_eResult.store(result); }
    eTqovixErrorCode GetErrorResult() const { return m_eResult.load(); }

private:
    mutable CTqovixCriticalSection m_criticalSection;
    // One aligned 32-bit value handed between the host and the library's thread;
    // atomic so that the hand-over is also visible as such to the memory model.
    std::atomic<eTqovixErrorCode> m_eResult{eTqovixFinished};
    int32_t m_progressFirst = 0;
    int32_t m_progressSecond = 0;
};
